#include "authority_model.h"

#include <algorithm>
#include <cctype>
#include <initializer_list>

namespace orv::model {
namespace {

// ---- Names of the configuration

const std::string kTop = "CN=CONFIGURATION";
const std::string kGroup = "CN=ADMINGROUP,CN=CONFIGURATION";
const std::string kKerberos = "CN=KERBEROS,CN=CONFIGURATION";
const std::string kDigest = "CN=DIGEST,CN=CONFIGURATION";
const std::string kPolicy = "CN=PWDPOLICY ADMIN,CN=CONFIGURATION";
const std::string kAudit = "CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
const std::string kAdminAudit = "CN=ADMIN AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
const std::string kDefaultLog = "CN=DEFAULT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
const std::string kReplication = "CN=REPLICATION,CN=CONFIGURATION";
const std::string kMaster = "CN=MASTER SERVER,CN=CONFIGURATION";
const std::string kPassThrough = "CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION";
const std::string kBackends = "CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION";
const std::string kDirectory = "CN=DIRECTORY,CN=RDBM BACKENDS," + kBackends;
const std::string kConfigDb = "CN=CONFIGDB,CN=CONFIG BACKENDS," + kBackends;
const std::string kProxies = "CN=PROXYDB,CN=PROXY BACKENDS," + kBackends;

const char* const kAdminDn = "orv-slapdAdminDN";
const char* const kAdminPw = "orv-slapdAdminPW";
const char* const kGroupEnabled = "orv-slapdAdminGroupEnabled";
const char* const kRole = "orv-slapdAdminRole";
const char* const kKrbDn = "orv-slapdKrbAdminDN";
const char* const kDigestUser = "orv-slapdDigestAdminUser";
const char* const kMasterDn = "orv-slapdMasterDN";
const char* const kMasterPw = "orv-slapdMasterPW";
const char* const kSplitName = "orv-slapdProxySplitName";
const char* const kSuffix = "orv-slapdSuffix";
const char* const kLog = "orv-slapdLog";
const char* const kClass = "objectClass";

enum : int {
  kOperationsError = 1,
  kNoAttribute = 16,
  kConstraint = 19,
  kSyntax = 21,
  kMissing = 32,
  kRefused = 50,
  kUnwilling = 53,
  kClassViolation = 65,
  kExists = 68,
  kOther = 80,
  kReplicationContext = 92
};

// ---- Texts

std::string upper(std::string text) {
  for (char& c : text) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  return text;
}

bool contains(const std::string& text, const std::string& part) {
  return text.find(part) != std::string::npos;
}

bool same_as_one(const std::string& dn, std::initializer_list<std::string> names) {
  return std::any_of(names.begin(), names.end(), [&](const auto& name) { return same(dn, name); });
}

bool begins(const std::string& text, const std::string& prefix) {
  return same(text.substr(0, prefix.size()), prefix);
}

bool is_kerberos_name(const std::string& value) {
  return begins(value, "orv-kerberosName=") || begins(value, "orv-kn=");
}

bool is_alphanumeric(const std::string& text) {
  return !text.empty() && std::all_of(text.begin(), text.end(),
                                      [](unsigned char c) { return std::isalnum(c) != 0; });
}

// Whether an entry's classes include one; classes are compared ignoring case.
bool is_a(const Entry& e, const char* name) {
  const Texts* classes = e.values(kClass);
  return classes != nullptr && std::any_of(classes->begin(), classes->end(),
                                           [&](const auto& value) { return same(value, name); });
}

// ---- Callers

bool is_master_server(const Caller& c) {
  return (c.authority & 0x03U) != 0;
}
bool is_stranger(const Caller& c) {
  return c.authority == 0x24U;
}
bool is_primary(const Caller& c) {
  return (c.authority & 0x0CU) == 0x0CU;
}
bool is_member(const Caller& c) {
  return (c.authority & 0x14U) == 0x14U;
}

// ---- What roles open

constexpr unsigned kAuditRole = 0x02;
constexpr unsigned kReplicationRoles = 0x0C;
constexpr unsigned kSchemaRole = 0x10;
constexpr unsigned kServerRole = 0x20;
constexpr unsigned kAnyRole = 0x3E;
constexpr unsigned kRolesOfSuppliers = 0x34;

enum Operation : unsigned { adds = 1, deletes = 2, modifies = 4, changes = 7 };

struct Target {
  std::string dn;
  bool supplier;

