// Opening the configuration file: what is read as it is, and which files cannot be opened.
#include <grp.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include "cfg/secret.h"
#include "cfg_fixture.h"

namespace orv::cfg_test {
namespace {

class BindTest : public CfgTest {
 protected:
  std::string bind_failure(const std::string& path) {
    CfgSession session(cfg_init(nullptr, 0));
    cfg_set_option(session.get(), kCfgOptConfigFile, path.c_str());
    EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 1);
    EXPECT_EQ(cfg_get_errno(session.get()), 1);
    return cfg_dump_exception(session.get());
  }

  enum ChildStatus : int { kRefused = 10, kNotRefused, kNotReached, kStillPrivileged, kDied };

  // Runs `body` in a process that may not read what it does not own; the superuser reads
  // everything.
  template <class Body>
  static int status_of_unprivileged_child(Body body) {
    constexpr uid_t kNobody = 65534;
    const pid_t child = ::fork();
    if (child == 0) {
      if (::geteuid() == 0 &&
          (::setgroups(0, nullptr) != 0 || ::setgid(kNobody) != 0 || ::setuid(kNobody) != 0)) {
        ::_exit(kStillPrivileged);
      }
      ::_exit(body());
    }
    int status = 0;
    if (child < 0 || ::waitpid(child, &status, 0) != child || !WIFEXITED(status)) return kDied;
    return WEXITSTATUS(status);
  }

