// Every allocation on the way of a request fails once: what was asked is refused with 90, or the
// connection ends; nobody waits for an answer that never comes, nothing leaks, and the gate is open
// again. A program of its own, because it replaces the allocation functions of the process.
#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <new>
#include <string>
#include <vector>

#include "../slapi/failing_allocation.h"
#include "../temporary_directory.h"
#include "auth/identities.h"
#include "auth/sasl_external.h"
#include "core_bare_session.h"
#include "net/limits.h"
#include "ops/canonical.h"
#include "ops/paged_results.h"
#include "protocol/control_values.h"
#include "protocol/decoder.h"
#include "protocol/encoder.h"
#include "publish/match.h"
#include "server_entries.h"

namespace orv::server {
namespace {

using orv::test::AllocationFault;
using test::tlv;

class WithSchema : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    ASSERT_EQ(cfg::register_attribute_types(builtin_schema().attribute_table()), 0);
  }
  const Schema& schema = builtin_schema();
};

// Calls `once` with its first allocation failing, then its second, until none is left to fail, and
// `check` after each, with whether one failed. Nothing of what `once` made may stay.
void fail_each(const std::function<void(bool hit)>& check, const std::function<void()>& once) {
  constexpr long kMost = 100000;
  once();  // what is made at the first use only
  for (long n = 1; n < kMost; ++n) {
    SCOPED_TRACE("allocation " + std::to_string(n));
    AllocationFault fault(n);
    once();
    fault.disarm();
    EXPECT_EQ(fault.balance(), 0);
    check(fault.hit());
    if (!fault.hit()) return;
    if (testing::Test::HasFailure()) return;
  }
  FAIL() << "it never succeeds";
}

TEST(MemoryOfAConnection, ThatIsNotAdmittedIsNotCounted) {
  ConnectionCounter counter;
  const std::string address = "2001:db8:1234:5678::/64";
  fail_each([&](bool) { EXPECT_EQ(counter.count(), 0); },
            [&] {
              try {
                EXPECT_TRUE(counter.admit(address, 1, 1));
              } catch (const std::bad_alloc&) {
              }
            });
}

std::vector<std::string> requests() {
  const std::string dn = tlv(0x04, "cn=a name that is not short,cn=configuration");
  const std::string filter = tlv(
      0xA0, tlv(0xA3, tlv(0x04, "description") + tlv(0x04, "a value that is longer than others")) +
                tlv(0xA2, tlv(0x87, "objectClass")));
  const std::string search =
      tlv(0x63, dn + tlv(0x0A, "\x02") + tlv(0x0A, std::string(1, '\0')) + test::integer(0) +
                    test::integer(0) + tlv(0x01, std::string(1, '\0')) + filter +
                    tlv(0x30, tlv(0x04, "a requested attribute name")));
  return {
      test::bind(1, "cn=a name that is not short", "a password that is not short"),
      test::sasl_bind(2, "A-MECHANISM-THAT-IS-NOT-SHORT"),
      test::message(3, search, test::control("2.16.840.1.113730.3.4.2", true)),
      test::add_entry(4, "cn=a name that is not short,cn=configuration", "description", "value"),
      test::delete_entry(5, "cn=a name that is not short,cn=configuration"),
      test::modify(6, "cn=a name that is not short,cn=configuration", "description", "value"),
      test::compare(7, "cn=a name that is not short,cn=configuration"),
      test::message(8, tlv(0x6C, dn + dn + tlv(0x01, "\xFF"))),
      test::extended(9, "1.3.6.1.4.1.1466.20037.1.2.3.4.5")};
}

class MemoryOfAMessage : public WithSchema, public testing::WithParamInterface<std::string> {};

TEST_P(MemoryOfAMessage, ThatCannotBeDecodedIsRefusedWith90) {
  DecodeState state = DecodeState::fatal;
  int code = 0;
  fail_each(
      [&](bool hit) {
        EXPECT_EQ(state == DecodeState::decoded, !hit);
        EXPECT_EQ(code, hit ? 90 : 0);
      },
      [&] {
        Message message;
        const Decoded decoded = decode(GetParam(), {}, message);
        state = decoded.state;
        code = decoded.code;
      });
}

