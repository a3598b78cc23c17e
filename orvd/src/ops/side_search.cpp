#include "ops/side_search.h"

#include <algorithm>
#include <new>

#include "cfg/ldif.h"
#include "cfg/result_codes.h"
#include "slapi/codepage.h"
#include "slapi/globals.h"

namespace orv::server {
namespace {

constexpr std::int32_t kAnyMessage = 1;

AnswerLimits bounded(std::size_t bytes) {
  AnswerLimits limits;
  limits.bytes = bytes;
  return limits;
}

// A value as the file would hold it; nothing for one that the code page lacks, which is refused
// before it comes to the file.
void append_line(std::string& record, const char* type, std::string_view value) {
  const std::string text(value);
  if (local_code_page_is_utf8()) return cfg::append_ldif_line(record, type, text);
  char* converted = nullptr;
  std::size_t length = 0;
  const int code = xlate_utf8_to_localcp(text.c_str(), &converted, &length);
  const MallocText local(converted);
  if (code == result::no_memory) throw std::bad_alloc();
  if (code == 0) cfg::append_ldif_line(record, type, local.get());
}

// Of a password it says that there is one: nothing that asks for its value matches, and it is not
// to lie about in memory.
std::string record_of(const Schema& schema, const entry& e) {
  std::string record;
  append_line(record, "dn", e.dn ? e.dn : "");
  for (const attr* a = e.attributes; a; a = a->next) {
    const SchemaAttribute* const type = schema.attribute(a->type);
    const bool secret = type && type->secret;
    for (berval** value = a->values; value && *value; ++value)
      append_line(record, a->type,
                  secret ? "secret" : std::string_view((*value)->bv_val, (*value)->bv_len));
  }
  return record;
}

}  // namespace

bool may_search(unsigned authority) noexcept {
  // A server of kind 3 has another rule first, which the backend applies.
  if (g_srvType.load(std::memory_order_relaxed) == 3) return true;
  constexpr unsigned kSupplier = authority::supplier_of_server | authority::supplier_of_suffix;
  return authority != authority::no_configuration_access && (authority & kSupplier) == 0;
}

std::string filter_for(const Schema& schema, std::string_view filter, unsigned authority) {
  // Who may not see an attribute must not learn it by asking for its value.
  const bool sees_all = authority == authority::primary_administrator;
  return rewrite_filter(schema, filter,
                        sees_all ? FilterUse::evaluate : FilterUse::evaluate_for_administrators);
}

int test_assertion(const Schema& schema, const entry& added, std::string_view filter,
                   unsigned authority) noexcept {
  try {
    bool matches = false;
    const int code = cfg::ldif_record_matches(
        record_of(schema, added), filter_for(schema, filter, authority).c_str(), matches);
    if (code == result::no_memory || code == result::time_limit_exceeded) return code;
    return code == 0 && matches ? result::success : result::assertion_failed;
  } catch (const std::bad_alloc&) {
    return result::no_memory;
  }
}

SideSearch::SideSearch(Services& services, Connection& connection, const Operation& client,
                       std::string_view normal_dn, std::string_view filter,
                       const std::vector<std::string>& attributes, std::size_t bytes)
    : connection_(connection),
      answer_(kAnyMessage, tag::search_done, bounded(bytes)),
      dn_(malloc_text(normal_dn)),
      filter_(malloc_text(filter_for(services.schema, filter, client.authority))),
      names_(canonical_names(services.schema, attributes)) {
  operation_.authority = client.authority;
  operation_.roles = client.roles;
  operation_.bound_dn = client.bound_dn;
  operation_.server_kind_marker = client.server_kind_marker;
  operation_.server = &answer_;
  parameters_ = make_parameters(services.backend.backend(), connection_, operation_);
  if (!parameters_) throw std::bad_alloc();
  pblock* const block = parameters_.get();
  if (slapi_pblock_set(block, parameter::target_dn, dn_.get()) != 0 ||
      slapi_pblock_set(block, parameter::search_filter_text, filter_.get()) != 0 ||
      slapi_pblock_set(block, parameter::search_attributes, names_.get()) != 0 ||
      slapi_pblock_set(block, parameter::search_scope, 0) != 0 ||
      slapi_pblock_set(block, parameter::search_types_only, 0) != 0)
    throw std::bad_alloc();
}

void SideSearch::bound(std::size_t bytes) noexcept {
  AnswerLimits limits = answer_.limits();
  limits.bytes = std::min(limits.bytes, bytes);
  answer_.set_limits(limits);
}

int SideSearch::run(BackendHost& backend) noexcept {
  const int code =
      backend.call_keeping_gate(parameter::search_function, parameters_.get(), connection_, false);
  if (!answer_.answered()) return code != 0 ? code : static_cast<int>(result::no_memory);
  return code != 0 ? code : answer_.code();
}

std::string SideSearch::shown_entry() {
  std::string bare;
  if (!found()) {
    entry named{};
    named.dn = dn_.get();
    if (!encode_entry(bare, kAnyMessage, named, AttributeSelection(), false, nullptr))
      throw std::bad_alloc();
  }
  return std::string(operation_in(found() ? answer_.bytes() : bare));
}

}  // namespace orv::server
