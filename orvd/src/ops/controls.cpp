#include "ops/controls.h"

#include <algorithm>
#include <array>
#include <iterator>
#include <new>
#include <utility>
#include <variant>

#include "cfg/result_codes.h"
#include "logs.h"

namespace orv::server {
namespace {

// ---- Which control is for which operation

namespace operation {
constexpr unsigned search = 1;
constexpr unsigned add = 2;
constexpr unsigned remove = 4;
constexpr unsigned modify = 8;
constexpr unsigned rename = 16;
constexpr unsigned compare = 32;
constexpr unsigned other = 64;
constexpr unsigned all = 127;
}  // namespace operation

unsigned kind_of(const Request& request) {
  struct Kinds {
    unsigned operator()(const SearchRequest&) const { return operation::search; }
    unsigned operator()(const AddRequest&) const { return operation::add; }
    unsigned operator()(const DeleteRequest&) const { return operation::remove; }
    unsigned operator()(const ModifyRequest&) const { return operation::modify; }
    unsigned operator()(const ModifyDnRequest&) const { return operation::rename; }
    unsigned operator()(const CompareRequest&) const { return operation::compare; }
    unsigned operator()(const BindRequest&) const { return operation::other; }
    unsigned operator()(const UnbindRequest&) const { return operation::other; }
    unsigned operator()(const AbandonRequest&) const { return operation::other; }
    unsigned operator()(const ExtendedRequest&) const { return operation::other; }
  };
  return std::visit(Kinds{}, request);
}

// ---- Each control's value: 0 or the code that refuses the request

struct Reading {
  const Control& control;
  const DecoderLimits& limits;
  RequestControls& controls;
};

int take_nothing(Reading& reading) {
  return reading.control.value ? result::protocol_error : result::success;
}

int take_persistent_search(Reading& reading) {
  PersistentWish& wish = reading.controls.persistent;
  if (!reading.control.value || !read_persistent_search(*reading.control.value, wish.control))
    return result::protocol_error;
  wish.wanted = true;
  wish.critical = reading.control.critical;
  return result::success;
}

int take_paged_results(Reading& reading) {
  if (!reading.control.value) return result::protocol_error;
  return read_paged_results(*reading.control.value, reading.controls.paged.emplace());
}

int take_assertion(Reading& reading) {
  if (!reading.control.value) return result::protocol_error;
  return read_assertion(*reading.control.value,
                        {reading.limits.filter_depth, reading.limits.filter_items},
                        reading.controls.assertion.emplace());
}

int take_read(const Reading& reading, std::optional<ReadWish>& wish) {
  if (!reading.control.value) return result::protocol_error;
  wish.emplace().critical = reading.control.critical;
  return read_attribute_selection(*reading.control.value,
                                  static_cast<std::size_t>(reading.limits.attributes),
                                  wish->attributes);
}

int take_pre_read(Reading& reading) {
  return take_read(reading, reading.controls.pre_read);
}

int take_post_read(Reading& reading) {
  return take_read(reading, reading.controls.post_read);
}

// Control, the operations that it is for, its reader, and what is said of it when that fails.
struct Row {
  std::string_view oid;
  unsigned operations;
  int (*take)(Reading&);
  const char* malformed;
};

constexpr Row kRows[] = {
    {kManageDsaItOid, operation::all, take_nothing, "the ManageDsaIT control is not valid"},
    {kPersistentSearchOid, operation::search, take_persistent_search,
     "the persistent search control is not valid"},
    // The notification is a control of answers.
    {kEntryChangeOid, 0, take_nothing, ""},
    {kPagedResultsOid, operation::search, take_paged_results,
     "the paged results control is not valid"},
    {kAssertionOid, operation::all & ~operation::other, take_assertion,
     "the assertion control is not valid"},
    {kPreReadOid, operation::remove | operation::modify | operation::rename, take_pre_read,
     "the pre-read control is not valid"},
    {kPostReadOid, operation::add | operation::modify | operation::rename, take_post_read,
     "the post-read control is not valid"},
};

// Null: known to the backend alone, and for every operation.
const Row* row_of(std::string_view oid) {
  const auto* const found = std::find_if(std::begin(kRows), std::end(kRows),
                                         [oid](const Row& r) { return r.oid == oid; });
  return found != std::end(kRows) ? found : nullptr;
}

Refusal refusal_of(int code, const Row& row) {
  if (code == result::no_memory) throw std::bad_alloc();
  if (code == result::admin_limit_exceeded) return {code, "a control holds too much"};
  return {code, row.malformed};
}

Refusal check_combination(const RequestControls& controls) {
  if (controls.paged && controls.persistent.wanted)
    return {result::protocol_error, "a persistent search has no pages"};
  if (controls.paged && !controls.paged->cookie.empty() && controls.assertion)
    return {result::protocol_error, "an assertion goes with the first page"};
  return {};
}

}  // namespace

Refusal read_controls(const Message& message, const std::vector<std::string>& supported,
                      const DecoderLimits& limits, RequestControls& controls) {
  const unsigned kind = kind_of(message.request);
  std::array<bool, std::size(kRows)> seen{};
  for (const Control& control : message.controls) {
    const bool known =
        std::find(supported.begin(), supported.end(), control.oid) != supported.end();
    const Row* const row = row_of(control.oid);
    if (!known || (row && (row->operations & kind) == 0)) {
      if (!control.critical) continue;
      return {result::unavailable_critical_extension, "critical control not supported"};
    }
    if (!row) continue;
    if (std::exchange(seen[static_cast<std::size_t>(row - kRows)], true))
      return {result::protocol_error, "a control is given twice"};
    Reading reading{control, limits, controls};
    if (const int code = row->take(reading)) return refusal_of(code, *row);
  }
  return check_combination(controls);
}

std::string describe_controls(const RequestControls& controls) {
  std::string text;
  if (controls.assertion) text += " assertion";
  if (controls.pre_read) text += " pre-read";
  if (controls.post_read) text += " post-read";
  if (controls.paged) append_number(text += " page=", controls.paged->size);
  return text;
}

}  // namespace orv::server
