// Random sequences of adds, deletes and modifies. After each the whole file is compared, byte by
// byte, with what a model of its lines says; and after a refusal every byte of every file, and all
// that the session shows, with what was there before.
//
// The model knows the file as lines and shares no code with the library: how a new line looks,
// where it goes and which values are equal are written here once more.
#include <dirent.h>

#include <algorithm>
#include <cctype>
#include <map>
#include <optional>
#include <random>

#include "change_fixture.h"
#include "faulty_files.h"

namespace orv::cfg_test {
namespace {

// ---- The model ----

std::string lower(std::string text) {
  for (char& c : text) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  return text;
}

std::string base64(const std::string& bytes) {
  static const char digits[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string text;
  for (std::size_t i = 0; i < bytes.size(); i += 3) {
    unsigned group = 0;
    for (std::size_t k = 0; k < 3; ++k) {
      group = group << 8 | (i + k < bytes.size() ? static_cast<unsigned char>(bytes[i + k]) : 0U);
    }
    for (unsigned k = 0; k < 4; ++k) {
      text += i + k > bytes.size() ? '=' : digits[group >> (18 - 6 * k) & 63];
    }
  }
  return text;
}

// A new line, with its end.
std::string rendered(const std::string& type, const std::string& value, const std::string& end) {
  const auto blank = [](char c) { return c == ' ' || c == '\t'; };
  const bool odd_ends = !value.empty() && (blank(value[0]) || value[0] == ':' || value[0] == '<' ||
                                           blank(value.back()));
  const bool odd_bytes = std::any_of(value.begin(), value.end(), [](unsigned char c) {
    return c >= 0x7F || (c < 0x20 && c != '\t');
  });
  std::string line = type + ":";
  if (odd_ends || odd_bytes) {
    line += ": " + base64(value);
  } else if (!value.empty()) {
    line += " " + value;
  }
  std::string text;
  for (std::size_t room = 76; line.size() > room; room = 75) {
    std::size_t length = room;
    while (line[length - 1] == ' ') --length;
    text += line.substr(0, length) + end + " ";
    line.erase(0, length);
  }
  return text + line + end;
}

class FileModel {
 public:
  struct Line {
    std::string text;
    std::string type{};  // of an attribute, as it is written
    std::string value{};
  };
  // The lines of an entry, and those that stand in front of it.
  struct Entry {
    std::vector<Line> above{};  // blank lines and comments
    std::string dn{};
    std::vector<Line> lines{};  // the first is that of the DN; comments have no type
  };

  std::string end;
  std::vector<Entry> entries;
  std::vector<Line> below;  // behind the last entry's lines

  [[nodiscard]] std::string text() const {
    std::string all;
    for (const Entry& entry : entries) {
      for (const Line& line : entry.above) all += line.text;
      for (const Line& line : entry.lines) all += line.text;
    }
    for (const Line& line : below) all += line.text;
    return all;
  }

  std::vector<Entry>::iterator find(const std::string& dn) {
    return std::find_if(entries.begin(), entries.end(),
                        [&](const Entry& entry) { return lower(entry.dn) == lower(dn); });
  }

  static bool is_below(const std::string& dn, const std::string& top) {
    return lower(dn).ends_with("," + lower(top));
  }

  int add(const std::string& dn, const NewEntry& attributes) {
    if (find(dn) != entries.end()) return 68;
    const std::string parent = dn.substr(dn.find(',') + 1);
    if (find(parent) == entries.end()) return 9;
    Entry entry;
    entry.above = {{end}};
    entry.dn = dn;
    entry.lines = {{rendered("dn", dn, end)}};
    for (const NewAttribute& attribute : attributes) {
      for (std::size_t i = 0; i < attribute.values.size(); ++i) {
        for (std::size_t k = 0; k < i; ++k) {
          if (equal(attribute.type, attribute.values[i], attribute.values[k])) return 20;
        }
        const std::string& value = attribute.values[i];
        entry.lines.push_back({rendered(attribute.type, value, end), attribute.type, value});
      }
    }
    auto after = find(parent);
    for (auto at = entries.begin(); at != entries.end(); ++at) {
      if (is_below(at->dn, parent)) after = std::max(after, at);
    }
    entries.insert(std::next(after), std::move(entry));
    return 0;
  }

  int remove(const std::string& dn) {
    const auto at = find(dn);
    if (at == entries.end()) return 9;
    for (const Entry& entry : entries) {
      if (is_below(entry.dn, dn)) return 66;
    }
    if (entries.size() == 1) return 53;
    const auto next = std::next(at);
    std::vector<Line>& following = next == entries.end() ? below : next->above;
    // One of the blank lines around it goes too.
    if (!at->above.empty() && at->above.back().text == end) {
      if (!following.empty() && following.front().text == end) {
        following.erase(following.begin());
      } else {
        at->above.pop_back();
      }
    }
    following.insert(following.begin(), at->above.begin(), at->above.end());
    entries.erase(at);
    return 0;
  }

  int modify(const std::string& dn, const NewEntry& list) {
    const auto at = find(dn);
    if (at == entries.end()) return 9;
    Editing editing{at->lines, std::vector<bool>(at->lines.size())};
    for (const NewAttribute& mod : list) {
      const int rc = apply(editing, mod);
      if (rc != 0) return rc;
    }
    std::vector<Line> left;
    bool has_value = false;
    for (std::size_t i = 0; i < editing.lines.size(); ++i) {
      if (editing.gone[i]) continue;
      left.push_back(editing.lines[i]);
      has_value = has_value || !left.back().type.empty();
    }
    if (!has_value) return 65;
    at->lines = left;
    return 0;
  }

 private:
  struct Editing {
    std::vector<Line> lines;
    std::vector<bool> gone;  // still there to show where values stood
  };

  // "bytes" is compared as it is, all others without regard to case and to the number of blanks.
  static bool equal(const std::string& type, const std::string& a, const std::string& b) {
    if (lower(type) == "bytes") return a == b;
    const auto form = [](const std::string& value) {
      std::string text;
      for (const char c : lower(value)) {
        if (c != ' ' || (!text.empty() && text.back() != ' ')) text += c;
      }
      while (text.ends_with(' ')) text.pop_back();
      return text;
    };
    return form(a) == form(b);
  }

  static bool is_of(const Line& line, const std::string& type) {
    return lower(line.type) == lower(type);
  }

  // Takes values away; how many there were.
  template <class Which>
  static int take(Editing& editing, const std::string& type, Which which) {
    int count = 0;
    for (std::size_t i = 0; i < editing.lines.size(); ++i) {
      if (editing.gone[i] || !is_of(editing.lines[i], type) || !which(editing.lines[i])) continue;
      editing.gone[i] = true;
      ++count;
    }
    return count;
  }

  // Behind the last value, also one that is gone; else behind the last line that is no comment.
  void append(Editing& editing, const std::string& type, const std::string& value) const {
    std::optional<std::size_t> last;
    std::size_t last_of_all = 0;
    for (std::size_t i = 0; i < editing.lines.size(); ++i) {
      if (is_of(editing.lines[i], type)) last = i;
      if (!editing.lines[i].type.empty()) last_of_all = i;
    }
    const auto at = static_cast<std::ptrdiff_t>(last.value_or(last_of_all) + 1);
    editing.lines.insert(editing.lines.begin() + at, {rendered(type, value, end), type, value});
    editing.gone.insert(editing.gone.begin() + at, false);
  }

  int apply(Editing& editing, const NewAttribute& mod) const {
    const auto all = [](const Line&) { return true; };
    const auto is = [&](const std::string& value) {
      return [&](const Line& line) { return equal(mod.type, line.value, value); };
    };
    const auto has = [&](auto which) {
      Editing trial = editing;
      return take(trial, mod.type, which) > 0;
    };
    if (mod.code == kModDelete) {
      if (!has(all)) return 16;
      if (mod.values.empty()) take(editing, mod.type, all);
      for (const std::string& value : mod.values) {
        if (take(editing, mod.type, is(value)) == 0) return 16;
      }
      return 0;
    }
    if (mod.code == kModAdd && mod.values.empty()) return 2;
    for (std::size_t i = 0; i < mod.values.size(); ++i) {
      for (std::size_t k = 0; k < i; ++k) {
        if (equal(mod.type, mod.values[i], mod.values[k])) return 20;
      }
      if (mod.code == kModAdd && has(is(mod.values[i]))) return 20;
    }
    std::vector<std::string> wanted = mod.values;
    if (mod.code == kModReplace) {
      // What is there byte for byte stays where it is.
      for (std::size_t i = 0; i < editing.lines.size(); ++i) {
        if (editing.gone[i] || !is_of(editing.lines[i], mod.type)) continue;
        const auto same = std::find(wanted.begin(), wanted.end(), editing.lines[i].value);
        if (same == wanted.end()) {
          editing.gone[i] = true;
        } else {
          wanted.erase(same);
        }
      }
    }
    for (const std::string& value : wanted) append(editing, mod.type, value);
    return 0;
  }
};

// ---- The tests ----

class FileModelTest : public ChangeTest {
 protected:
  FileModelTest() : ChangeTest(memory_directory()) {}

  unsigned below(unsigned end) { return static_cast<unsigned>(random_() % end); }

  std::string random_value(bool plain) {
    static const std::string easy[] = {"a", "A", "b", "word", " ", "  ", "7", "x y"};
    static const std::string odd[] = {"\n",
                                      ":",
                                      "<",
                                      "\xE4",
                                      "\xC3\xB6",
                                      "\r\n",
                                      "#",
                                      "\t",
                                      "- ",
                                      "dn: cn=x",
                                      "a rather long piece of text"};
    std::string value = easy[below(4)];
    if (below(4) == 0) value = " " + value;
    for (unsigned i = below(plain ? 2 : 20); i > 0; --i) {
      value += plain || below(2) == 0 ? easy[below(std::size(easy))] : odd[below(std::size(odd))];
    }
    return value;
  }

  NewAttribute random_attribute(int code) {
    // Values of the type that ignores case are few and plain, so that equal ones are met.
    static const char* const types[] = {"ou", "ou", "unknownType", "bytes", "description"};
    NewAttribute attribute;
    attribute.type = types[below(std::size(types))];
    attribute.counted = below(2) == 0;
    attribute.code = code;
    const bool plain = attribute.type != "bytes";
    for (unsigned i = below(4); i > 0; --i) attribute.values.push_back(random_value(plain));
    return attribute;
  }

  NewEntry random_entry() {
    NewEntry entry = {{"cn", {"entry"}}};
    std::map<std::string, bool> seen;
    for (unsigned i = below(4); i > 0; --i) {
      NewAttribute attribute = random_attribute(kModAdd);
      if (attribute.values.empty() || seen[attribute.type]) continue;
      seen[attribute.type] = true;
      entry.push_back(std::move(attribute));
    }
    return entry;
  }

  // Often a value that is there, so that deletes succeed.
  NewEntry random_list(const FileModel::Entry* entry) {
    NewEntry list;
    for (unsigned i = 0; i <= below(3); ++i) {
      NewAttribute mod = random_attribute(static_cast<int>(below(3)));
      if (entry != nullptr && below(2) == 0) {
        const auto& line = entry->lines[below(static_cast<unsigned>(entry->lines.size()))];
        if (!line.type.empty()) {
          mod.type = line.type;
          mod.values = {line.value};
        }
      }
      list.push_back(std::move(mod));
    }
    return list;
  }

  std::string random_dn(FileModel& model) {
    if (below(8) == 0) return "cn=nobody,cn=missing,cn=top";
    const auto& some = model.entries[below(static_cast<unsigned>(model.entries.size()))];
    return below(3) != 0 ? some.dn : "cn=" + std::to_string(below(30)) + "," + some.dn;
  }

  std::vector<FileModel::Line> filler(const std::string& end) {
    std::vector<FileModel::Line> lines;
    for (unsigned i = below(4); i > 0; --i)
      lines.push_back({(below(2) == 0 ? "# note" : "") + end});
    return lines;
  }

  FileModel random_file(const std::string& end) {
    FileModel model;
    model.end = end;
    model.entries.push_back({filler(end), "cn=top", {{"dn: cn=top" + end}}});
    model.entries.back().lines.push_back({"cn: top" + end, "cn", "top"});
    for (unsigned i = 0; i < 5; ++i) {
      FileModel::Entry entry;
      entry.above = {{end}};
      for (auto& line : filler(end)) entry.above.push_back(line);
      entry.dn = "cn=first " + std::to_string(i) + ",cn=top";
      entry.lines = {{"dn: " + entry.dn + end}};
      entry.lines.push_back(
          {"cn: first " + std::to_string(i) + end, "cn", "first " + std::to_string(i)});
      if (below(2) == 0) entry.lines.push_back({"# inside" + end});
      entry.lines.push_back({"OU:  two wo" + end + " rds" + end, "ou", "two words"});
      entry.lines.push_back({"bytes:: " + base64("x\n") + end, "bytes", "x\n"});
      entry.lines.push_back({"ou: a" + end, "ou", "a"});
      if (below(2) == 0) entry.lines.push_back({"# last" + end});
      model.entries.push_back(std::move(entry));
    }
    if (below(2) == 0) {
      model.below = {{end}};
      for (auto& line : filler(end)) model.below.push_back(line);
    }
    return model;
  }

  [[nodiscard]] std::map<std::string, std::string> all_files() const {
    std::map<std::string, std::string> files;
    DIR* const directory = ::opendir(directory_.file("").c_str());
    while (const dirent* const entry = ::readdir(directory)) {
      const std::string name = entry->d_name;
      if (name != "." && name != "..") files[name] = read_file(directory_.file(name));
    }
    ::closedir(directory);
    return files;
  }

  void run(unsigned seed) {
    SCOPED_TRACE(::testing::Message() << "seed " << seed);
    random_.seed(seed);
    FaultyFiles quick;
    FileModel model = random_file(seed % 2 == 0 ? "\n" : "\r\n");
    write_file(path_, model.text());
    CfgSession session = reopen();
    // It is made by the first change and stays.
    write_file(path_ + ".lock", "");
    for (int i = 0; i < 60 && !HasFailure(); ++i) {
      if (below(4) == 0) session = reopen();
      write_through(session, quick);
      const auto files_before = all_files();
      const auto shown_before = search(session, "cn=top", 2, nullptr);
      const cfg::SnapshotPtr snapshot = cfg::session_of(session.get())->snapshot;
      const std::string dn = random_dn(model);
      const auto target = model.find(dn);
      const NewEntry entry = random_entry();
      const NewEntry list = random_list(target == model.entries.end() ? nullptr : &*target);
      int expected = 0;
      int rc = 0;
      switch (below(4)) {
        case 0:
          expected = model.add(dn, entry);
          rc = cfg_test::add(session, dn, entry);
          break;
        case 1:
          expected = model.remove(dn);
          rc = cfg_test::remove(session, dn);
          break;
        default:
          expected = model.modify(dn, list);
          Mods mods(list);
          rc = cfg_modify_s(session.get(), dn.c_str(), mods.get());
      }
      ASSERT_EQ(rc, expected) << dn;
      ASSERT_EQ(read_file(path_), model.text());
      ++codes_[rc];
      if (rc != 0) {
        EXPECT_EQ(all_files(), files_before);
        EXPECT_EQ(cfg::session_of(session.get())->snapshot, snapshot);
        EXPECT_EQ(search(session, "cn=top", 2, nullptr), shown_before);
      } else {
        EXPECT_EQ(search(session, "cn=top", 2, nullptr), search(reopen(), "cn=top", 2, nullptr));
      }
    }
  }

  std::mt19937 random_;
  std::map<int, int> codes_;
};

TEST_F(FileModelTest, RandomChangesLeaveTheFileThatTheModelSays) {
  const unsigned first = std::random_device{}();
  for (unsigned i = 0; i < 80 && !HasFailure(); ++i) run(first + i);
  // All answers were met.
  for (const int code : {0, 9, 16, 20, 66, 68}) EXPECT_GT(codes_[code], 20) << code;
}

}  // namespace
}  // namespace orv::cfg_test
