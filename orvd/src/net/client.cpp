#include "net/client.h"

#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <asio/buffer.hpp>
#include <asio/error.hpp>
#include <asio/ip/tcp.hpp>
#include <cstring>
#include <exception>
#include <new>
#include <utility>

#include "cfg/result_codes.h"
#include "ops/log_text.h"
#include "ops/wiped_request.h"
#include "protocol/control_values.h"

namespace orv::server {
namespace {

using asio::ip::tcp;

constexpr std::size_t kReadBytes = 4096;
// Above this much unread output a client's requests wait.
constexpr std::size_t kBacklogMark = 256 * 1024;
// The same while nobody is bound: strangers may be many.
constexpr std::size_t kStrangersMark = 32 * 1024;
// Answers to requests that came together are written together, up to about this much.
constexpr std::size_t kWriteBatch = 32 * 1024;
// Storage that an idle connection may keep.
constexpr std::size_t kKeptOutput = 16 * 1024;
// Messages of one client before the loop looks at the others.
constexpr int kMessagesAtOnce = 32;
// How long a parting client may take to read the notice.
constexpr std::chrono::seconds kPartingTime{2};

std::string too_big(std::int64_t limit, bool for_everybody) {
  return "message too big: more than " + std::to_string(limit) + " bytes (" +
         (for_everybody ? "orv-slapdMaxMessageSize" : "orv-slapdMaxUnauthenticatedMessageSize") +
         ")";
}

// Nothing can be read or written at the moment.
bool later(const asio::error_code& error) {
  return error == asio::error::would_block || error == asio::error::try_again ||
         error == asio::error::interrupted;
}

// A layer may only sign: what it takes and what it gives may both hold passwords in clear.
struct WipedText {
  ~WipedText() { cfg::wipe(text); }
  std::string text;
};
struct WipedBytes {
  ~WipedBytes() { cfg::wipe(bytes.data(), used); }
  std::array<char, kReadBytes> bytes;
  std::size_t used = 0;
};

}  // namespace

Client::Client(Loop& loop, Services& services, std::uint64_t number, Arrival arrival)
    : Session(services, loop.access(), number),
      loop_(loop),
      arrived_(std::move(arrival.socket)),
      protocol_(arrival.protocol),
      socket_(loop.context()),
      ticket_(std::move(arrival.ticket)),
      tls_(arrival.secure ? Tls::shaking_hands : Tls::none),
      in_(kReadBytes) {
  set_transport(std::move(arrival.facts));
  loop_.change_load(1);
}

void Client::start(const std::string& peer) {
  try {
    begin(peer);
  } catch (const std::exception& error) {
    close(error.what());
  }
}

void Client::begin(const std::string& peer) {
  socket_.assign(protocol_, arrived_.number());
  arrived_.release();
  socket_.non_blocking(true);
  asio::error_code ignored;
  if (!transport().local) {
    socket_.set_option(tcp::no_delay(true), ignored);
    socket_.set_option(tcp::socket::keep_alive(true), ignored);
  }
  loop_.add(self());
  set_peer(peer);
  set_counted_as(ticket_.address());
  if (std::string* const line = begin_access_line()) {
    line->append("ACCEPT from=").append(peer);
    if (tls_ == Tls::shaking_hands) *line += " tls";
    end_access_line();
  }
  if (tls_ == Tls::shaking_hands) return begin_handshake();
  watch();
}

void Client::post(std::function<void()> work) {
  loop_.post(std::move(work));
}

// ---- waiting

void Client::watch() noexcept {
  if (waiting_ || continuing_ || !may_read()) return;
  waiting_ =
      stream_ && stream_->has_more() ? read_soon() : await(Socket::wait_read, &Client::readable);
}

void Client::go_on(void (Client::*then)()) noexcept {
  if (state_ == State::closed) return;
  try {
    (this->*then)();
  } catch (const std::exception& error) {
    close(error.what());
  }
}

bool Client::await(Socket::wait_type what, void (Client::*then)()) noexcept {
  try {
    socket_.async_wait(what, [self = self(), then](const asio::error_code&) { self->go_on(then); });
    return true;
  } catch (const std::exception& error) {
    close(error.what());
    return false;
  }
}

// What TLS has already taken from the socket would not wake anybody up.
bool Client::read_soon() noexcept {
  try {
    loop_.post([self = self()] { self->go_on(&Client::readable); });
    return true;
  } catch (const std::exception& error) {
    close(error.what());
    return false;
  }
}

// Whether bytes have come that nobody had the time to read.
bool Client::unread_in_system() noexcept {
  asio::error_code failure;
  if (stream_ && stream_->has_more()) return true;
  return socket_.available(failure) > 0 && !failure;
}

// For a socket that is not read from at the moment, which would tell.
bool Client::lost() noexcept {
  int failure = 0;
  socklen_t size = sizeof failure;
  return ::getsockopt(socket_.native_handle(), SOL_SOCKET, SO_ERROR, &failure, &size) == 0 &&
         failure != 0;
}

// ---- TLS

bool Client::can_start_tls() const noexcept {
  try {
    return !transport().local && services().tls && services().tls->current();
  } catch (...) {
    return false;
  }
}

void Client::start_tls() {
  tls_ = Tls::answering;
  handshake_begun_ = Clock::now();
  if (backlog() == 0) begin_handshake();
}

void Client::begin_handshake() {
  tls_ = Tls::shaking_hands;
  handshake_begun_ = Clock::now();
  std::shared_ptr<const TlsContext> context = services().tls->current();
  if (!context) return close("no certificate");
  stream_ = std::make_unique<TlsStream>(std::move(context), socket_.native_handle());
  shake_hands();
}

void Client::shake_hands() {
  switch (stream_->shake_hands()) {
    case Flow::moved:
      return tls_stands();
    case Flow::needs_input:
      await(Socket::wait_read, &Client::shake_hands);
      return;
    case Flow::needs_output:
      await(Socket::wait_write, &Client::shake_hands);
      return;
    case Flow::ended:
    case Flow::failed:
      break;
  }
  const std::string& why = stream_->failure();
  close(why.empty() ? "connection lost in the TLS handshake" : "TLS handshake failed: " + why);
}

void Client::tls_stands() {
  TransportFacts facts = transport();
  stream_->describe(facts);
  if (std::string* const line = begin_access_line()) {
    line->append("TLS version=").append(facts.tls_version);
    line->append(" cipher=").append(facts.tls_cipher).append(" bits=");
    append_number(*line, facts.tls_strength);
    if (!facts.certificate_subject.empty())
      append_normal_dn(line->append(" subject="), facts.certificate_subject);
    end_access_line();
  }
  set_transport(std::move(facts));
  tls_ = Tls::standing;
  last_activity_ = Clock::now();
  watch();
}

Flow Client::receive_some(char* to, std::size_t room, std::size_t& length) {
  if (stream_) return stream_->read(to, room, length);
  asio::error_code failure;
  length = socket_.receive(asio::buffer(to, room), 0, failure);
  if (!failure) return Flow::moved;
  if (failure == asio::error::eof) return Flow::ended;
  return later(failure) ? Flow::needs_input : Flow::failed;
}

Flow Client::send_some(std::size_t& length) {
  const char* const from = out_.data() + out_sent_;
  if (stream_) return stream_->write(from, backlog(), length);
  asio::error_code failure;
  do length = socket_.send(asio::buffer(from, backlog()), 0, failure);
  while (failure == asio::error::interrupted);
  if (!failure) return Flow::moved;
  return later(failure) ? Flow::needs_output : Flow::failed;
}

// Reading or writing has failed.
void Client::lose() {
  const std::string why = stream_ ? stream_->failure() : "";
  close(why.empty() ? "connection lost" : "TLS failed: " + why);
}

// Who was let in by a certificate stays for as long as it would be taken again.
bool Client::transport_holds() {
  if (tls_ != Tls::standing || !stream_ || !stream_->shows_certificate()) return true;
  const std::shared_ptr<const TlsContext> in_force = services().tls->current();
  const std::string problem = stream_->certificate_problem(in_force.get(), services().wall_time());
  if (problem.empty()) return true;
  cut_off(CutOff::certificate, result::stronger_auth_required,
          "the certificate of the client is no longer good (" + problem + ")");
  return false;
}

// The layer protects what follows the bind: what came in clear behind it is nobody's message.
void Client::protect(std::unique_ptr<SecurityLayer> layer) {
  const WipedText rest{std::string(layer_ ? std::string_view() : unread())};
  layer_ = std::move(layer);
  if (!rest.text.empty()) {
    forget_input();
    if (!unwrap(rest.text)) return close("not protected by the security layer");
    message_begun_ = Clock::now();
  }
  in_pieces_ = layer_->has_part();
}

// ---- reading

// While nobody is bound, less is kept for a client: there may be many, and of any kind.
std::int64_t Client::largest_message() const noexcept {
  const Settings& limits = loop_.settings();
  if (!is_unauthenticated()) return limits.max_message_size;
  return std::min(limits.max_message_size, limits.max_unauthenticated_message_size);
}

bool Client::reads_enough() const noexcept {
  return backlog() < (is_unauthenticated() ? kStrangersMark : kBacklogMark);
}

bool Client::may_read() const noexcept {
  if (!is_set_up()) return false;
  if (state_ == State::parting) return true;
  return state_ == State::open && !busy() && reads_enough();
}

void Client::readable() {
  waiting_ = false;
  if (!continuing_ && may_read()) read();
  watch();
}

void Client::read() {
  WipedBytes wire;
  if (!layer_) make_room();
  char* const to = layer_ ? wire.bytes.data() : in_.data() + end_;
  const std::size_t room = layer_ ? wire.bytes.size() : in_.size() - end_;
  std::size_t length = 0;
  switch (receive_some(to, room, length)) {
    case Flow::moved:
      if (!layer_) return received(length);
      wire.used = length;
      return received_wrapped({wire.bytes.data(), length});
    case Flow::needs_input:
      return nothing_yet();
    case Flow::needs_output:
      waiting_ = await(Socket::wait_write, &Client::readable);
      return;
    case Flow::ended:
      return close("end of stream");
    case Flow::failed:
      return lose();
  }
}

// Whoever sends half a record, or half a frame of a layer, has as long for the other half as for
// that of a message.
void Client::nothing_yet() {
  if (!stream_) return;
  const bool in_pieces = stream_->has_part_of_record();
  if (in_pieces && !in_pieces_ && begin_ == end_) message_begun_ = Clock::now();
  in_pieces_ = in_pieces;
}

void Client::received_wrapped(std::string_view wire) {
  if (state_ == State::parting) return;
  const bool waited = in_pieces_ || begin_ != end_;
  if (!unwrap(wire)) return close("not protected by the security layer");
  if (!waited) message_begun_ = Clock::now();
  in_pieces_ = layer_->has_part();
  process();
}

// Adds what is in it to what is to be handled.
bool Client::unwrap(std::string_view wire) {
  WipedText unwrapped;
  const std::string& clear = unwrapped.text;
  if (!layer_->unwrap(wire, unwrapped.text)) return false;
  move_to_front();
  if (end_ == 0) make_room();
  if (in_.size() - end_ < clear.size()) in_.resize(end_ + clear.size(), end_);
  std::memcpy(in_.data() + end_, clear.data(), clear.size());
  end_ += clear.size();
  return true;
}

// What moves leaves no password behind.
void Client::move_to_front() noexcept {
  const std::size_t end = std::exchange(end_, end_ - begin_);
  std::memmove(in_.data(), in_.data() + begin_, end_);
  cfg::wipe(in_.data() + end_, end - end_);
  begin_ = 0;
}

// Keeps room for reading: the message at hand moves to the front, and only what has really arrived
// makes the buffer grow.
void Client::make_room() {
  if (begin_ == end_) {
    begin_ = end_ = 0;
    if (in_.size() > kReadBytes) in_.resize(kReadBytes, 0);
  }
  if (end_ < in_.size()) return;
  if (begin_ > 0)
    move_to_front();
  else
    in_.resize(in_.size() * 2, end_);
}

// Gives up what has been read and not handled.
void Client::forget_input() {
  cfg::wipe(in_.data(), end_);
  begin_ = end_ = 0;
}

void Client::received(std::size_t length) {
  if (state_ == State::parting) {
    end_ += length;
    return forget_input();
  }
  if (begin_ == end_ && !in_pieces_) message_begun_ = Clock::now();
  in_pieces_ = false;
  end_ += length;
  process();
}

// Handles the messages that are here, then writes the answers, then reads on.
void Client::process() {
  if (processing_ || continuing_) return;
  processing_ = true;
  try {
    int left = kMessagesAtOnce;
    while (state_ == State::open && is_set_up() && !busy() && reads_enough() && process_one())
      if (--left == 0) {
        continuing_ = true;
        break;
      }
    processing_ = false;
    if (backlog() > 0) flush();
    if (state_ == State::closed) return;
    if (continuing_) {
      loop_.post([this, self = self()] {
        continuing_ = false;
        process();
      });
    }
    watch();
  } catch (const std::exception& error) {
    processing_ = false;
    close(error.what());
  }
}

// One message; false when none is whole.
bool Client::process_one() {
  const std::string_view bytes = unread();
  if (bytes.empty()) return false;
  const std::int64_t limit = largest_message();
  const Frame frame = next_frame(bytes, static_cast<std::size_t>(limit));
  switch (frame.state) {
    case FrameState::need_more:
      return false;
    case FrameState::too_big:
      cut_off(CutOff::message, result::protocol_error,
              too_big(limit, limit == loop_.settings().max_message_size));
      return false;
    case FrameState::malformed:
      disconnect(result::protocol_error, "not an LDAP message");
      return false;
    case FrameState::complete:
      break;
  }
  last_here_ = frame.length == bytes.size();
  handle(bytes.substr(0, frame.length));
  if (state_ != State::open) return false;
  consume(frame.length);
  return true;
}

void Client::consume(std::size_t length) {
  // A simple bind leaves no password behind in the buffer.
  cfg::wipe(in_.data() + begin_, length);
  begin_ += length;
  last_activity_ = Clock::now();
  message_begun_ = last_activity_;
}

void Client::resume() {
  if (state_ == State::closed) return;
  last_activity_ = Clock::now();
  // The client is not to blame for the time in which it was not read from.
  if (!waiting_) message_begun_ = last_activity_;
  process();
}

namespace {

// What messages that have not had their turn say about an operation.
struct Interest {
  bool lost = false;             // they abandon it, or end the connection
  std::int32_t canceled_by = 0;  // the message that cancels it; 0: none
};

// Looks at one message; one whose controls may forbid it is left to its turn.
void look_at(const Message& message, std::int32_t operation, Interest& interest) {
  if (std::holds_alternative<UnbindRequest>(message.request)) interest.lost = true;
  if (!message.controls.empty()) return;
  if (const auto* const abandon = std::get_if<AbandonRequest>(&message.request))
    interest.lost = interest.lost || abandon->message_id == operation;
  const auto* const extended = std::get_if<ExtendedRequest>(&message.request);
  std::int32_t target = 0;
  if (extended && extended->oid == kCancelOid && extended->value &&
      read_cancel(*extended->value, target) == 0 && target == operation &&
      message.id != operation && interest.canceled_by == 0)
    interest.canceled_by = message.id;
}

// Takes the whole messages from the front of `bytes`, which begin with one, up to the first that
// settles it.
Interest interest_in(std::int32_t operation, std::string_view& bytes) {
  const DecoderLimits limits;
  Interest interest;
  while (!interest.lost && interest.canceled_by == 0) {
    const Frame frame = next_frame(bytes, bytes.size());
    if (frame.state != FrameState::complete) break;
    WipedMessage message;
    const Decoded decoded = decode(bytes.substr(0, frame.length), limits, message);
    if (decoded.state == DecodeState::decoded) look_at(message, operation, interest);
    bytes.remove_prefix(frame.length);
  }
  return interest;
}

}  // namespace

Flow Client::peek(char* to, std::size_t room, std::size_t& length) noexcept {
  try {
    if (stream_) return stream_->peek(to, room, length);
  } catch (...) {
    return Flow::needs_input;
  }
  asio::error_code failure;
  length = socket_.receive(asio::buffer(to, room), Socket::message_peek, failure);
  if (!failure) return Flow::moved;
  return later(failure) ? Flow::needs_input : Flow::failed;
}

// Only looks: what is found here is read and handled in its turn, when the operation has ended.
bool Client::lost_interest(PendingOperation& operation) noexcept {
  char bytes[512];
  std::size_t length = 0;
  const Flow flow = peek(bytes, sizeof bytes, length);
  if (flow == Flow::ended || flow == Flow::failed) {
    operation.answer().abandon();
    return true;
  }
  if (layer_) length = 0;  // nothing can be told from a part of what it protects
  const std::int32_t id = operation.answer().message_id();
  try {
    // What came in one packet with the operation's own message was read along with it.
    std::string_view here = unread();
    Interest interest = interest_in(id, here);
    // Behind half a message comes its other half, which may look like anything.
    std::string_view coming = here.empty() ? std::string_view(bytes, length) : "";
    if (!interest.lost && interest.canceled_by == 0) interest = interest_in(id, coming);
    if (interest.lost) operation.answer().abandon();
    if (interest.canceled_by != 0) cancel_ahead(operation, interest.canceled_by);
  } catch (const std::bad_alloc&) {
    // It is handled late, then.
  }
  cfg::wipe(bytes, sizeof bytes);
  return operation.answer().is_given_up();
}

// ---- writing

void Client::transmit(std::string& bytes) {
  if (state_ != State::open || bytes.empty()) return bytes.clear();
  if (layer_ && !wrap(bytes)) return close("the security layer failed");
  if (backlog() == 0) {
    out_.swap(bytes);
    bytes.clear();
    out_sent_ = 0;
    pace_.begin(Clock::now());
  } else {
    out_ += bytes;
    bytes.clear();
  }
  if (!processing_ || last_here_ || backlog() >= kWriteBatch) flush();
  output_is(backlog());
}

bool Client::wrap(std::string& bytes) {
  std::string wire;
  const bool good = layer_->wrap(bytes, wire);
  bytes.swap(wire);
  cfg::wipe(wire);
  return good;
}

void Client::lend_storage(std::string& bytes) noexcept {
  if (backlog() == 0 && !writing_) bytes.swap(out_);
  bytes.clear();
}

void Client::flush() {
  if (state_ != State::closed && !writing_) write();
}

void Client::write() {
  while (backlog() > 0) {
    std::size_t sent = 0;
    const Flow flow = send_some(sent);
    if (flow == Flow::moved) {
      out_sent_ += sent;
      pace_.took(sent, Clock::now());
    } else if (flow == Flow::needs_output || flow == Flow::needs_input) {
      if (!writing_)
        writing_ = await(flow == Flow::needs_output ? Socket::wait_write : Socket::wait_read,
                         &Client::writable);
      return output_is(state_ == State::closed ? 0 : backlog());
    } else {
      return lose();
    }
  }
  all_sent();
  output_is(0);
}

void Client::writable() {
  writing_ = false;
  write_on();
}

// Writes what was left over, and goes on with what waited for that.
void Client::write_on() {
  if (state_ == State::closed) return;
  const bool was_full = !reads_enough();
  write();
  watch();
  if (was_full && reads_enough()) resume();
}

void Client::all_sent() {
  out_sent_ = 0;
  if (out_.capacity() > kKeptOutput)
    std::string().swap(out_);
  else
    out_.clear();
  if (state_ == State::parting) part();
  if (state_ == State::open && tls_ == Tls::answering) begin_handshake();
}

// ---- ending

void Client::disconnect(int code, std::string_view text) {
  if (state_ == State::parting && backlog() == 0) part();
  if (state_ != State::open) return;
  if (std::string* const line = begin_access_line()) {
    line->append("DISCONNECT result=");
    append_number(*line, code);
    *line += " reason=";
    append_quoted(*line, text);
    end_access_line();
  }
  // In the middle of a handshake nothing can be told.
  if (!is_set_up()) return close("not told");
  std::string notice;
  if (!encode_notice_of_disconnection(notice, code, text)) return close("out of memory");
  if (layer_ && !wrap(notice)) return close("the security layer failed");
  out_ += notice;
  state_ = State::parting;
  parting_since_ = Clock::now();
  client_left();
  if (state_ == State::closed) return;
  flush();
  forget_input();
  if (!processing_) watch();
}

// Answers to what came before the unbind are still on their way.
void Client::drop() {
  flush();
  close("unbind");
}

// The notice is written. Closing with unread input would make the system reset the connection and
// throw the notice away, so the client is given time to close, unless the server is stopping.
void Client::part() {
  asio::error_code ignored;
  if (stream_) stream_->say_goodbye();
  socket_.shutdown(Socket::shutdown_send, ignored);
  if (services().stopping.load(std::memory_order_relaxed)) close("server is stopping");
}

void Client::close(std::string_view why) noexcept {
  if (state_ == State::closed) return;
  const bool unread = backlog() > 0;
  state_ = State::closed;
  asio::error_code ignored;
  // It would come in the middle of a record otherwise.
  if (stream_ && !unread) stream_->say_goodbye();
  stream_.reset();
  socket_.close(ignored);
  forget_input();
  try {
    if (std::string* const line = begin_access_line()) {
      line->append("CLOSE reason=").append(why);
      end_access_line();
    }
  } catch (...) {
    // The line is lost.
  }
  output_is(0);
  client_left();
  if (idle()) settled();
}

void Client::settled() {
  // A parting client is still read from; close() comes back here.
  if (state_ != State::closed || settled_) return;
  settled_ = true;
  unbind();
  ticket_ = {};
  // The loop's own handlers may still refer to the client: it goes when they have run.
  try {
    loop_.post([this, self = self()] { loop_.remove(self); });
  } catch (...) {
    // The next sweep removes it.
  }
}

void Client::sweep(Clock::time_point now) {
  tick();
  if (settled_) return loop_.remove(self());
  if (state_ == State::closed) return;
  if (!waiting_ && lost()) return close("connection lost");
  look_at_deadlines(now);
}

namespace {

bool past(Clock::time_point now, Clock::time_point since, std::int64_t seconds) {
  return now - since >= std::chrono::seconds(seconds);
}

}  // namespace

void Client::look_at_deadlines(Clock::time_point now) {
  const Settings& limits = loop_.settings();
  // A loop that was busy for long may not have read what came in time.
  const auto late = [&](Clock::time_point since, std::int64_t seconds) {
    return past(now, since, seconds) && !unread_in_system();
  };
  if (!is_set_up()) {
    if (past(now, handshake_begun_, limits.handshake_timeout))
      cut_off_without_notice(CutOff::handshake, "TLS handshake not finished in time");
    return;
  }
  if (state_ == State::parting) {
    if (now - parting_since_ >= kPartingTime) close("gone");
  } else if (backlog() > 0 && does_not_read(now)) {
    cut_off_without_notice(CutOff::output, "does not read its answers");
  } else if (bind_is_overdue(now)) {
    cut_off(CutOff::bind, result::unavailable, "bind not finished in time");
  } else if (has_bound_too_late(now)) {
    cut_off(CutOff::bind, result::unavailable, "nobody bound for too long");
  } else if ((begin_ != end_ || in_pieces_) && may_read()) {
    if (late(message_begun_, limits.message_timeout))
      cut_off(CutOff::message, result::unavailable, "message not finished in time");
  } else if (backlog() == 0 && idle() && !listens() && limits.idle_timeout > 0) {
    if (late(last_activity_, limits.idle_timeout))
      disconnect(result::unavailable, "idle for too long");
  }
}

// A bind under way is waited for, but not one after the other.
bool Client::has_bound_too_late(Clock::time_point now) const noexcept {
  const Settings& limits = loop_.settings();
  if (limits.unauthenticated_timeout <= 0 || transport().local) return false;
  const std::int64_t more = idle() ? 0 : limits.bind_timeout;
  return without_identity(now) >= std::chrono::seconds(limits.unauthenticated_timeout + more);
}

bool Client::does_not_read(Clock::time_point now) {
  const Settings& limits = loop_.settings();
  const auto too_slow = [&] {
    return pace_.too_slow(now, limits.write_timeout, limits.min_read_rate);
  };
  if (too_slow()) write_on();  // it may have read just now
  return state_ == State::open && backlog() > 0 && too_slow();
}

void Client::cut_off(CutOff what, int code, const std::string& why) {
  tell_of(what, why);
  disconnect(code, why);
}

void Client::cut_off_without_notice(CutOff what, const std::string& why) {
  tell_of(what, why);
  close(why);
}

void Client::tell_of(CutOff what, std::string_view why) noexcept {
  try {
    services().cut_offs.tell(what, std::string(why).append(": closed ").append(peer()));
  } catch (...) {
    // Without memory the line is lost.
  }
}

}  // namespace orv::server
