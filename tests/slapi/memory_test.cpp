// What each function does when the n-th allocation fails, for every n; and which allocate nothing.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <string>
#include <thread>

#include "../temporary_directory.h"
#include "cfg/secret.h"
#include "configuration_file.h"
#include "entries.h"
#include "failing_allocation.h"
#include "messages.h"
#include "slapi/administrators.h"
#include "slapi/backends.h"
#include "slapi/codepage.h"
#include "slapi/control.h"
#include "slapi/log.h"
#include "slapi/owners.h"
#include "slapi/password_method.h"
#include "slapi/reserves.h"
#include "slapi/schema.h"
#include "slapi/services.h"
#include "slapi/strings.h"
#include "slapi/trace.h"
#include "slapi/value_syntax.h"
#include "values.h"

namespace orv {
namespace {

using test::AllocationFault;
using test::texts_of;
using test::to_text;
using test::Values;

// Calls `attempt` with every allocation failing in turn, until one call meets no failure. `attempt`
// says whether the call succeeded. One that did not must leave no block behind. One that did
// although an allocation failed (a block that could not be shrunk, say) must have done all of its
// work, which `after_success` checks, and makes undone for the next call.
void fail_each_allocation(
    const std::function<bool()>& attempt, const std::function<void()>& after_failure = [] {},
    const std::function<void()>& after_success = [] {}) {
  for (long n = 1;; ++n) {
    ASSERT_LT(n, 10000);
    AllocationFault fault(n);
    const bool succeeded = attempt();
    fault.disarm();
    if (succeeded) {
      after_success();
    } else {
      ASSERT_TRUE(fault.hit()) << "allocation " << n;
      EXPECT_EQ(fault.balance(), 0) << "allocation " << n;
      after_failure();
    }
    if (!fault.hit()) {
      EXPECT_GT(n, 1) << "nothing was allocated";
      return;
    }
  }
}

// Releases a list of records as backends do.
void free_list(ldapmod** list) {
  if (list == nullptr) return;
  free_ldmll(list[0]);
  std::free(list);
}

class OutOfMemory : public testing::Test {
 protected:
  // What is made once in a process is made before the counting begins.
  static void SetUpTestSuite() {
    current_schema();
    char* dn = strdup("cn=\xC3\xA9");
    ASSERT_EQ(replace_DN(&dn, 1), 0);
    std::free(dn);
    ASSERT_EQ(select_backend_opt("CN=LOCALHOST"), nullptr);
  }
};

EntryPtr entry_with(const char* type, std::initializer_list<std::string> texts) {
  EntryPtr e(static_cast<entry*>(std::calloc(1, sizeof(entry))));
  Values values(texts);
  EXPECT_EQ(attr_merge(e.get(), type, values.list(), 1, 1, nullptr), 0);
  return e;
}

TEST_F(OutOfMemory, MergeLeavesTheEntryAsItWas) {
  struct Case {
    const char* type;
    bool present;
    const char* after;
  };
  const std::string more_text =
      "container|a value too long to be kept inside a string object|b\xC3\xA9|; ";
  for (const Case& c : {Case{"cn", true, "objectClass=top|; cn=old|"},
                        Case{"orv-slapdAdminPW", true, "objectClass=top|; orv-slapdAdminPW=old|"},
                        Case{"description", false, "objectClass=top|; description="},
                        Case{"objectClass", false, "objectClass=top|"}}) {
    EntryPtr e;
    std::string before;
    const auto reset = [&] {
      e = entry_with("objectClass", {"top"});
      Values old{"old"};
      if (c.present) {
        ASSERT_EQ(attr_merge(e.get(), c.type, old.list(), 1, 1, nullptr), 0);
      }
      before = to_text(*e);
    };
    reset();
    Values more{"container", "a value too long to be kept inside a string object", "b\xC3\xA9"};
    int rc = 0;
    fail_each_allocation(
        [&] {
          rc = attr_merge(e.get(), c.type, more.list(), 1, 1, nullptr);
          return rc == 0;
        },
        [&] {
          EXPECT_EQ(rc, 90);
          EXPECT_EQ(to_text(*e), before);
          EXPECT_EQ(texts_of(e->object_class_list), std::vector<std::string>{"top"});
          EXPECT_EQ(e->object_classes->count, 1);
        },
        [&] {
          EXPECT_EQ(to_text(*e), c.after + more_text);
          EXPECT_EQ(texts_of(e->object_class_list), texts_of(e->object_classes));
          reset();
        });
  }
}

TEST_F(OutOfMemory, MergeIntoAnEmptyEntryLeavesItEmpty) {
  const EntryPtr e(static_cast<entry*>(std::calloc(1, sizeof(entry))));
  Values classes{"top", "container"};
  fail_each_allocation(
      [&] { return attr_merge(e.get(), "objectClass", classes.list(), 1, 1, nullptr) == 0; },
      [&] {
        EXPECT_EQ(e->attributes, nullptr);
        EXPECT_EQ(e->object_classes, nullptr);
        EXPECT_EQ(e->object_class_list, nullptr);
      });
}

TEST_F(OutOfMemory, MergeNeverTakesAValueThatIsThere) {
  const EntryPtr e = entry_with("cn", {"J\xC3\xBCrgen with a name too long for a short string"});
  Values again{"J\xC3\x9CRGEN with a name too long for a short string"};
  fail_each_allocation(
      [&] { return attr_merge(e.get(), "cn", again.list(), 1, 1, nullptr) == 20; });
  EXPECT_EQ(e->attributes->count, 1);
}

TEST_F(OutOfMemory, ValueFindNeverSaysPresent) {
  const EntryPtr e = entry_with("cn", {"a value too long to be kept inside a string object"});
  std::string text = "A value too long to be kept inside a string object";
  const berval value{text.size(), text.data()};
  fail_each_allocation(
      [&] { return value_find(e->attributes, &value, e->attributes->syntax, 1) == 0; });
}

TEST_F(OutOfMemory, EntryOfAFileIsNullAndLeavesNothing) {
  test::ConfigurationFile file(
      "dn: cn=configuration\nobjectClass: top\nobjectClass: orv-slapdTop\ncn: configuration\n"
      "description: a value too long to be kept inside a string object\ndescription:\n");
  const CfgResult result = file.find("cn=configuration");
  _CFGMessage* const record = file.first(result);
  // What the session keeps of an entry for the next look at it is no leak.
  EntryPtr e(CFGMessage2Entry(file.session(), record));
  e.reset();
  fail_each_allocation([&] {
    e.reset(CFGMessage2Entry(file.session(), record));
    return e != nullptr;
  });
  EXPECT_EQ(to_text(*e),
            "objectClass=top|orv-slapdTop|; cn=configuration|; description=a value too long to be "
            "kept inside a string object||; ");
}

// ---- The schema check ------------------------------------------------------------------------

TEST_F(OutOfMemory, SchemaCheckSays90AndNothingElse) {
  test::MessageRecorder messages;
  const EntryPtr e = test::make_entry(
      "cn=a member with a name too long for a short string,CN=ADMINGROUP,CN=CONFIGURATION",
      {{"objectClass", {"top", "orv-slapdConfigEntry", "orv-slapdAdminGroupMember"}},
       {"cn", {"A Member with a name too long for a short string"}},
       {"orv-slapdAdminDN", {"cn=a member with a name too long for a short string"}},
       {"orv-slapdAdminPW", {"a secret that is too long for a short string"}},
       {"orv-slapdKrbAdminDN", {"orv-kn=a-member-with-a-long-name@EXAMPLE.COM"}},
       {"orv-slapdDigestAdminUser", {"caf\xC3\xA9 with a name too long for a short string"}},
       {"orv-slapdAdminRole", {"NoAdmin"}}});
  int rc = 0;
  fail_each_allocation(
      [&] {
        rc = ldcf_api_schema_check(e.get(), 0, 0);
        return rc == 0;
      },
      [&] { EXPECT_EQ(rc, 90); });
  EXPECT_THAT(messages.take(), testing::IsEmpty());
}

TEST_F(OutOfMemory, SchemaCheckOfAnEntryInAnotherCodePageSays90) {
  set_local_code_page("ISO-8859-1");
  ASSERT_EQ(initIconvHandle(), 0);
  const EntryPtr e = test::make_entry("cn=caf\xE9,CN=CONFIGURATION",
                                      {{"objectClass", {"top", "container"}}, {"cn", {"caf\xE9"}}});
  e->local_code_page = true;
  ASSERT_EQ(ldcf_api_schema_check(e.get(), 0, 0), 0);
  int rc = 0;
  fail_each_allocation(
      [&] {
        rc = ldcf_api_schema_check(e.get(), 0, 0);
        return rc == 0;
      },
      [&] { EXPECT_EQ(rc, 90); });
  set_local_code_page("UTF-8");
  ASSERT_EQ(initIconvHandle(), 0);
}

TEST_F(OutOfMemory, CheckOfAValueSays90) {
  for (const char* type :
       {"orv-slapdAdminDN", "orv-slapdKrbAdminDN", "orv-slapdPtaSubtree", "createTimestamp"}) {
    const char* problem = nullptr;
    int rc = 0;
    const std::string value = std::string_view(type) == "createTimestamp"
                                  ? "20260101000000.123456789Z"
                                  : "orv-kn=caf\xC3\xA9-with-a-long-name@EXAMPLE.COM";
    fail_each_allocation(
        [&] {
          rc = check_value(*builtin_schema().attribute(type), value, &problem);
          return rc == 0;
        },
        [&] { EXPECT_EQ(rc, 90); });
    EXPECT_EQ(problem, nullptr);
  }
}

// ---- Modification records --------------------------------------------------------------------

// Never a null list: the change would be reported as done.
TEST_F(OutOfMemory, ListOfAttributesIsOneRecordThatNoChangeAccepts) {
  const EntryPtr e = test::make_entry(
      nullptr, {{"objectClass", {"top", "container"}}, {"cn", {"box"}}, {"description", {""}}});
  long refused = 0;
  for (long n = 1, hit = 1; hit != 0; ++n) {
    ASSERT_LT(n, 1000);
    AllocationFault fault(n);
    ldapmod** const list = EntryToLDAPMod(e->attributes);
    fault.disarm();
    hit = fault.hit() ? 1 : 0;
    ASSERT_NE(list, nullptr) << n;
    if (list[0]->mod_type == nullptr) {
      ++refused;
      EXPECT_EQ(list[1], nullptr);
    } else {
      EXPECT_STREQ(list[2]->mod_type, "description");
    }
    free_ldmll(list[0]);
    std::free(list);
  }
  EXPECT_GT(refused, 10);
}

TEST_F(OutOfMemory, ListOfAttributesLeavesNothingBehind) {
  const EntryPtr e = test::make_entry(nullptr, {{"cn", {"box", "crate"}}, {"description", {"x"}}});
  for (long n = 1, hit = 1; hit != 0; ++n) {
    ASSERT_LT(n, 1000);
    AllocationFault fault(n);
    free_list(EntryToLDAPMod(e->attributes));
    fault.disarm();
    hit = fault.hit() ? 1 : 0;
    // The reserve that an earlier call took is made again, or was taken by this one.
    EXPECT_LE(std::abs(fault.balance()), 1) << n;
  }
  AllocationFault none(0);
  for (int i = 0; i < 10; ++i) free_list(EntryToLDAPMod(e->attributes));
  none.disarm();
  EXPECT_LE(none.balance(), 1);
}

// Every allocation fails for a while, as it does when memory is short.
TEST_F(OutOfMemory, ListOfAttributesIsRefusedEachTimeFromTheReserve) {
  const EntryPtr e = test::make_entry(nullptr, {{"cn", {"box"}}});
  AllocationFault fault(1);
  ldapmod** const list = EntryToLDAPMod(e->attributes);
  fault.disarm();
  ASSERT_NE(list, nullptr);
  EXPECT_EQ(list[0]->mod_type, nullptr);
  free_list(list);
}

TEST_F(OutOfMemory, ReserveThatWasUsedIsFilledBeforeTheNextHandlerOrItIsNotCalled) {
  const EntryPtr e = test::make_entry(nullptr, {{"cn", {"box"}}});
  ASSERT_TRUE(fill_reserves());
  ldapmod** held = nullptr;
  {
    AllocationFault fault(1);
    held = EntryToLDAPMod(e->attributes);
  }
  ASSERT_EQ(held[0]->mod_type, nullptr);
  {
    AllocationFault fault(1);
    EXPECT_FALSE(fill_reserves());
  }
  EXPECT_TRUE(fill_reserves());
  {
    AllocationFault fault(1);
    EXPECT_TRUE(fill_reserves()) << "it is full";
    EXPECT_FALSE(fault.hit());
    ldapmod** const list = EntryToLDAPMod(e->attributes);
    ASSERT_NE(list, nullptr);
    EXPECT_EQ(list[0]->mod_type, nullptr);
    free_list(list);
  }
  free_list(held);
}

TEST_F(OutOfMemory, DeletedValuesStay) {
  const EntryPtr e = test::make_entry(
      nullptr, {{"objectClass", {"top", "container", "referral"}},
                {"cn", {"a value too long to be kept inside a string object", "box"}}});
  char* wanted[] = {strdup("A value too long to be kept inside a string object"), nullptr};
  char type[] = "cn";
  ldapmod record{kModDelete, type, {.modv_strvals = wanted}, nullptr};
  const std::string before = to_text(*e);
  int rc = 0;
  const auto attempt = [&] {
    rc = delete_values_from_entry(e.get(), &record);
    return rc == 0;
  };
  const auto unchanged = [&] {
    EXPECT_EQ(rc, 90);
    EXPECT_EQ(to_text(*e), before);
    EXPECT_EQ(texts_of(e->object_class_list), texts_of(e->object_classes));
  };
  fail_each_allocation(attempt, unchanged);
  EXPECT_EQ(texts_of(attr_find(e.get(), "cn", 0, 0)), std::vector<std::string>{"box"});
  std::free(wanted[0]);
}

TEST_F(OutOfMemory, DeletedObjectClassesStay) {
  const EntryPtr e = test::make_entry(nullptr, {{"objectClass", {"top", "container", "referral"}}});
  char* wanted[] = {strdup("REFERRAL"), nullptr};
  char type[] = "objectClass";
  ldapmod record{kModDelete, type, {.modv_strvals = wanted}, nullptr};
  int rc = 0;
  fail_each_allocation(
      [&] {
        rc = delete_values_from_entry(e.get(), &record);
        return rc == 0;
      },
      [&] {
        EXPECT_EQ(rc, 90);
        EXPECT_EQ(e->object_classes->count, 3);
        EXPECT_EQ(texts_of(e->object_class_list), texts_of(e->object_classes));
      });
  EXPECT_EQ(texts_of(e->object_class_list), (std::vector<std::string>{"top", "container"}));
  std::free(wanted[0]);
}

// ---- Passwords, URLs -------------------------------------------------------------------------

TEST_F(OutOfMemory, PasswordIsNeverAccepted) {
  test::MessageRecorder messages;
  char password[] = "correct-h0use-of-a-man";
  char old[] = "another of its kind";
  int rc = 0;
  _Admin_pwdPolicy policy = getGlobalAdminPWDPolicyLocal();
  policy.passwordMaxRepeatedChars = 0;
  const _Admin_pwdPolicy strict = getGlobalAdminPWDPolicyLocal();
  ASSERT_EQ(set_admin_password_policy(policy), 0);
  fail_each_allocation(
      [&] {
        rc = verify_admin_password(password, old, nullptr);
        return rc == 0;
      },
      [&] { EXPECT_EQ(rc, 90); });
  EXPECT_THAT(messages.take(), testing::IsEmpty());
  ASSERT_EQ(set_admin_password_policy(strict), 0);
}

TEST_F(OutOfMemory, PolicyBeforeStaysInForce) {
  test::MessageRecorder messages;
  test::ConfigurationFile file(
      "dn: CN=CONFIGURATION\nobjectClass: top\ncn: Configuration\n\n"
      "dn: CN=PWDPOLICY ADMIN,CN=CONFIGURATION\nobjectClass: orv-slapdAdminPolicy\n"
      "cn: PwdPolicy Admin\npwdMinLength: 20\n");
  const _Admin_pwdPolicy strict = getGlobalAdminPWDPolicyLocal();
  for (long n = 1, hit = 1; hit != 0; ++n) {
    ASSERT_LT(n, 10000);
    AllocationFault fault(n);
    const int rc = load_admin_password_policy(file.session());
    fault.disarm();
    hit = fault.hit() ? 1 : 0;
    ASSERT_EQ(rc, hit != 0 && rc != 0 ? 90 : 0) << n;
    EXPECT_EQ(getGlobalAdminPWDPolicyLocal().pwdMinLength, rc == 0 ? 20 : 12) << n;
    ASSERT_EQ(set_admin_password_policy(strict), 0);
  }
}

TEST_F(OutOfMemory, PasswordMethodBeforeStaysInForce) {
  test::MessageRecorder messages;
  test::ConfigurationFile hashed(
      "dn: CN=CONFIGURATION\nobjectClass: top\ncn: Configuration\n"
      "orv-slapdPwEncryption: SSHA512\n\n"
      "dn: CN=ADMINGROUP,CN=CONFIGURATION\nobjectClass: top\ncn: AdminGroup\n"
      "orv-slapdPwEncryptionAllowed: SSHA512\norv-slapdPwEncryptionAllowed: AES256\n");
  test::ConfigurationFile sealed("dn: CN=CONFIGURATION\nobjectClass: top\ncn: Configuration\n");
  for (long n = 1, hit = 1; hit != 0; ++n) {
    ASSERT_LT(n, 10000);
    ASSERT_EQ(load_password_methods(sealed.session()), 0);
    AllocationFault fault(n);
    const int rc = load_password_methods(hashed.session());
    fault.disarm();
    hit = fault.hit() ? 1 : 0;
    ASSERT_EQ(rc, hit != 0 && rc != 0 ? 90 : 0) << n;
    EXPECT_EQ(password_method_in_force(),
              rc == 0 ? password_method::ssha512 : password_method::aes256)
        << n;
  }
  ASSERT_EQ(load_password_methods(sealed.session()), 0);
}

TEST_F(OutOfMemory, PasswordMethodIsNotStaged) {
  for (long n = 1, hit = 1; hit != 0; ++n) {
    ASSERT_LT(n, 1000);
    AllocationFault fault(n);
    char* text = nullptr;
    const int rc = stage_password_method(password_method::ssha512, &text);
    fault.disarm();
    hit = fault.hit() ? 1 : 0;
    EXPECT_EQ(text, nullptr);
    ASSERT_EQ(rc, hit != 0 && rc != 0 ? 90 : 0) << n;
  }
  char* text = nullptr;
  AllocationFault fault(1);
  EXPECT_EQ(stage_password_method(16, &text), 53);
  fault.disarm();
  EXPECT_TRUE(fault.hit());
  EXPECT_EQ(text, nullptr);
}

TEST_F(OutOfMemory, SealedPasswordIsNotOpened) {
  const test::TemporaryDirectory directory;
  std::string why;
  cfg::KeyPtr key;
  ASSERT_EQ(cfg::create_key_stash(directory.file("key").c_str(), why), 0);
  ASSERT_EQ(cfg::load_key_stash(directory.file("key").c_str(), key, why), 0);
  std::string sealed;
  const std::string secret = "a secret too long to be kept inside a string object";
  ASSERT_EQ(cfg::seal_secret(*key, {"orv-slapdAdminPW", "CN=CONFIGURATION"}, secret, sealed), 0);
  for (long n = 1, hit = 1; hit != 0; ++n) {
    ASSERT_LT(n, 1000);
    char* clear = nullptr;
    AllocationFault fault(n);
    const int rc = unformat_password(sealed.c_str(), &clear, key.get(), 0);
    fault.disarm();
    hit = fault.hit() ? 1 : 0;
    ASSERT_EQ(rc, clear == nullptr ? -1 : 1) << n;
    if (clear != nullptr) {
      EXPECT_EQ(clear, secret);
    } else {
      EXPECT_NE(hit, 0);
    }
    std::free(clear);
  }
}

constexpr const char* kIdentities =
    "dn: CN=CONFIGURATION\nobjectClass: top\ncn: Configuration\norv-slapdAdminDN: cn=root\n"
    "orv-slapdAdminPW: a password too long to be kept inside a string object\n\n"
    "dn: CN=MASTER SERVER,CN=CONFIGURATION\nobjectClass: orv-slapdReplication\n"
    "cn: Master Server\norv-slapdMasterDN: cn=master\n\n"
    "dn: cn=s,CN=CONFIGURATION\nobjectClass: orv-slapdSupplier\ncn: s\n"
    "orv-slapdMasterDN: cn=sup\norv-slapdMasterSuffix: o=a\n";

TEST_F(OutOfMemory, AdministratorsBeforeStayAsTheyWere) {
  test::ConfigurationFile nobody("dn: CN=CONFIGURATION\nobjectClass: top\ncn: Configuration\n");
  test::ConfigurationFile file(kIdentities);
  // An algorithm whose first look-up fails for want of memory is never found again.
  ASSERT_EQ(load_administrators(file.session()), 0);
  for (long n = 1, hit = 1; hit != 0; ++n) {
    ASSERT_LT(n, 10000);
    ASSERT_EQ(load_administrators(nobody.session()), 0);
    AllocationFault fault(n);
    const int rc = load_administrators(file.session());
    fault.disarm();
    hit = fault.hit() ? 1 : 0;
    ASSERT_EQ(rc, hit != 0 && rc != 0 ? 90 : 0) << n;
    const bool there = rc == 0;
    EXPECT_EQ(findAdminPWDPAttrib("cn=root") != nullptr, there) << n;
    EXPECT_EQ(checkMasterSrvDn(nullptr, "CN=MASTER") != 0, there) << n;
    EXPECT_EQ(checkMasterSrvDn("O=A", "CN=SUP") != 0, there) << n;
  }
  ASSERT_EQ(load_administrators(nobody.session()), 0);
}

TEST_F(OutOfMemory, NobodyIsASupplierNorBinds) {
  test::ConfigurationFile nobody("dn: CN=CONFIGURATION\nobjectClass: top\ncn: Configuration\n");
  test::ConfigurationFile file(kIdentities);
  ASSERT_EQ(load_administrators(file.session()), 0);
  const char* const who = "CN=MASTER";
  const char* const where = "cn = a suffix too long to be kept inside a string object, o = b";
  fail_each_allocation([&] { return checkMasterSrvDn(nullptr, "cn = master") != 0; });
  fail_each_allocation([&] { return findAdminPWDPAttrib("cn = root") != nullptr; });
  fail_each_allocation([&] { return settle_administrator_bind("cn = root", true, {}); });
  for (long n = 1; n < 100; ++n) {
    AllocationFault fault(n);
    EXPECT_EQ(checkMasterSrvDn(where, who), 0);
  }
  ASSERT_EQ(load_administrators(nobody.session()), 0);
}

TEST_F(OutOfMemory, BackendIsNotRegisteredByHalves) {
  static constexpr const char* kSuffixes[] = {"CN=LOCALHOST", nullptr};
  static Backend backend;
  backend.suffixes = kSuffixes;
  const PluginFunction function = [](Backend*, int, char**) { return 0; };
  PluginFunction* list = nullptr;
  int rc = 0;
  fail_each_allocation(
      [&] {
        rc = register_backend(&backend);
        return rc == 0;
      },
      [&] {
        EXPECT_EQ(rc, 90);
        EXPECT_EQ(select_backend_opt("CN=LOCALHOST"), nullptr);
      });
  fail_each_allocation(
      [&] {
        rc = register_plugin_function(&backend, -159, function);
        return rc == 0;
      },
      [&] {
        EXPECT_EQ(rc, 90);
        EXPECT_EQ(getAllPluginFuncs(&backend, -159, &list), 80);
      });
  fail_each_allocation([&] { return select_backend_opt("cn = localhost") == &backend; });
  unregister_backend(&backend);
}

TEST_F(OutOfMemory, UrlIsNotParsed) {
  LDAPURLDesc* url = nullptr;
  fail_each_allocation(
      [&] {
        const bool parsed = ldap_url_parse("ldaps://host:636/o=x?cn?sub?(cn=*)", &url) == 0;
        EXPECT_EQ(parsed, url != nullptr);
        return parsed;
      },
      [&] { EXPECT_EQ(url, nullptr); });
  ldap_free_urldesc(url);
}

TEST_F(OutOfMemory, ParameterBlockIsNull) {
  PblockPtr block;
  fail_each_allocation([&] {
    block.reset(slapi_pblock_new());
    return block != nullptr;
  });
}

TEST_F(OutOfMemory, ReplaceDnLeavesTheTextToItsOwner) {
  constexpr char kText[] = "cn = Caf\xC3\xA9 with a long name, ou=x+cn=y, cn=configuration";
  char* dn = strdup(kText);
  char* before = dn;
  int rc = 0;
  fail_each_allocation(
      [&] {
        rc = replace_DN(&dn, 1);
        return rc == 0;
      },
      [&] {
        EXPECT_EQ(rc, 90);
        ASSERT_EQ(dn, before);
        ASSERT_STREQ(dn, kText);
      },
      [&] {
        EXPECT_STREQ(dn, "CN=CAF\xC3\x89 WITH A LONG NAME,CN=Y+OU=X,CN=CONFIGURATION");
        std::free(dn);
        dn = before = strdup(kText);
      });
  std::free(dn);
}

TEST_F(OutOfMemory, LightFormIsNull) {
  EscapedDn dn;
  fail_each_allocation([&] {
    dn.reset(dn_normalize_light_esc("cn=a name that is too long for a short string"));
    return dn != nullptr;
  });
  EXPECT_EQ(dn->error, 0);
}

// Null would say that the entry needs no parent.
TEST_F(OutOfMemory, ParentIsNoDn) {
  for (int i = 0; i < 3; ++i) {
    const MallocText warm(dn_parent_norm(nullptr, "CN=A,CN=B"));
    EXPECT_STREQ(warm.get(), "CN=B");
    AllocationFault fault(1);
    const MallocText text(dn_parent_norm(nullptr, "CN=A,CN=B"));
    fault.disarm();
    EXPECT_TRUE(fault.hit());
    EXPECT_STREQ(text.get(), "=");
    EXPECT_NE(slapi_dn_compare_v3(text.get(), text.get()), 0) << "is a DN";
  }
}

TEST_F(OutOfMemory, NoParentIsStillNull) {
  AllocationFault fault(1);
  EXPECT_EQ(dn_parent_norm(nullptr, "CN=A"), nullptr);
}

TEST_F(OutOfMemory, CopyIsNull) {
  MallocText text;
  fail_each_allocation([&] {
    text.reset(slapi_ch_strdup("text"));
    return text != nullptr;
  });
}

TEST_F(OutOfMemory, FormattedTextIsNull) {
  fail_each_allocation([&] {
    char unset = 'x';
    char* made = &unset;
    const int length = kel_asprintf(&made, "%s", "text");
    const bool succeeded = length == 4 && made != nullptr && std::strcmp(made, "text") == 0;
    EXPECT_EQ(length == -1, made == nullptr);
    std::free(made);
    return succeeded;
  });
}

TEST_F(OutOfMemory, ReallocKeepsTheBlock) {
  const MallocText block(slapi_ch_strdup("text"));
  AllocationFault fault(1);
  void* const grown = safe_realloc(block.get(), 100);
  fault.disarm();
  EXPECT_EQ(grown, nullptr);
  EXPECT_STREQ(block.get(), "text");
}

TEST_F(OutOfMemory, CompareSaysDifferent) {
  fail_each_allocation([&] {
    return slapi_dn_compare_v3("cn=some entry with a long name",
                               "CN=some entry with a long name") == 0;
  });
}

TEST_F(OutOfMemory, InsertedControlLeavesTheListAsItWas) {
  LDAPControl first{};
  LDAPControl second{};
  LDAPControl** list = nullptr;
  fail_each_allocation([&] { return ldap_insert_control(&first, &list) == 0; },
                       [&] { EXPECT_EQ(list, nullptr); });
  fail_each_allocation([&] { return ldap_insert_control(&second, &list) == 0; },
                       [&] {
                         EXPECT_EQ(list[0], &first);
                         EXPECT_EQ(list[1], nullptr);
                       });
  std::free(list);
}

TEST_F(OutOfMemory, RegisteredControlIsNotHalfRegistered) {
  const std::string oid = "1.2.3.4.5.6.7.8.9.10.11.12.13.14.15.16";
  slapi_supported_controls();
  fail_each_allocation([&] { return slapi_register_supported_control(oid.c_str(), -1) == 0; },
                       [&] { EXPECT_EQ(slapi_supported_controls().size(), 0U); });
  EXPECT_EQ(slapi_supported_controls(), std::vector<std::string>{oid});
}

class OutOfMemoryConverter : public testing::TestWithParam<const char*> {};

TEST_P(OutOfMemoryConverter, GivesNullAndLengthZero) {
  set_local_code_page(GetParam());
  ASSERT_EQ(initIconvHandle(), 0);
  using Converter = int (*)(const char*, char**, std::size_t*);
  for (const Converter converter : {xlate_localcp_to_utf8, xlate_utf8_to_localcp}) {
    char* result = nullptr;
    std::size_t length = 0;
    // A thread's descriptors are kept: they are made before the counting begins.
    ASSERT_EQ(converter("warm", &result, &length), 0);
    std::free(result);
    int rc = 0;
    fail_each_allocation(
        [&] {
          rc = converter("a text", &result, &length);
          return rc == 0;
        },
        [&] {
          EXPECT_EQ(rc, 90);
          EXPECT_EQ(result, nullptr);
          EXPECT_EQ(length, 0U);
        },
        [&] {
          EXPECT_STREQ(result, "a text");
          std::free(result);
        });
  }
}

TEST_P(OutOfMemoryConverter, SurvivesInAThreadThatHasNoDescriptorsYet) {
  set_local_code_page(GetParam());
  ASSERT_EQ(initIconvHandle(), 0);
  for (long n = 1, hit = 1; hit != 0; ++n) {
    ASSERT_LT(n, 1000);
    int rc = -1;
    std::string text;
    std::thread([&] {
      char* result = nullptr;
      std::size_t length = 0;
      AllocationFault fault(n);
      rc = xlate_localcp_to_utf8("a text", &result, &length);
      fault.disarm();
      hit = fault.hit() ? 1 : 0;
      text = result == nullptr ? "" : result;
      std::free(result);
    }).join();
    EXPECT_EQ(rc, text == "a text" ? 0 : 90) << n;
    if (hit == 0) {
      EXPECT_EQ(rc, 0);
    }
  }
}

INSTANTIATE_TEST_SUITE_P(CodePages, OutOfMemoryConverter,
                         testing::Values("UTF-8", "ISO-8859-1", "EUC-JP"));

TEST(OutOfMemorySetUp, OfTheConverterSaysSoOrSucceeds) {
  set_local_code_page("EUC-JP");
  ASSERT_EQ(initIconvHandle(), 0);
  for (long n = 1, hit = 1; hit != 0; ++n) {
    ASSERT_LT(n, 1000);
    AllocationFault fault(n);
    const int rc = initIconvHandle();
    fault.disarm();
    hit = fault.hit() ? 1 : 0;
    if (rc != 0) {
      EXPECT_EQ(fault.balance(), 0) << n;
    }
    EXPECT_STREQ(local_code_page(), "EUC-JP");
    if (hit == 0) {
      EXPECT_EQ(rc, 0);
    }
  }
}

TEST(OutOfMemorySchema, IsRefusedWithoutAnException) {
  std::string error;
  for (long n = 1; n < 200; ++n) {
    error = std::string();
    AllocationFault fault(n);
    // Refused before libldap's parser, which loses a text when it meets a lack of memory.
    const bool parsed =
        Schema::parse("# a comment\n\na line of another kind: x\n", error) != nullptr;
    fault.disarm();
    EXPECT_FALSE(parsed);
    EXPECT_TRUE(error == "no memory" || error == "line 3: neither attributeTypes nor objectClasses")
        << error;
    if (!fault.hit()) return;
  }
  FAIL() << "every call met a failure";
}

TEST(NoAllocation, IsMadeByATrace) {
  current_schema();
  const test::TemporaryDirectory directory;
  ASSERT_EQ(set_trace_file(directory.file("trace").c_str()), 0);
  trcEvents = 0xFFFFFFFF;
  AllocationFault fault(1);
  {
    const ldtr_function_local trace(0x01010100, "pb=0x%d", 1);
    trace.debug(trace::detail, "%s: %s\n", "orv-slapdAdminPW", "x");
    trace.debug(trace::detail, " Attribute %s: has value %s \n", "cn", "x");
    trace.debug(trace::error, "%d %p %i\n", 1, static_cast<const void*>(&trace), 2);
    PrintDebug(0xC8010000, "%d failed to trylock1 %s, waiting 0.1s\n", 5, "m");
  }
  fault.disarm();
  trcEvents = 0;
  EXPECT_EQ(fault.allocations(), 0);
  EXPECT_EQ(set_trace_file(nullptr), 0);
}

TEST(NoAllocation, IsMadeByAMessage) {
  set_message_sink([](int, int, int, const char*) noexcept {});
  AllocationFault fault(1);
  PrintMessage(0, 8, 167, "O=A", "O=B");
  fault.disarm();
  EXPECT_EQ(fault.allocations(), 0);
}

TEST(NoAllocation, IsMadeByAMapping) {
  current_schema();
  AllocationFault fault(1);
  EXPECT_EQ(verifyAttributeMapping("uid = mail, cn = 2.5.4.3", nullptr, nullptr), 0);
  fault.disarm();
  EXPECT_EQ(fault.allocations(), 0);
}

TEST(NoAllocation, IsMadeByThePolicy) {
  AllocationFault fault(1);
  EXPECT_TRUE(pwdIsAdminPolicyOn());
  EXPECT_EQ(validate_new_settings(getGlobalAdminPWDPolicyLocal(), true), 0);
  fault.disarm();
  EXPECT_EQ(fault.allocations(), 0);
}

TEST(NoAllocation, IsMadeByAMethodName) {
  int method = password_method::none_converted;
  AllocationFault fault(1);
  EXPECT_EQ(convertPWEncryptionMethod("ssha512", &method), 0);
  fault.disarm();
  EXPECT_EQ(method, password_method::ssha512);
  EXPECT_EQ(fault.allocations(), 0);
}

TEST(NoAllocation, IsMadeByAReferral) {
  const EntryPtr e = entry_with("objectClass", {"top", "referral"});
  current_schema();
  AllocationFault fault(1);
  EXPECT_EQ(checkReferral(e.get()), 53);
  fault.disarm();
  EXPECT_EQ(fault.allocations(), 0);
}

TEST(NoAllocation, IsMadeByLookups) {
  const Schema& schema = current_schema();
  const EntryPtr e = entry_with("objectClass", {"top"});
  AllocationFault fault(1);
  EXPECT_NE(schema.attribute("ORV-SLAPDADMINPW"), nullptr);
  EXPECT_NE(attr_find(e.get(), "OBJECTCLASS", 0, 0), nullptr);
  EXPECT_EQ(value_find_short_list(e->object_class_list, "TOP", 3), 0);
  EXPECT_EQ(are_nested_dn("CN=A,CN=B", "CN=B"), 1);
  fault.disarm();
  EXPECT_EQ(fault.allocations(), 0);
}

}  // namespace
}  // namespace orv
