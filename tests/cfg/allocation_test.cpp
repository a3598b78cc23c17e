// Every allocation of a session fails once: the answer is 90 or a null result, nothing leaks.
//
// The program's own allocation functions stand in front of the system's and count what is out.
#include <gtest/gtest.h>

#include <cerrno>
#include <cstdlib>
#include <iterator>
#include <new>

#include "cfg/diagnostics.h"
#include "cfg/dn.h"
#include "cfg/ldif.h"
#include "cfg/matching.h"
#include "cfg/secret.h"
#include "cfg_fixture.h"
#include "file_calls.h"
#include "session_state.h"

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
extern "C" void* __interceptor_malloc(std::size_t size);
extern "C" void* __interceptor_calloc(std::size_t count, std::size_t size);
extern "C" void* __interceptor_realloc(void* memory, std::size_t size);
#define ORV_SYSTEM_MALLOC __interceptor_malloc
#define ORV_SYSTEM_CALLOC __interceptor_calloc
#define ORV_SYSTEM_REALLOC __interceptor_realloc
#else
extern "C" void* __libc_malloc(std::size_t size);
extern "C" void* __libc_calloc(std::size_t count, std::size_t size);
extern "C" void* __libc_realloc(void* memory, std::size_t size);
#define ORV_SYSTEM_MALLOC __libc_malloc
#define ORV_SYSTEM_CALLOC __libc_calloc
#define ORV_SYSTEM_REALLOC __libc_realloc
#endif

// The operators below pair up, through malloc and free; seen one by one, inlined, they do not.
#pragma GCC diagnostic ignored "-Wmismatched-new-delete"

namespace {

thread_local long fail_at = -1;  // counts down to the allocation that fails; negative: none does
thread_local bool failed = false;
// The C library aborts when a thread cannot note that it has something to destroy; so only tests of
// what calls calloc itself let it fail, when nothing is left to note.
bool callocs_fail = false;

bool fails_now() noexcept {
  if (fail_at < 0) return false;
  if (fail_at-- > 0) return false;
  failed = true;
  return true;
}

}  // namespace

extern "C" void* malloc(std::size_t size) {
  return fails_now() ? nullptr : ORV_SYSTEM_MALLOC(size);
}
extern "C" void* calloc(std::size_t count, std::size_t size) {
  return callocs_fail && fails_now() ? nullptr : ORV_SYSTEM_CALLOC(count, size);
}
extern "C" void* realloc(void* memory, std::size_t size) {
  return fails_now() ? nullptr : ORV_SYSTEM_REALLOC(memory, size);
}
void* operator new(std::size_t size) {
  if (void* const memory = std::malloc(size == 0 ? 1 : size)) return memory;
  throw std::bad_alloc();
}
void* operator new(std::size_t size, const std::nothrow_t&) noexcept {
  return std::malloc(size == 0 ? 1 : size);
}
void operator delete(void* memory) noexcept {
  std::free(memory);
}
void operator delete(void* memory, std::size_t) noexcept {
  std::free(memory);
}

namespace orv::cfg_test {
namespace {

class AllocationTest : public CfgTest {
 protected:
  // Runs `body` with its n-th allocation failing, for n from 0 until none fails. `body` returns
  // whether the outcome is one that a failed allocation may have.
  template <class Body>
  static void fail_each(Body body) {
    for (long n = 0; n < 100000; ++n) {
      failed = false;
      fail_at = n;
      const bool good = body();
      fail_at = -1;
      ASSERT_TRUE(good) << "allocation " << n;
      if (!failed) return;
    }
    FAIL() << "it never succeeded";
  }

