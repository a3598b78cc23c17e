#include "slapi/codepage.h"

#include <gtest/gtest.h>

#include <atomic>
#include <clocale>
#include <cstdlib>
#include <string>
#include <thread>
#include <vector>

#include "configuration_file.h"
#include "slapi/owners.h"

namespace orv {
namespace {

using Converter = int (*)(const char*, char**, std::size_t*);

struct Converted {
  int code;
  std::string text;
  std::size_t length;
  bool null;
};

Converted run(Converter converter, const std::string& text) {
  int marker = 0;
  char* result = reinterpret_cast<char*>(&marker);
  std::size_t length = 99;
  const int code = converter(text.c_str(), &result, &length);
  const MallocText owner(result);
  return {code, result == nullptr ? "" : result, length, result == nullptr};
}

void expect_both_ways(const std::string& local, const std::string& utf8) {
  const Converted up = run(xlate_localcp_to_utf8, local);
  EXPECT_EQ(up.code, 0);
  EXPECT_EQ(up.text, utf8);
  EXPECT_EQ(up.length, utf8.size() + 1);
  const Converted down = run(xlate_utf8_to_localcp, utf8);
  EXPECT_EQ(down.code, 0);
  EXPECT_EQ(down.text, local);
  EXPECT_EQ(down.length, local.size() + 1);
}

void expect_invalid(Converter converter, const std::string& text) {
  const Converted converted = run(converter, text);
  EXPECT_EQ(converted.code, 21) << text;
  EXPECT_TRUE(converted.null) << text;
  EXPECT_EQ(converted.length, 0U) << text;
}

class CodePage : public testing::Test {
 protected:
  void TearDown() override {
    for (const char* name : {"LC_ALL", "LC_CTYPE", "LANG", "LOCPATH"}) unsetenv(name);
    set_local_code_page("UTF-8");
    EXPECT_EQ(initIconvHandle(), 0);
  }
  static int use(const char* name) {
    set_local_code_page(name);
    return initIconvHandle();
  }
};

TEST_F(CodePage, Utf8IsACheckedCopy) {
  ASSERT_EQ(use("utf-8"), 0);
  EXPECT_TRUE(local_code_page_is_utf8());
  EXPECT_STREQ(local_code_page(), "UTF-8");
  expect_both_ways("", "");
  expect_both_ways("abc", "abc");
  expect_both_ways("caf\xC3\xA9 \xF0\x9F\x98\x80", "caf\xC3\xA9 \xF0\x9F\x98\x80");
  for (const char* bad : {"\xFF", "caf\xE9", "\xC0\xAF", "\xED\xA0\x80", "\xC3"}) {
    expect_invalid(xlate_localcp_to_utf8, bad);
    expect_invalid(xlate_utf8_to_localcp, bad);
  }
}

TEST_F(CodePage, SubsetsOfUtf8AreUtf8) {
  for (const char* name : {"US-ASCII", "ANSI_X3.4-1968", "C", "POSIX"}) {
    ASSERT_EQ(use(name), 0) << name;
    EXPECT_TRUE(local_code_page_is_utf8()) << name;
  }
}

TEST_F(CodePage, ConvertsASingleByteCodePage) {
  ASSERT_EQ(use("ISO-8859-1"), 0);
  EXPECT_FALSE(local_code_page_is_utf8());
  EXPECT_STREQ(local_code_page(), "ISO-8859-1");
  expect_both_ways("", "");
  expect_both_ways("caf\xE9", "caf\xC3\xA9");
  std::string all;
  for (int c = 1; c < 256; ++c) all += static_cast<char>(c);
  const Converted up = run(xlate_localcp_to_utf8, all);
  EXPECT_EQ(up.code, 0);
  EXPECT_EQ(run(xlate_utf8_to_localcp, up.text).text, all);
  expect_invalid(xlate_utf8_to_localcp, "100 \xE2\x82\xAC");
  expect_invalid(xlate_utf8_to_localcp, "caf\xE9");
  expect_invalid(xlate_utf8_to_localcp, "caf\xC3");
}

TEST_F(CodePage, ConvertsMultiByteCodePages) {
  ASSERT_EQ(use("EUC-JP"), 0);
  expect_both_ways("\xC0\xDF\xC4\xEA x", "\xE8\xA8\xAD\xE5\xAE\x9A x");
  expect_invalid(xlate_localcp_to_utf8, "\xC0");
  expect_invalid(xlate_localcp_to_utf8, "\xC0\x20");
  ASSERT_EQ(use("GB18030"), 0);
  expect_both_ways("\xC5\xE4\xD6\xC3", "\xE9\x85\x8D\xE7\xBD\xAE");
  expect_both_ways("\x94\x39\xFC\x36", "\xF0\x9F\x98\x80");
}

TEST_F(CodePage, ConvertsTextsThatGrow) {
  ASSERT_EQ(use("ISO-8859-1"), 0);
  std::string local(100000, '\xE9');
  std::string utf8;
  for (std::size_t i = 0; i < local.size(); ++i) utf8 += "\xC3\xA9";
  expect_both_ways(local, utf8);
}

TEST_F(CodePage, EndsAShiftedTextInItsInitialState) {
  ASSERT_EQ(use("ISO-2022-JP"), 0);
  expect_both_ways("\x1B$B@_\x1B(B", "\xE8\xA8\xAD");
}

// A file of one entry in the code page, and what a search for it by another spelling gives.
class CodePageOfAFile : public CodePage {
 protected:
  static int search_for(const std::string& entry_dn, const std::string& base) {
    test::ConfigurationFile file("dn: " + entry_dn + "\ncn: x\n");
    _CFGMessage* found = nullptr;
    const int rc =
        cfg_search_s(file.session(), base.c_str(), kScopeBase, nullptr, nullptr, 0, &found);
    cfg_msgfree(found);
    return rc;
  }
};

TEST_F(CodePageOfAFile, LetterCaseOfNamesIsFoldedInTheCodePageInForce) {
  ASSERT_EQ(use("ISO-8859-1"), 0);
  EXPECT_EQ(search_for("cn=\xE6r\xF8", "CN=\xC6R\xD8"), 0);
  EXPECT_EQ(search_for("cn=\xE6r\xF8", "CN=\xC6R\xD9"), 32);
  ASSERT_EQ(use("ISO-8859-5"), 0);
  EXPECT_EQ(search_for("cn=\xE6r\xF8", "CN=\xC6R\xA8"), 0);  // letters of another script
  EXPECT_EQ(search_for("cn=\xE6r\xF8", "CN=\xC6R\xD8"), 32);
  ASSERT_EQ(use("UTF-8"), 0);
  EXPECT_EQ(search_for("cn=\xC3\xA6", "CN=\xC3\x86"), 0);
  EXPECT_EQ(search_for("cn=\xE6r\xF8", "CN=\xC6R\xD8"), 32);
}

TEST_F(CodePageOfAFile, CharactersOfTwoBytesMayHoldBytesOfTheSyntax) {
  ASSERT_EQ(use("SHIFT_JIS"), 0);
  // U+8868, whose second byte is that of the backslash.
  EXPECT_EQ(search_for("cn=\x95\x5C", "CN=\x95\x5C"), 0);
}

TEST_F(CodePage, RecoversAfterAnInvalidText) {
  ASSERT_EQ(use("EUC-JP"), 0);
  expect_invalid(xlate_localcp_to_utf8, "\xC0");
  expect_both_ways("\xC0\xDF", "\xE8\xA8\xAD");
  ASSERT_EQ(use("ISO-2022-JP"), 0);
  expect_invalid(xlate_localcp_to_utf8, "\x1B$B@");
  expect_both_ways("plain", "plain");
}

TEST_F(CodePage, RefusesNullArguments) {
  char* result = nullptr;
  std::size_t length = 1;
  for (const Converter converter : {xlate_localcp_to_utf8, xlate_utf8_to_localcp}) {
    EXPECT_EQ(converter(nullptr, &result, &length), 80);
    EXPECT_EQ(length, 0U);
    EXPECT_EQ(converter("a", nullptr, &length), 80);
    EXPECT_EQ(converter("a", &result, nullptr), 80);
    EXPECT_EQ(result, nullptr);
  }
}

TEST_F(CodePage, RefusesUnknownAndUnusableCodePages) {
  const std::string long_name(100, 'x');
  for (const char* name : {"NO-SUCH-PAGE", "UTF-16", "UCS-4", "EBCDIC-US", long_name.c_str()}) {
    ASSERT_EQ(use("ISO-8859-1"), 0);
    EXPECT_EQ(use(name), 80) << name;
    EXPECT_STREQ(local_code_page(), "ISO-8859-1") << name;
  }
}

// In a process of its own, because the C library keeps the list of directories that LOCPATH names
// for good each time it looks for a locale there.
TEST_F(CodePage, ComesFromTheEnvironmentByItsPrecedence) {
  const auto look_up = [] {
    setenv("LOCPATH", ORV_TEST_DATA "/locales", 1);
    EXPECT_EQ(use(nullptr), 0);
    EXPECT_STREQ(local_code_page(), "UTF-8");
    setenv("LANG", "tr_TR", 1);
    EXPECT_EQ(use(""), 0);
    EXPECT_STREQ(local_code_page(), "ISO-8859-9");
    setenv("LC_CTYPE", "C", 1);
    EXPECT_EQ(use(nullptr), 0);
    EXPECT_STREQ(local_code_page(), "UTF-8");
    setenv("LC_ALL", "tr_TR", 1);
    EXPECT_EQ(use(nullptr), 0);
    EXPECT_STREQ(local_code_page(), "ISO-8859-9");
    expect_both_ways("\xDD", "\xC4\xB0");
    EXPECT_STREQ(std::setlocale(LC_ALL, nullptr), "C");
    std::_Exit(HasFailure() ? 1 : 0);
  };
  EXPECT_EXIT(look_up(), testing::ExitedWithCode(0), "");
}

TEST_F(CodePage, IsReadFromTheNameOfALocaleThatIsNotInstalled) {
  setenv("LC_ALL", "xx_XX.ISO-8859-15@euro", 1);
  EXPECT_EQ(use(nullptr), 0);
  EXPECT_STREQ(local_code_page(), "ISO-8859-15");
  setenv("LC_ALL", "xx_XX", 1);
  EXPECT_EQ(use(nullptr), 0);
  EXPECT_STREQ(local_code_page(), "UTF-8");
  setenv("LC_ALL", "xx_XX.nonsense", 1);
  EXPECT_EQ(use(nullptr), 80);
}

TEST_F(CodePage, IsConvertedByManyThreadsAtOnce) {
  ASSERT_EQ(use("EUC-JP"), 0);
  std::atomic<int> failures{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 8; ++t)
    threads.emplace_back([&failures, t] {
      const std::string utf8 = "\xE8\xA8\xAD" + std::to_string(t);
      for (int i = 0; i < 2000; ++i) {
        const Converted local = run(xlate_utf8_to_localcp, utf8);
        if (local.code != 0 || run(xlate_localcp_to_utf8, local.text).text != utf8) ++failures;
        if (i % 10 == 0 && run(xlate_localcp_to_utf8, "\xC0").code != 21) ++failures;
      }
    });
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(failures, 0);
}

}  // namespace
}  // namespace orv
