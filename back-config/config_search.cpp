#include "config_search.h"

#include <pthread.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "auto_lock.h"
#include "callers.h"
#include "cfg/owners.h"
#include "cfg/result_codes.h"
#include "config_add.h"
#include "config_names.h"
#include "config_session.h"
#include "config_xlate.h"
#include "function_ids.h"
#include "handlers.h"
#include "slapi/dn.h"
#include "slapi/globals.h"
#include "slapi/log.h"
#include "slapi/owners.h"
#include "slapi/strings.h"
#include "slapi/trace.h"

namespace orv {

// ======== AutoLock and AutoFree

namespace {

constexpr const char* kShortWait = "%d failed to trylock1 %p, waiting 0.1s\n";
constexpr const char* kLongWait = "%d failed to trylock2 %p, waiting 1s\n";
constexpr const char* kLine = "%s\n";
constexpr const char* kStillBusy =
    "Couldn't get access to mutex controlled resource (still busy). Will wait for 30 more seconds.";
constexpr const char* kGivenUp =
    "Couldn't get access to mutex controlled resource (wait of 60 seconds expired.)";

constexpr int kTimed = 1;
constexpr const char* kPolicyVariable = "AUTOLOCKTYPE";
constexpr const char* kBlockingPolicy = "REGULARLOCK";

// The texts speak of 30 and 60 seconds; the second phase lasts up to 570.
constexpr int kShortAttempts = 300;
constexpr useconds_t kShortPause = 100'000;  // microseconds
constexpr int kLongAttempts = 570;
constexpr useconds_t kLongPause = 1'000'000;

// The line has a place for an int: of a longer identifier the lower part is shown.
int calling_thread() {
  return static_cast<int>(pthread_self());
}

void report_short_wait(pthread_mutex_t* mutex) {
  PrintDebug(trace::info, kShortWait, calling_thread(), static_cast<void*>(mutex));
}

void report_long_wait(pthread_mutex_t* mutex) {
  PrintDebug(trace::info, kLongWait, calling_thread(), static_cast<void*>(mutex));
}

void report(const char* text) {
  if (read_ldap_debug()) PrintDebug(trace::info, kLine, text);
}

bool acquire_within(pthread_mutex_t* mutex, int attempts, useconds_t pause,
                    void (*report_wait)(pthread_mutex_t*)) {
  for (int attempt = 0; attempt < attempts; ++attempt) {
    if (pthread_mutex_trylock(mutex) != EBUSY) return true;  // other errors count as acquired
    if (read_ldap_debug()) report_wait(mutex);
    usleep(pause);
  }
  return false;
}

void acquire_timed(pthread_mutex_t* mutex) {
  if (acquire_within(mutex, kShortAttempts, kShortPause, report_short_wait)) return;
  report(kStillBusy);
  if (acquire_within(mutex, kLongAttempts, kLongPause, report_long_wait)) return;
  report(kGivenUp);
  throw kGivenUp;
}

int refreshed_lock_policy() {
  const int policy = AutoLock::ReadAndSetLockType(default_autolock.load(std::memory_order_relaxed));
  default_autolock.store(policy, std::memory_order_relaxed);
  return policy;
}

}  // namespace

AutoLock::AutoLock(pthread_mutex_t* mutex, bool timed) : mutex_(mutex) {
  const ldtr_function_local trace(function_id::auto_lock_take);
  if (mutex_ == nullptr) return;
  if (timed && refreshed_lock_policy() == kTimed) {
    acquire_timed(mutex_);
  } else {
    pthread_mutex_lock(mutex_);
  }
}

// Unlocks also what could not be locked, and does not look at the result: a destructor has nobody
// to tell.
AutoLock::~AutoLock() {
  const ldtr_function_local trace(function_id::auto_lock_release);
  if (mutex_ != nullptr) pthread_mutex_unlock(mutex_);
}

int AutoLock::ReadAndSetLockType(int current) {
  ldtr_function_local trace(function_id::auto_lock_policy);
  const int read = configfile_read.load(std::memory_order_relaxed);
  if (al_configfile_counter.load(std::memory_order_relaxed) >= read) return trace.exit(current);
  al_configfile_counter.store(read, std::memory_order_relaxed);
  const char* wanted = ldap_getenv(kPolicyVariable);
  const bool blocking = wanted != nullptr && std::strcmp(wanted, kBlockingPolicy) == 0;
  return trace.exit(blocking ? 0 : kTimed);
}

template class AutoFree<char>;

// ======== Who may search

namespace {

constexpr int kServerOfMarkedCallers = 3;
constexpr int kMarked = 1;

}  // namespace

int has_search_authority(const Connection* /*connection*/, const Operation* operation) {
  ldtr_function_local trace(function_id::has_search_authority);
  // First of all: on such a server unmarked callers are not even told that there is something.
  if (g_srvType.load(std::memory_order_relaxed) == kServerOfMarkedCallers &&
      operation->server_kind_marker != kMarked) {
    return trace.exit(result::no_such_object);
  }
  if (has_no_configuration_access(*operation)) return trace.exit(result::insufficient_access);
  return trace.exit(result::success);
}

// ======== What each caller sees

namespace {

// Takes an attribute out of the entry, if it is there. 0 or 16.
int hide(entry& e, const char* attribute) {
  if (attr_find(&e, attribute, 0, 0) == nullptr) return result::success;
  if (attr_delete(&e, attribute, nullptr) != 0) return result::no_such_attribute;
  return result::success;
}

int hide_administrator(entry& e) {
  for (const char* attribute :
       {config_names::admin_dn, config_names::admin_password, config_names::admin_group_enabled}) {
    const int rc = hide(e, attribute);
    if (rc != 0) return rc;
  }
  return result::success;
}

// The caller is not the member whose entry this is. Nothing is sent of an entry of which nothing is
// left to show.
int hide_password_of_another(entry& e, bool& send) {
  const int rc = hide(e, config_names::admin_password);
  if (rc == 0 && e.attributes == nullptr) send = false;
  return rc;
}

// The bind DN of the member whose entry this is, from the entry or from the file; null with result
// 0 when the entry names one without saying which (a search for types only).
int member_dn(Connection* connection, const attr* named, const char* normalized_dn,
              MallocText& member) {
  if (named == nullptr) {
    member.reset(getAdminGroupMemberDn(connection, normalized_dn));
    return member != nullptr ? result::success : result::other;
  }
  if (named->values == nullptr || named->values[0] == nullptr) return result::success;
  return normalized_copy(named->values[0]->bv_val, member);
}

// An entry inside the administrative group: its password is for the member and the primary
// administrator only. `member` receives its normalised DN.
int restrict_member_entry(Connection* connection, const Operation& operation,
                          const char* normalized_dn, MallocText& member, entry& e, bool& send) {
  const attr* named = attr_find(&e, config_names::admin_dn, 0, 0);
  if (named == nullptr && attr_find(&e, config_names::admin_password, 0, 0) == nullptr) {
    return result::success;
  }
  const int rc = member_dn(connection, named, normalized_dn, member);
  if (rc != 0) return rc;
  const bool own = member != nullptr && std::strcmp(member.get(), operation.bound_dn) == 0;
  return own ? static_cast<int>(result::success) : hide_password_of_another(e, send);
}

// What is compared to decide about an entry. It goes when the entry has been sent.
struct Compared {
  MallocText member;
  MallocText dn;
};

// Takes out of the entry what the caller may not see; clears `send` when nothing is to be sent. The
// first rule that applies decides.
int restrict_to_caller(Connection* connection, const Operation& operation, Compared& compared,
                       entry& e, bool& send) {
  MallocText& dn = compared.dn;
  const int rc = normalized_copy(e.dn, dn);
  if (rc != 0) return rc;
  if (is_primary_administrator(operation)) return result::success;
  if (std::strcmp(dn.get(), config_names::admin_group_dn) == 0) return result::success;
  if (std::strstr(dn.get(), config_names::admin_group_dn) == nullptr) {
    const bool root = std::strcmp(dn.get(), config_names::configuration_dn) == 0;
    return root ? hide_administrator(e) : static_cast<int>(result::success);
  }
  return restrict_member_entry(connection, operation, dn.get(), compared.member, e, send);
}

// What is the same for all entries of one result.
struct Sending {
  Connection* connection;
  Operation* operation;
  Backend* backend;
  char** attributes;
  int types_only;
  bool full_view;
  LDAPControl** controls;
  AutoFree<char>& directory_backend;  // the one entry of the restricted view
  int sent = 0;                       // entries handed to the sender
};

// Whether an entry belongs to the restricted view.
int restrict_to_directory_backend(Sending& sending, const entry& e, bool& send) {
  const char* wanted = sending.directory_backend.get();
  if (wanted == nullptr) return result::no_memory;
  send = slapi_dn_compare_v3(e.dn, wanted) == 0;
  return result::success;
}

int send_entry(Sending& sending, entry& e) {
  const int rc = sending.connection->send_search_entry(
      sending.backend, sending.connection, sending.operation, &e, sending.attributes,
      sending.types_only, nullptr, nullptr, nullptr, sending.controls);
  ++sending.sent;  // also one that was not taken: it is the one that ended the search
  return rc;
}

int send_record(_CFG* session, _CFGMessage* record, Sending& sending) {
  const EntryPtr e(CFGMessage2EntryTrans(session, record));
  if (e == nullptr) return result::no_memory;
  Compared compared;
  bool send = true;
  const int rc = sending.full_view ? restrict_to_caller(sending.connection, *sending.operation,
                                                        compared, *e, send)
                                   : restrict_to_directory_backend(sending, *e, send);
  if (rc != 0 || !send) return rc;
  return send_entry(sending, *e);
}

// Sends the records of the chain up to the first that fails. After a failure the record may be gone
// and is not used to find the next.
int send_records(_CFG* session, _CFGMessage* record, Sending& sending) {
  while (record != nullptr) {
    const int rc = send_record(session, record, sending);
    if (rc != 0) return rc;
    record = cfg_next_entry(session, record);
    if (cfg_get_errno(session) != 0) cfg_perror(session, "cfg_next_entry");
  }
  return result::success;
}

int send_chain(_CFG* session, _CFGMessage* found, Sending& sending) {
  CfgResult chain(found);
  _CFGMessage* const first = cfg_first_entry(session, chain.get());
  if (cfg_get_errno(session) != 0) {
    cfg_perror(session, "cfg_first_entry");
    // Kept: the session releases it when it is unbound. And no failure: the client gets a success
    // without entries.
    static_cast<void>(chain.release());
    return result::success;
  }
  return send_records(session, first, sending);
}

using ControlList = std::unique_ptr<LDAPControl*, FreeDeleter>;

ControlList response_controls(const Connection& connection, LDAPControl* control) {
  LDAPControl** list = nullptr;
  if (connection.aux != nullptr && connection.aux->attach_response_control != 0 &&
      control != nullptr) {
    ldap_insert_control(control, &list);  // without memory entries come without the control
  }
  return ControlList(list);
}

}  // namespace

int sendCFGSearchResults(_CFG* session, _CFGMessage* chain, Connection* connection,
                         Operation* operation, Backend* backend, char** attributes, int types_only,
                         int full_view, LDAPControl* response_control) {
  ldtr_function_local trace(function_id::send_search_results);
  AutoFree<char> directory_backend(strdup(config_names::directory_backend_dn), std::free);
  const ControlList controls = response_controls(*connection, response_control);

  Sending sending{connection, operation,      backend,        attributes,
                  types_only, full_view == 1, controls.get(), directory_backend};
  const int rc = send_chain(session, chain, sending);
  connection->send_search_result(connection, operation, rc, nullptr, nullptr, sending.sent);
  return trace.exit(rc);
}

// ======== The handler

namespace {

struct SearchRequest {
  Backend* backend = nullptr;  // valid from step 1
  Connection* connection = nullptr;

