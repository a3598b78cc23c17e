// The configuration-file library of the scripted platform.
#include <cstring>

#include "cfg/session.h"
#include "platform/platform.h"
#include "platform/real.h"

namespace orv {

// A chain's head, or one of its records; plain, since a record may be released with free.
struct _CFGMessage {
  _CFGMessage* next;
  _CFGMessage* head;  // null for the head itself
  const scripted::ScriptedEntry* script;
};
struct _CFGBer {
  std::size_t position;
};

namespace {

using scripted::Call;
using scripted::Owned;
using scripted::Platform;

Platform& platform() {
  return *Platform::current();
}

// Notes the outcome of a call on the handle.
int done(int code) {
  return platform().error = code;
}
std::nullptr_t none(int code) {
  done(code);
  return nullptr;
}

_CFGMessage* make_message(Owned kind, const std::string& name, _CFGMessage* head,
                          const scripted::ScriptedEntry* script) {
  auto* message = static_cast<_CFGMessage*>(platform().give(kind, sizeof(_CFGMessage)));
  message->head = head;
  message->script = script;
  platform().name(message, name);
  return message;
}

_CFGMessage* make_chain(const scripted::Answer& answer) {
  _CFGMessage* head = make_message(Owned::chain, "chain", nullptr, nullptr);
  _CFGMessage* last = head;
  int number = 0;
  for (const scripted::ScriptedEntry& e : answer.entries) {
    last->next = make_message(Owned::record, "record " + std::to_string(++number), head, &e);
    last = last->next;
  }
  return head;
}

const scripted::ScriptedAttribute* find(const _CFGMessage* entry, const char* attribute) {
  for (const scripted::ScriptedAttribute& a : entry->script->attributes) {
    if (strcasecmp(a.type.c_str(), attribute) == 0) return &a;
  }
  return nullptr;
}

// The name of the attribute that the walk has come to, or the walk's end.
char* name_at(const _CFGMessage* entry, std::size_t position) {
  if (position >= entry->script->attributes.size()) return none(0);
  done(0);
  return platform().give_text(Owned::cfg_text, entry->script->attributes[position].type);
}

}  // namespace

_CFG* cfg_init(const char* host, int port) {
  const Call call("cfg_init", host, port);
  if (call.failure()) return nullptr;
  auto* session = static_cast<_CFG*>(platform().give(Owned::session, sizeof(_CFG)));
  platform().name(session, "session");
  return session;
}

int cfg_set_option(_CFG* session, int option, const char* value) {
  const Call call("cfg_set_option", session, option, value);
  return done(call.failure_or_no_memory().value_or(0));
}

int cfg_set_option(_CFG* session, int option, int value) {
  const Call call("cfg_set_option", session, option, value);
  return done(call.failure().value_or(0));
}

int cfg_get_option(_CFG* session, int option, const char** value) {
  const Call call("cfg_get_option", session, option);
  if (call.failure()) return done(*call.failure());
  *value = "/file/in/use";
  return done(0);
}

int cfg_bind_s(_CFG* session, const char* who, const char* credentials, int flags) {
  const Call call("cfg_bind_s", session, who, credentials, flags);
  return done(call.failure_or_no_memory().value_or(0));
}

int cfg_unbind(_CFG* session) {
  const Call call("cfg_unbind", session);
  if (session != nullptr) platform().take_back(session, Owned::session, "cfg_unbind");
  return call.failure().value_or(0);
}

const char* cfg_dump_exception(_CFG* session) {
  const Call call("cfg_dump_exception", session);
  return "line 7, column 3: not an attribute";
}

namespace {

const scripted::Answer& answer_of_file(const char* base, const char* filter) {
  static const scripted::Answer kMissing{{}, 32};
  auto answer = platform().file.find(std::string(base) + "?" + filter);
  if (answer == platform().file.end()) answer = platform().file.find(base);
  return answer == platform().file.end() ? kMissing : answer->second;
}

}  // namespace

int cfg_search_s(_CFG* session, const char* base, int scope, const char* filter, char** attributes,
                 int types_only, _CFGMessage** chain) {
  const Call call("cfg_search_s", session, base, scope, filter, attributes, types_only);
  *chain = nullptr;
  if (const auto failure = call.failure_or_no_memory()) return done(*failure);
  const scripted::Answer& answer =
      platform().search ? platform().search(base, scope, filter, attributes, types_only)
                        : answer_of_file(base, filter);
  if (answer.code == 0 || !answer.entries.empty()) *chain = make_chain(answer);
  return done(answer.code);
}

int cfg_count_entries(_CFG* session, _CFGMessage* chain) {
  const Call call("cfg_count_entries", session, chain);
  if (call.failure()) return *call.failure();
  int count = 0;
  if (chain != nullptr) {
    for (const _CFGMessage* record = chain->next; record != nullptr; record = record->next) ++count;
  }
  done(0);
  return count;
}

_CFGMessage* cfg_first_entry(_CFG* session, _CFGMessage* chain) {
  const Call call("cfg_first_entry", session, chain);
  if (call.failure()) return none(*call.failure());
  done(0);
  return chain == nullptr ? nullptr : chain->next;
}

_CFGMessage* cfg_next_entry(_CFG* session, _CFGMessage* entry) {
  const Call call("cfg_next_entry", session, entry);
  if (call.failure()) return none(*call.failure());
  done(0);
  return entry == nullptr ? nullptr : entry->next;
}

char* cfg_get_dn(_CFG* session, _CFGMessage* entry) {
  const Call call("cfg_get_dn", session, entry);
  if (const auto failure = call.failure_or_no_memory()) return none(*failure);
  done(0);
  return entry == nullptr ? nullptr : platform().give_text(Owned::cfg_text, entry->script->dn);
}

char* cfg_first_attribute(_CFG* session, _CFGMessage* entry, _CFGBer** cursor) {
  const Call call("cfg_first_attribute", session, entry);
  *cursor = nullptr;
  if (const auto failure = call.failure_or_no_memory()) return none(*failure);
  if (entry == nullptr) return none(1);
  char* name = name_at(entry, 0);
  if (name != nullptr) {
    *cursor = static_cast<_CFGBer*>(platform().give(Owned::cursor, sizeof(_CFGBer)));
    platform().name(*cursor, "cursor");
  }
  return name;
}

char* cfg_next_attribute(_CFG* session, _CFGMessage* entry, _CFGBer* cursor) {
  const Call call("cfg_next_attribute", session, entry, cursor);
  if (const auto failure = call.failure_or_no_memory()) return none(*failure);
  if (cursor == nullptr) return none(0);
  return name_at(entry, ++cursor->position);
}

char** cfg_get_values(_CFG* session, _CFGMessage* entry, const char* attribute) {
  const Call call("cfg_get_values", session, entry, attribute);
  if (const auto failure = call.failure_or_no_memory()) return none(*failure);
  const scripted::ScriptedAttribute* found = find(entry, attribute);
  if (found == nullptr) return none(16);
  const std::size_t count = platform().types_only_values ? 0 : found->values.size();
  auto** values =
      static_cast<char**>(platform().give(Owned::cfg_values, (count + 1) * sizeof(char*)));
  for (std::size_t i = 0; i < count; ++i) {
    values[i] = platform().give_text(Owned::cfg_value, found->values[i]);
  }
  done(0);
  return values;
}

void cfg_value_free(char** values) {
  const Call call("cfg_value_free");
  if (values == nullptr) return;
  for (char** value = values; *value != nullptr; ++value) {
    platform().take_back(*value, Owned::cfg_value, "cfg_value_free");
  }
  platform().take_back(values, Owned::cfg_values, "cfg_value_free");
}

void cfg_memfree(void* memory) {
  const Call call("cfg_memfree", static_cast<const char*>(memory));
  platform().take_back(memory, Owned::cfg_text, "cfg_memfree");
}

void cfg_ber_free(_CFGBer* cursor) {
  const Call call("cfg_ber_free", cursor);
  platform().take_back(cursor, Owned::cursor, "cfg_ber_free");
}

int cfg_msgfree(_CFGMessage* chain) {
  const Call call("cfg_msgfree", chain);
  if (chain == nullptr) return 0;
  _CFGMessage* record = chain->next;
  platform().take_back(chain, Owned::chain, "cfg_msgfree");
  while (record != nullptr) {
    _CFGMessage* next = record->next;
    platform().take_back(record, Owned::record, "cfg_msgfree");
    record = next;
  }
  return 0;
}

void cfg_msg_unlink(_CFG* session, _CFGMessage* record) {
  const Call call("cfg_msg_unlink", session, record);
  _CFGMessage* before = record->head;
  while (before->next != record) before = before->next;
  before->next = record->next;
  platform().change_owner(record, Owned::loose_record);
}

namespace {

// "code type=value,value|code type=..."; a record without values ends with its type.
std::string text_of(ldapmod** mods) {
  if (mods == nullptr) return "<null>";
  std::string text;
  for (ldapmod** mod = mods; *mod != nullptr; ++mod) {
    text += (mod == mods ? "" : "|") + std::to_string((*mod)->mod_op) + " " + (*mod)->mod_type;
    char** const values = (*mod)->mod_vals.modv_strvals;
    for (char** value = values; value != nullptr && *value != nullptr; ++value) {
      text += (value == values ? "=" : ",") + std::string(*value);
    }
  }
  return text;
}

}  // namespace

int cfg_add_s(_CFG* session, const char* dn, ldapmod** mods) {
  const Call call("cfg_add_s", session, dn, text_of(mods).c_str());
  return done(call.failure_or_no_memory().value_or(0));
}

int cfg_delete_s(_CFG* session, const char* dn) {
  const Call call("cfg_delete_s", session, dn);
  return done(call.failure_or_no_memory().value_or(0));
}

int cfg_modify_s(_CFG* session, const char* dn, ldapmod** mods) {
  const Call call("cfg_modify_s", session, dn, text_of(mods).c_str());
  return done(call.failure_or_no_memory().value_or(0));
}

int cfg_get_errno(_CFG* session) {
  const Call call("cfg_get_errno", session);
  return call.failure().value_or(platform().error);
}

void cfg_perror(_CFG* session, const char* text) {
  const Call call("cfg_perror", session, text);
}

}  // namespace orv

namespace orv::scripted {

const std::vector<ScriptedAttribute>& attributes_of(const _CFGMessage* record) {
  return record->script->attributes;
}

}  // namespace orv::scripted
