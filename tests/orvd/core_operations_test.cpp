// Extended operations and controls: what each accepts and refuses, what reaches the backend and in
// which order, and what becomes of operations that are canceled.
#include <gtest/gtest.h>

#include <atomic>
#include <functional>
#include <mutex>
#include <optional>
#include <ostream>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "core_searched_file.h"
#include "core_server_fixture.h"
#include "ops/controls.h"
#include "protocol/control_values.h"
#include "protocol/encoder.h"

namespace orv::server {
namespace {

using namespace std::chrono_literals;
using test::BlockedServer;
using test::Event;
using test::kSecret;
using test::kTop;
using test::LoopbackServer;
using test::Reply;
using test::tlv;
using test::WireClient;

constexpr const char* kUnknownOid = "1.2.3.4";
constexpr const char* kRoot = test::kRoot;

// ---- messages

std::string ldap_control(std::string_view oid, bool critical,
                         const std::optional<std::string>& value) {
  std::string content = tlv(0x04, oid);
  if (critical) content += tlv(0x01, "\xFF");
  if (value) content += tlv(0x04, *value);
  return tlv(0x30, content);
}

// The request with other controls.
std::string with(int id, const std::string& request, const std::string& controls) {
  return test::message(id, operation_in(request), controls);
}

std::string equality(std::string_view type, std::string_view value) {
  return tlv(0xA3, tlv(0x04, type) + tlv(0x04, value));
}

std::string assertion(std::string_view type, std::string_view value, bool critical = true) {
  return ldap_control(kAssertionOid, critical, equality(type, value));
}

std::string names(std::initializer_list<const char*> list) {
  std::string content;
  for (const char* name : list) content += tlv(0x04, name);
  return tlv(0x30, content);
}

std::string page(int size, std::string_view cookie = "", bool critical = true) {
  return ldap_control(kPagedResultsOid, critical,
                      tlv(0x30, test::integer(size) + tlv(0x04, cookie)));
}

std::string extended(int id, std::string_view oid, const std::optional<std::string>& value = {}) {
  return test::message(id, tlv(0x77, tlv(0x80, oid) + (value ? tlv(0x81, *value) : "")));
}

std::string cancel(int id, int target) {
  return extended(id, kCancelOid, tlv(0x30, test::integer(target)));
}

// ---- a server with all controls

std::vector<std::string> all_controls() {
  return {kManageDsaItOid, kPersistentSearchOid, kEntryChangeOid, kPagedResultsOid,
          kAssertionOid,   kPreReadOid,          kPostReadOid};
}

class OperationsTest : public LoopbackServer {
 protected:
  OperationsTest() {
    controls = all_controls();
    backend.on_change = [this](pblock* parameters) {
      note("change ");
      return finish_change(parameters, change_code);
    };
    backend.on_search = [this](pblock* parameters) {
      note("search ");
      std::function<void(pblock*)> before;
      {
        const std::lock_guard lock(mutex_);
        before = before_search_;
      }
      if (before) before(parameters);
      return find(parameters);
    };
  }
  ~OperationsTest() override {
    go_on.happen();
    stop();
  }
  static int finish_change(pblock* parameters, int code) {
    send_ldap_result(test::connection_of(parameters), test::operation_of(parameters), code, nullptr,
                     "");
    return code;
  }
  void note(std::string_view what) {
    const std::lock_guard lock(mutex_);
    order_ += what;
  }
  // What the backend was asked for since this was called last.
  std::string order() {
    const std::lock_guard lock(mutex_);
    return std::exchange(order_, "");
  }
  void before_search(std::function<void(pblock*)> what) {
    const std::lock_guard lock(mutex_);
    before_search_ = std::move(what);
  }
  // The client's search 2 stays inside the backend until `go_on`; later ones do not.
  void park_search() {
    before_search([this](pblock*) {
      entered.happen();
      go_on.wait();
    });
    client().send(test::search(2, kTop, 2));
    ASSERT_TRUE(entered.wait());
    before_search(nullptr);
  }
  void searches_last_until_given_up() {
    before_search([this](pblock* parameters) {
      entered.happen();
      const auto* const answer = static_cast<Answer*>(test::operation_of(parameters)->server);
      const auto end = Clock::now() + 10s;
      while (!answer->is_given_up() && Clock::now() < end) std::this_thread::yield();
    });
  }
  // As many entries as there are; with a filter for a name, none of another.
  int find(pblock* parameters) {
    const char* filter = nullptr;
    slapi_pblock_get(parameters, parameter::search_filter_text, &filter);
    const bool matches = std::string_view(filter).find("nobody") == std::string_view::npos;
    int code = search_code;
    for (int i = 0; matches && i < entries && code == 0; ++i) {
      const EntryPtr entry = test::make_test_entry("CN=" + std::to_string(i) + ",CN=CONFIGURATION");
      code = test::send_test_entry(parameters, *entry);
    }
    return test::finish_search(parameters, code, entries);
  }
  WireClient& client() {
    if (!client_) {
      start();
      bind_as_root(client_.emplace(port()));
    }
    return *client_;
  }
  std::optional<Reply> ask(std::string_view request) {
    client().send(request);
    const std::vector<Reply> replies = client().receive_result();
    if (replies.empty()) return std::nullopt;
    found = static_cast<int>(replies.size()) - 1;
    return replies.back();
  }
  int code(std::string_view request) {
    const std::optional<Reply> reply = ask(request);
    return reply ? reply->code : -1;
  }

