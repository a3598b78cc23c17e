#include "slapi/trace.h"
#include "../temporary_directory.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <map>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "cfg/attribute_table.h"
#include "slapi/schema.h"

namespace orv {
namespace {

using testing::HasSubstr;
using testing::MatchesRegex;
using testing::Not;

class Trace : public testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(cfg::register_attribute_types(current_schema().attribute_table()), 0);
    ASSERT_EQ(set_trace_file(directory_.file("trace").c_str()), 0);
  }
  void TearDown() override {
    trcEvents = 0;
    EXPECT_EQ(set_trace_file(nullptr), 0);
  }
  std::string written() { return directory_.read("trace"); }

  test::TemporaryDirectory directory_;
};

int traced(int code) {
  ldtr_function_local trace(0x01040300, "pb=0x%d", 5);
  trace.debug(trace::detail, "Save file name: %s\n", "x.save");
  return trace.exit(code);
}

TEST_F(Trace, IsSilentUnlessAskedFor) {
  EXPECT_EQ(traced(7), 7);
  EXPECT_EQ(written(), "");
}

TEST_F(Trace, WritesEachKindOfRecordUnderItsOwnBits) {
  const std::string start = "[-0-9]+T[0-9:.]+Z [0-9]+ 01040300 ";
  const std::string entry = start + "entry pb=0x5\n";
  const std::string debug = start + "debug C80D0000 Save file name: x\\.save\n";
  const std::string exit = start + "exit rc=7\n";
  struct Case {
    std::uint32_t mask;
    std::string expected;
  };
  for (const Case& c :
       {Case{0x00010000, entry + exit}, Case{0x00020000, exit}, Case{0x04000000, debug},
        Case{0x04010000, entry + debug + exit}, Case{0xFBFCFFFF, ""}}) {
    trcEvents = c.mask;
    ASSERT_EQ(set_trace_file(directory_.file("m" + std::to_string(c.mask)).c_str()), 0);
    traced(7);
    EXPECT_THAT(directory_.read("m" + std::to_string(c.mask)), MatchesRegex(c.expected)) << c.mask;
  }
}

TEST_F(Trace, WritesAnEntryRecordWithoutAText) {
  trcEvents = kTraceEntry;
  { const ldtr_function_local trace(0x01010100); }
  EXPECT_THAT(written(), MatchesRegex(".* 01010100 entry \n.* 01010100 exit rc=0\n"));
}

TEST_F(Trace, EndsEachRecordWithOneNewlineAndKeepsThoseInside) {
  trcEvents = kTraceDebug;
  const ldtr_function_local trace(0x01010100);
  trace.debug(trace::error, "Error: more then one admin DN ");
  trace.debug(trace::detail, "Readlink rc: %i\nPath:%s\n", 3, "abc");
  EXPECT_THAT(written(), MatchesRegex(".* debug C8110000 Error: more then one admin DN \n"
                                      ".* debug C80D0000 Readlink rc: 3\nPath:abc\n"));
}

TEST_F(Trace, MasksTheValuesOfSecretAttributes) {
  trcEvents = kTraceDebug;
  const ldtr_function_local trace(0x01020100);
  for (const char* name : {"orv-slapdAdminPW", "ORV-SLAPDMASTERPW", "orv-slapdAdminPW;x-option"}) {
    trace.debug(trace::detail, "%s: %s\n", name, "marker-secret");
    trace.debug(trace::detail, " Attribute %s: has value %s \n", name, "marker-secret");
  }
  EXPECT_THAT(written(), Not(HasSubstr("marker-secret")));
  EXPECT_THAT(written(), HasSubstr("orv-slapdAdminPW: ********\n"));
  EXPECT_THAT(written(), HasSubstr(" Attribute orv-slapdAdminPW: has value ******** \n"));
}