INSTANTIATE_TEST_SUITE_P(EachRequest, MemoryOfAMessage, testing::ValuesIn(requests()));

using MemoryOfAnAnswer = WithSchema;

TEST_F(MemoryOfAnAnswer, EntryThatCannotBeEncodedLeavesWhatIsThereAsItWas) {
  const EntryPtr e = make_entry("cn=configuration");
  add_values(e, "description", {std::string(400, 'x'), "y"});
  AttributeSelection all;
  ASSERT_TRUE(all.assign(nullptr));
  bool encoded = false;
  bool kept = false;
  fail_each([&](bool hit) { EXPECT_TRUE(hit ? !encoded && kept : encoded); },
            [&] {
              std::string out = "before";
              encoded = encode_entry(out, 1, *e, all, false, nullptr);
              kept = out == "before";
            });
}

TEST_F(MemoryOfAnAnswer, SelectionThatCannotBeMadeSaysSo) {
  Names names{"description", "a requested attribute that is not known", "*"};
  bool assigned = false;
  fail_each([&](bool hit) { EXPECT_EQ(assigned, !hit); },
            [&] {
              AttributeSelection selection;
              assigned = selection.assign(names.get());
            });
}

// ---- what handlers are given

class MemoryOfARequest : public WithSchema {
 protected:
  // `make` tells whether it made what it was to make. It throws std::bad_alloc when an allocation
  // failed that it cannot do without.
  static void expect_throws(const std::function<bool()>& make) {
    bool threw = false;
    bool made = false;
    fail_each(
        [&](bool hit) {
          EXPECT_TRUE(made || threw);
          EXPECT_TRUE(hit || !threw);
        },
        [&] {
          threw = false;
          made = false;
          try {
            made = make();
          } catch (const std::bad_alloc&) {
            threw = true;
          }
        });
  }
};

TEST_F(MemoryOfARequest, EntryIsMadeOrMemoryIsSaidToBeShort) {
  const AddRequest request{"cn=a name that is not short,cn=configuration",
                           {{"cn", {"another value"}}, {"objectClass", {"2.5.6.0", "container"}}}};
  expect_throws([&] {
    EntryPtr made;
    return make_entry(schema, request, made).code == 0;
  });
}

TEST_F(MemoryOfARequest, ModificationsAreMadeOrMemoryIsSaidToBeShort) {
  const ModifyRequest request{"cn=configuration",
                              {{0, {"description", {"one", "two"}}},
                               {1, {"description", {"a third one"}}},
                               {1, {"orv-slapdPort", {}}}}};
  expect_throws([&] {
    ldapmod* first = nullptr;
    const bool good = make_modifications(schema, request, ListForm::folded, first).code == 0;
    free_modifications(first);
    return good;
  });
}

TEST_F(MemoryOfARequest, FilterAndNamesAreMadeOrMemoryIsSaidToBeShort) {
  expect_throws([&] {
    rewrite_filter(schema, "(&(objectClass=2.5.6.0)(cn=a value that is not short at all))",
                   FilterUse::evaluate_for_administrators);
    return canonical_names(schema, {"cn", "a requested attribute that is not known"}) != nullptr;
  });
}

TEST_F(MemoryOfARequest, FilterOnAnEntryOfTheServersOwnIsDecidedOrMemoryIsSaidToBeShort) {
  const EntryPtr e = make_entry("cn=subschema");
  add_values(e, "cn", {"subschema that is not short"});
  expect_throws([&] { return entry_matches(*e, "(&(cn=*)(cn=subschema that is not short))"); });
}

// ---- who binds

class MemoryOfABind : public MemoryOfARequest {
 protected:
  void SetUp() override {
    std::ofstream(config()) << "dn: cn=configuration\nobjectClass: orv-slapdTop\n"
                               "cn: configuration\norv-slapdAdminDN: cn=a name that is not short\n"
                               "orv-slapdAdminPW: a password that is not short\n";
  }
  std::string config() const { return folder_.file("config.ldif"); }

  const orv::test::TemporaryDirectory folder_;
  std::string error_;
  std::vector<std::string> warnings_;
};