  [[nodiscard]] bool is_one(std::initializer_list<std::string> names) const {
    return same_as_one(dn, names);
  }
  [[nodiscard]] bool in_group() const { return contains(upper(dn), kGroup); }
};

struct RoleRule {
  unsigned operations;
  bool (*concerns)(const Target& target);
  unsigned roles;
  bool all_of_them;  // or one of them
};

// A member's roles must satisfy every row that concerns the target.
const RoleRule kRoleRules[] = {
    // No role, no change; members change their own entries without.
    {adds | deletes, [](const Target&) { return true; }, kAnyRole, false},
    {modifies, [](const Target& t) { return !t.in_group(); }, kAnyRole, false},
    // What has no row of its own takes the role for the server.
    {adds | deletes,
     [](const Target& t) {
       return !t.supplier && !t.is_one({kAudit, kAdminAudit, kDefaultLog, kReplication, kMaster});
     },
     kServerRole, false},
    {modifies,
     [](const Target& t) {
       return !t.supplier && !t.in_group() &&
              !t.is_one({kAudit, kAdminAudit, kDefaultLog, kReplication, kMaster, kBackends});
     },
     kServerRole, false},
    {changes,
     [](const Target& t) {
       return t.is_one({kAudit, kAdminAudit});
     },
     kAuditRole, false},
    {changes, [](const Target& t) { return t.is_one({kDefaultLog}); }, kAuditRole | kServerRole,
     false},
    {changes, [](const Target& t) { return t.is_one({kReplication}); },
     kReplicationRoles | kServerRole, false},
    {modifies, [](const Target& t) { return t.is_one({kBackends}); }, kSchemaRole | kServerRole,
     false},
    // By the bytes of the name.
    {modifies, [](const Target& t) { return contains(t.dn, kPassThrough); }, kServerRole, false},
    // Suppliers bring schema and data: it takes three roles at once.
    {changes, [](const Target& t) { return t.supplier || t.is_one({kMaster}); }, kRolesOfSuppliers,
     true},
};

bool roles_open(Operation operation, const Target& target, unsigned roles) {
  return std::all_of(std::begin(kRoleRules), std::end(kRoleRules), [&](const RoleRule& rule) {
    if ((rule.operations & operation) == 0 || !rule.concerns(target)) return true;
    const unsigned held = roles & rule.roles;
    return rule.all_of_them ? held == rule.roles : held != 0;
  });
}

// ---- Identities that are taken

// The primary administrator's bind DN; none when there is not exactly one.
std::optional<std::string> primary_dn(const File& file) {
  const Entry* top = file.find(kTop);
  const Texts* values = top == nullptr ? nullptr : top->values(kAdminDn);
  if (values == nullptr || values->size() != 1) return std::nullopt;
  return normal(values->front());
}

// The first values of an attribute in the entries at and below a name.
Texts first_values(const File& file, const std::string& base, const char* type) {
  Texts found;
  for (const Entry* e : file.subtree(base)) {
    if (const std::string* value = e->first(type)) found.push_back(*value);
  }
  return found;
}

int taken_administrator_dn(const File& file, const std::string& candidate) {
  const auto primary = primary_dn(file);
  if (!primary) return kOther;
  if (normal(candidate) == *primary) return kExists;
  for (const std::string& dn : first_values(file, kGroup, kAdminDn)) {
    if (normal(dn) == normal(candidate)) return kExists;
  }
  return 0;
}

// Only the first of the entries for replication counts, and each supplier.
int taken_supplier_dn(const File& file, const std::string& candidate) {
  bool is_first = true;
  for (const Entry* e : file.subtree(kTop)) {
    const bool counts =
        (is_a(*e, "orv-slapdReplication") && is_first) || is_a(*e, "orv-slapdSupplier");
    if (is_a(*e, "orv-slapdReplication")) is_first = false;
    const std::string* dn = e->first(kMasterDn);
    if (counts && dn != nullptr && normal(*dn) == normal(candidate)) return kExists;
  }
  return 0;
}

// Kerberos names are compared behind their first "=", ignoring case.
int taken_kerberos_name(const File& file, const std::string& candidate) {
  Texts names = first_values(file, kGroup, kKrbDn);
  const Entry* root = file.find(kKerberos);
  if (root != nullptr && root->first(kKrbDn) != nullptr) names.push_back(*root->first(kKrbDn));
  const auto essence = [](const std::string& name) {
    const std::size_t sign = name.find('=');
    return sign == std::string::npos ? name : name.substr(sign + 1);
  };
  return std::any_of(names.begin(), names.end(),
                     [&](const auto& name) { return same(essence(name), essence(candidate)); })
             ? kExists
             : 0;
}

// Digest names and split names are compared byte by byte.
int taken_digest_user(const File& file, const std::string& candidate) {
  Texts names = first_values(file, kGroup, kDigestUser);
  const Entry* root = file.find(kDigest);
  if (root != nullptr && root->first(kDigestUser) != nullptr) {
    names.push_back(*root->first(kDigestUser));
  }
  return std::count(names.begin(), names.end(), candidate) != 0 ? kExists : 0;
}

int taken_split_name(const File& file, const std::string& candidate) {
  const Texts names = first_values(file, kProxies, kSplitName);
  return std::count(names.begin(), names.end(), candidate) != 0 ? kExists : 0;
}

int checked_kerberos_name(const File& file, const std::string* value) {
  if (value == nullptr || !is_kerberos_name(*value)) return kOther;
  return taken_kerberos_name(file, *value);
}

int checked_split_name(const File& file, const std::string* value) {
  if (value == nullptr || !is_alphanumeric(*value)) return kSyntax;
  return taken_split_name(file, *value);
}

int first_failure(std::initializer_list<int> codes) {
  for (const int code : codes) {
    if (code != 0) return code;
  }
  return 0;
}

// ---- Subtrees of pass-through authentication

bool nested(const std::string& a, const std::string& b) {
  const std::string& longer = a.size() > b.size() ? a : b;
  const std::string& shorter = a.size() > b.size() ? b : a;
  return longer == shorter || ("," + longer).ends_with("," + shorter);
}

Texts subtrees_of(const Entry& e) {
  Texts subtrees;
  const Texts* values = e.values("orv-slapdPtaSubtree");
  if (values == nullptr) return subtrees;
  for (const std::string& value : *values) subtrees.push_back(normal(value));
  return subtrees;
}

bool has_nested(const Texts& subtrees, const Texts& others) {
  return std::any_of(subtrees.begin(), subtrees.end(), [&](const auto& subtree) {
    return std::any_of(others.begin(), others.end(),
                       [&](const auto& other) { return nested(subtree, other); });
  });
}

int pass_through_fits(const File& file, const std::string& dn, const Entry& e) {
  if (!contains(dn, kPassThrough)) return 0;
  const Texts subtrees = subtrees_of(e);
  const Texts reserved = {"CN=CONFIGURATION", "CN=SCHEMA", "CN=PWDPOLICY,CN=ORVPOLICIES",
                          "CN=CHANGELOG", "CN=LOCALHOST"};
  if (has_nested(subtrees, reserved)) return kConstraint;
  for (std::size_t i = 0; i < subtrees.size(); ++i) {
    if (has_nested({subtrees[i]},
                   {subtrees.begin() + static_cast<std::ptrdiff_t>(i) + 1, subtrees.end()})) {
      return kConstraint;
    }
  }
  for (const Entry* other : file.children(kPassThrough)) {
    if (!is_a(*other, "orv-slapdPta") || same(normal(other->dn), dn)) continue;
    if (has_nested(subtrees, subtrees_of(*other))) return kConstraint;
  }
  return 0;
}

// ---- Roles of a member that is added

const Texts kVocabulary = {"AuditAdmin",           "DirDataAdmin", "NoAdmin",
                           "ReplicationAdmin",     "SchemaAdmin",  "ServerConfigGroupMember",
                           "ServerStartStopAdmin", "PasswordAdmin"};
const Texts kDefaultRoles = {"DirDataAdmin", "PasswordAdmin", "SchemaAdmin",
                             "ServerConfigGroupMember", "ServerStartStopAdmin"};

bool is_role(const std::string& value) {
  return std::any_of(kVocabulary.begin(), kVocabulary.end(),
                     [&](const auto& role) { return same(role, value); });
}

// 21 where a value is no role; otherwise the entry has the roles that are stored.
int give_roles(const Caller& caller, const std::string& dn, Entry& e) {
  if (!contains(dn, kGroup)) return 0;
  if (!is_primary(caller)) return kRefused;
  if (same(dn, kGroup)) return 0;
  for (Attribute& a : e.attributes) {
    if (!same(a.type, kRole)) continue;
    if (!std::all_of(a.values.begin(), a.values.end(), is_role)) return kSyntax;
    const bool none = std::any_of(a.values.begin(), a.values.end(),
                                  [](const auto& role) { return same(role, "NoAdmin"); });
    if (none) a.values = {"NoAdmin"};
    return 0;
  }
  e.attributes.push_back({kRole, kDefaultRoles});
  return 0;
}

// ---- Rules for an entry that is added

struct Added {
  const Server& server;
  const Caller& caller;
  const Entry& e;
  const std::string& dn;
  [[nodiscard]] const File& file() const { return *server.file; }
};

int member_fits(const Added& a) {
  if (!is_a(a.e, "top")) return kClassViolation;
  if (a.dn == kGroup) return is_a(a.e, "container") ? 0 : kClassViolation;
  const std::string* dn = a.e.first(kAdminDn);
  if (!is_a(a.e, "orv-slapdConfigEntry") || !is_a(a.e, "orv-slapdAdminGroupMember") ||
      dn == nullptr) {
    return kClassViolation;
  }
  const std::string* kerberos = a.e.first(kKrbDn);
  const std::string* digest = a.e.first(kDigestUser);
  return first_failure({taken_administrator_dn(a.file(), *dn), taken_supplier_dn(a.file(), *dn),
                        kerberos == nullptr ? 0 : checked_kerberos_name(a.file(), kerberos),
                        digest == nullptr ? 0 : taken_digest_user(a.file(), *digest)});
}

int group_and_logs(const Added& a) {
  if (contains(a.dn, kGroup)) return is_primary(a.caller) ? member_fits(a) : kRefused;
  const bool is_log = a.dn == kAudit || a.dn == kAdminAudit || a.dn == kDefaultLog;
  if (!is_log || !is_member(a.caller)) return 0;
  const unsigned needed = a.dn == kAudit ? kAuditRole : kAuditRole | kServerRole;
  return (a.caller.roles & needed) != 0 ? 0 : kRefused;
}

// An entry of both classes is let through, any other is not.
int supplier_identity(const Added& a) {
  const std::string* dn = a.e.first(kMasterDn);
  if (a.e.values(kClass) == nullptr || dn == nullptr) return 0;
  if (is_a(a.e, "orv-slapdReplication") && is_a(a.e, "orv-slapdSupplier")) return 0;
  return taken_administrator_dn(a.file(), *dn);
}

int kerberos_entry(const Added& a) {
  if (a.dn != kKerberos) return 0;
  if (!is_primary(a.caller)) return kRefused;
  if (!is_a(a.e, "orv-slapdKerberos") || a.e.values(kKrbDn) == nullptr) return kClassViolation;
  return checked_kerberos_name(a.file(), a.e.first(kKrbDn));
}

int digest_entry(const Added& a) {
  if (a.dn != kDigest) return 0;
  if (!is_primary(a.caller)) return kRefused;
  if (!is_a(a.e, "orv-slapdDigest")) return kClassViolation;
  const std::string* user = a.e.first(kDigestUser);
  return user == nullptr ? 0 : taken_digest_user(a.file(), *user);
}

int split_container(const Added& a) {
  if (a.e.values(kSplitName) == nullptr) return 0;
  return checked_split_name(a.file(), a.e.first(kSplitName));
}

int pass_through_entry(const Added& a) {
  if (!contains(a.dn, kPassThrough)) return 0;
  if (!is_primary(a.caller) && (a.caller.roles & kServerRole) == 0) return kRefused;
  if (!same(parent_of(a.dn), kPassThrough)) return kUnwilling;
  if (!is_a(a.e, "top") || !is_a(a.e, "orv-slapdConfigEntry") || !is_a(a.e, "orv-slapdPta")) {
    return kClassViolation;
  }
  return pass_through_fits(a.file(), a.dn, a.e);
}

int password_complies(const Added& a) {
  if (!a.server.password_policy) return 0;
  const char* type = kAdminPw;
  if (!contains(a.dn, kGroup)) {
    // The classes, where they stand first.
    if (a.e.attributes.empty()) return 0;
    const Texts& values = a.e.attributes.front().values;
    if (std::count(values.begin(), values.end(), "orv-slapdReplication") != 0 &&
        std::count(values.begin(), values.end(), "orv-slapdSupplier") != 0) {
      return 0;
    }
    type = kMasterPw;
  }
  const std::string* password = a.e.first(type);
  return password == nullptr || password->empty() ? 0 : a.server.password;
}

// In this order; the first that refuses decides.
constexpr int (*kRulesOfAdd[])(const Added&) = {
    group_and_logs,  supplier_identity,  kerberos_entry,   digest_entry,
    split_container, pass_through_entry, password_complies};

int may_add(const Added& a) {
  if (is_master_server(a.caller) || is_stranger(a.caller)) return kRefused;
  if (!is_member(a.caller)) return 0;
  const Target target{a.dn, is_a(a.e, "orv-slapdSupplier")};
  return roles_open(adds, target, a.caller.roles) ? 0 : kRefused;
}

int add_is_sound(const Added& a) {
  const File& file = a.file();
  if (file.find(a.dn) != nullptr) return kExists;
  const std::string parent = parent_of(a.dn);
  if (!parent.empty() && file.find(parent) == nullptr) return kMissing;
  if (a.server.schema != 0) return a.server.schema;
  if (a.server.referral != 0) return a.server.referral;
  if (is_a(a.e, "orv-replicationContext")) return kReplicationContext;
  for (const auto& rule : kRulesOfAdd) {
    if (const int code = rule(a)) return code;
  }
  return 0;
}

// ---- Changes, as the library gets them

std::string shown(const Modifications& list) {
  if (list.empty()) return "<null>";
  std::string text;
  for (const Modification& m : list) {
    if (!text.empty()) text += "|";
    text += std::to_string(static_cast<int>(m.kind)) + " " + m.type;
    const Texts none;
    char sign = '=';
    for (const std::string& value : m.values ? *m.values : none) {
      text += sign + value;
      sign = ',';
    }
  }
  return text;
}

std::string call(const char* function, const std::string& dn, const Modifications& list) {
  return std::string(function) + "(session, \"" + dn + "\", \"" + shown(list) + "\")";
}

// By type and kind, in the order in which these first appear; an empty list of values is left out.
Modifications grouped(const Modifications& list) {
  Modifications groups;
  for (const Modification& m : list) {
    if (m.values && m.values->empty()) continue;
    auto group = std::find_if(groups.begin(), groups.end(), [&](const Modification& g) {
      return g.kind == m.kind && same(g.type, m.type);
    });
    if (group == groups.end()) {
      groups.push_back({m.kind, m.type, Texts()});
      group = groups.end() - 1;
    }
    if (m.values) group->values->insert(group->values->end(), m.values->begin(), m.values->end());
  }
  return groups;
}

// ---- The entry as it would be

int take_values(Entry& e, const Modification& m) {
  auto a = std::find_if(e.attributes.begin(), e.attributes.end(),
                        [&](const Attribute& other) { return same(other.type, m.type); });
  if (a == e.attributes.end()) return kNoAttribute;
  const Texts none;
  for (const std::string& value : m.values ? *m.values : none) {
    const auto found = std::find(a->values.begin(), a->values.end(), value);
    if (found == a->values.end()) return kNoAttribute;
    a->values.erase(found);
  }
  if (!m.values || m.values->empty() || a->values.empty()) e.attributes.erase(a);
  return 0;
}

void give_values(Entry& e, const Modification& m) {
  for (Attribute& a : e.attributes) {
    if (!same(a.type, m.type)) continue;
    a.values.insert(a.values.end(), m.values->begin(), m.values->end());
    return;
  }
  e.attributes.push_back({m.type, *m.values});
}

// The last delete or replace decides; nothing is added behind a failure.
int apply(Entry& e, const Modifications& list) {
  int code = 0;
  for (const Modification& m : list) {
    if (m.kind == Kind::remove) {
      code = take_values(e, m);
      continue;
    }
    if (m.kind == Kind::replace) {
      e.remove(m.type);
      code = 0;
    }
    if (code == 0 && m.values && !m.values->empty()) give_values(e, m);
  }
  return code;
}

int addresses_fit(const Server& server, const Entry& e, std::string& text) {
  const Texts* addresses = e.values("orv-slapdIpAddress");
  if (!is_a(e, "orv-slapdTop") || addresses == nullptr) return 0;
  for (const std::string& address : *addresses) {
    if (server.addresses.contains(address)) continue;
    text = "IP address " + address + " is not defined for this system.";
    return kConstraint;
  }
  return 0;
}

int change_fits(const Server& server, const std::string& dn, const Modifications& list, int schema,
                std::string& text) {
  text.clear();
  const Entry* stored = server.file->find(dn);
  if (stored == nullptr) return kMissing;
  Entry e = *stored;
  if (const int code = apply(e, list)) return code;
  if (schema != 0) return schema;
  if (server.referral != 0) return server.referral;
  if (is_a(e, "orv-replicationContext")) return kReplicationContext;
  if (const int code = addresses_fit(server, e, text)) return code;
  return pass_through_fits(*server.file, dn, e);
}

// ---- Rules for a change

struct Change {
  const Server& server;
  const Caller& caller;
  const std::string& dn;
  Modifications list;
  std::string text;

