// A file that is replaced while sessions are opened: each sees the old version or the new, whole.
#include <atomic>
#include <thread>

#include "cfg_fixture.h"

namespace orv::cfg_test {
namespace {

class ReplacementTest : public CfgTest {
 protected:
  // A file of which every entry carries the version; versions differ in length.
  static std::string version(int number) {
    const std::string mark = number % 2 == 0 ? "even" : "the odd version";
    std::string content = "dn: cn=top\ndescription: " + mark + "\n\n";
    for (int i = 0; i < 400 + number % 2 * 300; ++i) {
      content += "dn: cn=e" + std::to_string(i) + ",cn=top\ndescription: " + mark + "\n\n";
    }
    return content;
  }
};

TEST_F(ReplacementTest, EachOpenSeesOneVersionWhole) {
  write_file(path_, version(0));
  std::atomic<bool> stop{false};
  std::atomic<int> replaced{0};
  std::thread writer([&] {
    const std::string next = directory_.file("next");
    for (int number = 1; !stop.load(); ++number) {
      write_file(next, version(number));
      std::rename(next.c_str(), path_.c_str());
      ++replaced;
    }
  });
  int opened[2] = {0, 0};
  for (int i = 0; i < 3000 && (i < 300 || replaced.load() < 100); ++i) {
    const CfgSession session = unbound();
    const int rc = cfg_bind_s(session.get(), nullptr, nullptr, 128);
    if (rc != 0) {
      ADD_FAILURE() << cfg_dump_exception(session.get());
      break;
    }
    const std::size_t odd = search(session, "cn=top", 2, "(description=the odd version)").size();
    const std::size_t even = search(session, "cn=top", 2, "(description=even)").size();
    if (!((odd == 701 && even == 0) || (odd == 0 && even == 401))) {
      ADD_FAILURE() << odd << " odd, " << even << " even";
      break;
    }
    ++opened[odd != 0];
  }
  stop = true;
  writer.join();
  EXPECT_GT(opened[0] + opened[1], 0);
}

TEST_F(ReplacementTest, SessionsOfManyThreadsAreIndependent) {
  write_file(path_, version(0));
  std::vector<std::thread> threads;
  std::atomic<int> good{0};
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&] {
      for (int i = 0; i < 50; ++i) {
        CfgSession session(cfg_init(nullptr, 0));
        cfg_set_option(session.get(), kCfgOptConfigFile, path_.c_str());
        _CFGMessage* chain = nullptr;
        if (cfg_bind_s(session.get(), nullptr, nullptr, 128) == 0 &&
            cfg_search_s(session.get(), "cn=top", 2, "(description=even)", nullptr, 0, &chain) ==
                0 &&
            cfg_count_entries(session.get(), chain) == 401) {
          ++good;
        }
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(good.load(), 200);
}

TEST_F(ReplacementTest, ASessionMayEndOnAnotherThread) {
  CfgSession session = open(version(1));
  std::thread([&] {
    EXPECT_EQ(search(session, "cn=top", 2, nullptr).size(), 701U);
    session.reset();
  }).join();
}

}  // namespace
}  // namespace orv::cfg_test
