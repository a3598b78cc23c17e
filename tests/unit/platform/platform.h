// The scripted platform: what the backend is linked to in the unit tests instead of the server, the
// configuration-file library and parts of the C library.
//
// It answers from a script, writes down every call in order, and can make any call or any
// allocation fail. It knows who has to release what, and how, and it models mutexes instead of
// taking them: a lock that would wait for ever is a finding, not a hang.
//
// To add a function: implement it in server.cpp, library.cpp or system.cpp, beginning with a `Call`
// that names it and its arguments; ask `call.failure()` (or `call.failure_or_no_memory()`) first.
// Functions of the C library are wrapped by the linker: name them in CMakeLists.txt too.
//
// Only what runs inside `Platform::run` is observed. One Platform exists at a time.
#pragma once

#include <pthread.h>

#include <cstdint>
#include <cstdio>
#include <deque>
#include <functional>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "slapi/connection.h"
#include "slapi/control.h"
#include "slapi/entry.h"
#include "slapi/pblock.h"
#include "slapi/services.h"

namespace orv {

// The parameter block of the scripted platform.
struct pblock {
  struct Value {
    const void* pointer = nullptr;
    int number = 0;
    bool is_number = false;
  };
  std::map<int, Value> values;

  void put(int parameter, const void* pointer) { values[parameter] = {pointer, 0, false}; }
  void put(int parameter, int number) { values[parameter] = {nullptr, number, true}; }
};

}  // namespace orv

namespace orv::scripted {

// ---- The script of the configuration file

struct ScriptedAttribute {
  std::string type;
  std::vector<std::string> values;
};
struct ScriptedEntry {
  std::string dn;
  std::vector<ScriptedAttribute> attributes;
};
// What a search at one base answers. The entries are handed out even with a failure code, so that a
// caller who looks at the wrong one of the two is seen.
struct Answer {
  std::vector<ScriptedEntry> entries;
  int code = 0;
};

// One modification of a server's list; without values there is no array of them.
struct ScriptedModification {
  int code;  // with kModBvalues for counted values
  std::string type;
  std::optional<std::vector<std::string>> values;
};

// ---- What was seen

struct Event {
  enum class Kind { call, debug, entry, exit, print_debug, standard_error };
  Kind kind;
  std::string function;      // of a call
  std::string text;          // a call with its arguments, or the text written
  std::uint32_t number = 0;  // category of debug lines, identifier of entry and exit records
};

struct DebugLine {
  std::uint32_t category;
  std::string text;
  bool operator==(const DebugLine&) const = default;
};
void PrintTo(const DebugLine& line, std::ostream* out);

// ---- Who releases what

enum class Owned {
  memory,      // allocated by the code under test: free
  text,        // handed out for free
  cfg_text,    // cfg_memfree
  cfg_values,  // cfg_value_free, or free each value and the array
  cfg_value,   // one text in such an array
  chain,       // cfg_msgfree
  record,      // with its chain; free only after it was taken out of it
  loose_record,
  cursor,      // cfg_ber_free
  session,     // cfg_unbind
  part,        // of an entry: entry_free, attr_delete
  value,       // of an entry's attribute, record or text: the same, or free
  escaped_dn,  // free_ldap_escDN
  url,         // ldap_free_urldesc
  mods,        // free_ldmll
};

class Platform {
 public:
  Platform();
  ~Platform();
  Platform(const Platform&) = delete;
  Platform& operator=(const Platform&) = delete;

  // The one in existence, or null.
  static Platform* current();

  // Runs code under test.
  template <typename Function>
  auto run(Function function) {
    const UnderTest scope(*this);
    return function();
  }

  // ---- Script