  std::atomic<int> entries{1};
  std::atomic<int> search_code{0};
  std::atomic<int> change_code{0};
  Event entered;
  Event go_on;
  int found = 0;
  std::optional<WireClient> client_;

 private:
  std::mutex mutex_;
  std::string order_;  // guarded, like the next
  std::function<void(pblock*)> before_search_;
};

// ---- each control, well formed and not

struct ControlCase {
  const char* name;
  const char* oid;
  std::optional<std::string> good;
  int response_tag;  // an operation that it is for
  int other_tag;     // and one that it is not for; 0: there is none
};

void PrintTo(const ControlCase& tested, std::ostream* out) {
  *out << tested.name;
}

std::string request_of(int tag, int id) {
  if (tag == tag::search_done) return test::search(id, kTop);
  if (tag == tag::delete_response) return test::delete_entry(id, kTop);
  return test::modify(id, kTop, "description", "x");
}

class EachControl : public OperationsTest, public testing::WithParamInterface<ControlCase> {
 protected:
  int code_with(const std::string& list) {
    const int id = ++id_;
    return code(with(id, request_of(GetParam().response_tag, id), list));
  }
  void expect_refused_with(int expected, const std::optional<std::string>& value) {
    for (const bool critical : {false, true})
      EXPECT_EQ(code_with(ldap_control(GetParam().oid, critical, value)), expected)
          << GetParam().name << (critical ? ", critical" : "");
    EXPECT_EQ(order(), "");
  }
  int id_ = 1;
};

TEST_P(EachControl, IsUsedWhenItIsWellFormed) {
  if (std::string_view(GetParam().oid) == kPersistentSearchOid) return;  // it has no result
  for (const bool critical : {false, true})
    EXPECT_EQ(code_with(ldap_control(GetParam().oid, critical, GetParam().good)), 0);
}

TEST_P(EachControl, IsRefusedWithoutAValueOrWithOneTooMany) {
  expect_refused_with(2, GetParam().good ? std::nullopt : std::optional<std::string>("x"));
}

TEST_P(EachControl, IsRefusedWithAnEmptyValue) {
  expect_refused_with(2, "");
}

TEST_P(EachControl, IsRefusedWithAValueThatIsCutShort) {
  const std::string whole = GetParam().good.value_or("x");
  for (std::size_t length = 0; length < whole.size(); ++length)
    expect_refused_with(2, whole.substr(0, length));
}

TEST_P(EachControl, IsRefusedWithSomethingBehindItsValue) {
  expect_refused_with(2, GetParam().good.value_or("") + std::string(1, '\0'));
  expect_refused_with(2, GetParam().good.value_or("") + tlv(0x04, "x"));
}

TEST_P(EachControl, IsRefusedWithAValueOfAnotherType) {
  expect_refused_with(2, test::integer(5));
  expect_refused_with(2, tlv(0x31, tlv(0x02, "\1")));
  expect_refused_with(2, tlv(0x30, tlv(0x30, "")));
}

TEST_P(EachControl, IsRefusedWhenItIsGivenTwice) {
  for (const bool critical : {false, true}) {
    const std::string one = ldap_control(GetParam().oid, critical, GetParam().good);
    EXPECT_EQ(code_with(one + one), 2);
  }
  EXPECT_EQ(order(), "");
}

TEST_P(EachControl, IsRefusedForAnotherOperationOnlyWhenItIsCritical) {
  if (GetParam().other_tag == 0) return;
  for (const std::optional<std::string>& value : {GetParam().good, {"no value of it"}}) {
    const std::string request = request_of(GetParam().other_tag, 2);
    EXPECT_EQ(code(with(2, request, ldap_control(GetParam().oid, true, value))), 12);
    EXPECT_EQ(order(), "");
    EXPECT_EQ(code(with(2, request, ldap_control(GetParam().oid, false, value))), 0);
    order();
  }
}

TEST_P(EachControl, IsRefusedWhereItIsNotOfferedOnlyWhenItIsCritical) {
  controls.clear();
  for (const std::optional<std::string>& value : {GetParam().good, {"no value of it"}}) {
    EXPECT_EQ(code_with(ldap_control(GetParam().oid, true, value)), 12);
    EXPECT_EQ(code_with(ldap_control(GetParam().oid, false, value)), 0);
  }
}

INSTANTIATE_TEST_SUITE_P(
    All, EachControl,
    testing::Values(
        ControlCase{"ManageDsaIt", kManageDsaItOid, std::nullopt, tag::search_done, 0},
        ControlCase{"PersistentSearch", kPersistentSearchOid,
                    tlv(0x30, test::integer(1) + tlv(0x01, "\xFF") + tlv(0x01, "\xFF")),
                    tag::search_done, tag::modify_response},
        ControlCase{"PagedResults", kPagedResultsOid, tlv(0x30, test::integer(5) + tlv(0x04, "")),
                    tag::search_done, tag::modify_response},
        ControlCase{"AssertionOfASearch", kAssertionOid, equality("cn", "x"), tag::search_done, 0},
        ControlCase{"AssertionOfAChange", kAssertionOid, equality("cn", "x"), tag::delete_response,
                    0},
        ControlCase{"PreRead", kPreReadOid, names({"cn", "*"}), tag::delete_response,
                    tag::search_done},
        ControlCase{"PostRead", kPostReadOid, names({"cn", "*"}), tag::modify_response,
                    tag::delete_response}),
    [](const auto& info) { return std::string(info.param.name); });

TEST_F(OperationsTest, ManageDsaItIsTakenEverywhere) {
  const std::string manage = ldap_control(kManageDsaItOid, true, std::nullopt);
  EXPECT_EQ(code(with(2, test::bind(2, kRoot, kSecret), manage)), 0);
  EXPECT_EQ(code(with(3, test::search(3, ""), manage)), 0);
  EXPECT_EQ(code(with(4, test::add_entry(4, "cn=x,cn=configuration", "cn", "x"), manage)), 0);
  EXPECT_EQ(code(with(5, test::compare(5, kTop), manage)), 53);
  EXPECT_EQ(code(with(6, extended(6, kWhoAmIOid), manage)), 0);
}

TEST_F(OperationsTest, OtherControlsAreNotForBindsNorForExtendedOperations) {
  for (const char* oid : {kAssertionOid, kPreReadOid, kPostReadOid, kPagedResultsOid}) {
    EXPECT_EQ(code(with(2, extended(2, kWhoAmIOid), ldap_control(oid, true, "x"))), 12);
    EXPECT_EQ(code(with(3, extended(3, kWhoAmIOid), ldap_control(oid, false, "x"))), 0);
    EXPECT_EQ(code(with(4, test::bind(4, kRoot, kSecret), ldap_control(oid, false, "x"))), 0);
    EXPECT_EQ(code(with(5, test::bind(5, kRoot, kSecret), ldap_control(oid, true, "x"))), 12);
    EXPECT_EQ(code(test::search(6, kTop)), 50);  // a bind that is refused leaves nobody bound
  }
}

TEST_F(OperationsTest, NotificationOfChangesIsNoControlOfRequests) {
  EXPECT_EQ(code(with(2, test::search(2, kTop), ldap_control(kEntryChangeOid, true, {}))), 12);
  EXPECT_EQ(code(with(3, test::search(3, kTop), ldap_control(kEntryChangeOid, false, {}))), 0);
}

TEST_F(OperationsTest, CombinationsWithoutAMeaningAreRefused) {
  const std::string persistent =
      ldap_control(kPersistentSearchOid, false,
                   tlv(0x30, test::integer(1) + tlv(0x01, "\xFF") + tlv(0x01, "\xFF")));
  EXPECT_EQ(code(with(2, test::search(2, kTop), persistent + page(5))), 2);
  EXPECT_EQ(code(with(3, test::search(3, kTop), page(5, "x") + assertion("cn", "x"))), 2);
}

TEST_F(OperationsTest, AbandonWithAnUnknownCriticalControlIsNotPerformed) {
  park_search();
  client().send(with(3, test::abandon(3, 2), ldap_control(kUnknownOid, true, {})));
  client().send(test::search(4, ""));
  EXPECT_EQ(client().receive_result().back().id, 4);
  go_on.happen();
  EXPECT_EQ(client().receive_result().back().id, 2);
}

TEST_F(OperationsTest, ValuesBeyondTheLimitsOfMessagesAreRefused) {
  settings.max_attributes = 2;
  settings.max_filter_depth = 2;
  const std::string deep = tlv(0xA2, tlv(0xA2, equality("cn", "x")));
  EXPECT_EQ(code(with(2, test::delete_entry(2, kTop),
                      ldap_control(kPreReadOid, false, names({"a", "b", "c"})))),
            11);
  EXPECT_EQ(code(with(3, test::delete_entry(3, kTop), ldap_control(kAssertionOid, false, deep))),
            11);
  EXPECT_EQ(order(), "");
}

// ---- extended operations

TEST_F(OperationsTest, WhoAmITellsWhoIsBound) {
  const auto who = [this] { return ask(extended(5, kWhoAmIOid))->body; };
  EXPECT_NE(who().find("dn:CN=ROOT"), std::string::npos);
  EXPECT_EQ(code(test::bind(6, "", "")), 0);
  EXPECT_EQ(who().substr(who().size() - 2), std::string("\x8B\0", 2));
}

TEST_F(OperationsTest, RequestsOfExtendedOperationsAreRefusedWhenMalformed) {
  EXPECT_EQ(code(extended(2, kWhoAmIOid, "")), 2);
  EXPECT_EQ(code(extended(2, kWhoAmIOid, "x")), 2);
  EXPECT_EQ(code(extended(2, kCancelOid)), 2);
  const std::string good = tlv(0x30, test::integer(77));
  for (std::size_t length = 0; length < good.size(); ++length)
    EXPECT_EQ(code(extended(2, kCancelOid, good.substr(0, length))), 2);
  EXPECT_EQ(code(extended(2, kCancelOid, good + "x")), 2);
  EXPECT_EQ(code(extended(2, kCancelOid, tlv(0x30, tlv(0x04, "\2")))), 2);
  EXPECT_EQ(code(extended(2, kCancelOid, tlv(0x30, tlv(0x02, "")))), 2);
  EXPECT_EQ(code(extended(2, kCancelOid, tlv(0x30, tlv(0x02, "\xFF")))), 2);
  EXPECT_EQ(code(extended(2, kCancelOid, tlv(0x30, tlv(0x02, "\1\1\1\1\1")))), 2);
  EXPECT_EQ(code(extended(2, kCancelOid, tlv(0x30, test::integer(1) + test::integer(2)))), 2);
  EXPECT_EQ(code(extended(2, kCancelOid, good)), 119);
  EXPECT_EQ(code(with(2, extended(2, kWhoAmIOid), ldap_control(kUnknownOid, true, {}))), 12);
}

// ---- Cancel

using CancelTest = OperationsTest;

TEST_F(CancelTest, DoesNotCancelItself) {
  EXPECT_EQ(code(cancel(2, 2)), 121);
}

TEST_F(CancelTest, OfWhatHasEndedFindsNothing) {
  EXPECT_EQ(code(test::search(2, kTop)), 0);
  EXPECT_EQ(code(cancel(3, 2)), 119);
  EXPECT_EQ(code(cancel(4, 1)), 119);
}

TEST_F(CancelTest, OfNoMessageFindsNothing) {
  park_search();
  EXPECT_EQ(code(cancel(3, 0)), 119);
  go_on.happen();
}

TEST_F(CancelTest, EndsASearchThatRunsElsewhere) {
  searches_last_until_given_up();
  client().send(test::search(2, kTop, 2));
  ASSERT_TRUE(entered.wait());
  client().send(cancel(3, 2));
  const std::vector<Reply> replies = client().receive_result();
  ASSERT_EQ(replies.size(), 1U);  // none of its entries
  EXPECT_EQ(replies[0].id, 2);
  EXPECT_EQ(replies[0].code, 118);
  const std::optional<Reply> answer = client().receive();
  ASSERT_TRUE(answer);
  EXPECT_EQ(answer->id, 3);
  EXPECT_EQ(answer->code, 0);
  before_search(nullptr);
  EXPECT_EQ(code(test::search(2, kTop)), 0);
  EXPECT_EQ(code(test::search(3, kTop)), 0);
}

TEST_F(CancelTest, ThatIsOutstandingCanNeitherBeCanceledNorHaveItsIdUsedAgain) {
  park_search();
  client().send(cancel(3, 2) + cancel(4, 3) + cancel(5, 2));
  std::optional<Reply> reply = client().receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->id, 4);
  EXPECT_EQ(reply->code, 121);
  reply = client().receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->id, 5);
  EXPECT_EQ(reply->code, 120);
  client().send(test::search(3, ""));
  EXPECT_EQ(client().receive()->tag, test::kNotice);
  go_on.happen();
}

