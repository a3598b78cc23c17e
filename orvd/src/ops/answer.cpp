#include "ops/answer.h"

#include <new>
#include <vector>

#include "cfg/result_codes.h"

namespace orv::server {

bool Answer::select(char** attributes) noexcept {
  if (selected_ && selected_list_ == attributes) return true;
  if (!selection_.assign(attributes)) return false;
  selected_ = true;
  selected_list_ = attributes;
  return true;
}

bool Answer::append(const orv::entry& e, bool types_only, LDAPControl** controls) noexcept {
  if (!attached_) return encode_entry(bytes_, message_id_, e, selection_, types_only, controls);
  try {
    std::vector<LDAPControl*> all{attached_};
    for (; controls && *controls; ++controls) all.push_back(*controls);
    all.push_back(nullptr);
    return encode_entry(bytes_, message_id_, e, selection_, types_only, all.data());
  } catch (const std::bad_alloc&) {
    return false;
  }
}

int Answer::entry(const orv::entry& e, char** attributes, bool types_only,
                  LDAPControl** controls) noexcept {
  if (is_given_up() || answered_) return result::other;
  if (limits_.entries > 0 && entries_ >= limits_.entries) return result::size_limit_exceeded;
  if (limits_.deadline != Clock::time_point::max() && Clock::now() >= limits_.deadline)
    return result::time_limit_exceeded;
  if (hide_entries_) return result::success;
  if (!select(attributes)) return result::no_memory;
  const std::size_t before = bytes_.size();
  if (!append(e, types_only, controls)) return result::no_memory;
  if (bytes_.size() > limits_.bytes) {
    bytes_.resize(before);
    return result::admin_limit_exceeded;
  }
  ++entries_;
  return result::success;
}

void Answer::result(int code, std::string_view matched_dn, std::string_view text) noexcept {
  ResultAnswer answer{};
  answer.code = code;
  answer.matched_dn = matched_dn;
  answer.text = text;
  result(answer);
}

void Answer::result(const ResultAnswer& answer) noexcept {
  if (answered_ || abandoned()) return;
  ResultAnswer complete = answer;
  complete.message_id = message_id_;
  complete.response_tag = response_tag_;
  if (cut_off_ && complete.code == result::time_limit_exceeded) {
    complete.code = result::unavailable;
    complete.text = "server is stopping";
  }
  if (canceled() && response_tag_ == tag::search_done) replace_by_canceled(complete);
  code_ = complete.code;
  if (open_ && complete.code == result::success) {
    answered_ = true;
    return;
  }
  // Unanswered when it cannot be encoded: the server then tries again with less.
  answered_ = encode_result(bytes_, complete);
}

void Answer::replace_by_canceled(ResultAnswer& answer) noexcept {
  bytes_.clear();
  entries_ = 0;
  answer.code = result::canceled;
  answer.matched_dn = {};
  answer.text = {};
}

bool Answer::attach_to_result(const std::vector<Control>& controls) noexcept {
  if (!answered_ || controls.empty()) return true;
  std::string with;
  if (!encode_again(with, bytes_, message_id_, &controls)) return false;
  bytes_.swap(with);
  return true;
}

namespace {

std::string_view view(const char* text) {
  return text ? std::string_view(text) : "";
}

Answer* answer_of(Operation* operation) {
  return operation ? static_cast<Answer*>(operation->server) : nullptr;
}

bool client_is_gone(const Connection* connection) {
  return connection->state.load(std::memory_order_relaxed) == 0;
}

int send_entry(Backend*, Connection* connection, Operation* operation, entry* e, char** attributes,
               int types_only, void*, void*, void*, LDAPControl** controls) {
  if (!connection || !e) return result::other;
  Answer* const answer = answer_of(operation);
  if (!answer || client_is_gone(connection)) return result::other;
  return answer->entry(*e, attributes, types_only != 0, controls);
}

int send_result(Connection* connection, Operation* operation, int code, const char* matched_dn,
                const char* text) {
  if (!connection) return result::other;
  if (Answer* const answer = answer_of(operation); answer && !client_is_gone(connection))
    answer->result(code, view(matched_dn), view(text));
  return result::success;
}

int send_search_result(Connection* connection, Operation* operation, int code,
                       const char* matched_dn, const char* text, int) {
  return send_result(connection, operation, code, matched_dn, text);
}

}  // namespace

void install_senders(Connection& connection) noexcept {
  connection.send_search_entry = send_entry;
  connection.send_search_result = send_search_result;
  connection.send_result = send_result;
}

}  // namespace orv::server
