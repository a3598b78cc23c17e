#include "cfg/session.h"

#include <cstdio>
#include <cstring>
#include <new>
#include <utility>

#include "cfg/diagnostics.h"
#include "cfg/result_codes.h"
#include "diagnostics_line.h"
#include "dn_text.h"
#include "filter.h"
#include "interrupt_poll.h"
#include "local_text.h"
#include "session_state.h"

namespace orv::cfg {

namespace {

// Handed out when there is no memory for a handle. It has no state: all threads may hold it.
_CFG reserved_handle;

// Runs `body` and keeps its result as the handle's error number. Only memory can run out in it.
template <class Body>
int guarded(Session& session, Body body) noexcept {
  try {
    session.last_error = body();
  } catch (const std::bad_alloc&) {
    session.last_error = result::no_memory;
  } catch (...) {
    session.last_error = result::operations_error;
  }
  return session.last_error;
}

// The code for a call on a handle without a session.
int without_session(const _CFG* handle) noexcept {
  return is_reserved(handle) ? result::no_memory : result::operations_error;
}

std::string* text_option(Session& session, int option) noexcept {
  switch (option) {
    case kCfgOptConfigFile:
      return &session.config_file;
    case kCfgOptSaveFile:
      return &session.save_file;
    case kCfgOptKeyStashFile:
      return &session.key_stash_file;
    default:
      return nullptr;
  }
}

// ---- Bind ----

int fail_bind(Session& session, std::string file, FileFault fault) {
  session.fault_file = std::move(file);
  session.fault = std::move(fault);
  return result::operations_error;
}

int read_config_file(Session& session) {
  if (session.config_file.empty()) {
    return fail_bind(session, "", {"no configuration file is named", 0, 0});
  }
  std::string cause;
  const auto snapshot = std::make_shared<Snapshot>();
  if (!snapshot->text.read(*session.files, session.config_file.c_str(), cause)) {
    return fail_bind(session, session.config_file, {std::move(cause), 0, 0});
  }
  FileFault fault;
  if (!snapshot->index.build(snapshot->text, fault)) {
    return fail_bind(session, session.config_file, std::move(fault));
  }
  session.snapshot = snapshot;
  return result::success;
}

int load_key(Session& session) {
  if (session.key_stash_file.empty()) return result::success;
  std::string why;
  const int rc = share_key_stash(session.key_stash_file.c_str(), session.owned_key, why);
  if (rc == result::no_memory) return rc;
  // `why` names the file itself.
  if (rc != result::success) return fail_bind(session, "", {std::move(why), 0, 0});
  session.key = session.owned_key.get();
  return result::success;
}

int bind(Session& session) {
  if (session.state == Session::State::bound) {
    return fail_bind(session, session.config_file, {"the session is open already", 0, 0});
  }
  session.state = Session::State::failed;
  session.fault = {};
  int rc = read_config_file(session);
  if (rc == result::success) rc = load_key(session);
  if (rc == result::success) session.state = Session::State::bound;
  return rc;
}

std::string describe_fault(const Session& session) {
  if (!session.keeps_details) return "the configuration could not be opened";
  if (session.fault.cause.empty()) return "";
  std::string text;
  if (session.names_position) {
    if (!session.fault_file.empty()) text = session.fault_file + ": ";
    if (session.fault.line > 0) {
      text += "line " + std::to_string(session.fault.line) + ", column " +
              std::to_string(session.fault.column) + ": ";
    }
  }
  return text + session.fault.cause;
}

// ---- Search ----

struct Search {
  const LdifIndex& index;
  Chain& chain;
  const Filter* filter;  // null matches every entry

  int look_at(std::uint32_t entry) {
    if (interrupted()) return result::time_limit_exceeded;
    const Filter::Match match =
        filter == nullptr ? Filter::Match::yes : filter->match(index, entry);
    if (match == Filter::Match::interrupted) return result::time_limit_exceeded;
    if (match == Filter::Match::yes) chain.append(entry);
    return result::success;
  }

  int children_of(std::uint32_t base) {
    for (std::uint32_t entry = base + 1; entry < index.size(); ++entry) {
      if (index.parent(entry) != base) continue;
      const int rc = look_at(entry);
      if (rc != result::success) return rc;
    }
    return interrupted() ? result::time_limit_exceeded : result::success;
  }

  // Parents come before their children: one walk tells who is below.
  int subtree_of(std::uint32_t base) {
    int rc = look_at(base);
    std::vector<bool> below(base == 0 ? 0 : index.size() - base);
    if (!below.empty()) below[0] = true;
    for (std::uint32_t entry = base + 1; rc == result::success && entry < index.size(); ++entry) {
      if (base != 0) {
        const std::uint32_t parent = index.parent(entry);
        if (parent < base || !below[parent - base]) continue;
        below[entry - base] = true;
      }
      rc = look_at(entry);
    }
    return rc;
  }