  Operation* operation = nullptr;  // valid from step 3
  const char* target_dn = nullptr;
  void* parsed_filter = nullptr;  // not used: the file is searched by the text
  const char* filter = nullptr;
  char** attributes = nullptr;
  int scope = 0;
  int types_only = 0;
  LDAPControl* response_control = nullptr;

  char** searched_attributes = nullptr;  // valid from step 4
  int full_view = 0;

  MallocText local_filter;  // valid from step 6
  MallocText local_base;    // goes first
};

void read_parties(pblock* pb, SearchRequest& request) {
  slapi_pblock_get(pb, parameter::backend, &request.backend);
  slapi_pblock_get(pb, parameter::connection, &request.connection);
}

void read_arguments(pblock* pb, SearchRequest& request) {
  slapi_pblock_get(pb, parameter::operation, &request.operation);
  slapi_pblock_get(pb, parameter::target_dn, &request.target_dn);
  slapi_pblock_get(pb, parameter::search_filter, &request.parsed_filter);
  slapi_pblock_get(pb, parameter::search_filter_text, &request.filter);
  slapi_pblock_get(pb, parameter::search_attributes, &request.attributes);
  slapi_pblock_get(pb, parameter::search_scope, &request.scope);
  slapi_pblock_get(pb, parameter::search_types_only, &request.types_only);
  slapi_pblock_get(pb, parameter::search_response_control, &request.response_control);
}

bool client_is_gone(const Connection& connection) {
  return connection.state == 0 && connection.aux != nullptr && connection.aux->client_gone != 0;
}

int convert_arguments(SearchRequest& request) {
  const int rc = convert(cfg_xlate_utf8_to_localcp, request.target_dn, request.local_base);
  if (rc != 0) return rc;
  return convert(cfg_xlate_utf8_to_localcp, request.filter, request.local_filter);
}

}  // namespace

int config_back_search(pblock* pb) {
  ldtr_function_local trace(function_id::config_back_search, "pb=0x%p", static_cast<void*>(pb));

  // 1. Backend and connection.
  SearchRequest request;
  read_parties(pb, request);

  // 2. Nobody listens: nothing is sent and no lock is touched.
  if (client_is_gone(*request.connection)) return trace.exit(result::success);

  // 3. Everything else that was asked.
  read_arguments(pb, request);

  // 4. Authority comes before the file: who may not search does not make the server read it.
  int rc = has_search_authority(request.connection, request.operation);
  if (rc == 0) {
    request.full_view = 1;
    request.searched_attributes = request.attributes;
  }

  // 5. The session, and with it the lock.
  OperationSession session(request.connection,
                           static_cast<ConfigBackendPrivate*>(request.backend->private_data));
  if (rc == 0) rc = session.open();

  // 6. The file speaks the local code page.
  if (rc == 0) rc = convert_arguments(request);

  // 7. The same search on the file.
  _CFGMessage* chain = nullptr;
  if (rc == 0) {
    rc = cfg_search_s(session.handle(), request.local_base.get(), request.scope,
                      request.local_filter.get(), request.searched_attributes, request.types_only,
                      &chain);
  }

  // 8. The answer, entries or refusal.
  if (rc == 0) {
    rc = sendCFGSearchResults(session.handle(), chain, request.connection, request.operation,
                              request.backend, request.attributes, request.types_only,
                              request.full_view, request.response_control);
  } else {
    send_ldap_result(request.connection, request.operation, rc, nullptr, "");
  }

  // 9. Back to rest, from wherever we came.
  session.release_without_taking();

  // 10. The converted texts go with the request.
  return trace.exit(rc);
}

}  // namespace orv