TEST_F(CancelTest, OfASearchThatIsThenAbandonedComesTooLate) {
  park_search();
  client().send(cancel(3, 2) + test::abandon(4, 2));
  client().send(test::search(5, ""));
  EXPECT_EQ(client().receive_result().back().id, 5);
  go_on.happen();
  const std::optional<Reply> reply = client().receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->id, 3);
  EXPECT_EQ(reply->code, 120);
}

TEST_F(CancelTest, MayMeetTheEndOfTheConnectionAtAnyTime) {
  backend.on_unbind = [this](pblock*) {
    unbound.happen();
    return 0;
  };
  park_search();
  client().send(cancel(3, 2) + test::unbind(4));
  EXPECT_TRUE(client().closed());
  go_on.happen();
  EXPECT_TRUE(unbound.wait());
}

// Whoever comes first: both are answered once, and the answers agree.
TEST_F(CancelTest, RacingTheEndOfItsOperationIsAnsweredByWhatBecameOfIt) {
  loops = 2;
  entries = 20;
  for (int i = 0; i < 300; ++i) {
    const int scope = i % 3;
    const bool change = i % 5 == 4;
    client().send(change ? test::delete_entry(2, kTop) : test::search(2, kTop, scope));
    if (i % 2 == 0) std::this_thread::yield();
    client().send(cancel(3, 2));
    int target = -1;
    int canceled = -1;
    while (target < 0 || canceled < 0) {
      const std::optional<Reply> reply = client().receive();
      ASSERT_TRUE(reply);
      if (reply->code < 0) continue;
      int& code = reply->id == 2 ? target : canceled;
      ASSERT_EQ(code, -1);
      code = reply->code;
    }
    if (target == 118)
      EXPECT_EQ(canceled, 0);
    else
      EXPECT_TRUE(target == 0 && (canceled == 119 || canceled == 120)) << target << canceled;
  }
}

