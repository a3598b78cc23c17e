// Persistent searches: clients that are told of changes as they happen
// (draft-ietf-ldapext-psearch).
//
//   search + control 2.16.840.1.113730.3.4.3  ->  the entries there are (unless only changes are
//   wanted), no result, and from then on one entry for each change, with the entry change
//   notification 2.16.840.1.113730.3.4.7 if that was asked for
//
// Nothing is missed and nothing told twice: a search joins the list while its first part holds the
// gate, and a change takes down who is to be told while it holds the gate itself. Who is told of an
// entry that was added or modified sees what a search of its own finds at that time, under its own
// rights; of an entry that was deleted it sees what the backend kept of it, without credentials.
//
// Threads: `PersistentSearches` is thread-safe; a `PersistentSearch` says for each part whose it
// is.
#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "auth/identities.h"
#include "protocol/message.h"
#include "slapi/owners.h"
#include "slapi/psearch.h"
#include "slapi/schema.h"

namespace orv::server {

inline constexpr const char* kPersistentSearchOid = "2.16.840.1.113730.3.4.3";
inline constexpr const char* kEntryChangeOid = "2.16.840.1.113730.3.4.7";

// ---- The two controls

enum class ChangeType : unsigned { add = 1, remove = 2, modify = 4, rename = 8 };

struct PersistentSearchControl {
  unsigned change_types = 0;  // bits of ChangeType, at least one
  bool changes_only = false;
  bool return_notifications = false;
};

// Reads the value of the request control. False when it is not well formed or names no type of
// change, or one that does not exist.
bool read_persistent_search(std::string_view value, PersistentSearchControl& control) noexcept;

// The control that goes with a notice. It refers to memory of its own and does not move.
class EntryChangeControl {
 public:
  explicit EntryChangeControl(ChangeType type) noexcept;
  EntryChangeControl(const EntryChangeControl&) = delete;
  EntryChangeControl& operator=(const EntryChangeControl&) = delete;
  LDAPControl* get() noexcept { return &control_; }

 private:
  char value_[5];
  LDAPControl control_{};
};

// ---- What has changed

// One change. Immutable.
struct Change {
  ChangeType type;
  std::string dn;                       // normal form
  std::shared_ptr<const entry> before;  // what was deleted, in UTF-8; null for other changes
  std::size_t bytes = 0;                // about what it keeps in memory
};
using ChangePtr = std::shared_ptr<const Change>;

// What somebody who is bound as `identity` (null: nobody) may see of an entry that was deleted:
// secrets are the primary administrator's and the entry's own identity's. Null without memory.
EntryPtr visible_part(const Schema& schema, const entry& deleted,
                      const Identity* identity) noexcept;

// ---- Who listens

class PersistentSearch;
class PersistentSearches;
using PersistentSearchPtr = std::shared_ptr<PersistentSearch>;

// A connection with persistent searches.
class ChangeListener {
 public:
  virtual ~ChangeListener() = default;
  // Something happened that `search` waits for; what it is, is found in its queue. Any thread;
  // must only arrange for the work to go on elsewhere.
  virtual void has_news(PersistentSearchPtr search) noexcept = 0;
};

// One persistent search.
class PersistentSearch : public std::enable_shared_from_this<PersistentSearch> {
 public:
  // What may wait for one client. A search that falls further behind is ended: a client that
  // believed to have heard of everything would be worse off.
  static constexpr std::size_t kMostWaiting = 1000;
  static constexpr std::size_t kMostBytes = std::size_t{4} << 20;

  // Immutable.
  const std::int32_t message_id;
  const PersistentSearchControl control;
  const SearchRequest request;
  const std::string base;    // normal form of the request's
  const std::string filter;  // the request's as it is evaluated for this client

  PersistentSearch(std::weak_ptr<ChangeListener> home, std::int32_t id,
                   const PersistentSearchControl& wanted, const SearchRequest& searched,
                   std::string_view normal_base, std::string evaluated_filter);
  ~PersistentSearch();

  // Whether a change of this type at this place is among those that were asked for.
  bool covers(ChangeType type, std::string_view normal_dn) const noexcept;

  // ---- for any thread

  // Queues a change and tells the connection.
  void tell(ChangePtr change) noexcept;

  // It can no longer be told of everything, for this reason.
  void fail(int code) noexcept;

  // It is over: nothing is queued any more, and what was queued is gone.
  void end() noexcept;
  bool ended() const noexcept { return ended_.load(std::memory_order_acquire); }

  // The next change; null when there is none.
  ChangePtr take() noexcept;

  // Why the queue no longer holds all that happened: 0, 11 too much of it, 90 no memory.
  int failure() const noexcept { return failure_.load(std::memory_order_acquire); }

  // ---- for the connection's thread

  // Its first part is answered, so that notices may follow.
  bool established = false;
  std::int64_t notices = 0;  // entries sent since then

 private:
  friend class PersistentSearches;

  int queue(ChangePtr change) noexcept;
  void tell_home() noexcept;

  const std::weak_ptr<ChangeListener> home_;
  std::atomic<bool> ended_{false};
  std::atomic<int> failure_{0};
  PersistentSearches* counted_by_ = nullptr;  // under its mutex

  std::mutex mutex_;
  std::deque<ChangePtr> waiting_;  // under the mutex, oldest first
  std::size_t bytes_ = 0;          // of what waits
};

// All persistent searches of the server. While it exists the backend is told through the global
// parameter block that there may be some; there is one at a time in a process.
class PersistentSearches {
 public:
  PersistentSearches() noexcept;
  ~PersistentSearches();
  PersistentSearches(const PersistentSearches&) = delete;
  PersistentSearches& operator=(const PersistentSearches&) = delete;

  // Counts one more, to be given back with leave(). False when there are `most` already.
  bool count(PersistentSearch& search, std::int64_t most) noexcept;

  // Takes a counted search into the list. Only while it holds the gate. False without memory.
  bool join(const PersistentSearchPtr& search) noexcept;

  // Ends a search, whether it had joined or not.
  void leave(PersistentSearch& search) noexcept;

  // ---- told by whoever makes a change, in this order

  // Who is to be told, as of now. Only while the change holds the gate.
  struct Audience {
    ChangeType type = ChangeType::add;
    std::string dn;
    std::vector<PersistentSearchPtr> searches;
    EntryPtr before;         // of a deleted entry
    bool no_memory = false;  // for the list of them: nobody can be told
  };
  // `before` is the entry before its deletion, as the backend filled it in; null otherwise.
  Audience audience(ChangeType type, std::string_view normal_dn, EntryPtr before) noexcept;

  // Tells them. After the change has left the gate. Searches that cannot be told of a deletion (it
  // was not kept, or has no form in UTF-8) end with 80, those without memory with 90.
  void announce(Audience audience) noexcept;

 private:
  void announce_deletion(Audience& audience);
  static void fail_each(const std::vector<PersistentSearchPtr>& searches, int code) noexcept;
  void fail_all(int code) noexcept;

  PSearchMonitor monitor_;
  std::mutex mutex_;
  std::vector<PersistentSearchPtr> joined_;  // under the mutex
};

}  // namespace orv::server
