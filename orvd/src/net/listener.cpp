#include "net/listener.h"

#include <asio/ip/v6_only.hpp>
#include <exception>
#include <utility>

#include "cfg/result_codes.h"
#include "net/client.h"

namespace orv::server {
namespace {

using asio::ip::tcp;

// How long accepting rests when the process has no descriptor or memory left for a connection.
constexpr std::chrono::milliseconds kAcceptPause{100};

std::string endpoint_text(const tcp::endpoint& endpoint) {
  const std::string address = endpoint.address().to_string();
  const std::string port = std::to_string(endpoint.port());
  return endpoint.address().is_v6() ? "[" + address + "]:" + port : address + ":" + port;
}

// One client behind an IPv4-mapped address is the same client as behind the plain one.
std::string counted_address(const asio::ip::address& address) {
  if (address.is_v6() && address.to_v6().is_v4_mapped())
    return asio::ip::make_address_v4(asio::ip::v4_mapped, address.to_v6()).to_string();
  return address.to_string();
}

}  // namespace

Listeners::Listeners(asio::io_context& context, Services& services, ConnectionCounter& counter,
                     std::vector<std::unique_ptr<Loop>>& loops)
    : context_(context), services_(services), counter_(counter), loops_(loops) {}

bool Listeners::open(const std::vector<std::string>& addresses, std::uint16_t port,
                     std::string& error) {
  if (addresses.empty()) {
    // A host without IPv6 is served over IPv4 alone.
    return open_one("0.0.0.0", port, true, error) && open_one("::", this->port(), false, error);
  }
  for (const std::string& address : addresses)
    if (!open_one(address, listeners_.empty() ? port : this->port(), true, error)) return false;
  return true;
}

bool Listeners::open_one(const std::string& address, std::uint16_t port, bool required,
                         std::string& error) {
  asio::error_code failure;
  const asio::ip::address parsed = asio::ip::make_address(address, failure);
  if (failure) {
    error = "cannot listen on '" + address + "': not an IP address, such as 127.0.0.1 or ::1";
    return false;
  }
  auto made = std::make_unique<Listener>(context_);
  tcp::acceptor& acceptor = made->acceptor;
  const tcp::endpoint endpoint(parsed, port);
  acceptor.open(endpoint.protocol(), failure);
  if (!failure) acceptor.set_option(tcp::acceptor::reuse_address(true), failure);
  if (!failure && parsed.is_v6()) acceptor.set_option(asio::ip::v6_only(true), failure);
  if (!failure) acceptor.bind(endpoint, failure);
  if (!failure) acceptor.listen(1024, failure);
  if (failure) {
    if (!required) return true;
    error =
        "cannot listen on " + address + " port " + std::to_string(port) + ": " + failure.message();
    return false;
  }
  listeners_.push_back(std::move(made));
  return true;
}

void Listeners::start(std::shared_ptr<const Settings> settings) {
  settings_ = std::move(settings);
  for (const auto& listener : listeners_) accept(*listener);
}

void Listeners::accept(Listener& listener) {
  listener.acceptor.async_accept(
      [this, &listener](const asio::error_code& error, tcp::socket socket) {
        if (error == asio::error::operation_aborted) return;
        if (!error) {
          try {
            accepted(std::move(socket));
          } catch (const std::exception& failure) {
            services_.logs.error("a new connection is lost: " + std::string(failure.what()));
          }
          return accept(listener);
        }
        services_.logs.error("cannot accept a connection: " + error.message());
        listener.pause.expires_after(kAcceptPause);
        listener.pause.async_wait([this, &listener](const asio::error_code& stopped) {
          if (!stopped) accept(listener);
        });
      });
}

// Beginning with the one after the last, so that a few connections spread.
Loop& Listeners::next_loop() noexcept {
  Loop* least = nullptr;
  for (std::size_t i = 0; i < loops_.size(); ++i) {
    Loop& loop = *loops_[(last_loop_ + 1 + i) % loops_.size()];
    if (!least || loop.load() < least->load()) least = &loop;
  }
  while (loops_[last_loop_].get() != least) last_loop_ = (last_loop_ + 1) % loops_.size();
  return *least;
}

void Listeners::accepted(tcp::socket socket) {
  asio::error_code gone;
  const tcp::endpoint peer = socket.remote_endpoint(gone);
  if (gone) return;
  const std::string text = endpoint_text(peer);
  ConnectionCounter::Ticket ticket =
      counter_.admit(counted_address(peer.address()), settings_->max_connections,
                     settings_->max_connections_per_address);
  if (!ticket) {
    services_.logs.warning("too many connections: refused " + text);
    std::string notice;
    encode_notice_of_disconnection(notice, result::busy, "too many connections");
    socket.non_blocking(true, gone);
    socket.send(asio::buffer(notice), 0, gone);
    return;
  }
  Descriptor descriptor(socket.release(gone));
  if (gone) return;
  Loop& loop = next_loop();
  const auto client = std::make_shared<Client>(
      loop, services_, next_number_++, std::move(descriptor), peer.protocol(), std::move(ticket));
  loop.post([client, text] { client->start(text); });
}

void Listeners::close() noexcept {
  asio::error_code ignored;
  for (const auto& listener : listeners_) {
    listener->acceptor.close(ignored);
    listener->pause.cancel();
  }
}

std::uint16_t Listeners::port() const {
  asio::error_code ignored;
  return listeners_.empty() ? std::uint16_t{0}
                            : listeners_.front()->acceptor.local_endpoint(ignored).port();
}

std::string Listeners::url() const {
  asio::error_code ignored;
  return "ldap://" + endpoint_text(listeners_.front()->acceptor.local_endpoint(ignored));
}

}  // namespace orv::server