class BlockedOperations : public BlockedServer {
 protected:
  BlockedOperations() { controls = all_controls(); }
};

// What takes long must not take the time of the connection's thread.
TEST_F(BlockedOperations, AssertionOnAnAddedEntryIsTestedInItsTurn) {
  block();
  WireClient client(port());
  bind_as_root(client);
  client.send(
      with(2, test::add_entry(2, "cn=x,cn=configuration", "cn", "x"), assertion("cn", "nobody")));
  EXPECT_TRUE(wait_for_waiters(1));
  go_on.happen();
  EXPECT_EQ(client.receive()->code, 122);
  EXPECT_EQ(backend.calls(parameter::add_function), 0);
}

TEST_F(BlockedOperations, OperationsThatWaitAreCanceledUnserved) {
  block();
  WireClient client(port());
  bind_as_root(client);
  for (const std::string& request : {test::search(2, kTop), test::delete_entry(2, kTop)}) {
    client.send(request);
    ASSERT_TRUE(wait_for_waiters(1));
    client.send(cancel(3, 2));
    std::optional<Reply> reply = client.receive();
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->id, 2);
    EXPECT_EQ(reply->code, 118);
    reply = client.receive();
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->id, 3);
    EXPECT_EQ(reply->code, 0);
    EXPECT_TRUE(wait_for_waiters(0));
  }
  go_on.happen();
  EXPECT_EQ(backend.calls(parameter::search_function), 0);
  EXPECT_EQ(backend.calls(parameter::delete_function), 1);
}

