// Changes of a file of the test's own, and what the file then holds.
#pragma once

#include <fstream>
#include <iterator>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "cfg/diagnostics.h"
#include "cfg/ldapmod.h"
#include "cfg_fixture.h"
#include "file_calls.h"
#include "session_state.h"

namespace orv::cfg_test {

// An attribute of an entry to add.
struct NewAttribute {
  std::string type;
  Values values;
  bool counted = false;  // values with a length
  int code = kModAdd;
};
using NewEntry = std::vector<NewAttribute>;

// A modification list, every part of it a block of its own.
class Mods {
 public:
  explicit Mods(const NewEntry& entry) {
    for (const NewAttribute& attribute : entry) add(attribute);
    list_.push_back(nullptr);
  }

  ldapmod** get() noexcept { return list_.data(); }

 private:
  void add(const NewAttribute& attribute) {
    auto holder = std::make_unique<Holder>();
    holder->attribute = attribute;
    for (std::string& value : holder->attribute.values) {
      holder->counted.push_back({value.size(), value.data()});
      holder->strings.push_back(value.data());
    }
    for (berval& value : holder->counted) holder->pointers.push_back(&value);
    holder->pointers.push_back(nullptr);
    holder->strings.push_back(nullptr);
    holder->mod.mod_op = attribute.code | (attribute.counted ? kModBvalues : 0);
    holder->mod.mod_type = holder->attribute.type.data();
    if (attribute.counted) {
      holder->mod.mod_vals.modv_bvals = holder->pointers.data();
    } else {
      holder->mod.mod_vals.modv_strvals = holder->strings.data();
    }
    if (attribute.values.empty()) holder->mod.mod_vals.modv_strvals = nullptr;
    list_.push_back(&holder->mod);
    holders_.push_back(std::move(holder));
  }

  struct Holder {
    NewAttribute attribute;
    std::vector<berval> counted;
    std::vector<berval*> pointers;
    std::vector<char*> strings;
    ldapmod mod{};
  };
  std::vector<std::unique_ptr<Holder>> holders_;
  std::vector<ldapmod*> list_;
};

inline int add(const CfgSession& session, const std::string& dn, const NewEntry& entry) {
  Mods mods(entry);
  const int rc = cfg_add_s(session.get(), dn.c_str(), mods.get());
  EXPECT_EQ(cfg_get_errno(session.get()), rc);
  return rc;
}

inline int remove(const CfgSession& session, const std::string& dn) {
  const int rc = cfg_delete_s(session.get(), dn.c_str());
  EXPECT_EQ(cfg_get_errno(session.get()), rc);
  return rc;
}

inline int modify(const CfgSession& session, const std::string& dn, const NewEntry& list) {
  Mods mods(list);
  const int rc = cfg_modify_s(session.get(), dn.c_str(), mods.get());
  EXPECT_EQ(cfg_get_errno(session.get()), rc);
  return rc;
}

inline std::string read_file(const std::string& path) {
  std::ifstream file(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>()};
}

inline bool exists(const std::string& path) {
  struct stat status {};
  return ::lstat(path.c_str(), &status) == 0;
}

// Lets a session write through other file calls.
inline void write_through(const CfgSession& session, cfg::FileCalls& calls) {
  cfg::session_of(session.get())->files = &calls;
}

// Where files cost least, for tests that write thousands of them.
inline std::string memory_directory() {
  return ::access("/dev/shm", W_OK | X_OK) == 0 ? "/dev/shm" : "/tmp";
}

class ChangeTest : public CfgTest {
 protected:
  using CfgTest::CfgTest;

  // Reasons of refusals go to `told`, for the length of a test; from any thread, to be read when
  // the threads have ended.
  void SetUp() override {
    CfgTest::SetUp();
    told.clear();
    cfg::set_diagnostics_sink([](const char* line) noexcept {
      const std::lock_guard lock(told_mutex);
      (told += line) += '\n';
    });
  }
  void TearDown() override { cfg::set_diagnostics_sink(nullptr); }
  inline static std::string told;
  inline static std::mutex told_mutex;

  // A handle with the paths of file and save file set.
  CfgSession unbound_with_save() {
    CfgSession session = unbound();
    EXPECT_EQ(cfg_set_option(session.get(), kCfgOptSaveFile, save_.c_str()), 0);
    return session;
  }

  // A bound session on the file as it is.
  CfgSession reopen() {
    CfgSession session = unbound_with_save();
    EXPECT_EQ(cfg_bind_s(session.get(), nullptr, nullptr, 128), 0)
        << cfg_dump_exception(session.get());
    return session;
  }

  CfgSession open_for_change(std::string_view content) {
    write_file(path_, content);
    return reopen();
  }

  // The file after an entry was added to a file with `content`.
  std::string after_add(std::string_view content, const std::string& dn, const NewEntry& entry) {
    const CfgSession session = open_for_change(content);
    EXPECT_EQ(add(session, dn, entry), 0) << cfg_dump_exception(session.get());
    return read_file(path_);
  }

  std::string after_delete(std::string_view content, const std::string& dn) {
    const CfgSession session = open_for_change(content);
    EXPECT_EQ(remove(session, dn), 0) << cfg_dump_exception(session.get());
    return read_file(path_);
  }

  // The code of an add that must not change the file.
  int refused_add(std::string_view content, const std::string& dn, const NewEntry& entry) {
    const CfgSession session = open_for_change(content);
    const int rc = add(session, dn, entry);
    EXPECT_EQ(read_file(path_), content);
    EXPECT_FALSE(exists(save_));
    return rc;
  }

  int refused_delete(std::string_view content, const std::string& dn) {
    const CfgSession session = open_for_change(content);
    const int rc = remove(session, dn);
    EXPECT_EQ(read_file(path_), content);
    EXPECT_FALSE(exists(save_));
    return rc;
  }

  const std::string save_ = path_ + ".save";
};

}  // namespace orv::cfg_test