  [[nodiscard]] const File& file() const { return *server.file; }
  [[nodiscard]] const Modification* first_of(const char* type) const {
    for (const Modification& m : list) {
      if (same(m.type, type)) return &m;
    }
    return nullptr;
  }
  // The first modification of a type, if that adds or replaces.
  [[nodiscard]] const Modification* first_giving(const char* type) const {
    const Modification* m = first_of(type);
    return m != nullptr && m->kind != Kind::remove ? m : nullptr;
  }
  // The first one of a type that adds or replaces, whatever stands before it.
  [[nodiscard]] const Modification* giving(const char* type, bool with_values) const {
    for (const Modification& m : list) {
      if (!same(m.type, type) || m.kind == Kind::remove) continue;
      if (!with_values || (m.values && !m.values->empty())) return &m;
    }
    return nullptr;
  }
};

const std::string* first_value(const Modification* m) {
  return m == nullptr || !m->values || m->values->empty() ? nullptr : &m->values->front();
}

// ---- ... of the administrator's own identities and the roles of members

// Each value is judged by the one at its place in the first modification of roles.
int roles_are_known(const Modification& m, const Modification& first) {
  for (std::size_t i = 0; i < m.values->size(); ++i) {
    const bool has_place = first.values && i < first.values->size();
    if (!is_role(has_place ? first.values->at(i) : m.values->at(i))) return kOther;
  }
  return 0;
}

bool holds(const Texts& values, const std::string& wanted) {
  return std::any_of(values.begin(), values.end(),
                     [&](const auto& value) { return same(value, wanted); });
}

// A change that would leave a member without roles leaves "NoAdmin".
int change_of_roles(Change& c) {
  const Modification* first = c.first_of(kRole);
  if (first == nullptr) return 0;
  const Entry* e = c.file().find(c.dn);
  if (e == nullptr) return kMissing;
  const Texts* current = e->values(kRole);
  if (current == nullptr) return kNoAttribute;
  std::ptrdiff_t balance = 0;
  for (const Modification& m : c.list) {
    if (!same(m.type, kRole) || !m.values) continue;
    if (const int code = roles_are_known(m, *first)) return code;
    const auto count = static_cast<std::ptrdiff_t>(m.values->size());
    if (m.kind == Kind::add) balance -= count;
    if (m.kind == Kind::remove) balance += count;
    // Of the values that go only the last is looked for.
    if (m.kind == Kind::remove && count != 0 && !holds(*current, m.values->back())) {
      return kNoAttribute;
    }
  }
  if (balance != static_cast<std::ptrdiff_t>(current->size())) return 0;
  for (Modification& m : c.list) {
    if (m.kind != Kind::remove) continue;
    m.kind = Kind::replace;
    m.values = Texts{"NoAdmin"};
    break;
  }
  return 0;
}

int change_by_primary(Change& c) {
  if (c.dn != kTop && !contains(c.dn, kGroup)) return 0;
  if (const std::string* dn = first_value(c.giving(kAdminDn, true))) {
    if (const int code = first_failure(
            {taken_administrator_dn(c.file(), *dn), taken_supplier_dn(c.file(), *dn)})) {
      return code;
    }
  }
  if (const int code = change_of_roles(c)) return code;
  const std::string* kerberos = first_value(c.giving(kKrbDn, true));
  if (kerberos != nullptr) {
    if (const int code = checked_kerberos_name(c.file(), kerberos)) return code;
  }
  const std::string* user = first_value(c.giving(kDigestUser, true));
  return user == nullptr ? 0 : taken_digest_user(c.file(), *user);
}

// ---- ... by members of the group

// Of the group a member changes its own password, alone in its request.
int change_in_group(const Change& c) {
  if (c.list.size() != 1 || !same(c.list.front().type, kAdminPw)) return kRefused;
  const Entry* e = c.file().find(c.dn);
  const std::string* dn = e == nullptr ? nullptr : e->first(kAdminDn);
  if (dn == nullptr) return kOther;
  return normal(*dn) == c.caller.bound_dn ? 0 : kRefused;
}

int beyond_roles(const Change& c) {
  if (c.dn == kGroup || c.dn == kPolicy) return kRefused;
  if (c.dn == kAudit) return (c.caller.connection_roles & kAuditRole) != 0 ? 0 : kRefused;
  if (c.dn == kTop) {
    return c.first_of(kAdminDn) != nullptr || c.first_of(kAdminPw) != nullptr ||
                   c.first_of(kGroupEnabled) != nullptr
               ? kRefused
               : 0;
  }
  return contains(c.dn, kGroup) ? change_in_group(c) : 0;
}

int change_by_member(const Change& c) {
  Target target{c.dn, false};
  if ((c.caller.roles & kAnyRole) == 0 && !target.in_group()) return kRefused;
  const Entry* e = c.file().find(c.dn);
  if (e->values(kClass) == nullptr) return kNoAttribute;
  target.supplier = is_a(*e, "orv-slapdSupplier");
  if (!roles_open(modifies, target, c.caller.roles)) return kRefused;
  return beyond_roles(c);
}

// ---- ... by suppliers

int supplied(const Server& server, const std::string& suffix) {
  const auto found = server.supplied.find(suffix);
  return found == server.supplied.end() ? 0 : found->second;
}

// A supplier adds suffixes to the directory's entry: its own, or any if it supplies the server.
bool supplier_may(const Change& c) {
  const bool of_server = supplied(c.server, "") != 0;
  if (!same(c.dn, kDirectory)) return false;
  return std::all_of(c.list.begin(), c.list.end(), [&](const Modification& m) {
    if (!same(m.type, kSuffix) || m.kind != Kind::add) return false;
    return of_server || !m.values ||
           std::all_of(m.values->begin(), m.values->end(),
                       [&](const auto& suffix) { return supplied(c.server, suffix) != 0; });
  });
}

// ---- ... for everybody

int supplier_change(Change& c) {
  const bool member = (c.caller.connection_authority & 0x14U) == 0x14U;
  if (c.dn == kMaster && member && (c.caller.connection_roles & kReplicationRoles) == 0) {
    return kRefused;
  }
  const Modification* m = c.giving(kMasterDn, false);
  if (m == nullptr) return 0;
  const std::string* dn = first_value(m);
  return dn == nullptr ? kOther : taken_administrator_dn(c.file(), *dn);
}

int kerberos_change(Change& c) {
  if (c.dn != kKerberos || c.first_of(kKrbDn) == nullptr) return 0;
  if (!is_primary(c.caller)) return kRefused;
  const Modification* m = c.first_giving(kKrbDn);
  return m == nullptr ? 0 : checked_kerberos_name(c.file(), first_value(m));
}

int digest_change(Change& c) {
  if (c.dn != kDigest || c.first_of(kDigestUser) == nullptr) return 0;
  if (!is_primary(c.caller)) return kRefused;
  const Modification* m = c.first_giving(kDigestUser);
  if (m == nullptr) return 0;
  const std::string* user = first_value(m);
  return user == nullptr ? kOther : taken_digest_user(c.file(), *user);
}

std::string resolved(const Server& server, const std::string& path) {
  const auto link = server.links.find(path);
  return link == server.links.end() ? path : link->second;
}

int log_change(Change& c) {
  if (c.dn == kAudit) return 0;
  const Entry* audit = c.file().find(kAudit);
  const bool names_file =
      audit != nullptr && is_a(*audit, "orv-auditConfig") && audit->first(kLog) != nullptr;
  const std::string file =
      resolved(c.server, names_file ? *audit->first(kLog) : "/var/ldap/V6.0/audit.log");
  for (const Modification& m : c.list) {
    const std::string* path = first_value(&m);
    if (!same(m.type, kLog) || m.kind == Kind::remove || path == nullptr) continue;
    if (same(resolved(c.server, *path), file)) return kUnwilling;
  }
  return 0;
}

int policy_change(Change& c) {
  return c.server.password_policy && same(c.dn, kPolicy) ? c.server.policy_settings : 0;
}

// The first change of an administrator's password; only without one that of a supplier's.
int password_change(Change& c) {
  const char* type = c.first_of(kAdminPw) != nullptr ? kAdminPw : kMasterPw;
  const Modification* m = c.first_giving(type);
  if (!c.server.password_policy || m == nullptr) return 0;
  const bool administrator = c.dn == kTop || contains(c.dn, kGroup);
  const Entry* e = c.file().find(c.dn);
  const bool found = administrator
                         ? e->values(kAdminPw) != nullptr
                         : is_a(*e, "orv-slapdReplication") || is_a(*e, "orv-slapdSupplier");
  if (!found) return kMissing;
  if (e->values(administrator ? kAdminPw : kMasterPw) == nullptr && m->kind != Kind::add) {
    return kNoAttribute;
  }
  if (e->values(administrator ? kAdminDn : kMasterDn) == nullptr) return kNoAttribute;
  return c.server.password;
}

int split_change(Change& c) {
  const Modification* m = c.first_giving(kSplitName);
  return m == nullptr ? 0 : checked_split_name(c.file(), first_value(m));
}

int encryption_change(Change& c) {
  const Modification* m = c.first_giving("orv-slapdPwEncryption");
  if (c.server.safe_mode || c.dn != kTop || m == nullptr) return 0;
  if (c.server.encryption_method != 0) {
    c.text = "requested orv-slapdPwEncryption value is not allowed by current configuration.";
    return kUnwilling;
  }
  const std::string* method = first_value(m);
  if (method != nullptr && c.server.encryption_methods.contains(*method)) return 0;
  c.text = "orv-slapdPwEncryption value is not one of the supported values.";
  return kSyntax;
}

// In this order; the first that refuses decides.
constexpr int (*kRulesOfModify[])(Change&) = {supplier_change, kerberos_change,  log_change,
                                              digest_change,   policy_change,    password_change,
                                              split_change,    encryption_change};

int rules_for_everybody(Change& c) {
  for (const auto& rule : kRulesOfModify) {
    if (const int code = rule(c)) return code;
  }
  return 0;
}

int authority_to_change(Change& c) {
  if (is_primary(c.caller)) return change_by_primary(c);
  return is_member(c.caller) ? change_by_member(c) : 0;
}

// ---- What is seen

const char* const kCredentialsOfPrimary[] = {kAdminDn, kAdminPw, kGroupEnabled};

// 80 when the password stands in an entry of which nobody knows whose it is.
int hide_from_other_members(const Server& server, const Caller& caller, const std::string& dn,
                            Entry& e, bool& sent) {
  std::optional<std::string> owner;
  if (const Texts* named = e.values(kAdminDn)) {
    if (!named->empty()) owner = normal(named->front());
  } else if (e.values(kAdminPw) != nullptr) {
    const Entry* whole = server.file->find(dn);
    const std::string* stored = whole == nullptr ? nullptr : whole->first(kAdminDn);
    if (stored == nullptr) return kOther;
    owner = normal(*stored);
  } else {
    return 0;
  }
  if (owner && *owner == caller.bound_dn) return 0;
  e.remove(kAdminPw);
  sent = !e.attributes.empty();
  return 0;
}

}  // namespace

// ---- Interface

const Texts* Entry::values(const std::string& type) const {
  for (const Attribute& a : attributes) {
    if (same(a.type, type)) return &a.values;
  }
  return nullptr;
}

const std::string* Entry::first(const std::string& type) const {
  const Texts* found = values(type);
  return found == nullptr || found->empty() ? nullptr : &found->front();
}

void Entry::remove(const std::string& type) {
  std::erase_if(attributes, [&](const Attribute& a) { return same(a.type, type); });
}

bool same(const std::string& a, const std::string& b) {
  return a.size() == b.size() && std::equal(a.begin(), a.end(), b.begin(), [](char x, char y) {
           return std::toupper(static_cast<unsigned char>(x)) ==
                  std::toupper(static_cast<unsigned char>(y));
         });
}

std::string normal(const std::string& dn) {
  std::string text = upper(dn);
  for (const std::string separator : {",", "="}) {
    for (const auto& [blank, place] :
         {std::pair(" " + separator, 0), std::pair(separator + " ", 1)}) {
      for (std::size_t at = text.find(blank); at != std::string::npos; at = text.find(blank)) {
        text.erase(at + static_cast<std::size_t>(place), 1);
      }
    }
  }
  return text;
}

std::string parent_of(const std::string& dn) {
  const std::size_t comma = dn.find(',');
  return comma == std::string::npos ? "" : dn.substr(comma + 1);
}

File::File(std::vector<Entry> entries) : entries_(std::move(entries)) {
  for (const Entry& e : entries_) names_.push_back(normal(e.dn));
}

const Entry* File::find(const std::string& dn) const {
  const auto name = std::find(names_.begin(), names_.end(), normal(dn));
  return name == names_.end() ? nullptr
                              : &entries_[static_cast<std::size_t>(name - names_.begin())];
}

std::vector<const Entry*> File::subtree(const std::string& dn) const {
  std::vector<const Entry*> found;
  const std::string end = "," + normal(dn);
  for (std::size_t i = 0; i < entries_.size(); ++i) {
    if (("," + names_[i]).ends_with(end)) found.push_back(&entries_[i]);
  }
  return found;
}

std::vector<const Entry*> File::children(const std::string& dn) const {
  std::vector<const Entry*> found;
  for (std::size_t i = 0; i < entries_.size(); ++i) {
    if (parent_of(names_[i]) == normal(dn)) found.push_back(&entries_[i]);
  }
  return found;
}

Outcome adding(const Server& server, const Caller& caller, Entry e, const std::string& dn) {
  const int roles = give_roles(caller, dn, e);
  if (roles == kSyntax) return {kOther, "Invalid administrative role value", ""};
  if (roles != 0) return {roles, "", ""};
  const Added added{server, caller, e, dn};
  // Without a fitting entry it is not asked who adds it, but the schema's refusal comes last.
  if (server.schema == 0) {
    if (const int code = may_add(added)) return {code, "", ""};
  }
  if (const int code = add_is_sound(added)) return {code, "", ""};
  if (e.attributes.empty()) return {};
  Modifications list;
  for (const Attribute& a : e.attributes) list.push_back({Kind::add, a.type, a.values});
  return {0, "", call("cfg_add_s", e.dn, list)};
}

Outcome deleting(const Server& server, const Caller& caller, const std::string& dn) {
  if (is_master_server(caller) || is_stranger(caller)) return {kRefused, "", ""};
  const Entry* e = server.file->find(dn);
  if (e == nullptr) return {kMissing, "", ""};
  if (e->values(kClass) == nullptr) return {kNoAttribute, "", ""};
  const Target target{dn, is_a(*e, "orv-slapdSupplier")};
  if (is_member(caller) && !roles_open(deletes, target, caller.roles)) return {kRefused, "", ""};
  if (same(dn, kConfigDb)) return {kUnwilling, "", ""};
  const bool of_primary = contains(dn, kGroup) || dn == kKerberos || dn == kDigest;
  if (of_primary && !is_primary(caller)) return {kRefused, "", ""};
  return {0, "", "cfg_delete_s(session, \"" + dn + "\")"};
}

Outcome modifying(const Server& server, const Caller& caller, const std::string& dn,
                  Modifications list) {
  Change c{server, caller, dn, std::move(list), ""};
  const bool of_roles = contains(dn, kGroup) && !c.list.empty() && same(c.list.front().type, kRole);
  int fits = change_fits(server, dn, c.list, server.schema, c.text);
  if (fits == kClassViolation && of_roles) fits = 0;
  if (is_stranger(caller)) return {kRefused, c.text, ""};
  if (fits != 0) return {fits, c.text, ""};
  if (is_master_server(caller) && !supplier_may(c)) return {kRefused, "", ""};
  Modifications copy = grouped(c.list);
  if (const int code = authority_to_change(c)) return {code, "", ""};
  // What the primary administrator's rule rewrote counts where roles come first.
  if (of_roles) {
    if (const int code = change_fits(server, dn, c.list, server.schema_again, c.text)) {
      return {code, c.text, ""};
    }
    copy = grouped(c.list);
  }
  if (const int code = rules_for_everybody(c)) return {code, c.text, ""};
  return {0, "", call("cfg_modify_s", dn, copy)};
}

View searching(const Server& server, const Caller& caller,
               const std::optional<std::vector<Entry>>& found) {
  if (server.kind == 3 && server.caller_mark != 1) return {kMissing, {}};
  if (is_master_server(caller) || is_stranger(caller)) return {kRefused, {}};
  if (!found) return {kMissing, {}};
  View view;
  for (Entry e : *found) {
    const std::string dn = normal(e.dn);
    bool sent = true;
    if (is_primary(caller) || dn == kGroup) {
      // As it is.
    } else if (dn == kTop) {
      for (const char* type : kCredentialsOfPrimary) e.remove(type);
    } else if (contains(dn, kGroup)) {
      view.code = hide_from_other_members(server, caller, dn, e, sent);
      if (view.code != 0) return view;
    }
    if (sent) view.entries.push_back(e);
  }
  return view;
}

}  // namespace orv::model
