// Who may do what to the configuration, and what comes of it: the rules of authority and of the
// administrators' identities, written a second time and for themselves, so that the backend can be
// compared with them in many cases.
//
// It knows neither sessions nor the order of calls, only what a request comes to: its result, the
// text that goes with it, what is written, and what of an entry is seen. What the server decides
// (the schema, passwords, addresses) is an input. Whatever is a rule stands in authority_model.cpp,
// in tables where there is more than one row of it.
#pragma once

#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace orv::model {

using Texts = std::vector<std::string>;

struct Attribute {
  std::string type;
  Texts values;
};

struct Entry {
  std::string dn;
  std::vector<Attribute> attributes;

  // The values of an attribute, named in any letter case; null when it is absent.
  [[nodiscard]] const Texts* values(const std::string& type) const;
  // Its first value, or null.
  [[nodiscard]] const std::string* first(const std::string& type) const;
  void remove(const std::string& type);
};

// Parents before their children.
class File {
 public:
  explicit File(std::vector<Entry> entries);

  // The entry of that name in whatever spelling, or null.
  [[nodiscard]] const Entry* find(const std::string& dn) const;
  // The entries at a name and below it, in their order.
  [[nodiscard]] std::vector<const Entry*> subtree(const std::string& dn) const;
  [[nodiscard]] std::vector<const Entry*> children(const std::string& dn) const;

 private:
  std::vector<Entry> entries_;
  Texts names_;  // of the entries, in normal form
};

// The normal form of a name: in upper case, without blanks around separators.
std::string normal(const std::string& dn);
// The name above it, or "".
std::string parent_of(const std::string& dn);
bool same(const std::string& a, const std::string& b);  // ignoring case

enum class Kind { add = 0, remove = 1, replace = 2 };

struct Modification {
  Kind kind;
  std::string type;
  std::optional<Texts> values;  // none, an empty list, or some
};
using Modifications = std::vector<Modification>;

// Who asks. Flags and roles stand on the operation and once more on the connection.
struct Caller {
  unsigned authority = 0;
  unsigned roles = 0;
  std::string bound_dn;  // in normal form
  unsigned connection_authority = 0;
  unsigned connection_roles = 0;
};

// What the server decides, and what the file holds.
struct Server {
  const File* file = nullptr;
  int kind = 0;
  int caller_mark = 0;  // 1 lets it search a server of kind 3
  bool safe_mode = false;
  bool password_policy = false;
  int password = 0;           // what the policy says of a new password
  int policy_settings = 0;    // ... and of its own new settings
  int encryption_method = 0;  // whether the configuration allows the method named
  int schema = 0;             // what the schema says of the entry, or of the entry as changed
  int schema_again = 0;       // ... and when it is asked once more
  int referral = 0;
  std::set<std::string> addresses;           // of the host
  std::map<std::string, int> supplied;       // suffixes of the caller's; "" is the whole server
  std::map<std::string, std::string> links;  // paths that lead elsewhere
  std::set<std::string> encryption_methods;  // that exist
};

struct Outcome {
  int code = 0;
  std::string text;
  // The library's call, as the platform shows it; "" when nothing is written.
  std::string written;
};

struct View {
  int code = 0;
  std::vector<Entry> entries;
};

// `dn` is the name in normal form, or what arrives in its place; `e` has it as the client gave it.
Outcome adding(const Server& server, const Caller& caller, Entry e, const std::string& dn);
Outcome deleting(const Server& server, const Caller& caller, const std::string& dn);
Outcome modifying(const Server& server, const Caller& caller, const std::string& dn,
                  Modifications list);
// What the caller sees of what the file gave for a search; no list where the base is missing.
View searching(const Server& server, const Caller& caller,
               const std::optional<std::vector<Entry>>& found);

}  // namespace orv::model
