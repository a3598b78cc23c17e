#include "ops/request_text.h"

#include <new>

#include "cfg/masked_dn.h"
#include "cfg/result_codes.h"
#include "logs.h"
#include "ops/canonical.h"
#include "ops/log_text.h"
#include "protocol/encoder.h"

namespace orv::server {
namespace {

// A name as logs may show it: what is no DN may be anything, a password too.
std::string shown_dn(std::string_view dn) {
  std::string shown = "not a DN";
  if (cfg::mask_dn(dn, cfg::UnknownTypes::hidden, shown) == result::no_memory)
    throw std::bad_alloc();
  return shown;
}

}  // namespace

std::string_view operation_name(int tag) {
  switch (tag) {
    case tag::bind_response:
      return "BIND";
    case tag::search_done:
      return "SEARCH";
    case tag::add_response:
      return "ADD";
    case tag::delete_response:
      return "DELETE";
    case tag::modify_response:
      return "MODIFY";
    case tag::modify_dn_response:
      return "MODIFYDN";
    case tag::compare_response:
      return "COMPARE";
    case tag::extended_response:
      return "EXTENDED";
    default:
      return "REQUEST";
  }
}

std::string describe_dn(std::string_view name, std::string_view dn, std::string_view normal) {
  std::string text(name);
  text += " dn=";
  if (!normal.empty() && !cfg::normal_dn_may_need_mask(normal))
    append_client_text(text, dn);
  else
    append_client_text(text, shown_dn(dn));
  return text;
}

std::string describe_search(const Schema& schema, const SearchRequest& request,
                            std::string_view normal) {
  std::string text = describe_dn("SEARCH", request.base, normal);
  text += " scope=";
  append_number(text, request.scope);
  text += " filter=";
  // Cut before it is rewritten: a long filter costs no more than a short one.
  append_client_text(text, rewrite_filter(schema, logged_part(request.filter), FilterUse::show));
  if (request.filter.size() > kLoggedBytes) text += "...";
  return text;
}

std::string describe(const Schema& schema, const Request& request) {
  struct Describe {
    const Schema& schema;
    std::string operator()(const BindRequest&) const { return "BIND"; }
    std::string operator()(const UnbindRequest&) const { return "UNBIND"; }
    std::string operator()(const AbandonRequest&) const { return "ABANDON"; }
    std::string operator()(const SearchRequest& r) const { return describe_search(schema, r); }
    std::string operator()(const AddRequest& r) const { return describe_dn("ADD", r.dn); }
    std::string operator()(const DeleteRequest& r) const { return describe_dn("DELETE", r.dn); }
    std::string operator()(const ModifyRequest& r) const { return describe_dn("MODIFY", r.dn); }
    std::string operator()(const ModifyDnRequest& r) const { return describe_dn("MODIFYDN", r.dn); }
    std::string operator()(const CompareRequest& r) const { return describe_dn("COMPARE", r.dn); }
    std::string operator()(const ExtendedRequest& r) const {
      std::string text = "EXTENDED oid=";
      append_client_text(text, r.oid);
      return text;
    }
  };
  return std::visit(Describe{schema}, request);
}

}  // namespace orv::server
