// What each function does when the n-th allocation fails, for every n; and which allocate nothing.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <string>
#include <thread>

#include "configuration_file.h"
#include "failing_allocation.h"
#include "slapi/codepage.h"
#include "slapi/control.h"
#include "slapi/log.h"
#include "slapi/owners.h"
#include "slapi/schema.h"
#include "slapi/strings.h"
#include "slapi/trace.h"
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

class OutOfMemory : public testing::Test {
 protected:
  // What is made once in a process is made before the counting begins.
  static void SetUpTestSuite() {
    current_schema();
    char* dn = strdup("cn=\xC3\xA9");
    ASSERT_EQ(replace_DN(&dn, 1), 0);
    std::free(dn);
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

TEST_F(OutOfMemory, ParentIsNull) {
  MallocText text;
  fail_each_allocation([&] {
    text.reset(dn_parent_norm(nullptr, "CN=A,CN=B"));
    return text != nullptr;
  });
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
