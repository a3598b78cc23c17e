// Random changes of a random file, each compared with a small model of the tree and with the rule
// that nothing but the touched entry changes.
#include <algorithm>
#include <optional>
#include <random>

#include "cfg/dn.h"
#include "change_fixture.h"
#include "faulty_files.h"

namespace orv::cfg_test {
namespace {

// The tree as a list of entries by normal DN.
class Model {
 public:
  struct Entry {
    std::string normal;
    std::string parent;
    FoundEntry content;
  };

  static std::string normal(const std::string& dn) {
    std::string text;
    EXPECT_EQ(cfg::normalize_dn(dn, text), 0) << dn;
    return text;
  }

  int add(const std::string& dn, const NewEntry& attributes) {
    const std::string key = normal(dn);
    const std::string above(cfg::parent_of_normal_dn(key));
    if (find(key) != entries.end()) return 68;
    if (!entries.empty() && find(above) == entries.end()) return 9;
    Entry entry{key, above, {dn, {}}};
    for (const NewAttribute& attribute : attributes) {
      entry.content.attributes.emplace_back(attribute.type, attribute.values);
    }
    entries.push_back(std::move(entry));
    return 0;
  }

  int remove(const std::string& dn) {
    const std::string key = normal(dn);
    const auto found = find(key);
    if (found == entries.end()) return 9;
    const bool leaf = std::none_of(entries.begin(), entries.end(),
                                   [&](const Entry& entry) { return entry.parent == key; });
    if (!leaf) return 66;
    if (entries.size() == 1) return 53;
    entries.erase(found);
    return 0;
  }

  std::vector<Entry>::iterator find(const std::string& key) {
    return std::find_if(entries.begin(), entries.end(),
                        [&](const Entry& entry) { return entry.normal == key; });
  }

  std::vector<Entry> entries;
};

class ChangeModelTest : public ChangeTest {
 protected:
  ChangeModelTest() : ChangeTest(memory_directory()) {}

  unsigned below(unsigned end) { return static_cast<unsigned>(random_() % end); }

  std::string random_value() {
    static const std::string pieces[] = {"a",    "B",  " ",    "  ", ":",   "<",        "\n",
                                         "\r\n", "#",  "\xE4", "=",  ",",   "\xC3\xB6", "dn: cn=x",
                                         "long", "\t", "\x7F", "0",  "-\n", "word word"};
    std::string value;
    for (unsigned i = below(40); i > 0; --i) value += pieces[below(std::size(pieces))];
    return value;
  }

  NewEntry random_entry() {
    NewEntry entry = {{"objectClass", {"top"}}};
    const char* types[] = {"bytes", "unknownType", "description"};
    for (const char* type : types) {
      if (below(2) == 0) continue;
      Values values;
      for (unsigned i = 0; i <= below(4); ++i) {
        values.push_back(std::to_string(i) + random_value());  // no two are equal
      }
      entry.push_back({type, std::move(values), below(2) == 0});
    }
    return entry;
  }

  // The same DN, written in another way.
  std::string respelled(const std::string& dn) {
    std::string text;
    for (const char c : dn) {
      if (c == ',') {
        text += below(2) == 0 ? " , " : ",";
      } else if (c >= '0' && c <= '9' && below(3) == 0) {
        text += "\\3";
        text += c;
      } else {
        text += below(2) == 0 ? static_cast<char>(std::toupper(c)) : c;
      }
    }
    return text;
  }

  std::string random_dn(Model& model) {
    if (below(5) == 0) return "cn=nobody,cn=missing,cn=top";
    const auto& some = model.entries[below(static_cast<unsigned>(model.entries.size()))];
    if (below(3) == 0) return respelled(some.content.dn);
    return "cn=" + std::to_string(below(30)) + "," + some.content.dn;
  }

  // A text that is well formed, with comments and blank lines in all places.
  std::string random_file(const std::string& line_end) {
    const auto filler = [&] {
      std::string text;
      for (unsigned i = below(4); i > 0; --i) text += (below(2) == 0 ? "# note" : "") + line_end;
      return text;
    };
    std::string text = filler() + "dn: cn=top" + line_end + "cn: top" + line_end;
    for (unsigned i = 0; i < 6; ++i) {
      text += line_end + filler() + "dn: cn=first " + std::to_string(i) + ",cn=top" + line_end;
      if (below(3) == 0) text += "# inside" + line_end;
      text += "description: one" + line_end + "cn: tw" + line_end + " o" + line_end;
    }
    return text + line_end + filler();
  }

  static void expect_only_inserted(const std::string& before, const std::string& after) {
    std::size_t same = 0;
    while (same < before.size() && before[same] == after[same]) ++same;
    ASSERT_GT(after.size(), before.size());
    // The rest may begin earlier, where the new lines repeat the old ones.
    const std::size_t rest = before.size() - same;
    EXPECT_EQ(after.substr(after.size() - rest), before.substr(same));
    const std::string added = after.substr(same, after.size() - before.size());
    EXPECT_LE(std::count(added.begin(), added.end(), '\n'),
              std::count(after.begin(), after.end(), '\n') -
                  std::count(before.begin(), before.end(), '\n'));
  }

  void expect_tree(const CfgSession& session, Model& model) {
    const auto found = search(session, "cn=top", 2, nullptr);
    ASSERT_EQ(found.size(), model.entries.size());
    for (const FoundEntry& entry : found) {
      const auto expected = model.find(Model::normal(entry.dn));
      ASSERT_NE(expected, model.entries.end()) << entry.dn;
      EXPECT_EQ(entry, expected->content);
    }
  }

  void run(unsigned seed) {
    SCOPED_TRACE(::testing::Message() << "seed " << seed);
    random_.seed(seed);
    FaultyFiles quick;
    write_file(path_, random_file(seed % 2 == 0 ? "\n" : "\r\n"));
    Model model;
    for (const FoundEntry& entry : search(reopen(), "cn=top", 2, nullptr)) {
      ASSERT_EQ(model.add(entry.dn, {}), 0);
      model.entries.back().content = entry;
    }
    CfgSession session = reopen();
    for (int i = 0; i < 60 && !HasFailure(); ++i) {
      if (below(4) == 0) session = reopen();
      write_through(session, quick);
      const std::string before = read_file(path_);
      const std::string dn = random_dn(model);
      const bool adds = below(2) == 0;
      const NewEntry entry = random_entry();
      const int expected = adds ? model.add(dn, entry) : model.remove(dn);
      EXPECT_EQ(adds ? cfg_test::add(session, dn, entry) : remove(session, dn), expected)
          << (adds ? "add " : "delete ") << dn;
      const std::string after = read_file(path_);
      if (expected != 0) {
        EXPECT_EQ(before, after);
      } else {
        adds ? expect_only_inserted(before, after) : expect_only_inserted(after, before);
        EXPECT_EQ(read_file(save_), before);
      }
      expect_tree(session, model);
      expect_tree(reopen(), model);
    }
  }

  std::mt19937 random_;
};

TEST_F(ChangeModelTest, RandomChangesKeepToTheModel) {
  const unsigned first = std::random_device{}();
  for (unsigned i = 0; i < 60 && !HasFailure(); ++i) run(first + i);
}

}  // namespace
}  // namespace orv::cfg_test
