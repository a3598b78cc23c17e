#include "client.h"

#include <new>
#include <utility>
#include <variant>

#include "ops/persistent_search.h"
#include "protocol/ber_parser.h"
#include "protocol/control_values.h"
#include "protocol/encoder.h"

namespace orv::fuzz {
namespace {

using server::Element;

constexpr unsigned kNobody = 0x24;
constexpr int kInProgress = 14;

// The first element, which has to be there: the server's own output is well formed.
Element first_of(std::string_view& bytes) {
  server::BerParser parser;
  Element element;
  require(parser.take(bytes, element), "answers are well formed");
  return element;
}

std::int32_t number_in(std::string_view contents) {
  std::int32_t value = -1;
  require(server::read_integer(contents, value) == server::IntegerState::good, "a number");
  return value;
}

bool has_control(const server::Message& message, std::string_view oid) {
  for (const server::Control& control : message.controls)
    if (control.oid == oid) return true;
  return false;
}

}  // namespace

FuzzedClient::FuzzedClient(Round& round, std::uint64_t number, server::TransportFacts facts)
    : Session(round.services(), round.lane(), number), round_(round) {
  set_peer("192.0.2.1:1");
  set_transport(std::move(facts));
}

FuzzedClient::~FuzzedClient() {
  require(settled_, "a connection goes when it has settled");
}

// ---- bytes in

void FuzzedClient::receive(std::string_view bytes) {
  if (!open_) return;
  std::string clear(bytes);
  if (layer_) {
    clear.clear();
    layer_->unwrap(bytes, clear);
  }
  in_ += clear;
  process();
}

void FuzzedClient::process() {
  if (processing_) return;
  processing_ = true;
  while (open_ && !busy() && !in_.empty()) {
    const auto limit = static_cast<std::size_t>(settings().max_message_size);
    const server::Frame frame = server::next_frame(in_, limit);
    if (frame.state == server::FrameState::need_more) break;
    if (frame.state != server::FrameState::complete) {
      disconnect(2, "malformed");
      break;
    }
    const std::string message = in_.substr(0, frame.length);
    in_.erase(0, frame.length);
    more_is_here_ = !in_.empty();
    expect(message);
    try {
      handle(message);
    } catch (const std::bad_alloc&) {
      close();
    }
  }
  processing_ = false;
}

// Takes down what the message will have as an answer.
void FuzzedClient::expect(std::string_view frame) {
  server::DecoderLimits limits;
  limits.filter_depth = static_cast<int>(settings().max_filter_depth);
  limits.controls = static_cast<int>(settings().max_controls);
  limits.attributes = static_cast<int>(settings().max_attributes);
  limits.values = static_cast<int>(settings().max_values);
  server::Message message;
  const server::Decoded decoded = server::decode(frame, limits, message);
  if (decoded.state == server::DecodeState::fatal) return;
  if (decoded.state == server::DecodeState::decoded) {
    if (std::holds_alternative<server::UnbindRequest>(message.request)) return;
    if (const auto* abandon = std::get_if<server::AbandonRequest>(&message.request)) {
      Owed& given_up = owed_[abandon->message_id];
      given_up.possible += std::exchange(given_up.answers, 0);
      return;
    }
    if (has_control(message, server::kPersistentSearchOid)) {
      ++owed_[message.id].possible;
      return;
    }
  }
  ++owed_[message.id].answers;
}

// ---- bytes out

void FuzzedClient::transmit(std::string& bytes) {
  std::string_view rest = bytes;
  while (open_ && !rest.empty()) {
    const Element message = first_of(rest);
    require(message.tag == 0x30, "answers are messages");
    take_answer(message.contents);
  }
  if (open_ && !reading_) unread_ += bytes.size();
  bytes.clear();
  output_is(unread_);
}

void FuzzedClient::take_answer(std::string_view message) {
  const std::int32_t id = number_in(first_of(message).contents);
  const Element operation = first_of(message);
  Owed& owed = owed_[id];
  require(owed.answers + owed.possible > 0, "only what was asked is answered");
  if (connection().authority != kNobody) was_somebody_ = true;
  if (operation.tag == server::tag::search_entry) return check_entry(operation.contents);
  std::string_view fields = operation.contents;
  const std::int32_t code = number_in(first_of(fields).contents);
  if (operation.tag == server::tag::bind_response && code != 0)
    require(connection().authority == kNobody, "a failed bind leaves nobody bound");
  if (code == kInProgress) require(operation.tag == server::tag::bind_response, "14 is for binds");
  --(owed.answers > 0 ? owed.answers : owed.possible);
  if (!message.empty()) check_controls(first_of(message).contents);
}

// Takes a cookie out of them, too.
void FuzzedClient::check_controls(std::string_view controls) {
  while (!controls.empty()) {
    std::string_view parts = first_of(controls).contents;
    const std::string_view oid = first_of(parts).contents;
    if (oid == server::kPreReadOid || oid == server::kPostReadOid)
      require(was_somebody_, "strangers see nothing around a change");
    if (oid != server::kPagedResultsOid) continue;
    std::string_view value = first_of(parts).contents;
    value = first_of(value).contents;
    first_of(value);
    cookie_ = first_of(value).contents;
  }
}

void FuzzedClient::check_entry(std::string_view operation) const {
  if (was_somebody_) return;
  const std::string_view dn = first_of(operation).contents;
  require(dn.empty() || dn == "cn=schema", "strangers see nothing of the configuration");
}

void FuzzedClient::go_on_reading() {
  reading_ = true;
  unread_ = 0;
  output_is(0);
  process();
}

// ---- what may happen to the connection

void FuzzedClient::disconnect(int, std::string_view) {
  close();
}

void FuzzedClient::leave() {
  close();
}

void FuzzedClient::close() {
  if (!open_) return;
  open_ = false;
  unread_ = 0;
  output_is(0);
  client_left();
  if (idle()) settled();
}

void FuzzedClient::settled() {
  if (open_ || std::exchange(settled_, true)) return;
  unbind();
}

// As if the handshake had taken place.
void FuzzedClient::start_tls() {
  require(in_.empty(), "nothing that came in clear is left");
  require(connection().authority == kNobody, "StartTLS forgets who was bound");
  server::TransportFacts facts = transport();
  facts.tls_version = "TLSv1.3";
  facts.tls_cipher = "TLS_AES_256_GCM_SHA384";
  facts.tls_strength = 256;
  set_transport(std::move(facts));
}

void FuzzedClient::protect(std::unique_ptr<server::SecurityLayer> layer) {
  in_.clear();
  layer_ = std::move(layer);
}

// ---- the loop

void FuzzedClient::post(std::function<void()> work) {
  const std::lock_guard lock(mutex_);
  posted_.push_back(std::move(work));
}

bool FuzzedClient::run_one() {
  std::function<void()> work;
  {
    const std::lock_guard lock(mutex_);
    if (posted_.empty()) return false;
    work = std::move(posted_.front());
    posted_.pop_front();
  }
  work();
  return true;
}

void FuzzedClient::check_answers() const {
  if (!open_) return;
  require(idle(), "nothing is outstanding at rest");
  for (const auto& [id, owed] : owed_) require(owed.answers == 0, "every request is answered");
}

}  // namespace orv::fuzz
