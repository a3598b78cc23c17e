// How many connections there are, in all and from each address.
#pragma once

#include <cstdint>
#include <mutex>
#include <string>
#include <unordered_map>

namespace orv::server {

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
