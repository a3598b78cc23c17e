// Every allocation on the way of a change fails once: the attempt is in the audit log nevertheless,
// or it is said that it is not.
#include <gtest/gtest.h>

#include <cstdlib>
#include <memory>
#include <string>
#include <thread>
#include <utility>

#include "../slapi/failing_allocation.h"
#include "../temporary_directory.h"
#include "audit/log.h"
#include "core_bare_session.h"

namespace orv::server {
namespace {

using orv::test::AllocationFault;

class MemoryOfAnAttempt : public test::BareSessionTest,
                          public testing::WithParamInterface<std::string> {
 protected:
  MemoryOfAnAttempt() {
    settings.error_log = folder.file("error.log");
    settings.error_log_level = "error";
    EXPECT_TRUE(logs.open(settings).empty());
    backend.on_change = [](pblock*) { return 32; };
  }
  static bool fails_to_decode(long allocation) {
    Message message;
    AllocationFault fault(allocation);
    const Decoded decoded = decode(GetParam(), {}, message);
    fault.disarm();
    return decoded.state != DecodeState::decoded;
  }
  // Since it was asked last.
  bool a_record_is_said_to_be_missing() {
    while (logs.queued_bytes() > 0) std::this_thread::yield();
    logs.error("end of attempt");
    std::string text;
    do text = folder.read("error.log");
    while (count(text, "end of attempt") == ends_);
    ++ends_;
    const int said = count(text, "no memory for a record of the audit log");
    return std::exchange(said_, said) != said;
  }
  static int count(const std::string& text, const std::string& part) {
    int found = 0;
    for (std::size_t at = 0; (at = text.find(part, at)) != std::string::npos; ++at) ++found;
    return found;
  }

  const orv::test::TemporaryDirectory folder;
  int ends_ = 0;
  int said_ = 0;
};

// What cannot be decoded may be no change at all.
TEST_P(MemoryOfAnAttempt, IsRecordedOnceOrSaidToBeMissing) {
  for (const bool bound : {false, true})
    for (long n = 1;; ++n) {
      SCOPED_TRACE("allocation " + std::to_string(n) + (bound ? ", bound" : ", anonymous"));
      int complaints = 0;
      AuditLog log([&complaints](std::string_view) { ++complaints; });
      const std::string file = "audit." + std::to_string(n) + (bound ? "b" : "a");
      ASSERT_EQ(log.open(folder.file(file), {}), "");
      services.audit = &log;
      session = std::make_shared<test::BareSession>(services, lane, settings);
      if (bound) bind_as_root();
      bool threw = false;
      AllocationFault fault(n);
      try {
        session->handle(GetParam());
      } catch (const std::bad_alloc&) {
        threw = true;
      }
      fault.disarm();
      const bool hit = fault.hit();
      EXPECT_TRUE(
          session->run_until([&] { return threw || session->ended || !session->sent.empty(); }));
      session->client_left();
      EXPECT_TRUE(session->run_until([this] { return session->idle(); }));
      ASSERT_TRUE(log.finish());
      services.audit = nullptr;
      const int records = count(folder.read(file), "# message-id: 2\n");
      const bool said = complaints > 0 || a_record_is_said_to_be_missing();
      EXPECT_LE(records + (said ? 1 : 0), 1) << folder.read(file);
      EXPECT_TRUE(records == 1 || said || fails_to_decode(n));
      EXPECT_TRUE(hit || records == 1);
      if (!hit || HasFailure()) break;
    }
}

INSTANTIATE_TEST_SUITE_P(
    EachChange, MemoryOfAnAttempt,
    testing::Values(test::add_entry(2, "cn=a name that is not short,cn=configuration", "cn", "x"),
                    test::delete_entry(2, "cn=a name that is not short,cn=configuration"),
                    test::modify(2, test::kTop, "description", "a value that is not short at all"),
                    test::message(2, test::tlv(0x6C, test::tlv(0x04, "cn=a,cn=configuration") +
                                                         test::tlv(0x04, "cn=another name for it") +
                                                         test::tlv(0x01, "\xFF")))));

}  // namespace
}  // namespace orv::server