TEST_F(MemoryOfABind, WantOfItIsNoWrongPassword) {
  const auto identities = Identities::read(config().c_str(), "", error_, warnings_);
  ASSERT_TRUE(identities) << error_;
  const Identities::Verify compare = [](const cfg::Key*, cfg::SecretPlace, std::string_view stored,
                                        std::string_view clear) noexcept {
    return stored == clear;
  };
  expect_throws([&] {
    return identities->authenticate("CN = A name that is not short", "a password that is not short",
                                    compare) != nullptr;
  });
}

TEST_F(MemoryOfABind, WantOfItIsNoCertificateOfNobody) {
  std::ofstream(config(), std::ios::app)
      << "\ndn: cn=admingroup,cn=configuration\nobjectClass: orv-slapdAdminGroupSettings\n"
         "cn: admingroup\norv-slapdCertificateMap: cn=a subject that is not short => "
         "cn=a name that is not short\n";
  const auto identities = Identities::read(config().c_str(), "", error_, warnings_);
  ASSERT_TRUE(identities) << error_;
  expect_throws(
      [&] { return identities->of_certificate("CN=A SUBJECT THAT IS NOT SHORT") != nullptr; });
}

// The file is good, so nothing about it will change when there is memory again.
TEST_F(MemoryOfABind, WantOfItWhileTheFileIsReadIsMadeGoodAfterAPauseAndToldOnce) {
  int told = 0;
  IdentityStore store(config(), "", [&](const std::string&, const auto&) { ++told; });
  ASSERT_TRUE(store.reload(error_, warnings_)) << error_;
  const auto generation = store.generation();
  std::filesystem::last_write_time(config(), std::filesystem::file_time_type::clock::now());
  const auto now = IdentityStore::Clock::now();
  {
    const AllocationFault fault(1);
    store.current(now);
  }
  store.current(now);
  EXPECT_EQ(store.generation(), generation);
  EXPECT_EQ(told, 1);
  store.current(now + IdentityStore::kFirstPause);
  EXPECT_GT(store.generation(), generation);
  EXPECT_EQ(told, 1);
}

// ---- searches in pages

using MemoryOfPages = WithSchema;

TEST_F(MemoryOfPages, SearchThatCannotBeKeptIsNotCounted) {
  Answer answer(1, tag::search_done, {});
  const EntryPtr e = make_entry("cn=configuration");
  for (int i = 0; i < 3; ++i) answer.entry(*e, nullptr, false, nullptr);
  answer.result(0, "", "");
  const std::string messages = answer.bytes();
  KeptMeter meter;
  bool kept = false;
  fail_each([&](bool hit) { EXPECT_EQ(kept, !hit); },
            [&] {
              PagedSearches searches(meter);
              kept = false;
              try {
                std::string copy = messages;
                std::string cookie;
                kept = searches.keep(std::string(200, 'k'), FoundEntries(copy, 3, 0), {4, 1 << 20},
                                     cookie) == PagedSearches::Kept::yes;
              } catch (const std::bad_alloc&) {
                EXPECT_EQ(searches.size(), 0U);
                EXPECT_EQ(meter.bytes(), 0U);
              }
            });
  EXPECT_EQ(meter.bytes(), 0U);
}

// ---- the session

class MemoryOfASession : public test::BareSessionTest,
                         public ExternalIdentities,
                         public testing::WithParamInterface<std::string> {
 protected:
  MemoryOfASession() {
    mechanisms_.push_back(make_external(*this));
    services.mechanisms = &mechanisms_;
    services.supported_controls = {"2.16.840.1.113730.3.4.2", kPagedResultsOid, kAssertionOid,
                                   kPreReadOid, kPostReadOid};
  }
  std::shared_ptr<const Identity> primary_administrator() override {
    return std::make_shared<Identity>(Identity{"CN=ROOT", 0x0C, 0, ""});
  }
  std::shared_ptr<const Identity> of_certificate(std::string_view) override { return nullptr; }
  std::shared_ptr<test::BareSession> fresh_session(bool bound) {
    session = std::make_shared<test::BareSession>(services, lane, settings);
    TransportFacts facts;
    facts.local = true;
    facts.peer_uid = 0;
    session->set_transport(facts);
    if (bound) bind_as_root();
    return session;
  }
  SaslMechanisms mechanisms_;
};