TEST_F(BlockedOperations, ChangeThatIsBeingMadeCannotBeCanceledAnyMore) {
  block();
  holder->send(cancel(3, 2));
  holder->send(test::search(4, ""));
  EXPECT_EQ(holder->receive_result().back().id, 4);  // so the other was handled
  go_on.happen();
  std::optional<Reply> reply = holder->receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->id, 2);
  EXPECT_EQ(reply->code, 53);
  reply = holder->receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->id, 3);
  EXPECT_EQ(reply->code, 120);
}

TEST_F(BlockedOperations, BindWaitsForWhatIsBeingCanceled) {
  block();
  holder->send(cancel(3, 2) + test::bind(4, kRoot, kSecret));
  go_on.happen();
  std::vector<int> ids;
  for (int i = 0; i < 3; ++i) {
    const std::optional<Reply> reply = holder->receive();
    ASSERT_TRUE(reply);
    ids.push_back(reply->id);
  }
  EXPECT_EQ(ids, (std::vector<int>{2, 3, 4}));
}

// A search in the library that goes on until it is interrupted.
class EndlessSearch : public OperationsTest {
 protected:
  EndlessSearch() {
    backend.on_search = [this](pblock* parameters) {
      entered.happen();
      const int code = file.search_until([this] { return free.load(); });
      return test::finish_search(parameters, code, 0);
    };
  }
  ~EndlessSearch() override { stop(); }
  std::vector<std::pair<int, int>> replies(int count) {
    std::vector<std::pair<int, int>> all;
    for (int i = 0; i < count; ++i)
      if (const std::optional<Reply> reply = client().receive())
        all.emplace_back(reply->id, reply->code);
    return all;
  }
  // Ends the search when it has looked at what its client sends, and more than once.
  void end_when_looked_at() {
    ASSERT_TRUE(entered.wait());
    const auto looked = Clock::now() + 100ms;
    while (Clock::now() < looked) std::this_thread::yield();
    free = true;
  }
  using Pairs = std::vector<std::pair<int, int>>;
  test::SearchedFile file;
  std::atomic<bool> free{false};
};

// On the connection's own thread.
using CancelAhead = EndlessSearch;

TEST_F(CancelAhead, ReachesASearchThoughItsThreadIsBusy) {
  client().send(test::search(2, kTop));
  ASSERT_TRUE(entered.wait());
  client().send(cancel(3, 2));
  EXPECT_EQ(replies(2), (Pairs{{2, 118}, {3, 0}}));
  client().send(cancel(3, 2));
  EXPECT_EQ(replies(1), (Pairs{{3, 119}}));
}

