#include "change.h"

#include <cstring>
#include <memory>
#include <new>
#include <utility>

#include "cfg/matching.h"
#include "cfg/secret.h"
#include "cfg/text.h"
#include "characters.h"
#include "diagnostics_line.h"
#include "local_text.h"
#include "object_class_lookup.h"
#include "save.h"

namespace orv::cfg {

// ---- Writing a changed text ----

namespace {

bool is_same(const FileText& a, const FileText& b) noexcept {
  return a.size() == b.size() && std::memcmp(a.begin(), b.begin(), a.size()) == 0;
}

}  // namespace

Outcome commit(Session& session, const std::vector<Edit>& edits) {
  const Snapshot& before = *session.snapshot;
  if (edited_size(before.text, edits) > FileText::kMaxSize) {
    return {result::admin_limit_exceeded, "the file would be larger than 1 GiB"};
  }
  const auto after = std::make_shared<Snapshot>();
  apply_edits(before.text, edits, after->text);
  if (is_same(before.text, after->text)) return {};
  // Whatever the reason, a file that no session could read again must not be put in place.
  FileFault fault;
  const SaveJob job{session.config_file.c_str(), session.save_file.c_str(), before.text,
                    after->text, [&] { return after->index.build(after->text, fault); }};
  Outcome outcome;
  outcome.code = save(*session.files, job, outcome.reason);
  if (!fault.cause.empty()) outcome.reason += ": " + fault.cause;
  if (outcome.refused()) return outcome;
  session.snapshot = after;
  session.attributes = AttributeMap();
  return {};
}

// ---- Reading modifications ----

namespace {

bool is_reserved_name(std::string_view type) noexcept {
  return equals_ignore_ascii_case(type, kDnName) ||
         equals_ignore_ascii_case(type, kChangeTypeName) ||
         equals_ignore_ascii_case(type, kControlName);
}

Outcome refuse(int code, const ModType& type, const char* what) {
  return {code, std::string(type.name) + ": " + what};
}

}  // namespace

Outcome read_type(const ldapmod& mod, ModType& type) {
  // A list that could not be made for want of memory holds a modification without a type.
  if (mod.mod_type == nullptr) return {result::no_memory, {}};
  const std::string_view spelled(mod.mod_type);
  if (!is_attribute_name(spelled) || is_reserved_name(spelled)) {
    return {result::undefined_attribute_type, "an attribute type that cannot be stored"};
  }
  type.known = attribute_lookup().find(spelled);
  type.name = type.known != nullptr ? std::string_view(type.known->name) : spelled;
  return {};
}

namespace {

Outcome collect_values(const ldapmod& mod, const ModType& type,
                       std::vector<std::string_view>& values) {
  values.clear();
  if ((mod.mod_op & kModBvalues) == 0) {
    for (char** at = mod.mod_vals.modv_strvals; at != nullptr && *at != nullptr; ++at) {
      values.emplace_back(*at);
    }
    return {};
  }
  for (berval** at = mod.mod_vals.modv_bvals; at != nullptr && *at != nullptr; ++at) {
    const berval& value = **at;
    if (value.bv_val == nullptr) {
      return refuse(result::invalid_attribute_syntax, type, "a value without a text");
    }
    values.emplace_back(value.bv_val, value.bv_len);
    if (values.back().find('\0') != std::string_view::npos) {
      return refuse(result::invalid_attribute_syntax, type, "a value with a NUL byte");
    }
  }
  return {};
}

}  // namespace

Outcome read_values(const ldapmod& mod, const ModType& type,
                    std::vector<std::string_view>& values) {
  Outcome outcome = collect_values(mod, type, values);
  if (!equals_ignore_ascii_case(type.name, "objectClass")) return outcome;
  // A file in which a class stands under another of its names could not be read.
  for (std::string_view& value : values) {
    const std::string* const name = object_class_lookup().required_name(value);
    if (name != nullptr) value = *name;
  }
  return outcome;
}

std::string value_key(const ModType& type, std::string_view value) {
  std::string utf8;
  std::string key;
  const MatchingRule rule =
      type.known != nullptr ? type.known->equality : MatchingRule::case_ignore;
  if (equality_key(rule, as_utf8(value, utf8), key) != result::success) throw std::bad_alloc();
  return key;
}

Outcome check_password(const ModType& type, std::string_view clear) {
  if (clear.empty()) return refuse(result::invalid_attribute_syntax, type, "an empty password");
  if (!names_scheme(clear)) return {};
  return refuse(result::constraint_violation, type,
                "a password that begins with a scheme in braces");
}

Outcome given_twice(const ModType& type) {
  return refuse(result::attribute_or_value_exists, type, "a value is given twice");
}

// ---- The border ----

namespace {

// Tells why a change was refused; the code is what counts if there is no memory for that.
void report(Session& session, Outcome& outcome) noexcept try {
  session.fault = {};
  session.fault_file.clear();
  if (outcome.reason.empty()) return;
  const std::string line = "a change of the configuration was refused: " + outcome.reason;
  write_diagnostics_line(line.c_str());
  session.fault.cause = std::move(outcome.reason);
} catch (const std::bad_alloc&) {
}

thread_local unsigned long changes_made = 0;

}  // namespace

int run_change(_CFG* handle, Change change, const char* dn, ldapmod** mods) noexcept {
  Session* const session = session_of(handle);
  if (session == nullptr) {
    return is_reserved(handle) ? result::no_memory : result::operations_error;
  }
  session->last_error = result::operations_error;
  if (session->state != Session::State::bound) return session->last_error;
  try {
    Outcome outcome = change(*session, or_empty(dn), mods);
    session->last_error = outcome.code;
    if (!outcome.refused()) ++changes_made;
    report(*session, outcome);
  } catch (const std::bad_alloc&) {
    session->last_error = result::no_memory;
  } catch (...) {
    session->last_error = result::other;
  }
  return session->last_error;
}

}  // namespace orv::cfg

namespace orv {

unsigned long cfg_changes_made() {
  return cfg::changes_made;
}

}  // namespace orv