  // By base DN, or by "base?filter", which comes first; others answer 32.
  std::map<std::string, Answer> file;
  // Answers each search in place of `file`. What it gives stays until the chain is released.
  std::function<const Answer&(const char* base, int scope, const char* filter, char** attributes,
                              int types_only)>
      search;
  std::string link_target;  // what readlink finds
  int link_errno = 0;       // or why it fails
  std::map<std::string, std::string> environment;
  bool server_debug = false;          // read_ldap_debug()
  pthread_t thread = 0;               // pthread_self()
  bool types_only_values = false;     // value arrays come back empty
  bool empty_lists_are_null = false;  // entries have a null list where there are no values
  bool keeps_letter_case = false;     // replace_DN does not fold
  bool failed_text_is_left = false;   // a conversion that fails by the script gives a text as well
  bool results_left_alone = false;    // such a conversion touches no result
  bool real_mutexes = false;          // mutexes are taken, and not only modelled
  bool admin_policy = false;          // pwdIsAdminPolicyOn()
  bool password_is_overwritten = false;  // verify_admin_password leaves nothing of a new one
  std::set<std::string> addresses;       // of the host
  _Admin_pwdPolicy policy{};             // getGlobalAdminPWDPolicyLocal()
  _Admin_pwdPolicy validated{};          // what validate_new_settings was last asked about
  AdminPasswordRecord* administrator_record = nullptr;  // findAdminPWDPAttrib()
  Backend* localhost_backend = nullptr;                 // select_backend_opt()
  PluginFunction* plugin_functions = nullptr;           // getAllPluginFuncs()
  std::map<std::string, int> supplied;  // checkMasterSrvDn() by suffix; others answer 0
  std::map<std::string, std::string>
      real_paths;                          // what realpath makes of a path; others are missing
  std::map<std::string, int> path_errors;  // or why it fails
  pblock global_parameters;                // the server's own block

  // The n-th call of a function (from 1; 0 for each) gives `result`: the code it returns, or null
  // with that error number for functions that return a pointer.
  void fail(const std::string& function, int nth, int result);
  // Something happens at the beginning of the n-th call.
  void at(const std::string& function, int nth, std::function<void()> action);
  // The n-th allocation fails: by the code under test itself or, on its behalf, by the platform.
  void fail_allocation(int nth) { failing_allocation_ = nth; }
  // The same, and every later one.
  void fail_allocations_from(int nth) {
    failing_allocation_ = nth;
    fails_from_then_on_ = true;
  }
  [[nodiscard]] int allocations() const { return allocations_; }
  // What malloc and calloc were asked for by the code under test, in bytes and in order.
  std::vector<std::size_t> sizes;
  // What the n-th allocation gives is known by that name; its release with free is then a call. Of
  // an array of values each value is known as "one of" it.
  void name_allocation(int nth, const std::string& name) { allocation_names_[nth] = name; }
  // The same for the first allocation of the n-th call of a function (from 1; 0 for each).
  void name_allocation_in(const std::string& function, int nth, const std::string& name);
  // Forgets calls and script of failures, and starts counting again. What is owned and locked
  // stays.
  void forget();

  // How an address is shown in the record of calls.
  void name(const void* address, const std::string& name) { names_[address] = name; }

  // ---- Findings

  [[nodiscard]] const std::vector<Event>& events() const { return events_; }
  // Texts of calls in order; of the functions named only, or of all but those that ask for an error
  // number.
  [[nodiscard]] std::vector<std::string> calls(const std::set<std::string>& functions = {}) const;
  // Calls of the functions named, and debug lines as "debug: text", in order.
  [[nodiscard]] std::vector<std::string> story(const std::set<std::string>& functions) const;
  [[nodiscard]] int count(const std::string& function) const;
  [[nodiscard]] std::vector<DebugLine> debug_lines() const;
  [[nodiscard]] std::vector<DebugLine> print_debug_lines() const;
  [[nodiscard]] std::string standard_error() const;
  // "entry 01010100 text", "exit 01010100 0"
  [[nodiscard]] std::vector<std::string> records() const;

  [[nodiscard]] bool held(const pthread_mutex_t* mutex) const;
  void set_held(const pthread_mutex_t* mutex, bool held);
  [[nodiscard]] int unlocks_of_free_mutexes() const { return unlocks_of_free_; }
  [[nodiscard]] int mutexes_alive() const { return mutexes_alive_; }
  [[nodiscard]] const pthread_mutex_t* last_mutex_made() const { return last_mutex_made_; }

  // What has not been released, one word each ("cursor", "cfg_values"...), and wrong releases.
  [[nodiscard]] std::vector<std::string> leaks() const;
  [[nodiscard]] const std::vector<std::string>& violations() const { return violations_; }
  // Releases everything that was left: for tests that have looked at it, or that own it.
  void release_leaks();

  // Entries sent, each as "dn|type=value,value|type=", and the values they had.
  std::vector<std::string> sent;

  // ---- For the platform's own functions