// A client is answered or its connection ends; its socket's side ends it when `handle` throws.
TEST_P(MemoryOfASession, AnswersOrEnds) {
  const EntryPtr found = test::make_test_entry("CN=CONFIGURATION", 400);
  backend.on_search = [&](pblock* parameters) {
    int code = 0;
    for (int i = 0; i < 3 && code == 0; ++i) code = test::send_test_entry(parameters, *found);
    return test::finish_search(parameters, code, 3);
  };
  backend.on_change = [](pblock* parameters) { return test::finish_change(parameters, 0); };
  for (const bool bound : {false, true}) {
    for (long n = 1;; ++n) {
      SCOPED_TRACE("allocation " + std::to_string(n) + (bound ? ", bound" : ", anonymous"));
      const auto tried = fresh_session(bound);
      bool threw = false;
      AllocationFault fault(n);
      try {
        tried->handle(GetParam());
      } catch (const std::bad_alloc&) {
        threw = true;
      }
      fault.disarm();
      const bool hit = fault.hit();
      const auto heard = [&] { return threw || tried->ended || !tried->sent.empty(); };
      EXPECT_TRUE(tried->run_until(heard));
      EXPECT_TRUE(hit || !threw);
      tried->client_left();
      EXPECT_TRUE(tried->run_until([&] { return tried->idle(); }));
      EXPECT_TRUE(test::is_open(host.gate()));
      if (!hit || HasFailure()) break;
    }
  }
}

std::string with_controls(const std::string& request, const std::string& controls) {
  return test::message(2, operation_in(request), controls);
}

std::string control(const char* oid, const std::string& value) {
  return tlv(0x30, tlv(0x04, oid) + tlv(0x01, "\xFF") + tlv(0x04, value));
}

std::vector<std::string> messages() {
  const std::string asserted = control(
      kAssertionOid, tlv(0xA3, tlv(0x04, "cn") + tlv(0x04, "a value that is longer than others")));
  const std::string names = tlv(0x30, tlv(0x04, "a requested attribute name") + tlv(0x04, "*"));
  const std::string page = control(kPagedResultsOid, tlv(0x30, test::integer(1) + tlv(0x04, "")));
  const std::string next =
      control(kPagedResultsOid, tlv(0x30, test::integer(1) + tlv(0x04, "a cookie of nobody's")));
  return {test::extended(2, kWhoAmIOid),
          test::message(
              2, tlv(0x77, tlv(0x80, kCancelOid) + tlv(0x81, tlv(0x30, test::integer(1234567))))),
          with_controls(test::search(2, test::kTop, 2), page + asserted),
          with_controls(test::search(2, test::kTop, 2), next),
          with_controls(test::delete_entry(2, test::kTop), asserted + control(kPreReadOid, names)),
          with_controls(test::modify(2, test::kTop, "description", "a value that is not short"),
                        asserted + control(kPreReadOid, names) + control(kPostReadOid, names)),
          with_controls(test::add_entry(2, "cn=x,cn=configuration", "cn", "x"),
                        asserted + control(kPostReadOid, names)),
          test::bind(2, test::kRoot, test::kSecret),
          test::bind(2, "cn=somebody,cn=configuration", "a password that is not short"),
          test::sasl_bind(2, "EXTERNAL", "dn:cn=root"),
          test::sasl_bind(2, "EXTERNAL"),
          test::sasl_bind(2, "A-MECHANISM-THAT-IS-NOT-SHORT", "credentials that are not short"),
          test::search(2, test::kTop, 2),
          test::search(2, "cn=a name that is not short,cn=configuration"),
          test::add_entry(2, "cn=x,cn=configuration", "cn", "x"),
          test::modify(2, test::kTop, "description", "a value that is not short at all"),
          test::delete_entry(2, "cn=a name that is not short,cn=configuration"),
          test::compare(2, "cn=a name that is not short,cn=configuration"),
          test::extended(2, "1.3.6.1.4.1.1466.20037"),
          test::message(2, tlv(0x42, "wrong"))};
}

INSTANTIATE_TEST_SUITE_P(EachRequest, MemoryOfASession, testing::ValuesIn(messages()));

}  // namespace
}  // namespace orv::server