  // A failure that a library below can do without leaves a success.
  static bool is_memory_or_success(int rc) { return rc == 0 || (rc == 90 && failed); }
};

constexpr const char* kContent =
    "dn:: Y249dG9w\ncn: top\ndescri\n ption:: w6Q=\nmember: cn=\xC3\xA4,o=x\n\n"
    "dn: cn=a+ou=\\61,cn=top\ncn: a\nunknown: long enough to need a block of its own\n"
    "unknown: an\n  d folded\n\n";

TEST_F(AllocationTest, OpenSearchAndWalkSurviveEveryFailedAllocation) {
  write_file(path_, kContent);
  const char* const path = path_.c_str();
  fail_each([path] {
    _CFG* const session = cfg_init(nullptr, 0);
    if (session == nullptr) return false;
    bool good = true;
    int rc = cfg_set_option(session, kCfgOptConfigFile, path);
    if (rc == 0) rc = cfg_bind_s(session, nullptr, nullptr, 128);
    _CFGMessage* chain = nullptr;
    if (rc == 0) {
      const char* names[] = {"cn", "*", nullptr};
      rc = cfg_search_s(
          session, "2.5.4.3=\\54op", 2,
          "(|(member=cn=\xC3\xA4, o=x)(&(cn=*a*)(!(number=x)))(unknown:dn:caseExactMatch:=x))",
          const_cast<char**>(names), 0, &chain);
      good = (chain == nullptr) == (rc != 0);
    }
    good = good && (rc == 0 || (rc == 90 && failed));
    for (_CFGMessage* record = cfg_first_entry(session, chain); good && record != nullptr;
         record = cfg_next_entry(session, record)) {
      char* const dn = cfg_get_dn(session, record);
      good = (dn != nullptr) == (cfg_get_errno(session) == 0);
      cfg_memfree(dn);
      _CFGBer* cursor = nullptr;
      char* name = cfg_first_attribute(session, record, &cursor);
      good = good && (name == nullptr) == (cursor == nullptr) &&
             (name != nullptr || cfg_get_errno(session) == 90);
      while (good && name != nullptr) {
        char** const values = cfg_get_values(session, record, name);
        good = (values != nullptr) ? cfg_get_errno(session) == 0 : cfg_get_errno(session) == 90;
        cfg_value_free(values);
        cfg_memfree(name);
        name = cfg_next_attribute(session, record, cursor);
        good = good &&
               (name != nullptr || cfg_get_errno(session) == 0 || cfg_get_errno(session) == 90);
      }
      cfg_ber_free(cursor);
    }
    if (rc != 0 && cfg_dump_exception(session) == nullptr) good = false;
    return good && cfg_unbind(session) == 0;
  });
}

TEST_F(AllocationTest, ADamagedFileIsRefusedOrOutOfMemory) {
  write_file(path_, "dn: cn=top\ncn: top\n\ndn: cn=a,cn=b\ncn: a\n");
  const char* const path = path_.c_str();
  fail_each([path] {
    _CFG* const session = cfg_init(nullptr, 0);
    bool good = true;
    if (cfg_set_option(session, kCfgOptConfigFile, path) == 0) {
      const int rc = cfg_bind_s(session, nullptr, nullptr, 128);
      good = (rc == 1 || (rc == 90 && failed)) && cfg_dump_exception(session)[0] != '\0';
    }
    cfg_unbind(session);
    return good;
  });
}

TEST_F(AllocationTest, DnFunctionsAnswerNinety) {
  for (const char* dn : {"cn=plain,o=x", "ou=\xC3\xA4+cn=\\61,2.5.4.3=#0c0161"}) {
    fail_each([dn] {
      std::string normal;
      return is_memory_or_success(cfg::normalize_dn(dn, normal));
    });
    fail_each([dn] {
      std::string light;
      return is_memory_or_success(cfg::normalize_dn_light(dn, light));
    });
    fail_each([dn] {
      std::string canonical;
      return is_memory_or_success(cfg::canonicalize_dn_types(dn, canonical));
    });
    fail_each([dn] {
      cfg::Dn parsed;
      return is_memory_or_success(cfg::parse_dn(dn, parsed));
    });
  }
}

TEST_F(AllocationTest, CanonicalValuesAnswerNinetyAndStayAsTheyWere) {
  for (const cfg::MatchingRule rule :
       {cfg::MatchingRule::case_ignore, cfg::MatchingRule::octets,
        cfg::MatchingRule::distinguished_name, cfg::MatchingRule::telephone_number}) {
    fail_each([rule] {
      std::string form;
      const int rc =
          cfg::canonical_value(rule, "cn=\xC3\xA4 value that needs a block of its own,o=x", form);
      return rc == 0 ? !form.empty() : rc == 90 && failed && form.empty();
    });
  }
}

TEST_F(AllocationTest, ARecordIsComparedOrAnsweredNinety) {
  fail_each([] {
    bool matches = false;
    const int rc = cfg::ldif_record_matches(
        "dn: cn=a long name so that it needs a block of its own\ncn: a\nou: x\n",
        "(&(ou=a value that is long enough for a block, which no entry has)(cn=*))", matches);
    return is_memory_or_success(rc) && !matches;
  });
}

TEST_F(AllocationTest, AKeyStashIsMadeAndReadOrAnsweredNinety) {
  const std::string path = directory_.file("key.stash");
  fail_each([&] {
    ::unlink(path.c_str());
    std::string why;
    const int made = cfg::create_key_stash(path.c_str(), why);
    if (made != 0) return made == 90 && failed;
    cfg::KeyPtr key;
    const int rc = cfg::load_key_stash(path.c_str(), key, why);
    return is_memory_or_success(rc) && (rc == 0) == (key != nullptr);
  });
  fail_each([&] {
    std::string why;
    cfg::KeyPtr key;
    const int rc = cfg::load_key_stash("/a/path/long/enough/for/a/block/of/its/own", key, why);
    return rc == 1 || (rc == 90 && failed);
  });
}

// ---- Changes ----

// Nothing is flushed: it is memory that is short here.
class QuickFiles : public cfg::FileCalls {
 public:
  explicit QuickFiles(bool exchanges) : exchanges_(exchanges) {}
  int flush(int /*file*/) override { return 0; }
  int exchange(const char* a, const char* b) override {
    return exchanges_ ? FileCalls::exchange(a, b) : (errno = EINVAL, -1);
  }

