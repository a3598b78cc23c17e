#include "ops/paged_results.h"

#include <sys/random.h>

#include <algorithm>
#include <array>
#include <limits>
#include <utility>
#include <vector>

#include "cfg/result_codes.h"
#include "cfg/secret.h"
#include "protocol/control_values.h"
#include "protocol/decoder.h"
#include "protocol/encoder.h"

namespace orv::server {
namespace {

constexpr std::size_t kCookieBytes = 16;
// What keeping a search costs beside its texts, roughly.
constexpr std::size_t kSearchBytes = 512;

// Nobody gets it for a search that was not theirs, whatever they try.
std::string new_cookie() {
  std::array<char, kCookieBytes> octets{};
  std::size_t filled = 0;
  while (filled < octets.size()) {
    const ssize_t more = getrandom(octets.data() + filled, octets.size() - filled, 0);
    if (more > 0) filled += static_cast<std::size_t>(more);
  }
  return {octets.data(), octets.size()};
}

// No two lists of texts look the same.
void append_part(std::string& key, std::string_view part) {
  key += std::to_string(part.size());
  key += ':';
  key += part;
}

std::int32_t shown_total(std::int64_t entries) noexcept {
  constexpr std::int64_t kMost = std::numeric_limits<std::int32_t>::max();
  return static_cast<std::int32_t>(std::min(entries, kMost));
}

}  // namespace

// ---- all connections

bool KeptMeter::add(std::size_t bytes) noexcept {
  std::size_t now = bytes_.load(std::memory_order_relaxed);
  do {
    if (bytes > ceiling_ - std::min(ceiling_, now)) return false;
  } while (!bytes_.compare_exchange_weak(now, now + bytes, std::memory_order_relaxed));
  return true;
}

void KeptMeter::remove(std::size_t bytes) noexcept {
  bytes_.fetch_sub(bytes, std::memory_order_relaxed);
}

// ---- one search

std::string paged_search_key(const SearchRequest& request, std::string_view normal_base) {
  std::string key;
  append_part(key, normal_base);
  key += std::to_string(request.scope);
  key += request.types_only ? 't' : 'v';
  append_part(key, request.filter);
  for (const std::string& name : request.attributes) append_part(key, name);
  return key;
}

FoundEntries& FoundEntries::operator=(FoundEntries&& other) noexcept {
  if (this == &other) return *this;
  wipe();
  messages_.clear();
  messages_.swap(other.messages_);
  at_ = std::exchange(other.at_, 0);
  entries_ = std::exchange(other.entries_, 0);
  total_ = std::exchange(other.total_, 0);
  code_ = std::exchange(other.code_, 0);
  return *this;
}

// Stored passwords may be among the entries.
void FoundEntries::wipe() noexcept {
  cfg::wipe(messages_);
}

// The messages are the encoder's own; "" behind the last one.
std::string_view FoundEntries::take_message() noexcept {
  const std::string_view rest = std::string_view(messages_).substr(at_);
  const Frame frame = next_frame(rest, std::numeric_limits<std::size_t>::max());
  if (frame.state != FrameState::complete) return {};
  at_ += frame.length;
  return rest.substr(0, frame.length);
}

bool FoundEntries::append_entries(std::string& out, std::int64_t size, std::int32_t message_id) {
  for (; size > 0 && entries_ > 0; --size, --entries_) {
    const std::string_view message = take_message();
    if (!encode_again(out, message, message_id, nullptr)) return false;
  }
  return true;
}

bool FoundEntries::append_result(std::string& out, std::int32_t message_id) {
  for (; entries_ > 0; --entries_) take_message();
  const std::vector<Control> controls{paged_results_answer(shown_total(total_), "")};
  return encode_again(out, take_message(), message_id, &controls);
}

bool append_page_result(std::string& out, std::int32_t message_id, std::int64_t total,
                        std::string_view cookie) {
  const std::vector<Control> controls{paged_results_answer(shown_total(total), cookie)};
  ResultAnswer answer{};
  answer.message_id = message_id;
  answer.response_tag = tag::search_done;
  answer.code = result::success;
  answer.controls = &controls;
  return encode_result(out, answer);
}

// Not for every page: who asks for one entry at a time must not have all others copied each time.
void FoundEntries::shrink() {
  if (at_ < messages_.size() / 2 && messages_.capacity() / 2 <= messages_.size()) return;
  std::string rest(messages_, at_);
  wipe();
  messages_.swap(rest);
  at_ = 0;
}

// ---- one connection

void PagedSearches::forget(Place place) noexcept {
  meter_.remove(place->counted);
  bytes_ -= place->bytes;
  searches_.erase(place);
}

void PagedSearches::forget_all() noexcept {
  while (!searches_.empty()) forget(searches_.begin());
}

PagedSearches::Kept PagedSearches::keep(std::string key, FoundEntries&& found, const Limits& limits,
                                        std::string& cookie) {
  const std::size_t bytes = found.bytes();
  const std::size_t counted = bytes + key.size() + kSearchBytes;
  const auto most = static_cast<std::size_t>(limits.bytes);
  if (bytes > most || limits.searches <= 0) return Kept::no_room;
  std::list<Search> made;
  made.push_back({new_cookie(), std::move(key), FoundEntries(), bytes, counted});
  std::string shown = made.front().cookie;
  // Clients forget to say that they want no more.
  while (!searches_.empty() &&
         (searches_.size() >= static_cast<std::size_t>(limits.searches) || bytes_ + bytes > most))
    forget(searches_.begin());
  if (!meter_.add(counted)) return Kept::no_room;
  made.front().found = std::move(found);
  searches_.splice(searches_.end(), made);
  bytes_ += bytes;
  cookie.swap(shown);
  return Kept::yes;
}

bool PagedSearches::take(std::string_view cookie, std::string_view key,
                         FoundEntries& found) noexcept {
  const auto place =
      std::find_if(searches_.begin(), searches_.end(),
                   [cookie](const Search& search) { return search.cookie == cookie; });
  if (place == searches_.end()) return false;
  const bool same = place->key == key;
  if (same) found = std::move(place->found);
  forget(place);
  return same;
}

}  // namespace orv::server