TEST_F(CancelAhead, IsSeenInThePacketOfItsSearch) {
  client().send(test::search(2, kTop) + test::search(4, "") + cancel(3, 2));
  EXPECT_EQ(replies(3), (Pairs{{2, 118}, {4, -1}, {4, 0}}));
  EXPECT_EQ(replies(1), (Pairs{{3, 0}}));
}

TEST_F(CancelAhead, ThatMustNotBePerformedIsNotPerformed) {
  client().send(test::search(2, kTop) + with(3, cancel(3, 2), ldap_control(kUnknownOid, true, {})));
  end_when_looked_at();
  EXPECT_EQ(replies(2), (Pairs{{2, 0}, {3, 12}}));
}

TEST_F(CancelAhead, ThatIsRefusedForAControlIsNotPerformed) {
  client().send(test::search(2, kTop) +
                with(3, cancel(3, 2), ldap_control(kManageDsaItOid, false, "x")));
  end_when_looked_at();
  EXPECT_EQ(replies(2), (Pairs{{2, 0}, {3, 2}}));
}

TEST_F(CancelAhead, IsNotSeenInsideAnotherMessage) {
  const std::string looks_like_one = cancel(3, 2);
  const std::string message = test::search(5, looks_like_one);
  const std::size_t half = message.find(looks_like_one);
  ASSERT_NE(half, std::string::npos);
  client().send(test::search(2, kTop) + message.substr(0, half));
  ASSERT_TRUE(entered.wait());
  client().send(message.substr(half));
  end_when_looked_at();
  EXPECT_EQ(replies(1), (Pairs{{2, 0}}));
  EXPECT_EQ(client().receive()->id, 5);
}

// The search is that of a control, on a worker.
using EndlessCondition = EndlessSearch;

TEST_F(EndlessCondition, OfAChangeCanBeCanceledWithTheChangeUnmade) {
  client().send(with(2, test::delete_entry(2, kTop), assertion("cn", "x")));
  ASSERT_TRUE(entered.wait());
  client().send(cancel(3, 2));
  EXPECT_EQ(replies(2), (Pairs{{2, 118}, {3, 0}}));
  EXPECT_EQ(backend.calls(parameter::delete_function), 0);
}

TEST_F(EndlessCondition, OfAChangeThatIsAbandonedEndsWithTheChangeUnmade) {
  client().send(with(2, test::delete_entry(2, kTop), assertion("cn", "x")));
  ASSERT_TRUE(entered.wait());
  client().send(test::abandon(3, 2) + test::delete_entry(4, kTop));
  EXPECT_EQ(replies(1), (Pairs{{4, 0}}));
  EXPECT_EQ(backend.calls(parameter::delete_function), 1);
}

TEST_F(EndlessCondition, OfAChangeHasTheTimeOfASearch) {
  settings.time_limit = 1;
  const auto begun = Clock::now();
  EXPECT_EQ(
      code(with(2, test::delete_entry(2, kTop), ldap_control(kPreReadOid, true, names({"*"})))), 3);
  EXPECT_LT(Clock::now() - begun, 8s);
  EXPECT_EQ(backend.calls(parameter::delete_function), 0);
}

TEST_F(EndlessCondition, OfAChangeDoesNotKeepTheServerFromStopping) {
  client().send(with(2, test::delete_entry(2, kTop), assertion("cn", "x")));
  ASSERT_TRUE(entered.wait());
  const auto begun = Clock::now();
  server->stop();
  EXPECT_EQ(replies(1), (Pairs{{2, 52}}));
  EXPECT_LT(Clock::now() - begun, 8s);
  EXPECT_EQ(backend.calls(parameter::delete_function), 0);
}

TEST_F(EndlessCondition, IsNoneForTheCopyAfterAChangeWhichStaysMade) {
  client().send(with(2, test::modify(2, kTop, "description", "x"),
                     ldap_control(kPostReadOid, true, names({"*"}))));
  ASSERT_TRUE(entered.wait());
  client().send(cancel(3, 2));
  const std::optional<Reply> made = client().receive();
  ASSERT_TRUE(made);
  EXPECT_EQ(made->id, 2);
  EXPECT_EQ(made->code, 0);
  EXPECT_EQ(made->controls, "");
  EXPECT_EQ(replies(1), (Pairs{{3, 120}}));
}

// ---- assertion

using AssertionTest = OperationsTest;

TEST_F(AssertionTest, IsTestedByASearchOfTheClientBeforeTheChangeAndInTheSameTurn) {
  before_search([](pblock* parameters) {
    const Operation* const operation = test::operation_of(parameters);
    EXPECT_EQ(operation->authority, authority::primary_administrator);
    EXPECT_STREQ(operation->bound_dn, "CN=ROOT");
    EXPECT_EQ(test::target_of(parameters), "CN=CONFIGURATION");
    int scope = -1;
    slapi_pblock_get(parameters, parameter::search_scope, &scope);
    EXPECT_EQ(scope, 0);
  });
  EXPECT_EQ(code(with(2, test::delete_entry(2, kTop), assertion("cn", "x"))), 0);
  EXPECT_EQ(order(), "search change ");
  EXPECT_EQ(backend.most_inside(), 1);
}

