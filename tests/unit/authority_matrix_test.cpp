// The authority matrix: what the handlers do, compared with the model of authority_model.h, for
// every kind of caller, every set of roles, every name that a rule knows and names that nearly are
// one, and every attribute that a rule knows.
//
// Each case is one request, handed to the real handler on the scripted platform. Compared are the
// result and its text, what the library was told to write, and for searches each attribute of each
// entry. A difference names its case; after twenty of them a test ends.
#include <gtest/gtest.h>

#include <functional>
#include <set>

#include "authority_model.h"
#include "authority_scene.h"
#include "backend_test.h"
#include "config_add.h"
#include "config_delete.h"
#include "config_modify.h"
#include "config_search.h"

namespace orv {
namespace {

using model::Attribute;
using model::Entry;
using model::Kind;
using model::Modification;
using model::Modifications;
using model::Texts;

// Sanitizers slow everything down some ten times. Every eleventh case is left then, counted through
// a whole test: a number that divides no dimension of the matrix.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr int kStride = 11;
#else
constexpr int kStride = 1;
#endif

// What the large tests must have checked at least: a dimension that is lost is seen.
constexpr int kOutcomesOfSearches = 190'000;
constexpr int kOutcomesOfDeletes = 190'000;
constexpr int kOutcomesOfAdds = 250'000;
constexpr int kOutcomesOfShapes = 165'000;
constexpr int kOutcomesOfModifies = 125'000;
constexpr int kOutcomesOfLists = 155'000;
constexpr int kOutcomesOfAttributes = 75'000;

constexpr int kMostDifferences = 20;

std::string quoted(const std::string& text) {
  return '"' + text + '"';
}

class AuthorityMatrix : public BackendTest {
 protected:
  AuthorityMatrix() {
    debug_off();
    platform.search = [this](const char* base, int scope, const char* filter, char** attributes,
                             int types_only) -> const Answer& {
      return file_->file.search(base, scope, filter, attributes, types_only);
    };
    usual();
  }
  ~AuthorityMatrix() override { g_safe_mode = 0; }

  // The server as it usually is.
  void usual() {
    const model::File* file = server.file;
    server = {};
    server.file = file;
    server.addresses = {"10.0.0.1", "10.0.0.2"};
    server.supplied = {{"o=mine", 1}};
    server.links = {{"/log/link", "/LOG/audit"}, {"/log/audit", "/log/audit"}};
    server.encryption_methods = {"known"};
  }

  void in(scene::NamedFile& file) {
    file_ = &file;
    server.file = &file.file.entries();
  }

  // Whether the next case is one of those that are checked.
  bool is_chosen() { return ++cases_ % kStride == 0 && differences_ < kMostDifferences; }

  void check_delete(const scene::Caller& who, const std::string& dn) {
    if (!is_chosen()) return;
    begin(who);
    pb.put(parameter::target_dn, static_cast<const void*>(dn.c_str()));
    const int code = platform.run([&] { return config_back_delete(&pb); });
    compare(code, model::deleting(server, who.caller, dn),
            [&] { return who.name + " deletes " + quoted(dn); });
  }

  void check_add(const scene::Caller& who, const Entry& e, const std::string& what,
                 bool small_letters = false) {
    if (!is_chosen()) return;
    begin(who);
    entry* added = scripted::make_entry(scripted_entry(e));
    if (small_letters) {
      for (char* c = added->normalized_dn; *c != '\0'; ++c) {
        *c = static_cast<char>(std::tolower(static_cast<unsigned char>(*c)));
      }
    }
    const std::string dn = added->normalized_dn;
    pb.put(parameter::add_entry, added);
    const int code = platform.run([&] { return config_back_add(&pb); });
    compare(code, model::adding(server, who.caller, e, dn),
            [&] { return who.name + " adds " + quoted(dn) + ": " + what; });
  }

  void check_modify(const scene::Caller& who, const std::string& dn, const Modifications& list) {
    if (!is_chosen()) return;
    begin(who);
    pb.put(parameter::target_dn, static_cast<const void*>(dn.c_str()));
    pb.put(parameter::modifications, scripted::make_modifications(scripted_list(list)));
    const int code = platform.run([&] { return config_back_modify(&pb); });
    compare(code, model::modifying(server, who.caller, dn, list),
            [&] { return who.name + " modifies " + quoted(dn) + ": " + text_of(list); });
  }

