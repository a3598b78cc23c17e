// How many connections there are, in all and from each address.
#pragma once

#include <asio/ip/address.hpp>
#include <cstdint>
#include <mutex>
#include <string>
#include <unordered_map>

namespace orv::server {

// As whom a client with this address is counted: in IPv6 its network of 64 bits, of which one host
// has as many addresses as it likes; except on the link, where all hosts share one.
std::string counted_as(const asio::ip::address& address);

// How many connections from other hosts there may be by what the process has: by the descriptors
// that it may open (RLIMIT_NOFILE), so that some are left for files, and for who administers the
// server on its own host; and by the memory for keys. `bound` says for people which of the two it
// is.
struct Room {
  std::int64_t connections = 0;
  const char* bound = "";
};
Room room_for_connections() noexcept;
std::int64_t connections_that_fit() noexcept;

// Thread-safe; must outlive its tickets.
class ConnectionCounter {
 public:
  // The right to be connected, given back when it is destroyed.
  class Ticket {
   public:
    Ticket() = default;
    Ticket(ConnectionCounter& counter, std::string address)
        : counter_(&counter), address_(std::move(address)) {}
    Ticket(Ticket&& other) noexcept;
    Ticket& operator=(Ticket&& other) noexcept;
    ~Ticket() { release(); }
    explicit operator bool() const noexcept { return counter_ != nullptr; }
    const std::string& address() const noexcept { return address_; }

   private:
    void release() noexcept;
    ConnectionCounter* counter_ = nullptr;
    std::string address_;
  };

  // An empty ticket when one more connection would be beyond a limit.
  Ticket admit(const std::string& address, std::int64_t in_all, std::int64_t per_address);

  std::int64_t count() const;

 private:
  void leave(const std::string& address) noexcept;

  mutable std::mutex mutex_;
  std::int64_t count_ = 0;
  std::unordered_map<std::string, std::int64_t> by_address_;
};

}  // namespace orv::server