TEST_F(AssertionTest, ThatFailsLeavesTheChangeUnmade) {
  for (const bool critical : {false, true})
    EXPECT_EQ(code(with(2, test::delete_entry(2, kTop), assertion("cn", "nobody", critical))), 122);
  EXPECT_EQ(order(), "search search ");
  order();
  EXPECT_EQ(code(with(3, test::search(3, kTop, 2), assertion("cn", "nobody"))), 122);
  EXPECT_EQ(found, 0);
  EXPECT_EQ(order(), "search ");
}

TEST_F(AssertionTest, ThatCannotBeTestedFailsTheOperationWithItsReason) {
  for (const int reason : {1, 32, 50, 90}) {
    search_code = reason;
    entries = 0;
    EXPECT_EQ(code(with(2, test::delete_entry(2, kTop), assertion("cn", "x"))), reason);
  }
  EXPECT_EQ(order().find("change"), std::string::npos);
}

TEST_F(AssertionTest, OnAnAddedEntryIsAboutWhatIsAdded) {
  const std::string add = test::add_entry(2, "cn=x,cn=configuration", "cn", "x");
  EXPECT_EQ(code(with(2, add, assertion("cn", "y"))), 122);
  EXPECT_EQ(order(), "");
  EXPECT_EQ(code(with(2, add, assertion("cn", "X"))), 0);
  EXPECT_EQ(order(), "change ");
}

TEST_F(AssertionTest, OnAPublishedEntryIsAboutThatEntry) {
  EXPECT_EQ(code(with(2, test::search(2, ""), assertion("objectClass", "person"))), 122);
  EXPECT_EQ(found, 0);
  EXPECT_EQ(code(with(3, test::search(3, ""), assertion("objectClass", "TOP"))), 0);
  EXPECT_EQ(found, 1);
}

TEST_F(AssertionTest, OfWhomeverLostRightsMeanwhileIsNotTested) {
  client();
  authenticator.change(false);
  client_->send(with(2, test::delete_entry(2, kTop), assertion("cn", "x")));
  EXPECT_EQ(client_->receive()->tag, test::kNotice);
  EXPECT_EQ(order(), "");
}

// ---- pre-read and post-read

class ReadTest : public OperationsTest {
 protected:
  static std::string pre(bool critical = true) {
    return ldap_control(kPreReadOid, critical, names({"*"}));
  }
  static std::string post(bool critical = true) {
    return ldap_control(kPostReadOid, critical, names({"*"}));
  }
  std::string modify(const std::string& list) {
    return with(2, test::modify(2, kTop, "description", "x"), list);
  }
};

TEST_F(ReadTest, SurroundsTheChange) {
  const std::optional<Reply> reply = ask(modify(assertion("cn", "x") + pre() + post()));
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->code, 0);
  EXPECT_EQ(order(), "search search change search ");
  EXPECT_NE(reply->controls.find(kPreReadOid), std::string::npos);
  EXPECT_NE(reply->controls.find(kPostReadOid), std::string::npos);
  EXPECT_EQ(backend.most_inside(), 1);
}

TEST_F(ReadTest, IsLeftOutOfChangesThatFail) {
  change_code = 65;
  client().send(modify(pre() + post()));
  const std::optional<Reply> reply = client().receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->code, 65);
  EXPECT_EQ(reply->controls, "");
  EXPECT_EQ(order(), "search change ");
}

TEST_F(ReadTest, BeforeTheChangeThatFailsFailsTheChange) {
  search_code = 1;
  entries = 0;
  EXPECT_EQ(code(modify(pre(false))), 1);
  EXPECT_EQ(order(), "search ");
}

TEST_F(ReadTest, AfterTheChangeThatFailsLeavesTheChangeMade) {
  before_search([this](pblock*) { search_code = 1; });
  entries = 0;
  const std::optional<Reply> reply = ask(modify(post()));
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->code, 0);
  EXPECT_EQ(reply->controls, "");
  EXPECT_EQ(order(), "change search ");
}

TEST_F(ReadTest, AfterAChangeOfTheOwnIdentityShowsANameOnly) {
  backend.on_change = [this](pblock* parameters) {
    note("change ");
    authenticator.change(false);
    return finish_change(parameters, 0);
  };
  const std::optional<Reply> reply = ask(modify(post()));
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->code, 0);
  EXPECT_NE(reply->controls.find(kPostReadOid), std::string::npos);
  EXPECT_EQ(reply->controls.find("description"), std::string::npos);
  EXPECT_EQ(order(), "change ");  // nothing is searched for whoever is somebody else now
}

// ---- paged results