  void check_search(const scene::Caller& who, const std::string& base, int scope,
                    const Texts& wanted, bool types_only) {
    if (!is_chosen()) return;
    begin(who);
    std::vector<char*> attributes;
    for (const std::string& type : wanted) attributes.push_back(const_cast<char*>(type.c_str()));
    attributes.push_back(nullptr);
    char** const list = wanted.empty() ? nullptr : attributes.data();
    pb.put(parameter::target_dn, static_cast<const void*>(base.c_str()));
    pb.put(parameter::search_filter_text, static_cast<const void*>("(objectclass=*)"));
    pb.put(parameter::search_scope, scope);
    pb.put(parameter::search_types_only, types_only ? 1 : 0);
    pb.put(parameter::search_attributes, list);
    const int code = platform.run([&] { return config_back_search(&pb); });
    const Answer& found =
        file_->file.search(base.c_str(), scope, "(objectclass=*)", list, types_only ? 1 : 0);
    compare_view(code, found, model::searching(server, who.caller, entries_of(found)), [&] {
      std::string what = who.name + " searches " + quoted(base) + " scope " + std::to_string(scope);
      for (const std::string& type : wanted) what += " " + type;
      return what + (types_only ? " types only" : "");
    });
  }

  void TearDown() override {
    platform.release_leaks();
    BackendTest::TearDown();
  }

  void conclude(int least) {
    EXPECT_GE(outcomes_, least / kStride);
    RecordProperty("outcomes", outcomes_);
    RecordProperty("cases", cases_);
    std::printf("%d requests, %d outcomes checked\n", cases_ / kStride, outcomes_);
  }

  model::Server server;

 private:
  // ---- Script

  void begin(const scene::Caller& who) {
    platform.release_leaks();
    platform.forget();
    connection.config_session = nullptr;
    operation.authority = who.caller.authority;
    operation.roles = who.caller.roles;
    operation.bound_dn = who.caller.bound_dn.c_str();
    operation.server_kind_marker = server.caller_mark;
    connection.authority = who.caller.connection_authority;
    connection.roles = who.caller.connection_roles;
    g_srvType = server.kind;
    g_safe_mode = server.safe_mode ? 1 : 0;
    platform.admin_policy = server.password_policy;
    platform.addresses = server.addresses;
    platform.supplied = server.supplied;
    platform.real_paths = server.links;
    answer_with("ldcf_api_schema_check", 1, server.schema);
    answer_with("ldcf_api_schema_check", 2, server.schema_again);
    answer_with("checkReferral", 0, server.referral);
    answer_with("verify_admin_password", 0, server.password);
    answer_with("validate_new_settings", 0, server.policy_settings);
    answer_with("convertPWEncryptionMethod", 0, server.encryption_method);
  }
  void answer_with(const char* function, int nth, int code) {
    if (code != 0) platform.fail(function, nth, code);
  }

  static ScriptedEntry scripted_entry(const Entry& e) {
    ScriptedEntry made{e.dn, {}};
    for (const Attribute& a : e.attributes) made.attributes.push_back({a.type, a.values});
    return made;
  }
  static std::vector<scripted::ScriptedModification> scripted_list(const Modifications& list) {
    std::vector<scripted::ScriptedModification> made;
    for (const Modification& m : list) {
      made.push_back({static_cast<int>(m.kind) | kModBvalues, m.type, m.values});
    }
    return made;
  }
  static std::optional<std::vector<Entry>> entries_of(const Answer& found) {
    if (found.code != 0) return std::nullopt;
    std::vector<Entry> entries;
    for (const ScriptedEntry& e : found.entries) {
      Entry made{e.dn, {}};
      for (const auto& a : e.attributes) made.attributes.push_back({a.type, a.values});
      entries.push_back(made);
    }
    return entries;
  }

  // ---- Comparison

  static std::string text_of(const Modifications& list) {
    static const char* const kKinds[] = {"add ", "delete ", "replace "};
    std::string text;
    for (const Modification& m : list) {
      text += (text.empty() ? "" : ", ") + std::string(kKinds[static_cast<int>(m.kind)]) + m.type;
      if (m.values && m.values->empty()) text += " []";
      for (const std::string& value : m.values.value_or(Texts())) text += " " + quoted(value);
    }
    return text;
  }

  static std::string joined(const Texts& texts) {
    std::string text;
    for (const std::string& line : texts) text += "\n    " + line;
    return text.empty() ? "\n    nothing" : text;
  }

  static std::string answer_of(int code, const std::string& text) {
    return "send_ldap_result(connection, operation, " + std::to_string(code) + ", null, \"" + text +
           "\")";
  }

  void compare(int code, const model::Outcome& expected, const std::function<std::string()>& name) {
    static const std::set<std::string> kVisible = {"cfg_add_s", "cfg_delete_s", "cfg_modify_s",
                                                   "send_ldap_result"};
    Texts wanted;
    if (!expected.written.empty()) wanted.push_back(expected.written);
    wanted.push_back(answer_of(expected.code, expected.text));
    wanted.push_back("returns " + std::to_string(expected.code));
    Texts got = platform.calls(kVisible);
    got.push_back("returns " + std::to_string(code));
    // The answer, and what was written or not.
    outcomes_ += 2;
    if (got != wanted) differs(name(), wanted, got);
  }