TEST_F(Trace, ShowsTheValuesOfOtherAttributes) {
  trcEvents = kTraceDebug;
  const ldtr_function_local trace(0x01020100);
  const char* const volatile none = nullptr;  // volatile: the compiler warns of what this is about
  trace.debug(trace::detail, "%s: %s\n", "orv-slapdAdminDN", "cn=root");
  trace.debug(trace::detail, " Attribute %s: has value %s \n", "cn", "shown");
  trace.debug(trace::detail, "%s: %s\n", "cn", none);
  trace.debug(trace::detail, "%s: %s\n", none, "hidden");
  EXPECT_THAT(written(), HasSubstr("orv-slapdAdminDN: cn=root\n"));
  EXPECT_THAT(written(), HasSubstr(" Attribute cn: has value shown \n"));
  EXPECT_THAT(written(), HasSubstr("cn: (null)\n"));
  EXPECT_THAT(written(), Not(HasSubstr("hidden")));
}

TEST_F(Trace, MasksEveryNamedValueWhileNoSchemaIsInForce) {
  const Schema* const before = &current_schema();
  set_current_schema(nullptr);
  trcEvents = kTraceDebug;
  const ldtr_function_local trace(0x01020100);
  trace.debug(trace::detail, "%s: %s\n", "cn", "hidden");
  set_current_schema(before);
  EXPECT_THAT(written(), HasSubstr("cn: ********\n"));
}

TEST_F(Trace, CutsARecordThatIsTooLongAndSaysSo) {
  trcEvents = kTraceDebug;
  const ldtr_function_local trace(0x01020100);
  const std::string text(100000, 'x');
  trace.debug(trace::detail, "%s", text.c_str());
  trace.debug(trace::detail, "after");
  const std::string all = written();
  EXPECT_LT(all.size(), 10000U);
  EXPECT_THAT(all, MatchesRegex(".* x+ \\.\\.\\.\n.* after\n"));
}

TEST_F(Trace, LeavesErrnoAlone) {
  trcEvents = 0xFFFFFFFF;
  errno = EINVAL;
  traced(1);
  EXPECT_EQ(errno, EINVAL);
  ASSERT_EQ(set_trace_file("/dev/full"), 0);
  errno = ENOENT;
  traced(1);
  EXPECT_EQ(errno, ENOENT);
}

TEST_F(Trace, StaysWhereItWasWhenAFileCannotBeOpened) {
  EXPECT_EQ(set_trace_file("/nonexistent/trace"), ENOENT);
  EXPECT_EQ(set_trace_file("/tmp"), EISDIR);
  trcEvents = kTraceDebug;
  traced(0);
  EXPECT_THAT(written(), HasSubstr("Save file name"));
}

TEST_F(Trace, AppendsToItsFileAndKeepsItFromOthers) {
  trcEvents = kTraceDebug;
  traced(0);
  ASSERT_EQ(set_trace_file(directory_.file("other").c_str()), 0);
  ASSERT_EQ(set_trace_file(directory_.file("trace").c_str()), 0);
  traced(0);
  const std::string all = written();
  EXPECT_EQ(std::count(all.begin(), all.end(), '\n'), 2);
  EXPECT_EQ(std::filesystem::status(directory_.file("trace")).permissions() &
                std::filesystem::perms::mask,
            std::filesystem::perms::owner_read | std::filesystem::perms::owner_write);
}

// What a record shows of a text.
class SecretInTrace : public Trace {
 protected:
  std::string shown(const std::string& text) {
    trcEvents = kTraceDebug;
    const std::string before = written();
    ldtr_function_local(0x01020100).debug(trace::detail, "entry %s\n", text.c_str());
    const std::string record = written().substr(before.size());
    const std::size_t begin = record.find(" entry ") + 7;
    return record.substr(begin, record.size() - begin - 1);
  }
};