  static constexpr const char* kSmall = "dn: cn=top\ncn: top\n";
};

TEST_F(BindTest, MixedLineEndsBlankLinesCommentsAndFoldsAreRead) {
  const CfgSession session = open(
      "\xEF\xBB\xBF# first\r\n#  folded\r\n  comment\r\nversion: 1\r\n\r\n\n\r\ndn: cn=\r\n top\r\n"
      "# inside\n  the entry\nobjectClass: top\r\ndescription: a\n  b\r\n c\ncn:t\r\ncn:   "
      "o\n\n\n\n"
      "dn:: Y249YSxjbj10b3A=\ncn:\n : YQ==\r\nde\n scription:x\n# end");
  const std::vector<FoundEntry> found = search(session, "cn=top", 2, nullptr);
  const std::vector<FoundEntry> expected = {
      {"cn=top", {{"objectClass", {"top"}}, {"description", {"a bc"}}, {"cn", {"t", "o"}}}},
      {"cn=a,cn=top", {{"cn", {"a"}}, {"description", {"x"}}}}};
  EXPECT_EQ(found, expected);
}

TEST_F(BindTest, ValuesComeAsStored) {
  const std::string text(5000, 'x');
  const CfgSession session = open(
      "dn: cn=top\ncn:\ncn: trailing blanks  \ncn: :colon\ncn: a: b\ncn: <angle\ncn:: \n"
      "cn:: IGxlYWRpbmc=\ncn: \xE4 latin\ndescription: " +
      text + "\n");
  const std::vector<FoundEntry> found = search(session, "cn=top", 0, nullptr);
  ASSERT_EQ(found.size(), 1U);
  EXPECT_EQ(found[0].attributes[0].second, (Values{"", "trailing blanks  ", ":colon", "a: b",
                                                   "<angle", "", " leading", "\xE4 latin"}));
  EXPECT_EQ(found[0].attributes[1].second, (Values{text}));
}

TEST_F(BindTest, ValueOfBlanksAndAnEmptyValueAtAFoldAreRead) {
  const CfgSession session = open("dn: cn=top\ncn: \n  x\no:\n  y\nou: z\n \n");
  const std::vector<FoundEntry> found = search(session, "cn=top", 0, nullptr);
  EXPECT_EQ(found[0].attributes[0].second, (Values{"x"}));
  EXPECT_EQ(found[0].attributes[1].second, (Values{"y"}));
  EXPECT_EQ(found[0].attributes[2].second, (Values{"z"}));
}

TEST_F(BindTest, TypesByOidOrSecondNameAreReportedUnderTheCanonicalName) {
  const CfgSession session = open("dn: 2.5.4.3=top\nCOMMONNAME: top\n2.5.4.11: x\nX-Unknown: y\n");
  const std::vector<FoundEntry> found = search(session, "cn=top", 0, "(commonName=TOP)");
  ASSERT_EQ(found.size(), 1U);
  EXPECT_EQ(found[0].dn, "2.5.4.3=top");
  EXPECT_EQ(found[0].attributes[0].first, "cn");
  EXPECT_EQ(found[0].attributes[1].first, "ou");
  EXPECT_EQ(found[0].attributes[2].first, "X-Unknown");
}

TEST_F(BindTest, ASecretUnderItsOwnNameInAnyLetterCaseIsRead) {
  const CfgSession session = open("dn: cn=top\nORV-SLAPDADMINPW: {AES256}xyz\n");
  EXPECT_EQ(search(session, "cn=top", 0, nullptr)[0].attributes[0].first, "orv-slapdAdminPW");
}

TEST_F(BindTest, ATextInAnotherCodePageIsFoundByItsBytes) {
  const CfgSession session = open("dn: cn=\xE4rger\ncn: \xE4rger\n\ndn: cn=b,cn=\xE4RGER\ncn: b\n");
  EXPECT_EQ(search(session, "CN=B,CN=\xE4RGER", 0, nullptr).size(), 1U);
  EXPECT_EQ(search(session, "cn=\xE4rger", 2, "(cn=\xE4RGER)").size(), 1U);
  EXPECT_EQ(search_code(session, "cn=\xC4rger", 0, nullptr), 32);
}

TEST_F(BindTest, MissingDirectoryAndSpecialFilesAreNamedAsWhatTheyAre) {
  EXPECT_NE(bind_failure(directory_.file("missing")).find("No such file"), std::string::npos);
  EXPECT_NE(bind_failure(directory_.file("")).find("is a directory"), std::string::npos);
  const std::string pipe = directory_.file("pipe");
  ASSERT_EQ(::mkfifo(pipe.c_str(), 0600), 0);
  EXPECT_EQ(bind_failure(pipe), pipe + ": is not a regular file");
  EXPECT_EQ(bind_failure("/dev/null"), "/dev/null: is not a regular file");
  EXPECT_EQ(bind_failure(""), "no configuration file is named");
}

TEST_F(BindTest, AnUnreadableFileIsRefused) {
  write_file(path_, kSmall);
  ASSERT_EQ(::chmod(path_.c_str(), 0), 0);
  ASSERT_EQ(::chmod(directory_.path().c_str(), 0711), 0);  // others may pass
  EXPECT_EQ(status_of_unprivileged_child([this] {
              struct stat reached {};
              if (::stat(path_.c_str(), &reached) != 0) return kNotReached;
              const std::string failure = bind_failure(path_);
              const bool denied = failure == path_ + ": cannot be opened: Permission denied";
              return denied && !HasFailure() ? kRefused : kNotRefused;
            }),
            kRefused);
}

TEST_F(BindTest, AFileOfMoreThanAGigabyteIsRefused) {
  write_file(path_, "");
  ASSERT_EQ(::truncate(path_.c_str(), (off_t{1} << 30) + 1), 0);
  EXPECT_NE(bind_failure(path_).find("larger than 1 GiB"), std::string::npos);
}

TEST_F(BindTest, AFileThatCannotBeReadOrNeverStaysTheSameIsRefused) {
  // Files of the kernel's, which say that they are regular and empty.
  EXPECT_NE(bind_failure("/proc/self/mem").find("cannot be read"), std::string::npos);
  EXPECT_EQ(bind_failure("/proc/self/status"),
            "/proc/self/status: the file kept changing while it was read");
}

// Beyond the sizes of which a thread keeps the memory.
TEST_F(BindTest, AFileOfSeveralMegabytesIsSearchedAndChanged) {
  std::string text = "dn: cn=top\ncn: top\n";
  constexpr int kEntries = 40000;
  for (int i = 0; i < kEntries; ++i) {
    const std::string name = std::to_string(i);
    text += "\ndn: cn=" + name + ",cn=top\ncn: " + name +
            "\ndescription: " + std::string(100, static_cast<char>('a' + i % 26)) + "\n";
  }
  const CfgSession session = open(text);
  EXPECT_EQ(search(session, "cn=top", 2, "(description=b*)").size(), (kEntries + 24) / 26);
  EXPECT_EQ(search(session, "cn=39999,cn=top", 0, nullptr).size(), 1U);
  char type[] = "ou";
  char value[] = "x";
  char* values[] = {value, nullptr};
  ldapmod mod{kModAdd, type, {values}, nullptr};
  ldapmod* mods[] = {&mod, nullptr};
  EXPECT_EQ(cfg_modify_s(session.get(), "cn=0,cn=top", mods), 0);
  text.insert(text.find("\n\ndn: cn=1,") + 1, "ou: x\n");
  std::ifstream file(path_, std::ios::binary);
  EXPECT_TRUE(std::string(std::istreambuf_iterator<char>(file), {}) == text);
  EXPECT_EQ(search(session, "cn=top", 2, "(ou=x)").size(), 1U);
}

TEST_F(BindTest, ASymbolicLinkIsFollowed) {
  write_file(path_, kSmall);
  const std::string link = directory_.file("link");
  ASSERT_EQ(::symlink(path_.c_str(), link.c_str()), 0);
  CfgSession session(cfg_init(nullptr, 0));
  cfg_set_option(session.get(), kCfgOptConfigFile, link.c_str());
  EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 0);
}

