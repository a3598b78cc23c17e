// The persistent searches of a connection: how they begin, hear of changes, and end.
//
// One change is told at a time on a connection, in the order in which the changes were made. What
// was added or modified is looked up by a search of the client's own, which goes through the gate
// like any other.
#include <algorithm>
#include <new>
#include <utility>

#include "cfg/result_codes.h"
#include "ops/session.h"

namespace orv::server {
namespace {

constexpr std::string_view kWhat = "PERSISTENT SEARCH";
constexpr const char* kEverything = "(objectClass=*)";
constexpr const char* kNoAttributes = "1.1";

std::string_view reason(int code) {
  if (code == result::admin_limit_exceeded) return "changes are not read fast enough";
  return code == result::other ? "a deleted entry cannot be told of" : "";
}

}  // namespace

// ---- beginning

// Makes the operation the first part of a persistent search.
Refusal Session::begin_persistent(PendingOperation& operation,
                                  const PersistentSearchControl& control,
                                  const SearchRequest& request, std::string_view normal_base) {
  const auto first_parts =
      std::count_if(outstanding_.begin(), outstanding_.end(),
                    [](const OperationPtr& other) { return other->persistent != nullptr; });
  if (static_cast<std::int64_t>(persistent_.size()) + first_parts >=
      settings().max_persistent_searches_per_connection)
    return {result::admin_limit_exceeded, "too many persistent searches on this connection"};
  std::string filter = filter_for(services_.schema, request.filter, connection_.authority);
  auto search = std::make_shared<PersistentSearch>(std::weak_ptr<ChangeListener>(weak_from_this()),
                                                   operation.answer().message_id(), control,
                                                   request, normal_base, std::move(filter));
  if (!services_.persistent_searches.count(*search, settings().max_persistent_searches))
    return {result::busy, "too many persistent searches"};
  operation.answer().keep_open(!control.changes_only);
  operation.persistent = std::move(search);
  return {};
}

// What tells whether a client may search here at all, when it wants no entries.
SearchRequest Session::probe(const SearchRequest& request) {
  SearchRequest asked = request;
  asked.scope = 0;
  asked.filter = kEverything;
  asked.attributes = {kNoAttributes};
  return asked;
}

// The first part is over, and what it found is on its way.
void Session::first_part_done(PendingOperation& operation) {
  const PersistentSearchPtr search = operation.persistent;
  const Answer& answer = operation.answer();
  // A bind that waits ends what is outstanding before it (RFC 4511, 4.2.1).
  const bool goes_on =
      answer.answered() && answer.code() == 0 && !answer.abandoned() && !gone_ && !bind_;
  if (!goes_on) return;
  persistent_.push_back(search);
  search->established = true;
  if (const int code = search->failure()) return end_persistent(search, code, reason(code));
  next_notice_later();
}

// ---- changes

// Any thread.
void Session::has_news(PersistentSearchPtr search) noexcept {
  try {
    post([this, self = shared_from_this(), search] {
      try {
        hear(search);
      } catch (...) {
        end_for_want_of_memory();
      }
    });
  } catch (...) {
    // The next tick finds it.
    search->fail(result::no_memory);
  }
}

void Session::hear(const PersistentSearchPtr& search) {
  if (gone_ || search->ended()) return;
  if (const int code = search->failure()) {
    if (search->established) end_persistent(search, code, reason(code));
    return;
  }
  news_.push_back(search);
  next_notice();
}

// Tells the next change, when none is being told and the client reads.
void Session::next_notice() {
  while (!gone_ && !notice_ && !news_.empty() && !output_.full()) {
    const PersistentSearchPtr search = news_.front();
    if (!search->ended() && !search->established) return;  // its first part comes first
    news_.pop_front();
    const ChangePtr change = search->ended() ? nullptr : search->take();
    if (!change) continue;
    // Whose rights have shrunk hears nothing more.
    if (!identity_holds()) return;
    if (change->type == ChangeType::remove)
      tell_deletion(*search, *change);
    else
      search_for_notice(search, change);
    return next_notice_later();
  }
}

// Others on this loop have their turn in between.
void Session::next_notice_later() noexcept {
  if (gone_ || news_.empty() || notice_ || output_.full() || notice_posted_) return;
  try {
    post([this, self = shared_from_this()] {
      notice_posted_ = false;
      try {
        next_notice();
      } catch (...) {
        end_for_want_of_memory();
      }
    });
    notice_posted_ = true;
  } catch (...) {
    // The next tick goes on.
  }
}

// No limits: those of the client were for the first part, and time that passes at the gate is not
// the search's.
void Session::search_for_notice(const PersistentSearchPtr& search, const ChangePtr& change) {
  const OperationPtr operation = make_operation(search->message_id, tag::search_done, 0, 0);
  operation->persistent = search;
  operation->notice_of = change;
  operation->answer().keep_open(true);
  if (search->control.return_notifications)
    operation->answer().attach(operation->change_control.emplace(change->type).get());
  SearchRequest request = search->request;
  request.scope = 0;
  const Refusal refusal = operation->prepare_search(services_, request, change->dn);
  // It holds the connection: once it is noted here, nothing may keep it from being completed.
  outstanding_.reserve(outstanding_.size() + 1);
  notice_ = operation;
  submit(operation, refusal);
}

// Whether it matches was decided when it was deleted.
void Session::tell_deletion(PersistentSearch& search, const Change& change) {
  const EntryPtr visible = visible_part(services_.schema, *change.before, identity_.get());
  if (!visible) throw std::bad_alloc();
  if (change.before->attributes && !visible->attributes) return;
  const TextArray names = canonical_names(services_.schema, search.request.attributes);
  EntryChangeControl control(change.type);
  AnswerLimits limits;
  Answer answer(search.message_id, tag::search_done, limits);
  if (search.control.return_notifications) answer.attach(control.get());
  if (answer.entry(*visible, names.get(), search.request.types_only, nullptr) != 0)
    throw std::bad_alloc();
  ++search.notices;
  const std::size_t bytes = answer.bytes().size();
  output_.answered(bytes);
  output_.queued(bytes);
  transmit(answer.bytes());
  output_.settled(bytes);
}

// What a search for a notice found goes to the client, but not its result: one that is no success
// ends the persistent search, because from then on it would not hear of everything.
void Session::notice_done(const OperationPtr& operation) {
  const PersistentSearchPtr search = operation->persistent;
  if (notice_ == operation) notice_.reset();
  Answer& answer = operation->answer();
  const int code = answer.code();
  const bool wanted = !gone_ && !search->ended() && identity_holds();
  if (!wanted || code != 0)
    answer.abandon();
  else
    search->notices += answer.entries();
  deliver(*operation);
  // An entry that has been deleted meanwhile is told of in its turn.
  if (wanted && code != 0 && code != result::no_such_object) end_persistent(search, code, "");
  next_notice_later();
}

// ---- ending

PersistentSearchPtr Session::persistent_search(std::int32_t message_id) const noexcept {
  for (const PersistentSearchPtr& search : persistent_)
    if (search->message_id == message_id) return search;
  return nullptr;
}

// By value: what is handed over may be an element of the list that it is taken out of.
// NOLINTNEXTLINE(performance-unnecessary-value-param)
void Session::end_persistent(PersistentSearchPtr search, int code, std::string_view text) {
  services_.persistent_searches.leave(*search);
  std::erase(persistent_, search);
  if (const OperationPtr operation = notice_; operation && operation->persistent == search)
    if (give_up(operation)) complete(operation);
  if (code == kAbandoned || gone_) {
    log_result(search->message_id, kWhat, kAbandoned, search->notices, Clock::now());
    return;
  }
  respond(search->message_id, tag::search_done, code, text, kWhat);
}

// Without a result: the client knows why, or is gone.
void Session::end_persistent_searches() {
  while (!persistent_.empty()) end_persistent(persistent_.back(), kAbandoned, "");
  news_.clear();
}

// What could not be told when it happened.
void Session::look_after_persistent_searches() {
  const std::vector<PersistentSearchPtr> all = persistent_;
  for (const PersistentSearchPtr& search : all)
    if (const int code = search->failure(); code != 0 && !search->ended())
      end_persistent(search, code, reason(code));
  next_notice_later();
}

}  // namespace orv::server