 private:
  bool exchanges_;
};

class ChangeAllocationTest : public AllocationTest {
 protected:
  static constexpr const char* kBefore =
      "dn: cn=a long name of the top so that it takes a block\ncn: top\n";

  // Opens the file with `before`, lets each allocation of `change` fail, and looks at the file.
  template <class Change>
  void fail_each_of(Change change) {
    for (const bool exchanges : {true, false}) {
      QuickFiles files(exchanges);
      fail_each([&] {
        fail_at_end();
        write_file(path_, before_);
        const CfgSession session = unbound();
        cfg_set_option(session.get(), kCfgOptSaveFile, save_.c_str());
        if (cfg_bind_s(session.get(), nullptr, nullptr, 128) != 0) return false;
        cfg::session_of(session.get())->files = &files;
        fail_at_start();
        const int rc = change(session.get());
        fail_at_end();
        const std::string now = read_all(path_);
        if (::access((path_ + ".new").c_str(), F_OK) == 0) return false;
        return rc == 0 ? now == after_ : rc == 90 && failed && now == before_;
      });
    }
  }

  // Within a round only the change itself is short of memory.
  void fail_at_end() {
    if (fail_at >= 0) next_ = fail_at;
    fail_at = -1;
  }
  void fail_at_start() const { fail_at = next_; }

  static std::string read_all(const std::string& path) {
    std::ifstream file(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>()};
  }

