#include "ops/persistent_search.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <new>
#include <utility>

#include "cfg/dn.h"
#include "cfg/ldif.h"
#include "cfg/result_codes.h"
#include "protocol/ber_parser.h"
#include "slapi/codepage.h"
#include "slapi/pblock.h"

namespace orv::server {
namespace {

constexpr int kSwitchedOn = 1;
constexpr unsigned kAllTypes = 15;
// What an entry costs beside its texts, roughly.
constexpr std::size_t kValueBytes = 64;

constexpr const char* kTopEntry = "CN=CONFIGURATION";
// Shown to the primary administrator only, beside the secrets, where they stand on that entry.
constexpr const char* kHiddenOnTop[] = {"orv-slapdAdminDN", "orv-slapdAdminGroupEnabled"};

}  // namespace

// ---- The two controls

namespace {

constexpr ber_tag_t kSequence = 0x30;

bool take(BerParser& parser, std::string_view& rest, ber_tag_t tag, std::string_view& contents) {
  Element element;
  if (!parser.take(rest, element) || element.tag != tag) return false;
  contents = element.contents;
  return true;
}

bool take_boolean(BerParser& parser, std::string_view& rest, bool& value) {
  std::string_view contents;
  if (!take(parser, rest, LBER_BOOLEAN, contents) || contents.size() != 1) return false;
  value = contents[0] != 0;
  return true;
}

}  // namespace

bool read_persistent_search(std::string_view value, PersistentSearchControl& control) noexcept {
  try {
    BerParser parser;
    std::string_view rest;
    std::string_view types;
    PersistentSearchControl read;
    std::int32_t bits = 0;
    if (!take(parser, value, kSequence, rest) || !value.empty()) return false;
    if (!take(parser, rest, LBER_INTEGER, types) ||
        read_integer(types, bits) != IntegerState::good || bits == 0 ||
        static_cast<unsigned>(bits) > kAllTypes)
      return false;
    if (!take_boolean(parser, rest, read.changes_only) ||
        !take_boolean(parser, rest, read.return_notifications) || !rest.empty())
      return false;
    read.change_types = static_cast<unsigned>(bits);
    control = read;
    return true;
  } catch (...) {
    return false;
  }
}

EntryChangeControl::EntryChangeControl(ChangeType type) noexcept
    : value_{0x30, 3, 0x0A, 1, static_cast<char>(type)} {
  control_.oid = const_cast<char*>(kEntryChangeOid);  // only read
  control_.value = {sizeof value_, value_};
}

// ---- Entries

namespace {

// Calls `visit` with each value.
template <typename Visit>
void each_value(const attr& attribute, Visit visit) {
  for (berval** value = attribute.values; value && *value; ++value)
    visit(std::string_view((*value)->bv_val, (*value)->bv_len));
}

EntryPtr new_entry(const char* dn, const char* normal_dn) {
  EntryPtr made(static_cast<entry*>(std::calloc(1, sizeof(entry))));
  if (!made) throw std::bad_alloc();
  made->dn = strdup(dn ? dn : "");
  made->normalized_dn = strdup(normal_dn ? normal_dn : "");
  if (!made->dn || !made->normalized_dn) throw std::bad_alloc();
  return made;
}

void add_values(entry& to, const char* type, berval** values) {
  if (attr_merge(&to, type, values, 1, 1, nullptr) == result::no_memory) throw std::bad_alloc();
}

// ---- out of the local code page

struct Converted {
  explicit Converted(const char* local) {
    char* made = nullptr;
    std::size_t length = 0;
    const int code = xlate_localcp_to_utf8(local, &made, &length);
    text.reset(made);
    if (code == result::no_memory) throw std::bad_alloc();
  }
  MallocText text;  // null when a character cannot be converted
};

void add_converted(entry& to, const attr& from) {
  for (berval** value = from.values; value && *value; ++value) {
    const Converted converted((*value)->bv_val);
    if (!converted.text) continue;
    berval counted{std::strlen(converted.text.get()), converted.text.get()};
    berval* one[] = {&counted, nullptr};
    add_values(to, from.type, one);
  }
}

// The entry in UTF-8; null when not even its name can be converted. Throws std::bad_alloc.
EntryPtr in_utf8(EntryPtr local) {
  if (!local->local_code_page || local_code_page_is_utf8()) return local;
  const Converted dn(local->dn);
  if (!dn.text) return nullptr;
  EntryPtr made = new_entry(dn.text.get(), local->normalized_dn);
  for (const attr* a = local->attributes; a; a = a->next) add_converted(*made, *a);
  return made;
}

// ---- as a record

std::string record_of(const entry& e) {
  std::string record;
  cfg::append_ldif_line(record, "dn", e.dn);
  for (const attr* a = e.attributes; a; a = a->next)
    each_value(*a, [&](std::string_view value) { cfg::append_ldif_line(record, a->type, value); });
  return record;
}

std::size_t bytes_of(const entry& e) noexcept {
  std::size_t bytes = sizeof(entry);
  for (const attr* a = e.attributes; a; a = a->next)
    each_value(*a, [&](std::string_view value) { bytes += value.size() + kValueBytes; });
  return bytes;
}

bool is_hidden_on_top(const char* type) noexcept {
  return std::any_of(std::begin(kHiddenOnTop), std::end(kHiddenOnTop),
                     [type](const char* hidden) { return std::strcmp(type, hidden) == 0; });
}

}  // namespace

EntryPtr visible_part(const Schema& schema, const entry& deleted,
                      const Identity* identity) noexcept {
  try {
    const std::string_view normal = deleted.normalized_dn ? deleted.normalized_dn : "";
    const bool primary = identity && identity->authority == authority::primary_administrator;
    const bool own = identity && !normal.empty() && identity->entry_dn == normal;
    EntryPtr visible = new_entry(deleted.dn, deleted.normalized_dn);
    for (const attr* a = deleted.attributes; a; a = a->next) {
      const SchemaAttribute* const type = schema.attribute(a->type);
      if (type && type->secret && !primary && !own) continue;
      if (!primary && normal == kTopEntry && is_hidden_on_top(a->type)) continue;
      add_values(*visible, a->type, a->values);
    }
    return visible;
  } catch (...) {
    return nullptr;
  }
}

// ---- One search

PersistentSearch::PersistentSearch(std::weak_ptr<ChangeListener> home, std::int32_t id,
                                   const PersistentSearchControl& wanted,
                                   const SearchRequest& searched, std::string_view normal_base,
                                   std::string evaluated_filter)
    : message_id(id),
      control(wanted),
      request(searched),
      base(normal_base),
      filter(std::move(evaluated_filter)),
      home_(std::move(home)) {}

PersistentSearch::~PersistentSearch() {
  if (counted_by_) counted_by_->leave(*this);
}

bool PersistentSearch::covers(ChangeType type, std::string_view normal_dn) const noexcept {
  if ((control.change_types & static_cast<unsigned>(type)) == 0) return false;
  if (request.scope == 0) return normal_dn == base;
  if (request.scope == 1) return cfg::parent_of_normal_dn(normal_dn) == base;
  return cfg::normal_dn_is_at_or_below(normal_dn, base);
}

// The code with which the search has to end, or 0.
int PersistentSearch::queue(ChangePtr change) noexcept {
  const std::lock_guard lock(mutex_);
  if (ended()) return 0;
  // One change is let through however large it is.
  const bool too_much = !waiting_.empty() && bytes_ + change->bytes > kMostBytes;
  if (too_much || waiting_.size() >= kMostWaiting) return result::admin_limit_exceeded;
  const std::size_t bytes = change->bytes;
  try {
    waiting_.push_back(std::move(change));
  } catch (...) {
    return result::no_memory;
  }
  bytes_ += bytes;
  return 0;
}

void PersistentSearch::tell_home() noexcept {
  if (const std::shared_ptr<ChangeListener> home = home_.lock()) home->has_news(shared_from_this());
}

void PersistentSearch::tell(ChangePtr change) noexcept {
  if (ended() || failure() != 0) return;
  if (const int code = queue(std::move(change))) return fail(code);
  tell_home();
}

void PersistentSearch::fail(int code) noexcept {
  int none = 0;
  if (failure_.compare_exchange_strong(none, code)) tell_home();
}

void PersistentSearch::end() noexcept {
  const std::lock_guard lock(mutex_);
  ended_.store(true, std::memory_order_release);
  waiting_.clear();
  bytes_ = 0;
}

ChangePtr PersistentSearch::take() noexcept {
  const std::lock_guard lock(mutex_);
  if (waiting_.empty()) return nullptr;
  ChangePtr change = std::move(waiting_.front());
  waiting_.pop_front();
  bytes_ -= change->bytes;
  return change;
}

// ---- All of them

PersistentSearches::PersistentSearches() noexcept {
  pblock* const global = getGlobalPBlock();
  slapi_pblock_set(global, parameter::persistent_search_monitor, static_cast<void*>(&monitor_));
  slapi_pblock_set(global, parameter::persistent_search_switch, kSwitchedOn);
}

PersistentSearches::~PersistentSearches() {
  pblock* const global = getGlobalPBlock();
  slapi_pblock_set(global, parameter::persistent_search_switch, 0);
  slapi_pblock_set(global, parameter::persistent_search_monitor, nullptr);
}

bool PersistentSearches::count(PersistentSearch& search, std::int64_t most) noexcept {
  constexpr std::int64_t kMax = std::numeric_limits<int>::max();
  const std::lock_guard lock(mutex_);
  if (!monitor_.begin(static_cast<int>(std::min(most, kMax)))) return false;
  search.counted_by_ = this;
  return true;
}

bool PersistentSearches::join(const PersistentSearchPtr& search) noexcept {
  try {
    const std::lock_guard lock(mutex_);
    if (search->counted_by_) joined_.push_back(search);
    return true;
  } catch (...) {
    return false;
  }
}

void PersistentSearches::leave(PersistentSearch& search) noexcept {
  search.end();
  PersistentSearchPtr last;  // released without the mutex
  const std::lock_guard lock(mutex_);
  const auto found =
      std::find_if(joined_.begin(), joined_.end(),
                   [&search](const PersistentSearchPtr& other) { return other.get() == &search; });
  if (found != joined_.end()) {
    last = std::move(*found);
    joined_.erase(found);
  }
  if (std::exchange(search.counted_by_, nullptr)) monitor_.end();
}

PersistentSearches::Audience PersistentSearches::audience(ChangeType type,
                                                          std::string_view normal_dn,
                                                          EntryPtr before) noexcept {
  Audience audience;
  audience.type = type;
  audience.before = std::move(before);
  try {
    audience.dn = normal_dn;
    const std::lock_guard lock(mutex_);
    for (const PersistentSearchPtr& search : joined_)
      if (search->covers(type, normal_dn)) audience.searches.push_back(search);
  } catch (...) {
    audience.no_memory = true;
  }
  return audience;
}

void PersistentSearches::announce(Audience audience) noexcept {
  if (audience.no_memory) return fail_all(result::no_memory);
  if (audience.searches.empty()) return;
  try {
    if (audience.type == ChangeType::remove) return announce_deletion(audience);
    const auto change = std::make_shared<const Change>(
        Change{audience.type, audience.dn, nullptr, audience.dn.size() + kValueBytes});
    for (const PersistentSearchPtr& search : audience.searches) search->tell(change);
  } catch (...) {
    fail_each(audience.searches, result::no_memory);
  }
}

// Whether a deleted entry matches is decided here and now: nobody can search for it any more. It is
// compared as it stood in the file, in the file's code page; only what is sent is converted. Who
// cannot be told of it is told that: it would believe to have heard of everything.
void PersistentSearches::announce_deletion(Audience& audience) {
  if (!audience.before) return fail_each(audience.searches, result::other);
  const std::string record = record_of(*audience.before);
  std::vector<PersistentSearchPtr> matching;
  for (const PersistentSearchPtr& search : audience.searches) {
    bool matches = false;
    if (const int code = cfg::ldif_record_matches(record, search->filter.c_str(), matches))
      search->fail(code);
    else if (matches)
      matching.push_back(search);
  }
  if (matching.empty()) return;
  const std::shared_ptr<const entry> before(in_utf8(std::move(audience.before)));
  if (!before) return fail_each(matching, result::other);
  const auto change =
      std::make_shared<const Change>(Change{audience.type, audience.dn, before, bytes_of(*before)});
  for (const PersistentSearchPtr& search : matching) search->tell(change);
}

void PersistentSearches::fail_each(const std::vector<PersistentSearchPtr>& searches,
                                   int code) noexcept {
  for (const PersistentSearchPtr& search : searches) search->fail(code);
}

void PersistentSearches::fail_all(int code) noexcept {
  try {
    std::vector<PersistentSearchPtr> all;
    {
      const std::lock_guard lock(mutex_);
      all = joined_;
    }
    fail_each(all, code);
  } catch (...) {
    // Told at the next tick of their connections.
    const std::lock_guard lock(mutex_);
    for (const PersistentSearchPtr& search : joined_) search->failure_.store(code);
  }
}

}  // namespace orv::server