  int run(std::uint32_t base, int scope) {
    switch (scope) {
      case kScopeBase:
        return look_at(base);
      case kScopeOneLevel:
        return children_of(base);
      case kScopeSubtree:
        return subtree_of(base);
      default:
        return result::protocol_error;
    }
  }
};

int find_base(const Session& session, const char* base, std::uint32_t& entry) {
  std::string normal;
  if (!normalize_local(base == nullptr ? "" : base, normal)) {
    return result::invalid_dn_syntax;
  }
  entry = session.snapshot->index.find(normal);
  return entry == LdifIndex::kNone ? result::no_such_object : result::success;
}

int search(Session& session, const char* base, int scope, const char* filter_text,
           char** attributes, bool types_only, _CFGMessage** result) {
  if (session.state != Session::State::bound || result == nullptr) return result::operations_error;
  Filter filter;
  if (filter_text != nullptr) {
    std::string utf8;
    if (!filter.parse(as_utf8(filter_text, utf8))) return result::protocol_error;
  }
  std::uint32_t entry = LdifIndex::kNone;
  int rc = find_base(session, base, entry);
  if (rc != result::success) return rc;
  auto chain = std::make_unique<Chain>(session, attributes, types_only);
  const Filter* const wanted = filter_text == nullptr ? nullptr : &filter;
  rc = Search{session.snapshot->index, *chain, wanted}.run(entry, scope);
  if (rc == result::success) *result = chain.release();
  return rc;
}

// ---- Diagnostics ----

const char* reason(int code) noexcept {
  switch (code) {
    case result::success:
      return "success";
    case result::operations_error:
      return "operations error";
    case result::protocol_error:
      return "the request cannot be read";
    case result::time_limit_exceeded:
      return "interrupted";
    case result::no_such_record:
      return "no such entry, or no parent for it";
    case result::no_such_attribute:
      return "no such attribute";
    case result::attribute_or_value_exists:
      return "the value exists already";
    case result::not_allowed_on_non_leaf:
      return "the entry has children";
    case result::already_exists:
      return "the entry exists already";
    case result::no_such_object:
      return "no such entry";
    case result::invalid_dn_syntax:
      return "not a DN";
    case result::busy:
      return "busy";
    case result::no_memory:
      return "out of memory";
    default:
      return "failed";
  }
}

}  // namespace

bool is_reserved(const _CFG* handle) noexcept {
  return handle == &reserved_handle;
}

Session* session_of(_CFG* handle) noexcept {
  return handle == nullptr || is_reserved(handle) ? nullptr : static_cast<Session*>(handle);
}

Session::~Session() {
  while (chains != nullptr) delete chains;
}

}  // namespace orv::cfg

namespace orv {

using cfg::Session;
using cfg::session_of;

_CFG* cfg_init(const char* /*host*/, int /*port*/) {
  _CFG* const session = new (std::nothrow) Session;
  return session != nullptr ? session : &cfg::reserved_handle;
}

int cfg_set_option(_CFG* handle, int option, const char* value) {
  Session* const session = session_of(handle);
  if (session == nullptr) return cfg::without_session(handle);
  return cfg::guarded(*session, [&]() -> int {
    std::string* const text = cfg::text_option(*session, option);
    if (text == nullptr || session->state == Session::State::bound) {
      return result::operations_error;
    }
    text->assign(value == nullptr ? "" : value);
    return result::success;
  });
}

int cfg_set_option(_CFG* handle, int option, int value) {
  Session* const session = session_of(handle);
  if (session == nullptr) return cfg::without_session(handle);
  return cfg::guarded(*session, [&]() -> int {
    if (option != kCfgOptDiagnostics && option != kCfgOptDiagnosticsFile) {
      return result::operations_error;
    }
    (option == kCfgOptDiagnostics ? session->keeps_details : session->names_position) = value != 0;
    return result::success;
  });
}

int cfg_get_option(_CFG* handle, int option, const char** value) {
  if (value == nullptr) return result::operations_error;
  *value = "";
  Session* const session = session_of(handle);
  if (session == nullptr) return cfg::without_session(handle);
  return cfg::guarded(*session, [&]() -> int {
    const std::string* const text = cfg::text_option(*session, option);
    if (text == nullptr) return result::operations_error;
    *value = text->c_str();
    return result::success;
  });
}

int cfg_bind_s(_CFG* handle, const char* /*who*/, const char* /*credentials*/, int /*flags*/) {
  Session* const session = session_of(handle);
  if (session == nullptr) return cfg::without_session(handle);
  const int rc = cfg::guarded(*session, [&] { return cfg::bind(*session); });
  if (rc == result::no_memory) session->fault = cfg::FileFault{"out of memory", 0, 0};
  return rc;
}

int cfg_unbind(_CFG* handle) {
  delete session_of(handle);
  return result::success;
}

const char* cfg_dump_exception(_CFG* handle) {
  Session* const session = session_of(handle);
  if (session == nullptr) return cfg::is_reserved(handle) ? "out of memory" : "";
  try {
    session->dump = cfg::describe_fault(*session);
    return session->dump.c_str();
  } catch (...) {
    return "out of memory";
  }
}

int cfg_search_s(_CFG* handle, const char* base, int scope, const char* filter, char** attributes,
                 int types_only, _CFGMessage** chain) {
  if (chain != nullptr) *chain = nullptr;
  Session* const session = session_of(handle);
  if (session == nullptr) return cfg::without_session(handle);
  return cfg::guarded(*session, [&] {
    return cfg::search(*session, base, scope, filter, attributes, types_only != 0, chain);
  });
}

int cfg_get_errno(_CFG* handle) {
  const Session* const session = session_of(handle);
  return session != nullptr ? session->last_error : cfg::without_session(handle);
}

void cfg_perror(_CFG* handle, const char* text) {
  char line[512];
  const char* const reason = cfg::reason(cfg_get_errno(handle));
  if (text == nullptr) {
    std::snprintf(line, sizeof line, "%s", reason);
  } else {
    std::snprintf(line, sizeof line, "%s: %s", text, reason);
  }
  cfg::write_diagnostics_line(line);
}

}  // namespace orv