  const std::string save_ = path_ + ".save";
  std::string before_ = kBefore;
  std::string after_;
  long next_ = 0;
};

TEST_F(ChangeAllocationTest, AnAddIsDoneOrAnsweredNinety) {
  char cn[] = "2.5.4.3";
  char description[] = "description";
  char short_value[] = "a";
  char other_value[] = "\xC3\xA4 value that has to be encoded and then folded, because it is long";
  char* values[] = {short_value, other_value, nullptr};
  ldapmod first{kModAdd, cn, {values}, nullptr};
  ldapmod second{kModAdd, description, {values}, nullptr};
  ldapmod* mods[] = {&first, &second, nullptr};
  const char* const dn = "cn=\\61 new entry,cn=a long name of the top so that it takes a block";
  write_file(path_, kBefore);
  {
    const CfgSession session = open(kBefore);
    ASSERT_EQ(cfg_add_s(session.get(), dn, mods), 0);
  }
  after_ = read_all(path_);
  fail_each_of([&](_CFG* session) { return cfg_add_s(session, dn, mods); });
}

TEST_F(ChangeAllocationTest, APasswordIsProtectedOrTheAddAnsweredNinety) {
  using cfg::SecretMethod;
  char type[] = "orv-slapdAdminPW";
  char value[] = "correct horse battery staple";
  char* values[] = {value, nullptr};
  ldapmod mod{kModAdd, type, {values}, nullptr};
  ldapmod* mods[] = {&mod, nullptr};
  const char* const dn = "cn=new,cn=a long name of the top so that it takes a block";
  std::string why;
  const std::string stash = directory_.file("key.stash");
  ASSERT_EQ(cfg::create_key_stash(stash.c_str(), why), 0);
  QuickFiles files(true);
  for (const auto& [method, scheme] : {std::pair{SecretMethod::sealed, "{AES256}"},
                                       {SecretMethod::ssha384, "{SSHA384}"},
                                       {SecretMethod::ssha512, "{SSHA512}"},
                                       {SecretMethod::crypt, "{CRYPT}"}}) {
    if (!cfg::can_make_secret(method)) continue;
    cfg::set_secret_method(method);
    callocs_fail = method == SecretMethod::crypt;
    const char* const expected = scheme;
    next_ = 0;
    fail_each([&] {
      fail_at_end();
      write_file(path_, kBefore);
      const CfgSession session = unbound();
      cfg_set_option(session.get(), kCfgOptKeyStashFile, stash.c_str());
      if (cfg_bind_s(session.get(), nullptr, nullptr, 128) != 0) return false;
      cfg::session_of(session.get())->files = &files;
      fail_at_start();
      const int rc = cfg_add_s(session.get(), dn, mods);
      fail_at_end();
      const std::string now = read_all(path_);
      if (now.find("horse") != std::string::npos) return false;
      return rc == 0 ? now.find(expected) != std::string::npos : rc == 90 && now == kBefore;
    });
  }
  callocs_fail = false;
  cfg::set_secret_method(SecretMethod::sealed);
}

// A sealed password that is deleted by its clear text.
TEST_F(ChangeAllocationTest, ASealedPasswordIsFoundByItsClearTextOrTheModifyAnsweredNinety) {
  std::string why;
  const std::string stash = directory_.file("key.stash");
  ASSERT_EQ(cfg::create_key_stash(stash.c_str(), why), 0);
  cfg::KeyPtr key;
  ASSERT_EQ(cfg::load_key_stash(stash.c_str(), key, why), 0);
  char type[] = "orv-slapdAdminPW";
  char value[] = "correct horse battery staple";
  char* values[] = {value, nullptr};
  ldapmod mod{kModDelete, type, {values}, nullptr};
  ldapmod* mods[] = {&mod, nullptr};
  const char* const dn = "cn=a long name of the top so that it takes a block";
  std::string normal;
  std::string stored;
  ASSERT_EQ(cfg::normalize_dn(dn, normal), 0);
  ASSERT_EQ(cfg::seal_secret(*key, {type, normal}, value, stored), 0);
  before_ = std::string(kBefore) + "orv-slapdAdminPW: " + stored + "\n";
  QuickFiles files(true);
  fail_each([&] {
    fail_at_end();
    write_file(path_, before_);
    const CfgSession session = unbound();
    cfg_set_option(session.get(), kCfgOptKeyStashFile, stash.c_str());
    if (cfg_bind_s(session.get(), nullptr, nullptr, 128) != 0) return false;
    cfg::session_of(session.get())->files = &files;
    fail_at_start();
    const int rc = cfg_modify_s(session.get(), dn, mods);
    fail_at_end();
    const std::string now = read_all(path_);
    return rc == 0 ? now == kBefore : rc == 90 && failed && now == before_;
  });
}

TEST_F(ChangeAllocationTest, ADeleteIsDoneOrAnsweredNinety) {
  after_ = kBefore;
  before_ = std::string(kBefore) +
            "\ndn: cn=\xC3\xA4 new entry,cn=a long name of the top so that it takes a block\n"
            "description: one\ndescr\n iption: two\n";
  fail_each_of([](_CFG* session) {
    return cfg_delete_s(
        session, "cn=\xC3\x84 NEW entry, cn=a long name of the top so that it takes a block");
  });
}

TEST_F(ChangeAllocationTest, AModifyIsDoneOrAnsweredNinety) {
  before_ = std::string(kBefore) + "description: one\ndescr\n iption: two\nunknown: x\n";
  after_ = std::string(kBefore) + "descr\n iption: two\ndescription: three\n";
  char description[] = "description";
  char unknown[] = "UNKNOWN";
  char two[] = "two";
  char three[] = "three";
  char* values[] = {two, three, nullptr};
  ldapmod first{kModReplace, description, {values}, nullptr};
  ldapmod second{kModDelete, unknown, {nullptr}, nullptr};
  ldapmod* mods[] = {&first, &second, nullptr};
  fail_each_of([&](_CFG* session) {
    return cfg_modify_s(session, "cn=a long name of the top so that it takes a block", mods);
  });
}

// A comparison for which there was no memory is no "no": that would be the code 16, or a second
// value.
TEST_F(ChangeAllocationTest, AStoredPasswordIsFoundByItsClearTextOrTheModifyAnsweredNinety) {
  char type[] = "orv-slapdAdminPW";
  char value[] = "correct horse battery staple";
  char* values[] = {value, nullptr};
  for (const cfg::SecretMethod method :
       {cfg::SecretMethod::ssha512, cfg::SecretMethod::clear, cfg::SecretMethod::crypt}) {
    std::string stored;
    if (!cfg::can_make_secret(method)) continue;
    ASSERT_EQ(cfg::make_secret(method, value, stored), 0);
    after_ = kBefore;
    before_ = std::string(kBefore) + "orv-slapdAdminPW: " + stored + "\n";
    ldapmod mod{kModDelete, type, {values}, nullptr};
    ldapmod* mods[] = {&mod, nullptr};
    callocs_fail = method == cfg::SecretMethod::crypt;
    fail_each_of([&](_CFG* session) {
      return cfg_modify_s(session, "cn=a long name of the top so that it takes a block", mods);
    });
  }
  callocs_fail = false;
}

TEST_F(ChangeAllocationTest, ARefusalIsAnsweredWithItsCodeOrNinety) {
  write_file(path_, kBefore);
  const CfgSession session = open(kBefore);
  write_file(path_, std::string(kBefore) + "# edited by somebody, with another size\n");
  char type[] = "cn";
  char value[] = "a";
  char* values[] = {value, nullptr};
  ldapmod mod{kModAdd, type, {values}, nullptr};
  ldapmod* mods[] = {&mod, nullptr};
  cfg::set_diagnostics_sink([](const char* /*line*/) noexcept {});
  fail_each([&] {
    const int rc =
        cfg_add_s(session.get(), "cn=a,cn=a long name of the top so that it takes a block", mods);
    return rc == 51 || (rc == 90 && failed);
  });
  cfg::set_diagnostics_sink(nullptr);
}

TEST_F(AllocationTest, WithoutMemoryTheReservedHandleAnswersNinety) {
  failed = false;
  fail_at = 0;
  _CFG* const session = cfg_init(nullptr, 0);
  fail_at = -1;
  ASSERT_TRUE(failed);
  ASSERT_NE(session, nullptr);
  const char* value = nullptr;
  _CFGMessage* chain = reinterpret_cast<_CFGMessage*>(&chain);
  EXPECT_EQ(cfg_set_option(session, kCfgOptConfigFile, "x"), 90);
  EXPECT_EQ(cfg_get_option(session, kCfgOptConfigFile, &value), 90);
  EXPECT_STREQ(value, "");
  EXPECT_EQ(cfg_bind_s(session, nullptr, nullptr, 128), 90);
  EXPECT_EQ(cfg_get_errno(session), 90);
  EXPECT_STREQ(cfg_dump_exception(session), "out of memory");
  EXPECT_EQ(cfg_search_s(session, "", 0, nullptr, nullptr, 0, &chain), 90);
  EXPECT_EQ(chain, nullptr);
  EXPECT_EQ(cfg_unbind(session), 0);
}

}  // namespace
}  // namespace orv::cfg_test