class PagesTest : public OperationsTest {
 protected:
  PagesTest() { entries = 10; }
  std::optional<Reply> next(int size, std::string_view cookie, int scope = 2, int size_limit = 0) {
    return ask(with(7, test::search(7, kTop, scope, size_limit), page(size, cookie)));
  }
  // The cookie in an answer: the end of the control's value.
  static std::string cookie_in(const Reply& reply) {
    constexpr std::size_t kBytes = 16;
    const std::size_t at = reply.controls.rfind(std::string("\x04\x10", 2));
    return at == std::string::npos ? "" : reply.controls.substr(at + 2, kBytes);
  }
};

TEST_F(PagesTest, AreOneSearchOfTheBackend) {
  std::string cookie;
  for (const int expected : {4, 4, 2}) {
    const std::optional<Reply> reply = next(4, cookie);
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->id, 7);
    EXPECT_EQ(reply->code, 0);
    EXPECT_EQ(found, expected);
    cookie = cookie_in(*reply);
    EXPECT_EQ(cookie.empty(), expected == 2);
  }
  EXPECT_EQ(order(), "search ");
}

TEST_F(PagesTest, EndWithTheSearchsOwnFailure) {
  backend.on_search = [](pblock* parameters) {
    const EntryPtr entry = test::make_test_entry("CN=CONFIGURATION");
    for (int i = 0; i < 3; ++i) test::send_test_entry(parameters, *entry);
    return test::finish_search(parameters, 3, 3);
  };
  const std::optional<Reply> first = next(2, "");
  ASSERT_TRUE(first);
  EXPECT_EQ(first->code, 0);
  const std::optional<Reply> second = next(2, cookie_in(*first));
  ASSERT_TRUE(second);
  EXPECT_EQ(second->code, 3);
  EXPECT_EQ(found, 1);
  EXPECT_EQ(next(2, cookie_in(*first))->code, 53);
}

TEST_F(PagesTest, CookiesAreForOneConnectionAndOneSearch) {
  const std::string cookie = cookie_in(*next(2, ""));
  WireClient other(port());
  bind_as_root(other);
  EXPECT_EQ(code_of(other, with(2, test::search(2, kTop, 2), page(2, cookie))), 53);
  EXPECT_EQ(next(2, cookie, 1)->code, 53);
  EXPECT_EQ(next(2, cookie)->code, 53);
  EXPECT_EQ(next(2, "x")->code, 53);
}

TEST_F(PagesTest, CookiesEndWithAnyBind) {
  const std::string cookie = cookie_in(*next(2, ""));
  EXPECT_EQ(code(test::bind(8, kRoot, "wrong")), 49);
  EXPECT_EQ(next(2, cookie)->code, 50);
  EXPECT_EQ(code(test::bind(9, kRoot, kSecret)), 0);
  EXPECT_EQ(next(2, cookie)->code, 53);
}

TEST_F(PagesTest, MeanNothingWhereOnePageHoldsAllThatMayBeFound) {
  for (const int size : {5, 6, 2147483647}) {
    const std::optional<Reply> reply = next(size, "", 2, 5);
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->code, 4);
    EXPECT_EQ(reply->controls, "");
    EXPECT_EQ(found, 5);
  }
}

TEST_F(PagesTest, SearchThatFindsNothingHasOnePageAndARefusedOneNone) {
  entries = 0;
  std::optional<Reply> reply = next(2, "");
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->code, 0);
  EXPECT_NE(reply->controls.find(kPagedResultsOid), std::string::npos);
  search_code = 32;
  reply = next(2, "");
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->code, 32);
  EXPECT_EQ(reply->controls, "");
}

TEST_F(PagesTest, AreNotKeptOfASearchThatIsCanceled) {
  searches_last_until_given_up();
  client().send(with(2, test::search(2, kTop, 2), page(2)));
  ASSERT_TRUE(entered.wait());
  client().send(cancel(3, 2));
  const std::optional<Reply> reply = client().receive();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->code, 118);
  EXPECT_EQ(reply->controls, "");
}

TEST_F(PagesTest, AreRefusedWhileAllConnectionsKeepTooMuch) {
  settings.max_paged_result_size = 1 << 30;
  backend.on_search = [](pblock* parameters) {
    const EntryPtr small = test::make_test_entry("CN=CONFIGURATION");
    const EntryPtr large = test::make_test_entry("CN=X,CN=CONFIGURATION", std::size_t{40} << 20);
    test::send_test_entry(parameters, *small);
    return test::finish_search(parameters, test::send_test_entry(parameters, *large), 2);
  };
  settings.max_result_size = 1 << 30;
  const std::optional<Reply> reply = next(1, "");
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->code, 0);
  EXPECT_EQ(found, 1);
  WireClient other(port());
  bind_as_root(other);
  EXPECT_EQ(code_of(other, with(2, test::search(2, kTop, 2), page(1))), 51);
}

}  // namespace
}  // namespace orv::server