  void* give(Owned kind, std::size_t size);
  char* give_text(Owned kind, const std::string& text);
  void note(void* block, Owned kind);
  [[nodiscard]] std::optional<Owned> owner(const void* block) const;
  void change_owner(void* block, Owned kind);
  // The block is released through the function for `kind`; frees it. Null is a no-op.
  void take_back(void* block, Owned kind, const char* function);
  // Released as a part of something, whatever it was.
  void dispose(void* block);
  bool freed(void* block);  // by free; false when it must not be

  void record(Event event);
  std::optional<int> begin_call(const std::string& function, const std::string& text);
  bool allocation_fails();
  [[nodiscard]] std::string show(const void* address) const;
  void violation(const std::string& text) { violations_.push_back(text); }
  int lock(const pthread_mutex_t* mutex);
  int try_lock(const pthread_mutex_t* mutex);
  int unlock(const pthread_mutex_t* mutex);
  void mutex_made(const pthread_mutex_t* mutex) {
    ++mutexes_alive_;
    last_mutex_made_ = mutex;
    mutexes_[mutex] = false;
  }
  void mutex_gone() { --mutexes_alive_; }

  int error = 0;  // cfg_get_errno

 private:
  class UnderTest {
   public:
    explicit UnderTest(Platform& platform);
    ~UnderTest();
    UnderTest(const UnderTest&) = delete;
    UnderTest& operator=(const UnderTest&) = delete;

   private:
    std::FILE* real_stderr_;
    std::FILE* captured_;
  };

  struct Failure {
    std::string function;
    int nth;
    int result;
  };
  struct Action {
    std::string function;
    int nth;
    std::function<void()> action;
  };

  std::vector<Event> events_;
  std::map<std::string, int> counts_;
  std::vector<Failure> failures_;
  std::vector<Action> actions_;
  std::map<const void*, std::string> names_;
  std::map<const void*, Owned> blocks_;
  std::map<const pthread_mutex_t*, bool> mutexes_;
  std::vector<std::string> violations_;
  int failing_allocation_ = 0;
  bool fails_from_then_on_ = false;
  int allocations_ = 0;
  int unlocks_of_free_ = 0;
  int mutexes_alive_ = 0;
  const pthread_mutex_t* last_mutex_made_ = nullptr;
  std::map<int, std::string> allocation_names_;
};

// Whether the calling thread is inside code under test, and not inside the platform.
bool observed();

// Suspends observation.
class Unobserved {
 public:
  Unobserved();
  ~Unobserved();
  Unobserved(const Unobserved&) = delete;
  Unobserved& operator=(const Unobserved&) = delete;

 private:
  bool before_;
};

// ---- How arguments are shown

std::string show(const char* text);
inline std::string show(char* text) {
  return show(static_cast<const char*>(text));
}
std::string show(char** list);
std::string show(int number);
std::string show(unsigned number);
std::string show(std::size_t number);
std::string show(std::nullptr_t);
template <typename T>
std::string show(T* address) {
  return Platform::current()->show(reinterpret_cast<const void*>(address));
}

// One call into the platform; unobserved while it lasts.
class Call {
 public:
  template <typename... Arguments>
  explicit Call(const char* function, Arguments... arguments) {
    std::string text;
    ((text += (text.empty() ? "" : ", ") + show(arguments)), ...);
    failure_ = Platform::current()->begin_call(function, std::string(function) + "(" + text + ")");
  }

  // What the script says that this call gives.
  [[nodiscard]] std::optional<int> failure() const { return failure_; }
  // The same for functions that allocate, which may also run out of memory (90).
  [[nodiscard]] std::optional<int> failure_or_no_memory() const;

 private:
  Unobserved unobserved_;
  std::optional<int> failure_;
};

// ---- The server's side

// Fills the connection's send operations.
void connect(Connection& connection);

// Builds an entry as the server would hand it over, for `entry_free`: its DN as the script spells
// it, and normalised.
entry* make_entry(const ScriptedEntry& script);
std::string text_of(const entry& e);

// Builds a server's list of modifications, for `free_ldmll`.
ldapmod* make_modifications(const std::vector<ScriptedModification>& script);
// "0x80 type=value,value|0x81 type", in the order of the list; values are counted ones.
std::string text_of(const ldapmod* first);

// The script of a record's attributes.
const std::vector<ScriptedAttribute>& attributes_of(const _CFGMessage* record);

}  // namespace orv::scripted
