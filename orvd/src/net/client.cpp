#include "net/client.h"

#include <sys/socket.h>

#include <algorithm>
#include <asio/buffer.hpp>
#include <asio/error.hpp>
#include <cstring>
#include <exception>
#include <new>
#include <utility>

#include "cfg/result_codes.h"

namespace orv::server {
namespace {

using asio::ip::tcp;

constexpr std::size_t kReadBytes = 4096;
// Above this much unread output a client's requests wait.
constexpr std::size_t kBacklogMark = 256 * 1024;
// Answers to requests that came together are written together, up to about this much.
constexpr std::size_t kWriteBatch = 32 * 1024;
// Storage that an idle connection may keep.
constexpr std::size_t kKeptOutput = 16 * 1024;
// Messages of one client before the loop looks at the others.
constexpr int kMessagesAtOnce = 32;
// How long a parting client may take to read the notice.
constexpr std::chrono::seconds kPartingTime{2};

std::string too_big(std::int64_t limit) {
  return "message too big: more than " + std::to_string(limit) + " bytes (orv-slapdMaxMessageSize)";
}

// Nothing can be read or written at the moment.
bool later(const asio::error_code& error) {
  return error == asio::error::would_block || error == asio::error::try_again ||
         error == asio::error::interrupted;
}

}  // namespace

Client::Client(Loop& loop, Services& services, std::uint64_t number, Descriptor arrived,
               tcp protocol, ConnectionCounter::Ticket ticket)
    : Session(services, loop.access(), number),
      loop_(loop),
      arrived_(std::move(arrived)),
      protocol_(protocol),
      socket_(loop.context()),
      ticket_(std::move(ticket)),
      in_(kReadBytes) {
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
  socket_.set_option(tcp::no_delay(true), ignored);
  socket_.set_option(tcp::socket::keep_alive(true), ignored);
  loop_.add(self());
  set_peer(peer);
  if (std::string* const line = begin_access_line()) {
    line->append("ACCEPT from=").append(peer);
    end_access_line();
  }
  watch();
}

void Client::post(std::function<void()> work) {
  loop_.post(std::move(work));
}

// ---- waiting

void Client::watch() noexcept {
  if (!waiting_ && !continuing_ && may_read())
    waiting_ = await(tcp::socket::wait_read, &Client::readable);
}

bool Client::await(tcp::socket::wait_type what, void (Client::*then)()) noexcept {
  try {
    socket_.async_wait(what, [self = self(), then](const asio::error_code&) {
      if (self->state_ == State::closed) return;
      try {
        (self.get()->*then)();
      } catch (const std::exception& error) {
        self->close(error.what());
      }
    });
    return true;
  } catch (const std::exception& error) {
    close(error.what());
    return false;
  }
}

// Whether bytes have come that nobody had the time to read.
bool Client::unread_in_system() noexcept {
  asio::error_code failure;
  return socket_.available(failure) > 0 && !failure;
}

// For a socket that is not read from at the moment, which would tell.
bool Client::lost() noexcept {
  int failure = 0;
  socklen_t size = sizeof failure;
  return ::getsockopt(socket_.native_handle(), SOL_SOCKET, SO_ERROR, &failure, &size) == 0 &&
         failure != 0;
}

// ---- reading

bool Client::may_read() const noexcept {
  if (state_ == State::parting) return true;
  return state_ == State::open && !busy() && backlog() < kBacklogMark;
}

void Client::readable() {
  waiting_ = false;
  if (!continuing_ && may_read()) read();
  watch();
}

void Client::read() {
  make_room();
  asio::error_code failure;
  const std::size_t length =
      socket_.receive(asio::buffer(in_.data() + end_, in_.size() - end_), 0, failure);
  if (!failure) return received(length);
  if (failure == asio::error::eof) return close("end of stream");
  if (!later(failure)) close("connection lost");
}

// Keeps room for reading: the message at hand moves to the front, and only what has really arrived
// makes the buffer grow.
void Client::make_room() {
  if (begin_ == end_) {
    begin_ = end_ = 0;
    if (in_.size() > kReadBytes) std::vector<char>(kReadBytes).swap(in_);
  }
  if (end_ < in_.size()) return;
  // What moves leaves no password behind.
  if (begin_ > 0) {
    const std::size_t end = std::exchange(end_, end_ - begin_);
    std::memmove(in_.data(), in_.data() + begin_, end_);
    cfg::wipe(in_.data() + end_, end - end_);
    begin_ = 0;
  } else {
    std::vector<char> larger(in_.size() * 2);
    std::copy(in_.begin(), in_.end(), larger.begin());
    in_.swap(larger);
    cfg::wipe(larger.data(), larger.size());
  }
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
  if (begin_ == end_) message_begun_ = Clock::now();
  end_ += length;
  process();
}

// Handles the messages that are here, then writes the answers, then reads on.
void Client::process() {
  if (processing_ || continuing_) return;
  processing_ = true;
  try {
    int left = kMessagesAtOnce;
    while (state_ == State::open && !busy() && backlog() < kBacklogMark && process_one())
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
  const Frame frame =
      next_frame(bytes, static_cast<std::size_t>(loop_.settings().max_message_size));
  switch (frame.state) {
    case FrameState::need_more:
      return false;
    case FrameState::too_big:
      disconnect(result::protocol_error, too_big(loop_.settings().max_message_size));
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

// Whether whole messages among `bytes` abandon the operation or end the connection.
bool gives_up(std::string_view bytes, std::int32_t message_id) {
  const DecoderLimits limits;
  for (;;) {
    const Frame frame = next_frame(bytes, bytes.size());
    if (frame.state != FrameState::complete) return false;
    Message message;
    const Decoded decoded = decode(bytes.substr(0, frame.length), limits, message);
    if (decoded.state == DecodeState::decoded) {
      const auto* const abandon = std::get_if<AbandonRequest>(&message.request);
      if (abandon && abandon->message_id == message_id) return true;
      if (std::holds_alternative<UnbindRequest>(message.request)) return true;
    }
    bytes.remove_prefix(frame.length);
  }
}

}  // namespace

// Only looks: what is found here is read and handled in its turn, when the operation has ended.
bool Client::lost_interest(PendingOperation& operation) noexcept {
  char bytes[512];
  asio::error_code failure;
  const std::size_t length =
      socket_.receive(asio::buffer(bytes), tcp::socket::message_peek, failure);
  if (failure && !later(failure)) {
    operation.answer().abandon();
    return true;
  }
  const std::int32_t id = operation.answer().message_id();
  try {
    // What came in one packet with the operation's own message was read along with it.
    if (gives_up(unread(), id) || (length > 0 && gives_up({bytes, length}, id))) {
      operation.answer().abandon();
    }
  } catch (const std::bad_alloc&) {
    // It is handled late, then.
  }
  return operation.answer().abandoned();
}

// ---- writing

void Client::transmit(std::string& bytes) {
  if (state_ != State::open || bytes.empty()) return bytes.clear();
  if (backlog() == 0) {
    out_.swap(bytes);
    bytes.clear();
    out_sent_ = 0;
    write_progress_ = Clock::now();
  } else {
    out_ += bytes;
    bytes.clear();
  }
  if (!processing_ || last_here_ || backlog() >= kWriteBatch) flush();
  output_is(backlog());
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
    asio::error_code failure;
    const std::size_t sent =
        socket_.send(asio::buffer(out_.data() + out_sent_, backlog()), 0, failure);
    if (!failure) {
      out_sent_ += sent;
      write_progress_ = Clock::now();
    } else if (failure == asio::error::interrupted) {
      continue;
    } else if (later(failure)) {
      if (!writing_) writing_ = await(tcp::socket::wait_write, &Client::writable);
      return output_is(state_ == State::closed ? 0 : backlog());
    } else {
      return close("connection lost");
    }
  }
  all_sent();
  output_is(0);
}

void Client::writable() {
  writing_ = false;
  const bool was_full = backlog() >= kBacklogMark;
  flush();
  watch();
  if (was_full && backlog() < kBacklogMark) resume();
}

void Client::all_sent() {
  out_sent_ = 0;
  if (out_.capacity() > kKeptOutput)
    std::string().swap(out_);
  else
    out_.clear();
  if (state_ == State::parting) part();
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
  std::string notice;
  if (!encode_notice_of_disconnection(notice, code, text)) return close("out of memory");
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
  socket_.shutdown(tcp::socket::shutdown_send, ignored);
  if (services().stopping.load(std::memory_order_relaxed)) close("server is stopping");
}

void Client::close(std::string_view why) noexcept {
  if (state_ == State::closed) return;
  state_ = State::closed;
  asio::error_code ignored;
  socket_.close(ignored);
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
  const Settings& limits = loop_.settings();
  const auto past = [now](Clock::time_point since, std::int64_t seconds) {
    return now - since >= std::chrono::seconds(seconds);
  };
  // A loop that was busy for long may not have read what came in time.
  const auto late = [&](Clock::time_point since, std::int64_t seconds) {
    return past(since, seconds) && !unread_in_system();
  };
  if (!waiting_ && lost()) return close("connection lost");
  if (state_ == State::parting) {
    if (now - parting_since_ >= kPartingTime) close("gone");
  } else if (backlog() > 0) {
    if (past(write_progress_, limits.write_timeout)) write();  // it may have read just now
    if (backlog() > 0 && past(write_progress_, limits.write_timeout))
      close("does not read its answers");
  } else if (begin_ != end_ && may_read()) {
    if (late(message_begun_, limits.message_timeout))
      disconnect(result::unavailable, "message not finished in time");
  } else if (idle() && !listens() && limits.idle_timeout > 0) {
    if (late(last_activity_, limits.idle_timeout))
      disconnect(result::unavailable, "idle for too long");
  }
}

}  // namespace orv::server
