#include "authority_scene.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cctype>
#include <cstdio>
#include <set>

namespace orv::scene {
namespace {

using model::Attribute;
using model::Entry;
using model::Texts;

constexpr unsigned kPrimary = 0x0C;
constexpr unsigned kMember = 0x14;
constexpr unsigned kNobody = 0x24;

std::string hexadecimal(unsigned number) {
  char text[16];
  std::snprintf(text, sizeof text, "0x%02x", number);
  return text;
}

void call(std::vector<Caller>& callers, const std::string& name, unsigned authority, unsigned roles,
          const std::string& bound_dn) {
  callers.push_back({name + ", flags " + hexadecimal(authority) + ", roles " + hexadecimal(roles),
                     {authority, roles, bound_dn, authority, roles}});
}

// Roles are bits 1 to 5; bits 0, 6 and 7 are none of them.
std::vector<unsigned> sets_of_roles() {
  std::vector<unsigned> sets;
  for (unsigned roles = 0; roles <= 0x3E; roles += 2) {
    sets.push_back(roles);
    sets.push_back(roles | 0xC1U);
  }
  return sets;
}

constexpr unsigned kTellingRoles[] = {0, 0x02, 0x20, 0x34, 0x3E};

void call_identities(std::vector<Caller>& callers) {
  for (const unsigned roles : {0x00U, 0x3EU}) {
    call(callers, "anonymous", kNobody, roles, "");
    call(callers, "stranger under the administrator's name", kNobody, roles, "CN=ROOT");
    call(callers, "primary administrator", kPrimary, roles, "CN=ROOT");
    call(callers, "primary administrator by Kerberos", kPrimary, roles, "ORV-KN=ROOT@X");
    call(callers, "primary administrator by digest", kPrimary, roles, "");
    call(callers, "supplier of the server", 0x01, roles, "CN=MASTER");
    call(callers, "supplier of a suffix", 0x02, roles, "CN=FEEDER");
  }
}

// ---- Files

const char* const kConfigEntry = "orv-slapdConfigEntry";

Entry make(const std::string& dn, const std::string& kind, std::vector<Attribute> attributes = {}) {
  Entry e{dn, {{"objectClass", {"top", kConfigEntry, kind}}}};
  e.attributes.insert(e.attributes.end(), attributes.begin(), attributes.end());
  return e;
}

Entry container(const std::string& dn) {
  return {dn, {{"objectClass", {"top", "container"}}, {"description", {"old"}}}};
}

Entry top(const Texts& administrators) {
  return make("cn=Configuration", "orv-slapdTop",
              {{"orv-slapdAdminDN", administrators},
               {"orv-slapdAdminPW", {"secret"}},
               {"orv-slapdAdminGroupEnabled", {"TRUE"}},
               {"orv-slapdIpAddress", {"10.0.0.1"}},
               {"orv-slapdPwEncryption", {"known"}},
               {"description", {"old"}}});
}

Entry member(const std::string& dn, const std::string& bind_dn, const std::string& user,
             const Texts& roles) {
  return make(dn, "orv-slapdAdminGroupMember",
              {{"orv-slapdAdminDN", {bind_dn}},
               {"orv-slapdAdminPW", {"secret"}},
               {"orv-slapdAdminRole", roles},
               {"orv-slapdKrbAdminDN", {"orv-kn=" + user + "@X"}},
               {"orv-slapdDigestAdminUser", {user}}});
}

Entry supplier(const std::string& dn, const std::string& kind, const std::string& bind_dn) {
  return make(dn, kind, {{"orv-slapdMasterDN", {bind_dn}}, {"orv-slapdMasterPW", {"secret"}}});
}

std::vector<Entry> members() {
  return {member("cn=One, cn=AdminGroup, cn=Configuration", "cn=One", "one",
                 {"SchemaAdmin", "AuditAdmin", "PasswordAdmin"}),
          member("cn=Two,cn=AdminGroup,cn=Configuration", "cn=Two, o=Orv", "two", {"NoAdmin"}),
          member("CN=SUB,CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION", "cn=sub", "sub", {"SchemaAdmin"})};
}

std::vector<Entry> suppliers() {
  return {supplier("CN=FIRST,CN=SCHEMAS,CN=CONFIGURATION", "orv-slapdReplication", "cn=first"),
          supplier("CN=SECOND,CN=SCHEMAS,CN=CONFIGURATION", "orv-slapdReplication", "cn=second"),
          supplier("CN=HERE,CN=REPLICATION,CN=CONFIGURATION", "orv-slapdSupplier", "cn=feeder"),
          supplier("CN=ODD,CN=SCHEMAS,CN=CONFIGURATION", "ORV-SLAPDSUPPLIER", "cn=odd"),
          make("CN=BARE SUPPLIER,CN=SCHEMAS,CN=CONFIGURATION", "orv-slapdSupplier")};
}

// What other entries stand on.
std::vector<Entry> structure() {
  return {container("CN=LOG MANAGEMENT,CN=CONFIGURATION"),
          container("CN=SCHEMAS,CN=CONFIGURATION"),
          container("CN=RDBM BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION"),
          container("CN=CONFIG BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION"),
          container("CN=PROXYDB,CN=PROXY BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION"),
          make("CN=PART,CN=PROXYDB,CN=PROXY BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION",
               "orv-slapdProxySplit", {{"orv-slapdProxySplitName", {"part1"}}}),
          container("CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION"),
          make("CN=PARTNER,CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION", "orv-slapdPta",
               {{"orv-slapdPtaURL", {"ldap://partner"}}, {"orv-slapdPtaSubtree", {"o=Partner"}}})};
}

// Entries that a rule names, and their like; all of them can be taken away.
std::vector<Entry> named_entries() {
  return {make("cn=Kerberos,cn=Configuration", "orv-slapdKerberos",
               {{"orv-slapdKrbAdminDN", {"orv-kn=root@X"}}}),
          make("CN=DIGEST,CN=CONFIGURATION", "orv-slapdDigest",
               {{"orv-slapdDigestAdminUser", {"root"}}}),
          make("CN=PWDPOLICY ADMIN,CN=CONFIGURATION", "orv-slapdAdminPolicy",
               {{"pwdMinLength", {"8"}}}),
          make("CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION", "orv-auditConfig",
               {{"orv-slapdLog", {"/log/audit"}}}),
          make("CN=ADMIN AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION", "orv-slapdLogSettings",
               {{"orv-slapdLog", {"/log/admin"}}}),
          make("CN=DEFAULT,CN=LOG MANAGEMENT,CN=CONFIGURATION", "orv-slapdLogSettings",
               {{"orv-slapdLog", {"/log/default"}}}),
          make("CN=ACCESS,CN=LOG MANAGEMENT,CN=CONFIGURATION", "orv-slapdLogSettings"),
          make("CN=REPLICATION,CN=CONFIGURATION", "orv-slapdReplicationSettings"),
          supplier("CN=MASTER SERVER,CN=CONFIGURATION", "orv-slapdReplication", "cn=master"),
          make("CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION", "orv-slapdBackendEntry"),
          make("CN=DIRECTORY,CN=RDBM BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION",
               "orv-slapdBackendEntry", {{"orv-slapdSuffix", {"o=old"}}}),
          make("CN=CONFIGDB,CN=CONFIG BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION",
               "orv-slapdBackendEntry"),
          make("CN=DEEP,CN=PARTNER,CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION", "orv-slapdPta",
               {{"orv-slapdPtaSubtree", {"o=deep"}}}),
          supplier("CN=BOTH,CN=SCHEMAS,CN=CONFIGURATION", "orv-slapdSupplier", "cn=both"),
          container("CN=ORDINARY,CN=SCHEMAS,CN=CONFIGURATION"),
          {"CN=CLASSLESS,CN=SCHEMAS,CN=CONFIGURATION", {{"cn", {"classless"}}}},
          make("CN=CONTEXT,CN=SCHEMAS,CN=CONFIGURATION", "orv-replicationContext")};
}

// Names that hold a protected one as a part, or nearly are one.
Texts near_misses() {
  return {"CN=X,CN=ADMINGROUP,CN=CONFIGURATION,O=ELSEWHERE",
          "CN=X,CN=ADMINGROUP,CN=CONFIGURATIONS",
          "CN=NOTCN=ADMINGROUP,CN=CONFIGURATION",
          "CN=ADMINGROUPS,CN=CONFIGURATION",
          "CN=XADMINGROUP,CN=CONFIGURATION",
          "CN=ADMINGROUP,CN=SCHEMAS,CN=CONFIGURATION",
          "CN=KERBEROS,CN=SCHEMAS,CN=CONFIGURATION",
          "CN=BELOW,CN=KERBEROS,CN=CONFIGURATION",
          "CN=KERBEROS,CN=CONFIGURATION,O=ELSEWHERE",
          "CN=BELOW,CN=DIGEST,CN=CONFIGURATION",
          "CN=DIGEST,CN=CONFIGURATION,O=ELSEWHERE",
          "CN=DIGESTS,CN=CONFIGURATION",
          "CN=PWDPOLICY ADMINS,CN=CONFIGURATION",
          "CN=BELOW,CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION",
          "CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION,O=ELSEWHERE",
          "CN=AUDITS,CN=LOG MANAGEMENT,CN=CONFIGURATION",
          "CN=AUDIT,CN=CONFIGURATION",
          "CN=ADMIN AUDIT,CN=CONFIGURATION",
          "CN=DEFAULT,CN=CONFIGURATION",
          "CN=REPLICATIONS,CN=CONFIGURATION",
          "CN=REPLICATION,CN=SCHEMAS,CN=CONFIGURATION",
          "CN=MASTER SERVERS,CN=CONFIGURATION",
          "CN=BELOW,CN=MASTER SERVER,CN=CONFIGURATION",
          "CN=BELOW,CN=CONFIGDB,CN=CONFIG BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION",
          "CN=CONFIGDB,CN=CONFIG BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION,O=ELSEWHERE",
          "CN=DIRECTORY,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION",
          "CN=PASSTHROUGH AUTHENTICATION,CN=SCHEMAS,CN=CONFIGURATION",
          "CN=X,CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION,O=ELSEWHERE",
          "CN=CONFIGURATION,O=ELSEWHERE",
          "CN=CONFIGURATIONS",
          "CN=XCN=CONFIGURATION"};
}

std::string lower(std::string text) {
  for (char& c : text) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  return text;
}

std::vector<Entry> full(const Texts& administrators) {
  std::vector<Entry> all = {top(administrators), container("CN=ADMINGROUP,CN=CONFIGURATION")};
  for (const auto& part : {members(), structure(), suppliers(), named_entries()}) {
    all.insert(all.end(), part.begin(), part.end());
  }
  // Of both classes.
  for (Entry& e : all) {
    if (e.dn == "CN=BOTH,CN=SCHEMAS,CN=CONFIGURATION") {
      e.attributes.front().values.emplace_back("orv-slapdReplication");
    }
  }
  for (const std::string& dn : near_misses()) {
    all.push_back(make(dn, "orv-slapdLogSettings",
                       {{"orv-slapdAdminPW", {"secret"}}, {"orv-slapdAdminDN", {"cn=near"}}}));
  }
  return all;
}

std::vector<Entry> with_suppliers_everywhere() {
  std::vector<Entry> all = full({"cn=root"});
  for (Entry& e : all) {
    Attribute& first = e.attributes.front();
    if (first.type == "objectClass") first.values.emplace_back("orv-slapdSupplier");
  }
  return all;
}

std::vector<Entry> without_primary_identity() {
  std::vector<Entry> all = full({"cn=root", "cn=second root"});
  std::erase_if(all, [](const Entry& e) {
    return e.dn == "cn=Kerberos,cn=Configuration" || e.dn == "CN=DIGEST,CN=CONFIGURATION" ||
           e.dn == "CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION";
  });
  all.push_back({"CN=GHOST,CN=ADMINGROUP,CN=CONFIGURATION",
                 {{"objectClass", {"top"}}, {"orv-slapdAdminPW", {"secret"}}}});
  return all;
}

std::vector<Entry> sparse(const Texts& administrators, bool with_group) {
  std::vector<Entry> all = {top(administrators)};
  if (with_group) {
    all.push_back(container("CN=ADMINGROUP,CN=CONFIGURATION"));
    for (const Entry& e : members()) all.push_back(e);
  }
  for (const auto& part : {structure(), suppliers()}) {
    all.insert(all.end(), part.begin(), part.end());
  }
  all.push_back(container("CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION"));
  all.push_back(container("CN=CONFIGURATION,O=ELSEWHERE"));
  all.push_back(container("CN=ADMINGROUP,CN=CONFIGURATION,O=ELSEWHERE"));
  all.push_back(container("CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION,O=ELSEWHERE"));
  return all;
}

// Two of the entries that can be added collide with the identities of these.
std::vector<Entry> sparse_with_identities() {
  std::vector<Entry> all = sparse({"cn=root"}, true);
  all.push_back(make("CN=REPLICATION,CN=CONFIGURATION", "orv-slapdReplicationSettings"));
  all.push_back(named_entries()[0]);
  all.push_back(named_entries()[1]);
  return all;
}

// ---- Searches

bool has(const Entry& e, const char* type, const std::string& value) {
  const Texts* values = e.values(type);
  return values != nullptr && std::any_of(values->begin(), values->end(),
                                          [&](const auto& v) { return model::same(v, value); });
}

bool matches(const Entry& e, std::string filter) {
  if (filter.starts_with('(')) filter = filter.substr(1, filter.size() - 2);
  const std::size_t sign = filter.find('=');
  if (sign == std::string::npos) return e.values(filter) != nullptr;
  const std::string type = filter.substr(0, sign);
  const std::string value = filter.substr(sign + 1);
  // Also of an entry that has lost its classes.
  if (type == "objectclass" && value == "*") return true;
  return value == "*" ? e.values(type) != nullptr : has(e, type.c_str(), value);
}

bool is_wanted(const std::string& type, char** attributes) {
  if (attributes == nullptr) return true;
  for (char** wanted = attributes; *wanted != nullptr; ++wanted) {
    if (model::same(type, *wanted)) return true;
  }
  return false;
}

scripted::ScriptedEntry selected(const Entry& e, char** attributes, bool types_only) {
  scripted::ScriptedEntry given{e.dn, {}};
  for (const Attribute& a : e.attributes) {
    if (is_wanted(a.type, attributes)) {
      given.attributes.push_back({a.type, types_only ? Texts() : a.values});
    }
  }
  return given;
}

}  // namespace

scripted::Answer File::evaluated(const std::string& base, int scope, const std::string& filter,
                                 char** attributes, bool types_only) const {
  const Entry* at = entries_.find(base);
  if (at == nullptr) return {{}, 32};
  std::vector<const Entry*> candidates = {at};
  if (scope == 1) candidates = entries_.children(base);
  if (scope == 2) candidates = entries_.subtree(base);
  scripted::Answer answer;
  for (const Entry* e : candidates) {
    if (matches(*e, filter)) answer.entries.push_back(selected(*e, attributes, types_only));
  }
  return answer;
}

const scripted::Answer& File::search(const char* base, int scope, const char* filter,
                                     char** attributes, int types_only) {
  std::string key =
      std::string(base) + '?' + std::to_string(scope) + filter + (types_only != 0 ? "!" : "?");
  for (char** wanted = attributes; wanted != nullptr && *wanted != nullptr; ++wanted) {
    key += '?' + std::string(*wanted);
  }
  if (attributes == nullptr) key += "*";
  std::unique_ptr<scripted::Answer>& answer = answers_[key];
  if (answer == nullptr) {
    answer = std::make_unique<scripted::Answer>(
        evaluated(base, scope, filter, attributes, types_only != 0));
  }
  return *answer;
}

const std::vector<Caller>& everybody() {
  static const std::vector<Caller> kCallers = [] {
    std::vector<Caller> callers;
    call_identities(callers);
    for (const unsigned roles : sets_of_roles()) {
      call(callers, "member", kMember, roles, "CN=ONE");
    }
    for (unsigned word = 0; word < 0x40; ++word) {
      if (word == kMember) continue;
      for (const unsigned roles : kTellingRoles) {
        call(callers, "word of flags", word, roles, "CN=ONE");
      }
    }
    return callers;
  }();
  return kCallers;
}

const std::vector<Caller>& some() {
  static const std::vector<Caller> kCallers = [] {
    std::vector<Caller> callers;
    call(callers, "primary administrator", kPrimary, 0, "CN=ROOT");
    call(callers, "stranger", kNobody, 0x3E, "CN=ONE");
    call(callers, "supplier of the server", 0x01, 0, "CN=MASTER");
    call(callers, "supplier of a suffix", 0x02, 0, "CN=FEEDER");
    call(callers, "neither", 0x04, 0x3E, "CN=ONE");
    for (const unsigned roles : {0x00U, 0x02U, 0x0CU, 0x10U, 0x20U, 0x34U, 0x3EU}) {
      call(callers, "member", kMember, roles, "CN=ONE");
    }
    call(callers, "another member", kMember, 0x3E, "CN=TWO,O=ORV");
    call(callers, "member and primary", 0x1C, 0, "CN=ONE");
    return callers;
  }();
  return kCallers;
}

const std::vector<Caller>& readers() {
  static const std::vector<Caller> kCallers = [] {
    std::vector<Caller> callers;
    call_identities(callers);
    for (const char* bound : {"CN=ONE", "cn=one", "CN=TWO,O=ORV", "CN=TWO", "CN=SUB", "CN=NEAR",
                              "CN=ROOT", "CN=REMOVED", ""}) {
      call(callers, std::string("member \"") + bound + '"', kMember, 0, bound);
      call(callers, std::string("member \"") + bound + '"', kMember, 0x3E, bound);
    }
    for (unsigned word = 0; word < 0x40; ++word)
      call(callers, "word of flags", word, 0x3E, "CN=ONE");
    return callers;
  }();
  return kCallers;
}

const std::vector<std::string>& names() {
  static const std::vector<std::string> kNames = [] {
    std::vector<std::string> all;
    for (const Entry& e : full({"cn=root"})) all.push_back(model::normal(e.dn));
    for (const char* dn :
         {"CN=CONFIGURATION", "CN=ADMINGROUP,CN=CONFIGURATION",
          "CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION", "CN=KERBEROS,CN=CONFIGURATION",
          "CN=DIGEST,CN=CONFIGURATION", "CN=PWDPOLICY ADMIN,CN=CONFIGURATION",
          "CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION",
          "CN=ADMIN AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION",
          "CN=DEFAULT,CN=LOG MANAGEMENT,CN=CONFIGURATION", "CN=REPLICATION,CN=CONFIGURATION",
          "CN=MASTER SERVER,CN=CONFIGURATION",
          "CN=PARTNER,CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION",
          "CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION",
          "CN=DIRECTORY,CN=RDBM BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION",
          "CN=CONFIGDB,CN=CONFIG BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION"}) {
      all.push_back(lower(dn));
    }
    all.emplace_back("CN=NEW,CN=ADMINGROUP,CN=CONFIGURATION");
    all.emplace_back("CN=GHOST,CN=ADMINGROUP,CN=CONFIGURATION");
    all.emplace_back("CN=NEW,CN=PASSTHROUGH AUTHENTICATION,CN=CONFIGURATION");
    all.emplace_back("CN=NEW,CN=SCHEMAS,CN=CONFIGURATION");
    all.emplace_back("CN=NEW,CN=MISSING,CN=CONFIGURATION");
    return all;
  }();
  return kNames;
}

std::vector<NamedFile>& full_files() {
  static std::vector<NamedFile> files = [] {
    std::vector<NamedFile> made;
    made.push_back({"usual file", File(full({"cn=root"}))});
    made.push_back({"all are suppliers", File(with_suppliers_everywhere())});
    made.push_back({"primary administrator unknown", File(without_primary_identity())});
    return made;
  }();
  return files;
}

std::vector<NamedFile>& sparse_files() {
  static std::vector<NamedFile> files = [] {
    std::vector<NamedFile> made;
    made.push_back({"group", File(sparse({"cn=root"}, true))});
    made.push_back({"group and identities", File(sparse_with_identities())});
    made.push_back({"no group", File(sparse({"cn=root"}, false))});
    made.push_back({"primary administrator unknown", File(sparse({}, true))});
    return made;
  }();
  return files;
}

}  // namespace orv::scene
