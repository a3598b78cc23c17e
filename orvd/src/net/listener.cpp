#include "net/listener.h"

#include <fcntl.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <algorithm>
#include <asio/ip/tcp.hpp>
#include <cerrno>
#include <cstring>
#include <exception>
#include <utility>

#include "cfg/result_codes.h"
#include "config/local_url.h"

namespace orv::server {
namespace {

using asio::ip::tcp;
using Endpoint = asio::generic::stream_protocol::endpoint;

// How long accepting rests when the process has no descriptor or memory left for a connection, and
// how many clients are told so in one go.
constexpr std::chrono::milliseconds kAcceptPause{100};
constexpr int kTurnedAwayAtOnce = 64;
// What all clients of the Unix socket are counted as.
constexpr const char* kLocalPeer = "local";

Descriptor open_reserve() noexcept {
  return Descriptor(::open("/dev/null", O_RDONLY | O_CLOEXEC));
}

bool no_descriptors_left(const asio::error_code& error) {
  return error.value() == EMFILE || error.value() == ENFILE;
}

// Without waiting for the client.
void send_notice(int socket, std::string_view why) {
  std::string notice;
  encode_notice_of_disconnection(notice, result::busy, why);
  static_cast<void>(::send(socket, notice.data(), notice.size(), MSG_DONTWAIT | MSG_NOSIGNAL));
}

tcp::endpoint tcp_endpoint(const Endpoint& endpoint) {
  tcp::endpoint result;
  const std::size_t size = std::min(endpoint.size(), result.capacity());
  std::memcpy(result.data(), endpoint.data(), size);
  result.resize(size);
  return result;
}

std::string endpoint_text(const tcp::endpoint& endpoint) {
  const std::string address = endpoint.address().to_string();
  const std::string port = std::to_string(endpoint.port());
  return endpoint.address().is_v6() ? "[" + address + "]:" + port : address + ":" + port;
}

// One client behind an IPv4-mapped address is the same client as behind the plain one.
asio::ip::address plain_address(const asio::ip::address& address) {
  if (address.is_v6() && address.to_v6().is_v4_mapped())
    return asio::ip::make_address_v4(asio::ip::v4_mapped, address.to_v6());
  return address;
}

// Where a Unix socket is; "" for one without a name in the file system.
std::string local_path(const Endpoint& endpoint) {
  sockaddr_un address{};
  std::memcpy(&address, endpoint.data(), std::min(endpoint.size(), sizeof address));
  return {address.sun_path, ::strnlen(address.sun_path, sizeof address.sun_path)};
}

// Who holds the other end, and as whom it is counted. False when it has gone already.
struct Peer {
  std::string text;
  std::string counted;
};
using Socket = asio::generic::stream_protocol::socket;

bool describe_tcp(Socket& socket, TransportFacts& facts, Peer& peer) {
  asio::error_code gone;
  const Endpoint remote = socket.remote_endpoint(gone);
  if (gone) return false;
  const Endpoint local = socket.local_endpoint(gone);
  if (gone) return false;
  const asio::ip::address address = plain_address(tcp_endpoint(remote).address());
  peer = {endpoint_text(tcp_endpoint(remote)), counted_as(address)};
  facts.peer = peer.text;
  facts.own = endpoint_text(tcp_endpoint(local));
  facts.loopback = address.is_loopback();
  return true;
}

bool describe_local(Socket& socket, TransportFacts& facts, Peer& peer) {
  uid_t user = 0;
  pid_t process = 0;
  if (!peer_of(socket.native_handle(), user, process)) return false;
  facts.local = true;
  facts.peer_uid = user;
  peer = {"local uid=" + std::to_string(user) + " pid=" + std::to_string(process), kLocalPeer};
  return true;
}

}  // namespace

Listeners::Listeners(asio::io_context& context, Services& services, ConnectionCounter& counter,
                     ConnectionCounter& local_counter, std::vector<std::unique_ptr<Loop>>& loops)
    : context_(context),
      services_(services),
      counter_(counter),
      local_counter_(local_counter),
      loops_(loops),
      reserve_(open_reserve()) {}

bool Listeners::open(const std::vector<std::string>& addresses, std::uint16_t port, bool secure,
                     std::string& error) {
  std::vector<ListeningSocket> sockets;
  if (!open_tcp(addresses, port, secure, sockets, error)) return false;
  for (ListeningSocket& socket : sockets)
    if (!adopt(std::move(socket), error)) return false;
  return true;
}

bool Listeners::open_local(const std::string& path, std::string& error) {
  Descriptor socket = local_.listen(path, error);
  return socket && adopt({std::move(socket), Kind::local, AF_UNIX}, error);
}

bool Listeners::adopt(ListeningSocket socket, std::string& error) {
  const int protocol = socket.kind == Kind::local ? 0 : IPPROTO_TCP;
  auto made = std::make_unique<Listener>(context_, socket.kind);
  asio::error_code failure;
  made->acceptor.assign(asio::generic::stream_protocol(socket.family, protocol),
                        socket.socket.number(), failure);
  if (failure) {
    error = "cannot accept connections: " + failure.message();
    return false;
  }
  socket.socket.release();
  listeners_.push_back(std::move(made));
  return true;
}

bool Listeners::has(Kind kind) const noexcept {
  return std::any_of(listeners_.begin(), listeners_.end(),
                     [kind](const auto& listener) { return listener->kind == kind; });
}

void Listeners::start(std::shared_ptr<const Settings> settings) {
  settings_ = std::move(settings);
  const Room room = room_for_connections();
  if (settings_->max_connections > room.connections)
    services_.logs.warning("orv-slapdMaxConnections is " +
                           std::to_string(settings_->max_connections) + ", but " + room.bound +
                           " has room for " + std::to_string(room.connections) + " connections");
  for (const auto& listener : listeners_) accept(*listener);
}

void Listeners::accept(Listener& listener) {
  if (listener.kind != Kind::local && !has_reserve()) return pause(listener);
  listener.acceptor.async_accept(
      listener.waiting.keep([this, &listener](const asio::error_code& error, Socket socket) {
        if (error == asio::error::operation_aborted) return;
        if (error) return cannot_accept(listener, error);
        try {
          accepted(listener, std::move(socket));
        } catch (const std::exception& failure) {
          // Apart: what is missing may be the memory to put them together.
          services_.logs.error("a new connection is lost:");
          services_.logs.error(failure.what());
        }
        accept(listener);
      }));
}

void Listeners::go_on() {
  for (const auto& listener : listeners_)
    if (listener->acceptor.is_open() && !listener->waiting.under_way()) accept(*listener);
}

// What is lacking will not be there at once.
void Listeners::cannot_accept(Listener& listener, const asio::error_code& error) {
  try {
    services_.cut_offs.tell(CutOff::descriptors, "cannot accept a connection: " + error.message());
  } catch (...) {
    // Without memory the line is lost.
  }
  if (no_descriptors_left(error) && listener.kind != Kind::local) turn_away(listener);
  pause(listener);
}

// Another thread that opened a file may have got the number that was given back for a moment. A
// client must not have it next: nobody could be turned away until he leaves.
bool Listeners::has_reserve() noexcept {
  if (!reserve_) reserve_ = open_reserve();
  return static_cast<bool>(reserve_);
}

void Listeners::pause(Listener& listener) {
  listener.pause.expires_after(kAcceptPause);
  listener.pause.async_wait(
      listener.waiting.keep([this, &listener](const asio::error_code& stopped) {
        if (!stopped) accept(listener);
      }));
}

// Who has connected already would wait for an answer otherwise. At the Unix socket that is better:
// who administers the server on its own host gets in with the next descriptor.
void Listeners::turn_away(Listener& listener) noexcept {
  asio::error_code ignored;
  listener.acceptor.native_non_blocking(true, ignored);
  for (int left = kTurnedAwayAtOnce; left > 0; --left) {
    reserve_.close();
    const Descriptor client(::accept4(listener.acceptor.native_handle(), nullptr, nullptr,
                                      SOCK_CLOEXEC | SOCK_NONBLOCK));
    if (!client) break;
    try {
      if (listener.kind == Kind::clear) send_notice(client.number(), "no descriptor is left");
    } catch (...) {
      // It is closed without a word, then.
    }
  }
  reserve_ = open_reserve();
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

// Why one more connection cannot be; "" when it can. Strangers must not be able to keep out who
// administers the server on its own host, nor does that one take their places: the two are counted
// apart.
std::string Listeners::admit(Arrival& arrival, const std::string& counted) {
  constexpr const char* kTooMany = "too many connections";
  const Settings& limits = *settings_;
  const std::int64_t of_one = limits.max_connections_per_address;
  if (arrival.facts.local) {
    arrival.ticket = local_counter_.admit(counted, of_one, of_one);
    return arrival.ticket ? "" : kTooMany;
  }
  if (services_.unauthenticated.load(std::memory_order_relaxed) >=
      limits.max_unauthenticated_connections)
    return "too many connections on which nobody is bound";
  // What the process has, both kinds share.
  const std::int64_t room = connections_that_fit() - local_counter_.count();
  arrival.ticket = counter_.admit(counted, std::min(limits.max_connections, room), of_one);
  return arrival.ticket ? "" : kTooMany;
}

void Listeners::accepted(const Listener& listener, Socket socket) {
  Arrival arrival;
  Peer peer;
  const bool local = listener.kind == Kind::local;
  arrival.secure = listener.kind == Kind::secure;
  if (local ? !describe_local(socket, arrival.facts, peer)
            : !describe_tcp(socket, arrival.facts, peer))
    return;
  asio::error_code gone;
  if (const std::string refusal = admit(arrival, peer.counted); !refusal.empty()) {
    services_.cut_offs.tell(CutOff::connections, refusal + ": refused " + peer.text);
    // A client that begins with TLS would not understand.
    if (!arrival.secure) send_notice(socket.native_handle(), refusal);
    return;
  }
  const Endpoint own = socket.local_endpoint(gone);
  if (!gone) arrival.protocol = own.protocol();
  if (!gone) arrival.socket = Descriptor(socket.release(gone));
  if (gone) return;
  Loop& loop = next_loop();
  const auto client = std::make_shared<Client>(loop, services_, next_number_++, std::move(arrival));
  loop.post([client, text = peer.text] { client->start(text); });
}

void Listeners::close() noexcept {
  asio::error_code ignored;
  for (const auto& listener : listeners_) {
    listener->acceptor.close(ignored);
    listener->pause.cancel();
  }
  local_.remove();
}

std::uint16_t Listeners::port(bool secure) const {
  asio::error_code ignored;
  for (const auto& listener : listeners_)
    if (listener->kind == (secure ? Kind::secure : Kind::clear))
      return tcp_endpoint(listener->acceptor.local_endpoint(ignored)).port();
  return 0;
}

std::string Listeners::url(const Listener& listener) const {
  asio::error_code ignored;
  if (listener.kind == Kind::local)
    return local_url(local_path(listener.acceptor.local_endpoint(ignored)));
  return (listener.kind == Kind::secure ? "ldaps://" : "ldap://") +
         endpoint_text(tcp_endpoint(listener.acceptor.local_endpoint(ignored)));
}

std::string Listeners::url() const {
  for (const auto& listener : listeners_)
    if (listener->kind == Kind::clear) return url(*listener);
  return url(*listeners_.front());
}

std::vector<std::string> Listeners::urls() const {
  std::vector<std::string> all;
  for (const auto& listener : listeners_) all.push_back(url(*listener));
  return all;
}

}  // namespace orv::server