TEST_F(BindTest, EachBindReadsTheFileAfresh) {
  open(kSmall);
  const CfgSession second = open("dn: cn=new\ncn: new\n");
  EXPECT_EQ(search(second, "cn=new", 0, nullptr).size(), 1U);
  EXPECT_EQ(search_code(second, "cn=top", 0, nullptr), 32);
}

TEST_F(BindTest, ASessionKeepsItsTextWhenTheFileChangesOrVanishes) {
  const CfgSession session = open(kSmall);
  write_file(path_, "");
  EXPECT_EQ(search(session, "cn=top", 0, nullptr).size(), 1U);
  ASSERT_EQ(::unlink(path_.c_str()), 0);
  EXPECT_EQ(search(session, "cn=top", 0, "(cn=top)").size(), 1U);
}

TEST_F(BindTest, TheKeyOfTheStashIsOnTheHandle) {
  const std::string stash = directory_.file("key.stash");
  std::string why;
  ASSERT_EQ(cfg::create_key_stash(stash.c_str(), why), 0);
  write_file(path_, kSmall);
  const CfgSession session = unbound();
  ASSERT_EQ(cfg_set_option(session.get(), kCfgOptKeyStashFile, stash.c_str()), 0);
  EXPECT_EQ(session->key, nullptr);
  ASSERT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 0);
  EXPECT_NE(session->key, nullptr);
}

TEST_F(BindTest, AnOpenOrMissingStashIsRefusedByName) {
  const std::string stash = directory_.file("key.stash");
  write_file(path_, kSmall);
  const CfgSession session = unbound();
  cfg_set_option(session.get(), kCfgOptKeyStashFile, stash.c_str());
  EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 1);
  EXPECT_NE(std::string(cfg_dump_exception(session.get())).find(stash), std::string::npos);
  EXPECT_EQ(search_code(session, "cn=top", 0, nullptr), 1);
  std::string why;
  ASSERT_EQ(cfg::create_key_stash(stash.c_str(), why), 0);
  ASSERT_EQ(::chmod(stash.c_str(), 0640), 0);
  EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 1);
  EXPECT_NE(std::string(cfg_dump_exception(session.get())).find("others than its owner"),
            std::string::npos);
}

}  // namespace
}  // namespace orv::cfg_test
