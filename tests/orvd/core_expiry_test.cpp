// Reminders of what ends at a date, by a clock that the tests set.
#include <gtest/gtest.h>

#include <atomic>
#include <fstream>

#include "../temporary_directory.h"
#include "core_server_fixture.h"
#include "core_tls_client.h"
#include "net/expiry.h"

namespace orv::server {
namespace {

using namespace std::chrono_literals;
using Due = ExpiryReminder::Due;

constexpr std::time_t kDay = ExpiryReminder::kDay;
constexpr std::time_t kEnd = 1000 * kDay;

TEST(ExpiryReminder, IsSilentUntilTheTimeBeforeTheEnd) {
  ExpiryReminder reminder(30 * kDay);
  EXPECT_EQ(reminder.due("a", kEnd, 0), Due::nothing);
  EXPECT_EQ(reminder.due("a", kEnd, kEnd - 30 * kDay - 1), Due::nothing);
  EXPECT_EQ(reminder.due("a", kEnd, kEnd - 30 * kDay), Due::ends_soon);
}

TEST(ExpiryReminder, RemindsOnceADay) {
  ExpiryReminder reminder(30 * kDay);
  const std::time_t begin = kEnd - 20 * kDay;
  int told = 0;
  for (std::time_t hour = 0; hour < 72; ++hour)
    told += reminder.due("a", kEnd, begin + hour * 3600) == Due::ends_soon ? 1 : 0;
  EXPECT_EQ(told, 3);
}

TEST(ExpiryReminder, TellsOfTheEndWhenItComesAndThenOnceADay) {
  ExpiryReminder reminder(30 * kDay);
  EXPECT_EQ(reminder.due("a", kEnd, kEnd), Due::ends_soon);
  EXPECT_EQ(reminder.due("a", kEnd, kEnd + 1), Due::has_ended);
  EXPECT_EQ(reminder.due("a", kEnd, kEnd + kDay), Due::nothing);
  EXPECT_EQ(reminder.due("a", kEnd, kEnd + kDay + 1), Due::has_ended);
}

TEST(ExpiryReminder, TellsOfAnotherThingAtOnceAndIsSilentAboutAGoodOne) {
  ExpiryReminder reminder(30 * kDay);
  EXPECT_EQ(reminder.due("a", kEnd, kEnd + 1), Due::has_ended);
  EXPECT_EQ(reminder.due("b", kEnd, kEnd + 2), Due::has_ended);
  EXPECT_EQ(reminder.due("c", 2 * kEnd, kEnd + 3), Due::nothing);
  EXPECT_EQ(reminder.due("b", kEnd, kEnd + 4), Due::has_ended);
}

TEST(ExpiryReminder, GoesOnWhenTheClockIsSetBack) {
  ExpiryReminder reminder(30 * kDay);
  EXPECT_EQ(reminder.due("a", kEnd, kEnd - 1), Due::ends_soon);
  EXPECT_EQ(reminder.due("a", kEnd, kEnd - 10 * kDay), Due::ends_soon);
  EXPECT_EQ(reminder.due("a", kEnd, kEnd - 10 * kDay + 1), Due::nothing);
}

// ---- the server

class ExpiringServer : public test::LoopbackServer {
 protected:
  ExpiringServer() {
    settings.error_log = certificates.path("error.log");
    settings.error_log_level = "info";
    more.secure_port = 0;
    wall_time = [this] { return std::time(nullptr) + later.load(); };
  }
  ~ExpiringServer() override { stop(); }

  // The server has a certificate that is good for so many days.
  void certify(std::time_t days) {
    test::Wording wording;
    wording.subject = {{"CN", V_ASN1_UTF8STRING, "localhost"}};
    wording.ends = days * kDay;
    const test::Pair own = certificates.self_signed(wording);
    settings.tls.certificate_file = own.certificate;
    settings.tls.key_file = own.key;
  }
  int lines(const std::string& part) const {
    const std::string text = orv::test::content_of(settings.error_log);
    int found = 0;
    for (auto at = text.find(part); at != std::string::npos; at = text.find(part, at + 1)) ++found;
    return found;
  }
  bool wait_for_lines(const std::string& part, int count) const {
    const auto end = Clock::now() + 10s;
    while (lines(part) < count && Clock::now() < end) std::this_thread::yield();
    return lines(part) == count;
  }

  static constexpr const char* kSoon =
      "the certificate for TLS expires within 30 days: cn=localhost";
  static constexpr const char* kOver = "the certificate for TLS has expired: cn=localhost";
  std::atomic<std::time_t> later{0};
  test::Certificates certificates;
};

TEST_F(ExpiringServer, RemindsOfItsCertificateEveryDayFromThirtyDaysBeforeTheEndOn) {
  certify(40);
  start();
  later = 11 * kDay;
  EXPECT_TRUE(wait_for_lines(kSoon, 1));
  later = 12 * kDay;
  EXPECT_TRUE(wait_for_lines(kSoon, 2));
  later = 41 * kDay;
  EXPECT_TRUE(wait_for_lines(kOver, 1));
  later = 42 * kDay;
  EXPECT_TRUE(wait_for_lines(kOver, 2));
  stop();
  EXPECT_EQ(lines(kSoon), 2);
  EXPECT_EQ(lines(kOver), 2);
}

TEST_F(ExpiringServer, IsSilentAboutAGoodCertificateAndOneThatTookItsPlace) {
  certify(20);
  reload = [this](Settings& wanted) {
    wanted = settings;
    return true;
  };
  start();
  EXPECT_TRUE(wait_for_lines(kSoon, 1));
  certify(100);
  server->reload();
  later = 2 * kDay;
  // Behind another line that the same clock brings.
  later = 71 * kDay;
  EXPECT_TRUE(wait_for_lines(kSoon, 2));
  stop();
  EXPECT_EQ(lines(kSoon), 2);
}

TEST_F(ExpiringServer, RemindsOfListsOfRevokedCertificatesThatAreTooOld) {
  certify(1000);
  const test::Pair authority = certificates.self_signed([] {
    test::Wording wording;
    wording.subject = {{"CN", V_ASN1_UTF8STRING, "Authority"}};
    wording.constraint = "critical,CA:TRUE";
    return wording;
  }());
  settings.tls.ca_file = authority.certificate;
  settings.tls.crl_file = certificates.path("crl");
  settings.tls.client_certificates = ClientCertificates::optional;
  std::ofstream(settings.tls.crl_file) << certificates.revoked_by(authority, {}, 3600);
  start();
  later = 3700;
  EXPECT_TRUE(wait_for_lines("a list in orv-slapdTlsCrlFile is too old", 1));
}

}  // namespace
}  // namespace orv::server
