// Random files against a slow, straightforward reader of the same format.
#include <map>
#include <random>
#include <sstream>

#include "cfg/dn.h"
#include "cfg/text.h"
#include "cfg_fixture.h"

namespace orv::cfg_test {
namespace {

// Reads well-formed files only, one step at a time: lines, unfolded lines, entries.
std::vector<FoundEntry> read_slowly(const std::string& content) {
  std::vector<std::string> lines;
  std::istringstream stream(content);
  for (std::string line; std::getline(stream, line);) {
    if (!line.empty() && line.back() == '\r') line.pop_back();
    if (!line.empty() && line[0] == ' ') {
      lines.back() += line.substr(1);
    } else {
      lines.push_back(line);
    }
  }
  std::vector<FoundEntry> entries;
  bool inside = false;
  for (const std::string& line : lines) {
    if (line.empty()) inside = false;
    if (line.empty() || line[0] == '#') continue;
    const std::size_t colon = line.find(':');
    const bool encoded = line.substr(colon, 2) == "::";
    std::string value = line.substr(colon + (encoded ? 2 : 1));
    value.erase(0, std::min(value.find_first_not_of(' '), value.size()));
    std::size_t at = 0;
    if (encoded) {
      EXPECT_EQ(cfg::base64_decode(value, value, at), 0);
    }
    if (!inside) {
      entries.push_back({value, {}});
      inside = true;
      continue;
    }
    const cfg::AttributeType* const known = cfg::find_attribute_type(line.substr(0, colon));
    const std::string name = known != nullptr ? known->name : line.substr(0, colon);
    auto& attributes = entries.back().attributes;
    auto found = attributes.begin();
    while (found != attributes.end() && !cfg::equals_ignore_ascii_case(found->first, name)) ++found;
    if (found == attributes.end()) found = attributes.insert(found, {name, {}});
    found->second.push_back(value);
  }
  return entries;
}

class Writer {
 public:
  explicit Writer(unsigned seed) : random_(seed) {}

  std::string write(std::vector<std::string>& dns) {
    std::string out;
    for (int i = 0; i < 40; ++i) {
      const std::string parent = dns.empty() ? "" : dns[random_() % dns.size()];
      const std::string dn = std::string("cn=e") + std::to_string(i) +
                             (parent.empty() ? "" : (chance(4) ? " , " : ",") + parent);
      dns.push_back(dn);
      if (chance(4)) out += fold(std::string("# comment ") + word(), false);
      out += line(chance(5) ? "DN" : "dn", dn);
      for (std::size_t n = 1 + random_() % 8; n > 0; --n) {
        if (chance(6)) out += fold(std::string("#") + word(), false);
        const char* names[] = {"cn",          "COMMONNAME", "2.5.4.11", "ou",
                               "description", "Free-Type",  "x"};
        out += line(names[random_() % 7], value());
      }
      for (std::size_t n = 1 + random_() % 2; n > 0; --n) out += end();
    }
    return out;
  }

 private:
  bool chance(unsigned n) { return random_() % n == 0; }
  std::string end() { return chance(3) ? "\r\n" : "\n"; }
  std::string word() {
    std::string text;
    for (std::size_t n = random_() % 30; n > 0; --n)
      text += static_cast<char>('!' + random_() % 90);
    return text;
  }
  std::string value() {
    std::string text = word();
    if (chance(4)) text.append(" ").append(word());
    if (chance(6)) text += "\xC3\xA4";
    if (chance(8)) text = std::string(1 + random_() % 3, '\t') + text + " ";
    return text;
  }
  std::string fold(const std::string& text, bool anywhere) {
    std::string out;
    for (std::size_t i = 0; i < text.size(); ++i) {
      if (i > (anywhere ? 0U : 1U) && chance(25)) out += end() + " ";
      out += text[i];
    }
    return out + end();
  }
  std::string line(const std::string& type, const std::string& text) {
    const bool unsafe = text.empty() || text[0] == ' ' || text[0] == ':' || text[0] == '<';
    if (!unsafe && !chance(4))
      return fold(type + ":" + std::string(random_() % 3, ' ') + text, true);
    std::string encoded;
    cfg::base64_encode(text, encoded);
    return fold(type + "::" + std::string(random_() % 3, ' ') + encoded, true);
  }
  std::mt19937 random_;
};

class ReferenceTest : public CfgTest {};

TEST_F(ReferenceTest, RandomFilesReadTheSame) {
  for (unsigned seed = 0; seed < 150; ++seed) {
    std::vector<std::string> spelled;
    const std::string content = Writer(seed).write(spelled);
    const CfgSession session = open(content);
    const std::vector<FoundEntry> expected = read_slowly(content);
    ASSERT_EQ(search(session, spelled[0].c_str(), 2, nullptr), expected) << "seed " << seed;

    std::vector<std::string> normal(expected.size());
    for (std::size_t i = 0; i < expected.size(); ++i) {
      ASSERT_EQ(cfg::normalize_dn(expected[i].dn, normal[i]), 0);
    }
    for (std::size_t i = 0; i < expected.size(); ++i) {
      Values subtree;
      Values children;
      for (std::size_t k = 0; k < expected.size(); ++k) {
        if (cfg::normal_dn_is_at_or_below(normal[k], normal[i])) subtree.push_back(expected[k].dn);
        if (cfg::parent_of_normal_dn(normal[k]) == normal[i]) children.push_back(expected[k].dn);
      }
      ASSERT_EQ(dns(search(session, normal[i].c_str(), 0, nullptr)), (Values{expected[i].dn}));
      ASSERT_EQ(dns(search(session, normal[i].c_str(), 1, nullptr)), children) << "seed " << seed;
      ASSERT_EQ(dns(search(session, normal[i].c_str(), 2, nullptr)), subtree) << "seed " << seed;
    }
  }
}

TEST_F(ReferenceTest, AThousandBrothersAndCousinsAreFoundByTheirDns) {
  std::string content = "dn: o=top\no: top\n\n";
  for (int i = 0; i < 50; ++i) {
    content += "dn: ou=u" + std::to_string(i) + ",o=top\nou: x\n\n";
  }
  for (int i = 0; i < 5000; ++i) {
    content +=
        "dn: cn=c" + std::to_string(i) + ",ou=u" + std::to_string(i % 50) + ",o=top\ncn: x\n\n";
  }
  const CfgSession session = open(content);
  EXPECT_EQ(search(session, "o=top", 2, nullptr).size(), 5051U);
  EXPECT_EQ(search(session, "ou=u7,o=top", 1, nullptr).size(), 100U);
  for (int i = 0; i < 5000; i += 37) {
    const std::string dn = "CN=C" + std::to_string(i) + ",OU=U" + std::to_string(i % 50) + ",O=TOP";
    ASSERT_EQ(search(session, dn.c_str(), 0, nullptr).size(), 1U) << dn;
    ASSERT_EQ(search_code(session, ("CN=X" + dn).c_str(), 0, nullptr), 32);
  }
}

}  // namespace
}  // namespace orv::cfg_test
