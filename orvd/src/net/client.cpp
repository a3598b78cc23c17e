#include "net/client.h"

#include <sys/socket.h>

#include <algorithm>
#include <asio/post.hpp>
#include <cerrno>
#include <cstring>
#include <exception>
#include <new>
#include <utility>

#include "cfg/result_codes.h"

namespace orv::server {
namespace {

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

}  // namespace

Client::Client(Loop& loop, Services& services, std::uint64_t number, asio::ip::tcp::socket socket,
               ConnectionCounter::Ticket ticket)
    : Session(services, loop.access(), number),
      loop_(loop),
      socket_(std::move(socket)),
      ticket_(std::move(ticket)),
      in_(kReadBytes) {}

void Client::start(const std::string& peer) {
  asio::error_code ignored;
  socket_.set_option(asio::ip::tcp::no_delay(true), ignored);
  socket_.set_option(asio::socket_base::keep_alive(true), ignored);
  socket_.non_blocking(true, ignored);
  loop_.add(self());
  if (std::string* const line = begin_access_line()) {
    line->append("ACCEPT from=").append(peer);
    end_access_line();
  }
  read();
}

void Client::post(std::function<void()> work) {
  asio::post(loop_.context(), std::move(work));
}

// ---- reading

bool Client::may_read() const noexcept {
  if (state_ == State::parting) return true;
  return state_ == State::open && !busy() && backlog() < kBacklogMark;
}

void Client::read() {
  if (reading_ || continuing_ || !may_read()) return;
  make_room();
  reading_ = true;
  socket_.async_read_some(asio::buffer(in_.data() + end_, in_.size() - end_),
                          [this, self = self()](const asio::error_code& error, std::size_t length) {
                            received(error, length);
                          });
}

// Keeps room for reading: the message at hand moves to the front, and only what has really arrived
// makes the buffer grow.
void Client::make_room() {
  if (begin_ == end_) {
    begin_ = end_ = 0;
    if (in_.size() > kReadBytes) std::vector<char>(kReadBytes).swap(in_);
  }
  if (end_ < in_.size()) return;
  if (begin_ > 0) {
    std::memmove(in_.data(), in_.data() + begin_, end_ - begin_);
    end_ -= begin_;
    begin_ = 0;
  } else {
    in_.resize(in_.size() * 2);
  }
}

void Client::received(const asio::error_code& error, std::size_t length) {
  reading_ = false;
  if (state_ == State::closed) return;
  if (error) return close(error == asio::error::eof ? "end of stream" : "connection lost");
  if (state_ == State::parting) {
    begin_ = end_ = 0;
    return read();
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
      asio::post(loop_.context(), [this, self = self()] {
        continuing_ = false;
        process();
      });
    } else {
      read();
    }
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
      disconnect(result::protocol_error, "message too big");
      return false;
    case FrameState::malformed:
      disconnect(result::protocol_error, "not an LDAP message");
      return false;
    case FrameState::complete:
      break;
  }
  handle(bytes.substr(0, frame.length));
  if (state_ != State::open) return false;
  consume(frame.length);
  return true;
}

void Client::consume(std::size_t length) {
  // A simple bind leaves no password behind in the buffer.
  cfg::wipe(in_.data() + begin_, length);
  begin_ += length;
  const Clock::time_point now = Clock::now();
  last_activity_ = now;
  message_begun_ = now;
}

void Client::resume() {
  if (state_ == State::closed) return;
  last_activity_ = Clock::now();
  // The client is not to blame for the time in which it was not read from.
  if (!reading_) message_begun_ = last_activity_;
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
  const ssize_t length =
      ::recv(socket_.native_handle(), bytes, sizeof bytes, MSG_PEEK | MSG_DONTWAIT);
  if (length == 0 || (length < 0 && errno != EAGAIN && errno != EINTR)) {
    operation.answer().abandon();
    return true;
  }
  const std::int32_t id = operation.answer().message_id();
  try {
    // What came in one packet with the operation's own message was read along with it.
    if (gives_up(unread(), id) ||
        (length > 0 && gives_up({bytes, static_cast<std::size_t>(length)}, id))) {
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
  if (!processing_ || backlog() >= kWriteBatch) flush();
}

void Client::lend_storage(std::string& bytes) noexcept {
  if (backlog() == 0 && !writing_) bytes.swap(out_);
  bytes.clear();
}

void Client::flush() {
  if (state_ == State::closed || writing_) return;
  while (backlog() > 0) {
    const ssize_t sent = ::send(socket_.native_handle(), out_.data() + out_sent_, backlog(),
                                MSG_DONTWAIT | MSG_NOSIGNAL);
    if (sent > 0) {
      out_sent_ += static_cast<std::size_t>(sent);
      write_progress_ = Clock::now();
    } else if (sent < 0 && errno == EINTR) {
      continue;
    } else if (sent < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
      return await_writable();
    } else {
      return close("connection lost");
    }
  }
  all_sent();
}

void Client::await_writable() {
  writing_ = true;
  socket_.async_wait(asio::socket_base::wait_write,
                     [this, self = self()](const asio::error_code& error) {
                       writing_ = false;
                       if (error || state_ == State::closed) return;
                       const bool was_full = backlog() >= kBacklogMark;
                       flush();
                       if (was_full && backlog() < kBacklogMark) resume();
                     });
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
  begin_ = end_ = 0;
  if (!processing_ && !reading_) read();
}

// Answers to what came before the unbind are still on their way.
void Client::drop() {
  flush();
  close("unbind");
}

// The notice is written. Closing with unread input would make the system reset the connection and
// throw the notice away, so the client is given time to close.
void Client::part() {
  asio::error_code ignored;
  socket_.shutdown(asio::ip::tcp::socket::shutdown_send, ignored);
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
  asio::post(loop_.context(), [this, self = self()] { loop_.remove(self); });
}

void Client::sweep(Clock::time_point now) {
  if (state_ == State::closed) return;
  const Settings& limits = loop_.settings();
  const auto past = [now](Clock::time_point since, std::int64_t seconds) {
    return now - since >= std::chrono::seconds(seconds);
  };
  if (state_ == State::parting) {
    if (now - parting_since_ >= kPartingTime) close("gone");
  } else if (backlog() > 0) {
    if (past(write_progress_, limits.write_timeout)) close("does not read its answers");
  } else if (begin_ != end_ && reading_) {
    if (past(message_begun_, limits.message_timeout))
      disconnect(result::unavailable, "message not finished in time");
  } else if (idle() && limits.idle_timeout > 0 && past(last_activity_, limits.idle_timeout)) {
    disconnect(result::unavailable, "idle for too long");
  }
}

}  // namespace orv::server