  void compare_view(int code, const Answer& found, const model::View& expected,
                    const std::function<std::string()>& name) {
    Texts wanted;
    for (const Entry& e : expected.entries) wanted.push_back(shown(e));
    const bool answered_by_view = server_lets_search(expected, found);
    wanted.push_back(answered_by_view ? "send_search_result(connection, operation, " +
                                            std::to_string(expected.code) + ", null, null, " +
                                            std::to_string(expected.entries.size()) + ")"
                                      : answer_of(expected.code, ""));
    wanted.push_back("returns " + std::to_string(expected.code));
    Texts got = platform.sent;
    for (const std::string& call : platform.calls({"send_search_result", "send_ldap_result"})) {
      got.push_back(call);
    }
    got.push_back("returns " + std::to_string(code));
    outcomes_ += 1;
    if (answered_by_view) {
      for (const ScriptedEntry& e : found.entries) {
        outcomes_ += 1 + static_cast<int>(e.attributes.size());
      }
    }
    if (got != wanted) differs(name(), wanted, got);
  }
  // Refusals and missing entries are answered in the way of other operations.
  static bool server_lets_search(const model::View& expected, const Answer& found) {
    return found.code == 0 && (expected.code == 0 || expected.code == 80);
  }

  static std::string shown(const Entry& e) {
    std::string text = e.dn;
    for (const Attribute& a : e.attributes) {
      text += "|" + a.type + "=";
      for (std::size_t i = 0; i < a.values.size(); ++i) text += (i == 0 ? "" : ",") + a.values[i];
    }
    return text;
  }

  void differs(const std::string& name, const Texts& wanted, const Texts& got) {
    ++differences_;
    ADD_FAILURE() << file_->name << ": " << name << "\n  expected" << joined(wanted) << "\n  got"
                  << joined(got);
    if (differences_ == kMostDifferences) ADD_FAILURE() << "and no more are looked for";
  }

