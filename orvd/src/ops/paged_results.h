// Paged results (RFC 2696): searches whose answers a client fetches in pieces.
//
//   search, size, cookie ""     ->  the first entries, the number of all, cookie A
//   same search, size, cookie A ->  the next ones, cookie B ... until the cookie is ""
//
// The search is made once, with the first page, and what it found is kept in its encoded form: all
// pages show the configuration as it was at one moment. Each cookie is good once, on the connection
// and for the search that it was given for, until somebody binds there. What is kept is bounded for
// each connection (beyond that the searches that were gone on with least recently are forgotten)
// and for all together.
//
// Threads: `KeptMeter` is thread-safe; the rest belongs to the connection's thread.
#pragma once

#include <atomic>
#include <cstdint>
#include <list>
#include <string>
#include <string_view>

#include "protocol/message.h"

namespace orv::server {

// What all connections keep. Outlives them.
class KeptMeter {
 public:
  static constexpr std::size_t kDefaultCeiling = std::size_t{64} << 20;

  explicit KeptMeter(std::size_t ceiling = kDefaultCeiling) : ceiling_(ceiling) {}

  // False when there is no room for so many bytes more.
  bool add(std::size_t bytes) noexcept;
  void remove(std::size_t bytes) noexcept;
  std::size_t bytes() const noexcept { return bytes_.load(std::memory_order_relaxed); }

 private:
  const std::size_t ceiling_;
  std::atomic<std::size_t> bytes_{0};
};

// What all pages of a search have in common: base, scope, filter, attributes and whether only types
// are wanted. Throws std::bad_alloc.
std::string paged_search_key(const SearchRequest& request, std::string_view normal_base);

// The answer to a search: its entries as finished messages, and behind them its result.
class FoundEntries {
 public:
  FoundEntries() = default;
  // Takes `messages` over and leaves it empty.
  FoundEntries(std::string& messages, std::int64_t entries, int code)
      : entries_(entries), total_(entries), code_(code) {
    messages_.swap(messages);
  }
  ~FoundEntries() { wipe(); }
  FoundEntries(FoundEntries&& other) noexcept { *this = std::move(other); }
  FoundEntries& operator=(FoundEntries&& other) noexcept;

  // Appends the next `size` entries, or those there are, under the message id. False without
  // memory.
  bool append_entries(std::string& out, std::int64_t size, std::int32_t message_id);
  // Appends the search's own result with the control that ends the pages; no entries are left then.
  // False without memory.
  bool append_result(std::string& out, std::int32_t message_id);

  std::int64_t left() const noexcept { return entries_; }
  std::int64_t total() const noexcept { return total_; }
  int code() const noexcept { return code_; }  // of the search's own result
  std::size_t bytes() const noexcept { return messages_.size(); }
  // Gives back memory that is not needed any more, when it is about half of what is held. Throws
  // std::bad_alloc.
  void shrink();

 private:
  std::string_view take_message() noexcept;
  void wipe() noexcept;

  std::string messages_;
  std::size_t at_ = 0;
  std::int64_t entries_ = 0;  // that are left
  std::int64_t total_ = 0;
  int code_ = 0;
};

// Appends the successful result of a page behind which others may come. False without memory.
bool append_page_result(std::string& out, std::int32_t message_id, std::int64_t total,
                        std::string_view cookie);

// What one connection keeps.
class PagedSearches {
 public:
  explicit PagedSearches(KeptMeter& meter) : meter_(meter) {}
  ~PagedSearches() { forget_all(); }
  PagedSearches(const PagedSearches&) = delete;
  PagedSearches& operator=(const PagedSearches&) = delete;

  struct Limits {
    std::int64_t searches;
    std::int64_t bytes;  // of messages
  };
  enum class Kept { yes, no_room };

  // Keeps what is left of a search under a new cookie. No room: it is larger than the limit, or all
  // connections together keep too much. Throws std::bad_alloc; nothing is kept then.
  Kept keep(std::string key, FoundEntries&& found, const Limits& limits, std::string& cookie);

  // Takes out what the cookie stands for; false when it stands for nothing, or for another search,
  // which is then forgotten.
  bool take(std::string_view cookie, std::string_view key, FoundEntries& found) noexcept;

  void forget_all() noexcept;
  std::size_t size() const noexcept { return searches_.size(); }

 private:
  struct Search {
    std::string cookie;
    std::string key;
    FoundEntries found;
    std::size_t bytes;    // of its messages
    std::size_t counted;  // by the meter
  };
  using Place = std::list<Search>::iterator;
  void forget(Place place) noexcept;

  KeptMeter& meter_;
  std::list<Search> searches_;  // the one that was gone on with last comes last
  std::size_t bytes_ = 0;
};

}  // namespace orv::server