TEST_F(SecretInTrace, IsMaskedWhereItStandsInADn) {
  EXPECT_EQ(shown("orv-slapdAdminPW=secret,O=X"), "orv-slapdAdminPW=********,O=X");
  EXPECT_EQ(shown("CN=A+ORV-SLAPDMASTERPW=S\\,ECRET\\2C+CN=B"),
            "CN=A+ORV-SLAPDMASTERPW=********+CN=B");
  EXPECT_EQ(shown("cn=a,orv-slapdAdminPW = (se) cret"), "cn=a,orv-slapdAdminPW =********");
  EXPECT_EQ(shown("cn=a,orv-slapdAdminPW=se\ncret"), "cn=a,orv-slapdAdminPW=********");
  EXPECT_EQ(shown("CN=ORV-SLAPDADMINPW\\3DSECRET\\2CO\\3DX,O=X"),
            "CN=ORV-SLAPDADMINPW\\3D********,O=X");
  EXPECT_EQ(shown("cn=cn\\=orv-slapdAdminPW\\\\\\=secret"),
            "cn=cn\\=orv-slapdAdminPW\\\\\\=********");
  EXPECT_EQ(shown("orv-slapdAdminPW=,O=X"), "orv-slapdAdminPW=********,O=X");
}

TEST_F(SecretInTrace, IsMaskedUnderTheNumberOfItsType) {
  const std::string oid = current_schema().attribute("orv-slapdAdminPW")->oid;
  EXPECT_EQ(shown(oid + "=secret,o=x"), oid + "=********,o=x");
}

TEST_F(SecretInTrace, IsMaskedInAFilter) {
  EXPECT_EQ(shown("(&(orv-slapdAdminPW>=se,cr+et)(cn=a))"),
            "(&(orv-slapdAdminPW>=********)(cn=a))");
  EXPECT_EQ(shown("(orv-slapdAdminPW;x-a:dn:2.5.13.5:=secret)"),
            "(orv-slapdAdminPW;x-a:dn:2.5.13.5:=********)");
}

TEST_F(SecretInTrace, LeavesEverythingElseAsItIs) {
  for (const char* text : {"cn=a,o=x", "rc =3 for cn=a.", "=", "a=b=c", "(cn=orv-slapdAdminPW)",
                           "orv-slapdAdminPW", "\\=", "description=\\3D"})
    EXPECT_EQ(shown(text), text);
}

TEST_F(SecretInTrace, IsMaskedWhenTheRecordIsFull) {
  const std::string text = shown(std::string(8100, ',') +
                                 "orv-slapdAdminPW=s,orv-slapdAdminPW=s,"
                                 "orv-slapdAdminPW=s,cn=a");
  EXPECT_THAT(text, Not(HasSubstr("=s")));
  EXPECT_THAT(shown("orv-slapdAdminPW=" + std::string(9000, 's')), Not(HasSubstr("ss")));
}

TEST_F(Trace, GoesToStandardErrorByDefault) {
  ASSERT_EQ(set_trace_file(nullptr), 0);
  trcEvents = kTraceDebug;
  testing::internal::CaptureStderr();
  traced(0);
  EXPECT_THAT(testing::internal::GetCapturedStderr(), HasSubstr("Save file name: x.save\n"));
}

TEST_F(Trace, WritesWholeRecordsFromManyThreadsWhileItsFileChanges) {
  trcEvents = kTraceDebug;
  constexpr int kThreads = 8;
  constexpr int kEach = 500;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t)
    threads.emplace_back([t] {
      const ldtr_function_local trace(0x01020100);
      for (int i = 0; i < kEach; ++i)
        trace.debug(trace::detail, "%s: %s\n", "cn",
                    std::string(100, static_cast<char>('a' + t)).c_str());
    });
  for (int i = 0; i < 50; ++i) {
    ASSERT_EQ(set_trace_file(directory_.file("other").c_str()), 0);
    ASSERT_EQ(set_trace_file(directory_.file("trace").c_str()), 0);
  }
  for (std::thread& thread : threads) thread.join();
  std::istringstream lines(directory_.read("trace") + directory_.read("other"));
  std::map<char, int> seen;
  for (std::string line; std::getline(lines, line);) {
    ASSERT_GT(line.size(), 100U);
    const std::string value = line.substr(line.size() - 100);
    ASSERT_EQ(value, std::string(100, value[0])) << line;
    ++seen[value[0]];
  }
  EXPECT_EQ(seen.size(), static_cast<std::size_t>(kThreads));
  for (const auto& [letter, count] : seen) EXPECT_EQ(count, kEach) << letter;
}

}  // namespace
}  // namespace orv
