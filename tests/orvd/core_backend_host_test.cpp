// The backend in the server's hands: the way back to rest, and handlers that throw.
#include "ops/backend_host.h"

#include <gtest/gtest.h>

#include <stdexcept>
#include <thread>

#include "cfg/session.h"
#include "core_fake_backend.h"
#include "ops/answer.h"

namespace orv::server {
namespace {

using namespace std::chrono_literals;
using test::FakeBackend;

struct Caller {
  explicit Caller(BackendHost& host)
      : host(host), parameters(make_parameters(host.backend(), connection, operation)) {
    install_senders(connection);
    operation.server = &answer;
  }
  int call(int handler, bool leaves_slot) {
    EXPECT_EQ(test::enter_at_once(host.gate()), Gate::Entry::inside);
    return host.call_inside_gate(handler, parameters.get(), connection, leaves_slot);
  }
  bool gate_is_open() { return test::is_open(host.gate()); }

  BackendHost& host;
  Connection connection;
  Operation operation;
  Answer answer{1, 0x65, {}};
  PblockPtr parameters;
};

TEST(BackendHost, SlotLeftFilledIsEmptiedByARefusedSearchOnAConnectionOfTheServersOwn) {
  FakeBackend backend;
  BackendHost host(backend.record(), [](std::string_view) {});
  Caller caller(host);
  _CFG handle;
  std::thread::id change_thread;
  backend.on_change = [&](pblock* parameters) {
    test::connection_of(parameters)->config_session = &handle;
    change_thread = std::this_thread::get_id();
    return 1;
  };
  int rests = 0;
  backend.on_search = [&](pblock* parameters) {
    ++rests;
    Connection* const internal = test::connection_of(parameters);
    EXPECT_NE(internal, &caller.connection);
    EXPECT_EQ(internal->config_session, &handle);
    EXPECT_EQ(internal->state.load(), 1);
    EXPECT_EQ(test::operation_of(parameters)->authority, 0x24U);
    EXPECT_EQ(std::this_thread::get_id(), change_thread);
    send_ldap_result(internal, test::operation_of(parameters), 50, nullptr, "");
    internal->config_session = nullptr;
    return 50;
  };
  EXPECT_EQ(caller.call(parameter::delete_function, true), 1);
  EXPECT_EQ(rests, 1);
  EXPECT_EQ(caller.connection.config_session, nullptr);
  EXPECT_TRUE(caller.answer.bytes().empty());  // the refusal of the rest reaches nobody
  EXPECT_TRUE(caller.gate_is_open());
}

TEST(BackendHost, RestIsNotCalledWhenTheSlotIsEmpty) {
  FakeBackend backend;
  BackendHost host(backend.record(), [](std::string_view) {});
  Caller caller(host);
  EXPECT_EQ(caller.call(parameter::add_function, true), 53);
  EXPECT_EQ(backend.calls(parameter::search_function), 0);
  EXPECT_TRUE(caller.gate_is_open());
}

TEST(BackendHost, AfterAHandlerThatThrewNothingIsAdmitted) {
  FakeBackend backend;
  std::string why;
  BackendHost host(backend.record(), [&](std::string_view reason) { why = reason; });
  Caller caller(host);
  backend.on_search = [](pblock*) -> int { throw std::runtime_error("lost"); };
  EXPECT_EQ(caller.call(parameter::search_function, false), 52);
  EXPECT_EQ(why, "lost");
  EXPECT_TRUE(host.failed());
  EXPECT_EQ(test::enter_at_once(host.gate()), Gate::Entry::closed);
  EXPECT_FALSE(host.close(1ms));
  EXPECT_EQ(backend.closed(), 0);
}

TEST(BackendHost, TextThrownAsAPointerIsReported) {
  FakeBackend backend;
  std::string why;
  BackendHost host(backend.record(), [&](std::string_view reason) { why = reason; });
  Caller caller(host);
  backend.on_search = [](pblock*) -> int { throw "gave up"; };
  caller.call(parameter::search_function, false);
  EXPECT_EQ(why, "gave up");
}

TEST(BackendHost, CloseRunsTheCloseHandlerOnceTheGateIsEmpty) {
  FakeBackend backend;
  BackendHost host(backend.record(), [](std::string_view) {});
  test::enter_at_once(host.gate());
  EXPECT_FALSE(host.close(1ms));
  EXPECT_EQ(backend.closed(), 0);
  host.gate().leave();
  EXPECT_TRUE(host.close(1s));
  EXPECT_EQ(backend.closed(), 1);
}

}  // namespace
}  // namespace orv::server