  scene::NamedFile* file_ = nullptr;
  int cases_ = 0;
  int outcomes_ = 0;
  int differences_ = 0;
};

// ---- Searches

const char* const kTop = "CN=CONFIGURATION";
const char* const kGroup = "CN=ADMINGROUP,CN=CONFIGURATION";
const char* const kOne = "CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION";

const std::vector<Texts>& requests() {
  static const std::vector<Texts> kRequests = {{},
                                               {"orv-slapdAdminPW"},
                                               {"orv-slapdAdminDN"},
                                               {"orv-slapdAdminGroupEnabled"},
                                               {"orv-slapdAdminDN", "orv-slapdAdminPW"},
                                               {"orv-slapdAdminPW", "orv-slapdAdminRole"},
                                               {"orv-slapdAdminRole"},
                                               {"orv-slapdMasterPW", "orv-slapdMasterDN"},
                                               {"description"},
                                               {"1.1"}};
  return kRequests;
}

TEST_F(AuthorityMatrix, EveryCallerSeesWhatTheRulesShow) {
  const std::pair<const char*, int> places[] = {{kTop, 0},
                                                {kTop, 2},
                                                {kGroup, 0},
                                                {kGroup, 1},
                                                {kOne, 0},
                                                {"cn=one,cn=admingroup,cn=configuration", 0},
                                                {"CN=GHOST,CN=ADMINGROUP,CN=CONFIGURATION", 0},
                                                {"CN=SCHEMAS,CN=CONFIGURATION", 2},
                                                {"CN=NOWHERE,CN=CONFIGURATION", 0}};
  for (scene::NamedFile& file : scene::full_files()) {
    in(file);
    for (const scene::Caller& who : scene::readers()) {
      for (const auto& [base, scope] : places) {
        for (const Texts& wanted : requests()) {
          // The whole is large: what roles and files change is seen in the parts.
          if (scope == 2 && wanted.empty() && who.caller.roles == 0x3E) continue;
          check_search(who, base, scope, wanted, false);
          if (scope != 2) check_search(who, base, scope, wanted, true);
        }
      }
    }
  }
  conclude(kOutcomesOfSearches);
}

TEST_F(AuthorityMatrix, ServerOfKindThreeShowsNothingToCallersWithoutMark) {
  in(scene::full_files().front());
  for (const int kind : {0, 1, 2, 3}) {
    for (const int mark : {0, 1, 2, -1}) {
      server.kind = kind;
      server.caller_mark = mark;
      for (const scene::Caller& who : scene::readers()) check_search(who, kOne, 0, {}, false);
    }
  }
  conclude(2'500);
}

// ---- Deletes

TEST_F(AuthorityMatrix, EveryCallerDeletesWhatTheRulesLetIt) {
  for (scene::NamedFile& file : scene::full_files()) {
    in(file);
    for (const scene::Caller& who : scene::everybody()) {
      for (const std::string& dn : scene::names()) check_delete(who, dn);
    }
  }
  conclude(kOutcomesOfDeletes);
}

// ---- Adds

Entry fitting(const std::string& dn) {
  const auto is_in = [&](const char* part) { return dn.find(part) != std::string::npos; };
  Entry e{dn, {{"objectClass", {"top", "orv-slapdConfigEntry"}}}};
  const auto more = [&](const char* name, const char* type = nullptr, const char* value = "") {
    e.attributes.front().values.emplace_back(name);
    if (type != nullptr) e.attributes.push_back({type, {value}});
  };
  if (dn == kGroup) {
    e.attributes.front().values = {"top", "container"};
  } else if (is_in("CN=ADMINGROUP,CN=CONFIGURATION")) {
    more("orv-slapdAdminGroupMember", "orv-slapdAdminDN", "cn=fresh");
  } else if (is_in("CN=KERBEROS,")) {
    more("orv-slapdKerberos", "orv-slapdKrbAdminDN", "orv-kn=fresh@X");
  } else if (is_in("CN=DIGEST,")) {
    more("orv-slapdDigest", "orv-slapdDigestAdminUser", "fresh");
  } else if (is_in("CN=PASSTHROUGH")) {
    more("orv-slapdPta", "orv-slapdPtaSubtree", "o=fresh");
  }
  return e;
}

struct Shape {
  std::string name;
  std::function<void(Entry&)> change;
};

Texts& classes_of(Entry& e) {
  return e.attributes.front().values;
}

Shape with_class(const std::string& name) {
  return {"with class " + name, [name](Entry& e) { classes_of(e).push_back(name); }};
}

std::vector<Shape> shapes_of_classes() {
  const auto without = [](const std::string& name) {
    return Shape{"without class " + name, [name](Entry& e) { std::erase(classes_of(e), name); }};
  };
  return {
      {"as it fits", [](Entry&) {}},
      without("top"),
      without("orv-slapdConfigEntry"),
      without("container"),
      {"without its last class", [](Entry& e) { classes_of(e).pop_back(); }},
      {"without its second attribute", [](Entry& e) { e.attributes.resize(1); }},
      {"without classes", [](Entry& e) { e.attributes.erase(e.attributes.begin()); }},
      {"without attributes", [](Entry& e) { e.attributes.clear(); }},
      with_class("orv-slapdSupplier"),
      with_class("ORV-SLAPDSUPPLIER"),
      with_class("orv-slapdSuppliers"),
      with_class("orv-slapdReplication"),
      with_class("orv-replicationContext"),
      {"of both classes of replication", [](Entry& e) {
         classes_of(e).insert(classes_of(e).end(), {"orv-slapdReplication", "orv-slapdSupplier"});
         e.attributes.push_back({"orv-slapdMasterDN", {"cn=one"}});
         e.attributes.push_back({"orv-slapdMasterPW", {"secret"}});
       }}};
}

Shape with_values(const std::string& type, const Texts& values) {
  std::string name = "with " + type;
  for (const std::string& value : values) name += " " + quoted(value);
  return {name, [=](Entry& e) {
            e.remove(type);
            e.attributes.push_back({type, values});
          }};
}

std::vector<Shape> shapes_of_attributes() {
  std::vector<Shape> shapes;
  const std::pair<const char*, std::vector<Texts>> values[] = {
      {"orv-slapdAdminDN",
       {{"cn=fresh"},
        {"CN = Root"},
        {"cn=one"},
        {"cn=Two,  o=Orv"},
        {"cn=feeder"},
        {"cn=odd"},
        {"cn=first"},
        {"cn=second"},
        {"cn=fresh", "cn=root"}}},
      {"orv-slapdAdminPW", {{"new"}, {""}}},
      {"orv-slapdKrbAdminDN",
       {{"orv-kn=fresh@X"},
        {"ORV-KN=fresh@X"},
        {"orv-kerberosName=ONE@x"},
        {"orv-kn=root@X"},
        {"orv-knfresh@X"},
        {"fresh"}}},
      {"orv-slapdDigestAdminUser", {{"fresh"}, {"one"}, {"ONE"}, {"root"}}},
      {"orv-slapdMasterDN", {{"cn=fresh"}, {"cn=one"}, {"CN=ROOT"}, {"cn=feeder"}}},
      {"orv-slapdMasterPW", {{"new"}, {""}}},
      {"orv-slapdProxySplitName", {{"fresh1"}, {"part1"}, {"PART1"}, {"not-one"}, {""}}},
      {"orv-slapdPtaSubtree",
       {{"o=fresh"},
        {"o=partner"},
        {"ou=x, o=partner"},
        {"cn=localhost"},
        {"o=a", "ou=b,o=a"},
        {"o=a", "o=b"},
        {"cn=configuration"},
        {"cn=x,cn=changelog"}}},
      {"orv-slapdAdminRole",
       {{"SchemaAdmin"},
        {"auditadmin"},
        {"SchemaAdmin", "NoAdmin", "AuditAdmin"},
        {"Unknown"},
        {"NoAdmin"},
        {"NoAdmin", "Unknown"},
        {"NoAdmins"},
        {}}},
      {"orv-slapdSuffix", {{"o=new"}}},
      {"orv-slapdLog", {{"/log/audit"}}}};
  for (const auto& [type, lists] : values) {
    for (const Texts& list : lists) shapes.push_back(with_values(type, list));
  }
  return shapes;
}

class AuthorityMatrixOfAdds : public AuthorityMatrix {
 protected:
  void check_shape(const scene::Caller& who, const std::string& dn, const Shape& shape) {
    Entry e = fitting(dn);
    shape.change(e);
    // Names in small letters arrive as such.
    check_add(who, e, shape.name, dn.starts_with("cn="));
  }
};

TEST_F(AuthorityMatrixOfAdds, EveryCallerAddsWhatTheRulesLetIt) {
  const std::vector<Shape> shapes = {shapes_of_classes().front(), with_class("orv-slapdSupplier")};
  for (const scene::Caller& who : scene::everybody()) {
    for (const std::string& dn : scene::names()) {
      in(scene::sparse_files()[1]);
      check_shape(who, dn, shapes.front());
      in(scene::sparse_files()[0]);
      for (const Shape& shape : shapes) check_shape(who, dn, shape);
      server.schema = 65;
      check_shape(who, dn, shapes.front());
      server.schema = 0;
    }
  }
  conclude(kOutcomesOfAdds);
}

TEST_F(AuthorityMatrixOfAdds, EveryShapeOfEntryIsAddedAsTheRulesSay) {
  std::vector<Shape> shapes = shapes_of_classes();
  for (const Shape& shape : shapes_of_attributes()) shapes.push_back(shape);
  for (scene::NamedFile& file : scene::sparse_files()) {
    in(file);
    for (const std::string& dn : scene::names()) {
      for (const Shape& shape : shapes) {
        for (const std::size_t who : {0U, 4U, 9U, 11U}) {
          check_shape(scene::some()[who], dn, shape);
        }
      }
    }
  }
  conclude(kOutcomesOfShapes);
}

TEST_F(AuthorityMatrixOfAdds, PasswordsReferralsAndSchemaCountInTheirOrder) {
  in(scene::sparse_files().front());
  for (const int password : {0, 19}) {
    for (const int referral : {0, 10}) {
      for (const int schema : {0, 65}) {
        server.password_policy = true;
        server.password = password;
        server.referral = referral;
        server.schema = schema;
        for (const std::string& dn : scene::names()) {
          for (const char* type : {"orv-slapdAdminPW", "orv-slapdMasterPW"}) {
            for (const char* value : {"new", ""}) {
              check_shape(scene::some()[0], dn, with_values(type, {value}));
              check_shape(scene::some()[11], dn, with_values(type, {value}));
            }
          }
          check_shape(scene::some()[0], dn, shapes_of_classes().back());
          Shape late = {"with its classes behind", [](Entry& e) {
                          shapes_of_classes().back().change(e);
                          std::reverse(e.attributes.begin(), e.attributes.end());
                        }};
          check_shape(scene::some()[0], dn, late);
        }
      }
    }
  }
  conclude(12'000);
}

const Texts& role_names() {
  static const Texts kNames = {"AuditAdmin",           "DirDataAdmin", "NoAdmin",
                               "ReplicationAdmin",     "SchemaAdmin",  "ServerConfigGroupMember",
                               "ServerStartStopAdmin", "PasswordAdmin"};
  return kNames;
}

// The roles of which the number has the bit.
Texts roles_of(unsigned bits) {
  Texts roles;
  for (std::size_t i = 0; i < role_names().size(); ++i) {
    if ((bits >> i & 1U) != 0) roles.push_back(role_names()[i]);
  }
  return roles;
}

TEST_F(AuthorityMatrixOfAdds, EverySetOfRolesIsStoredAsTheRulesSay) {
  in(scene::sparse_files().front());
  for (unsigned bits = 0; bits < 0x100; ++bits) {
    Texts roles = roles_of(bits);
    for (const char* dn :
         {"CN=NEW,CN=ADMINGROUP,CN=CONFIGURATION", kGroup, "CN=NEW,CN=SCHEMAS,CN=CONFIGURATION"}) {
      check_shape(scene::some()[0], dn, with_values("orv-slapdAdminRole", roles));
      check_shape(scene::some()[11], dn, with_values("orv-slapdAdminRole", roles));
    }
    std::reverse(roles.begin(), roles.end());
    check_shape(scene::some()[0], "CN=NEW,CN=ADMINGROUP,CN=CONFIGURATION",
                with_values("ORV-SLAPDADMINROLE", roles));
    roles.emplace_back("Unknown");
    check_shape(scene::some()[0], "CN=NEW,CN=ADMINGROUP,CN=CONFIGURATION",
                with_values("orv-slapdAdminRole", roles));
  }
  conclude(4'000);
}

// ---- Modifies

const std::vector<std::pair<const char*, Texts>>& values_of_attributes() {
  static const std::vector<std::pair<const char*, Texts>> kValues = {
      {"description", {"new"}},
      {"orv-slapdAdminDN", {"cn=fresh", "CN=Root", "cn=two, o=orv", "cn=feeder", "cn=second"}},
      {"orv-slapdAdminPW", {"new"}},
      {"orv-slapdAdminGroupEnabled", {"FALSE"}},
      {"orv-slapdAdminRole", {"DirDataAdmin", "Unknown", "schemaadmin"}},
      {"orv-slapdKrbAdminDN",
       {"orv-kn=fresh@X", "ORV-KERBEROSNAME=ROOT@x", "orv-kn=one@X", "fresh@X"}},
      {"orv-slapdDigestAdminUser", {"fresh", "root", "ROOT", "two"}},
      {"orv-slapdMasterDN", {"cn=fresh", "cn=one", "cn=root", "cn=feeder"}},
      {"orv-slapdMasterPW", {"new"}},
      {"orv-slapdProxySplitName", {"fresh1", "part1", "not-one"}},
      {"orv-slapdPtaSubtree", {"o=fresh", "ou=x,o=partner", "cn=schema"}},
      {"orv-slapdLog", {"/log/new", "/LOG/audit", "/log/link", "/var/ldap/V6.0/AUDIT.log"}},
      {"orv-slapdIpAddress", {"10.0.0.2", "192.0.2.1"}},
      {"orv-slapdPwEncryption", {"known", "unknown"}},
      {"orv-slapdSuffix", {"o=mine", "o=other"}},
      {"pwdMinLength", {"12"}},
      {"objectClass", {"orv-slapdSupplier", "orv-replicationContext"}}};
  return kValues;
}

Modification replaced(const std::string& type, const Texts& values) {
  return {Kind::replace, type, values};
}
Modification added(const std::string& type, const Texts& values) {
  return {Kind::add, type, values};
}
Modification removed(const std::string& type, const std::optional<Texts>& values = std::nullopt) {
  return {Kind::remove, type, values};
}

// One modification each: every attribute by every kind, with values that rules refuse, and without.
std::vector<Modifications> single_lists() {
  std::vector<Modifications> lists;
  for (const auto& [type, values] : values_of_attributes()) {
    for (const std::string& value : values) {
      lists.push_back({replaced(type, {value})});
      lists.push_back({added(type, {value})});
    }
    lists.push_back({removed(type)});
    lists.push_back({removed(type, Texts{values.front()})});
    lists.push_back({{Kind::replace, type, std::nullopt}});
    lists.push_back({{Kind::replace, type, Texts()}});
  }
  return lists;
}

std::vector<Modifications> lists_of_more() {
  const Modification describe = replaced("description", {"new"});
  const Modification password = replaced("orv-slapdAdminPW", {"new"});
  const Modification own_suffix = added("orv-slapdSuffix", {"o=mine"});
  const Modification role = removed("orv-slapdAdminRole", Texts{"NoAdmin"});
  return {
      {password, describe},
      {describe, password},
      {password, password},
      {replaced("ORV-SLAPDADMINPW", {"new"})},
      {removed("orv-slapdAdminPW", Texts{"secret"}), added("orv-slapdAdminPW", {"new"})},
      {password, replaced("orv-slapdMasterPW", {"new"})},
      {replaced("orv-slapdMasterPW", {"new"}), password},
      {describe, replaced("orv-slapdAdminGroupEnabled", {"FALSE"})},
      {own_suffix, describe},
      {describe, own_suffix},
      {own_suffix, added("orv-slapdSuffix", {"o=other"})},
      {added("orv-slapdSuffix", {"o=mine", "o=other"})},
      {added("ORV-SLAPDSUFFIX", {"o=mine"})},
      {replaced("orv-slapdSuffix", {"o=mine"})},
      {added("description", {"a", "b"}), added("DESCRIPTION", {"c"}), describe},
      {removed("description", Texts{"old"}), added("description", {"new"})},
      {added("description", {"new"}), removed("description", Texts{"old"})},
      {removed("orv-slapdPort"), removed("description")},
      {removed("orv-slapdPort"), added("description", {"new"})},
      {role},
      {role, added("orv-slapdAdminRole", {"SchemaAdmin"})},
      {describe, role},
      {role, describe},
      {removed("description"), role},
      {role, password},
      {role, replaced("orv-slapdDigestAdminUser", {"root"})},
      {replaced("orv-slapdAdminDN", {"cn=root"}), role},
      {removed("orv-slapdAdminDN"), added("orv-slapdAdminDN", {"cn=root"})},
      {{Kind::replace, "orv-slapdAdminDN", std::nullopt}, added("orv-slapdAdminDN", {"cn=root"})},
      {removed("orv-slapdMasterDN"), added("orv-slapdMasterDN", {"cn=one"})},
      {{Kind::replace, "orv-slapdMasterDN", std::nullopt}, added("orv-slapdMasterDN", {"cn=one"})},
      {removed("orv-slapdKrbAdminDN"), added("orv-slapdKrbAdminDN", {"wrong"})},
      {removed("orv-slapdDigestAdminUser"), added("orv-slapdDigestAdminUser", {"one"})},
      {removed("orv-slapdProxySplitName"), added("orv-slapdProxySplitName", {"part1"})},
      {removed("orv-slapdPwEncryption"), added("orv-slapdPwEncryption", {"unknown"})},
      {removed("orv-slapdLog"), added("orv-slapdLog", {"/log/audit"})},
      {replaced("orv-slapdLog", {"/log/new", "/log/audit"})},
      {replaced("orv-slapdProxySplitName", {"fresh1", "not-one"})},
      {replaced("orv-slapdIpAddress", {"10.0.0.1", "192.0.2.2", "192.0.2.1"})},
      {replaced("orv-slapdPtaSubtree", {"o=a", "ou=b,o=a"})}};
}

// Entries of which a rule protects single attributes, and names that nearly are theirs.
const Texts& names_of_attribute_rules() {
  static const Texts kNames = {
      kTop,
      kGroup,
      kOne,
      "CN=TWO,CN=ADMINGROUP,CN=CONFIGURATION",
      "CN=KERBEROS,CN=CONFIGURATION",
      "CN=DIGEST,CN=CONFIGURATION",
      "CN=PWDPOLICY ADMIN,CN=CONFIGURATION",
      "CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION",
      "CN=MASTER SERVER,CN=CONFIGURATION",
      "CN=X,CN=ADMINGROUP,CN=CONFIGURATION,O=ELSEWHERE",
      "cn=one,cn=admingroup,cn=configuration",
      "cn=directory,cn=rdbm backends,cn=orv directory,cn=schemas,cn=configuration",
      "CN=DIRECTORY,CN=RDBM BACKENDS,CN=ORV DIRECTORY,CN=SCHEMAS,CN=CONFIGURATION"};
  return kNames;
}

TEST_F(AuthorityMatrix, EveryCallerModifiesWhatTheRulesLetIt) {
  const Modifications list = {replaced("description", {"new"})};
  for (const std::size_t file : {0U, 1U}) {
    in(scene::full_files()[file]);
    for (const scene::Caller& who : scene::everybody()) {
      for (const std::string& dn : scene::names()) check_modify(who, dn, list);
    }
  }
  conclude(kOutcomesOfModifies);
}

TEST_F(AuthorityMatrix, EveryListOfModificationsIsTakenAsTheRulesSay) {
  std::vector<Modifications> lists = single_lists();
  for (const Modifications& list : lists_of_more()) lists.push_back(list);
  for (scene::NamedFile& file : scene::full_files()) {
    in(file);
    for (const std::string& dn : scene::names()) {
      for (const Modifications& list : lists) {
        check_modify(scene::some()[0], dn, list);
        if (&file != &scene::full_files().front()) continue;
        for (const std::size_t who : {4U, 11U}) check_modify(scene::some()[who], dn, list);
      }
    }
  }
  conclude(kOutcomesOfLists);
}

TEST_F(AuthorityMatrix, EveryCallerChangesTheAttributesThatTheRulesLeaveIt) {
  const std::vector<Modifications> lists = {{replaced("orv-slapdAdminPW", {"new"})},
                                            {replaced("orv-slapdAdminGroupEnabled", {"FALSE"})},
                                            {replaced("orv-slapdAdminRole", {"AuditAdmin"})},
                                            {replaced("orv-slapdKrbAdminDN", {"orv-kn=fresh@X"})},
                                            {removed("orv-slapdDigestAdminUser")},
                                            {replaced("orv-slapdMasterDN", {"cn=fresh"})},
                                            {added("orv-slapdSuffix", {"o=mine"})}};
  in(scene::full_files().front());
  // Readers are bound under many names: whose password it is counts.
  for (const auto* callers : {&scene::everybody(), &scene::readers()}) {
    for (const scene::Caller& who : *callers) {
      for (const std::string& dn : names_of_attribute_rules()) {
        for (const Modifications& list : lists) check_modify(who, dn, list);
      }
    }
  }
  conclude(kOutcomesOfAttributes);
}

TEST_F(AuthorityMatrix, WhatMembersAndSuppliersMayNotTouchDependsOnTheAttribute) {
  std::vector<Modifications> lists = single_lists();
  for (const Modifications& list : lists_of_more()) lists.push_back(list);
  in(scene::full_files().front());
  for (const bool of_server : {false, true}) {
    if (of_server) server.supplied[""] = 1;
    for (const scene::Caller& who : scene::some()) {
      const bool supplier = (who.caller.authority & 3U) != 0;
      if (of_server && !supplier) continue;
      for (const std::string& dn : names_of_attribute_rules()) {
        for (const Modifications& list : lists) check_modify(who, dn, list);
      }
    }
  }
  conclude(kOutcomesOfAttributes);
}

TEST_F(AuthorityMatrix, ConnectionsCopyOfTheRolesCountsWhereRulesSaySo) {
  in(scene::full_files().front());
  for (const scene::Caller& given : scene::some()) {
    for (const unsigned authority : {0x0CU, 0x14U, 0x24U}) {
      for (const unsigned roles : {0x00U, 0x02U, 0x04U, 0x08U, 0x20U, 0x3EU}) {
        scene::Caller who = given;
        who.caller.connection_authority = authority;
        who.caller.connection_roles = roles;
        who.name += ", on a connection of other rights";
        for (const char* dn :
             {"CN=AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION",
              "CN=ADMIN AUDIT,CN=LOG MANAGEMENT,CN=CONFIGURATION",
              "CN=MASTER SERVER,CN=CONFIGURATION", "CN=SCHEMAS,CN=CONFIGURATION"}) {
          check_modify(who, dn, {replaced("description", {"new"})});
        }
      }
    }
  }
  conclude(2'000);
}

TEST_F(AuthorityMatrix, SchemaPasswordsAndSafeModeCountInTheirOrder) {
  std::vector<Modifications> lists = {{replaced("description", {"new"})},
                                      {replaced("orv-slapdAdminPW", {"new"})},
                                      {added("orv-slapdAdminPW", {"new"})},
                                      {removed("orv-slapdAdminPW")},
                                      {replaced("orv-slapdMasterPW", {"new"})},
                                      {added("orv-slapdMasterPW", {"new"})},
                                      {replaced("orv-slapdPwEncryption", {"known"})},
                                      {replaced("orv-slapdPwEncryption", {"unknown"})},
                                      {replaced("pwdMinLength", {"1"})},
                                      {removed("orv-slapdAdminRole", Texts{"NoAdmin"})},
                                      {replaced("orv-slapdAdminRole", {"SchemaAdmin"})},
                                      {added("orv-slapdSuffix", {"o=mine"})},
                                      {replaced("orv-slapdIpAddress", {"192.0.2.1"})}};
  const std::pair<const char*, std::function<void(model::Server&)>> servers[] = {
      {"schema", [](model::Server& s) { s.schema = 65; }},
      {"schema twice", [](model::Server& s) { s.schema = s.schema_again = 65; }},
      {"schema later", [](model::Server& s) { s.schema_again = 65; }},
      {"other schema", [](model::Server& s) { s.schema = 19; }},
      {"referral", [](model::Server& s) { s.referral = 10; }},
      {"policy", [](model::Server& s) { s.password_policy = true; }},
      {"refusing policy",
       [](model::Server& s) {
         s.password_policy = true;
         s.password = 19;
         s.policy_settings = 53;
       }},
      {"policy off",
       [](model::Server& s) {
         s.password = 19;
         s.policy_settings = 53;
       }},
      {"method not allowed", [](model::Server& s) { s.encryption_method = 1; }},
      {"safe mode", [](model::Server& s) {
         s.safe_mode = true;
         s.encryption_method = 1;
       }}};
  for (const auto& [name, change] : servers) {
    usual();
    change(server);
    in(scene::full_files().front());
    for (const std::size_t who : {0U, 2U, 11U}) {
      for (const std::string& dn : scene::names()) {
        for (const Modifications& list : lists) check_modify(scene::some()[who], dn, list);
      }
    }
  }
  conclude(60'000);
}

// A member holds three roles: which of them go, in one request, and what comes.
TEST_F(AuthorityMatrix, EveryChangeOfRolesLeavesWhatTheRulesSay) {
  in(scene::full_files().front());
  const char* const type = "orv-slapdAdminRole";
  for (unsigned gone = 0; gone < 0x100; ++gone) {
    const Texts roles = roles_of(gone);
    for (const std::size_t who : {0U, 11U}) {
      for (const char* dn : {kOne, "CN=SUB,CN=ONE,CN=ADMINGROUP,CN=CONFIGURATION", kGroup}) {
        if (gone != 0) check_modify(scene::some()[who], dn, {removed(type, roles)});
        check_modify(scene::some()[who], dn, {{Kind::add, type, roles}});
        check_modify(scene::some()[who], dn, {{Kind::replace, type, roles}});
      }
    }
    if (gone == 0) continue;
    check_modify(scene::some()[0], kOne, {replaced("description", {"new"}), removed(type, roles)});
    check_modify(scene::some()[0], kOne,
                 {removed(type, roles), removed("orv-slapdDigestAdminUser")});
    check_modify(scene::some()[0], kOne,
                 {removed("orv-slapdDigestAdminUser"), removed(type, roles)});
    check_modify(scene::some()[0], kOne, {removed(type, roles), added(type, {"DirDataAdmin"})});
  }
  conclude(11'000);
}

}  // namespace
}  // namespace orv
