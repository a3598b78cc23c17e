// What stands behind the handles of cfg/session.h.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "attribute_lookup.h"
#include "attribute_map.h"
#include "cfg/session.h"
#include "file_calls.h"
#include "file_text.h"
#include "ldif_index.h"
#include "secret_key.h"

namespace orv {

// Common to a chain and its records, which callers hold as the same type.
struct _CFGMessage {
  enum class Kind : unsigned char { chain, record };
  Kind kind;
};

}  // namespace orv

namespace orv::cfg {

struct Chain;

// One version of the file: its text, and what stands where in it. A session goes on to another with
// each change of its own; results keep the one that they are of.
struct Snapshot {
  FileText text;
  LdifIndex index;
};
using SnapshotPtr = std::shared_ptr<const Snapshot>;

// The session. Chains that its user never releases go with it.
struct Session : _CFG {
  enum class State { unbound, bound, failed };

  ~Session();

  std::string config_file;
  std::string save_file;
  std::string key_stash_file;
  bool keeps_details = true;   // option 1001
  bool names_position = true;  // option 1002

  State state = State::unbound;
  int last_error = 0;
  SnapshotPtr snapshot;     // null until the session is bound
  AttributeMap attributes;  // of the entry whose record was looked at last
  SharedKey owned_key;
  FileFault fault;
  std::string fault_file;  // the file the fault is about
  std::string dump;
  Chain* chains = nullptr;
  FileCalls* files = &system_file_calls();  // with which it waits for writers, and writes changes
};

// Which attributes a search asked for.
class Selection {
 public:
  // `names` as for cfg_search_s. Throws std::bad_alloc.
  explicit Selection(char** names);

  [[nodiscard]] bool has_all() const noexcept { return all_; }
  [[nodiscard]] bool has(const KnownType* known, std::string_view name) const noexcept;

 private:
  struct Name {
    const KnownType* known;
    std::string text;
  };
  bool all_ = false;
  std::vector<Name> names_;
};

// One entry of a result: a block of its own from malloc, which its holder may free once it is
// unlinked. It holds no values, only where they stand in the session's text.
struct Record : _CFGMessage {
  Chain* chain;
  Record* previous;
  Record* next;
  std::uint32_t entry;
};

struct Chain : _CFGMessage {
  Chain(Session& owner, char** attributes, bool types_only);
  ~Chain();
  Chain(const Chain&) = delete;
  Chain& operator=(const Chain&) = delete;

  // Appends a record; throws std::bad_alloc.
  void append(std::uint32_t entry);
  void unlink(Record& record) noexcept;

  Session* session;
  const SnapshotPtr snapshot;
  Chain* previous_chain = nullptr;
  Chain* next_chain = nullptr;
  Record* first = nullptr;
  Record* last = nullptr;
  int count = 0;
  bool types_only;
  Selection selection;
};

// The session behind a handle; null for null and for the reserved handle that stands for "no
// memory".
Session* session_of(_CFG* handle) noexcept;

// Whether this is the reserved handle.
bool is_reserved(const _CFG* handle) noexcept;

// The record behind a message; null for null, for a chain, and for a record without a chain.
Record* record_of(_CFGMessage* message) noexcept;
Chain* chain_of(_CFGMessage* message) noexcept;

}  // namespace orv::cfg
