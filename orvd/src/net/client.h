// A client's connection, over TCP or a Unix socket: its socket, its buffers and its deadlines; and
// what may lie between the bytes on the socket and the messages, TLS and a security layer of SASL.
//
// Asio says when the socket can be read or written; reading and writing then are plain calls that
// do not block. An idle connection has no read under way that would own a buffer, and what has not
// been read yet can be looked at while an operation runs.
//
// Bytes are read when some are there and the session can take a message; answers are written at
// once from the thread that made them, and by the event loop only when the client does not keep up.
// A client that does not read its answers is not read from either, nor is one while its bind is
// verified or too many of its operations are outstanding: what it sends waits in the system.
//
// Threads: the loop's thread, except construction.
#pragma once

#include <asio/generic/stream_protocol.hpp>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "descriptor.h"
#include "net/limits.h"
#include "net/loop.h"
#include "net/pace.h"
#include "net/receive_buffer.h"
#include "net/tls.h"
#include "ops/session.h"

namespace orv::server {

// A connection as it comes from its listener.
struct Arrival {
  Descriptor socket;
  asio::generic::stream_protocol protocol{0, 0};
  TransportFacts facts;
  bool secure = false;  // TLS comes first
  ConnectionCounter::Ticket ticket;
};

class Client final : public Session {
 public:
  // Any thread.
  Client(Loop& loop, Services& services, std::uint64_t number, Arrival arrival);
  ~Client() override { loop_.change_load(-1); }

  // Begins to serve. On the loop's thread.
  void start(const std::string& peer);

  // Looks at the connection's deadlines.
  void sweep(Clock::time_point now);

  void disconnect(int code, std::string_view text) override;
  bool lost_interest(PendingOperation& operation) noexcept override;

 protected:
  const Settings& settings() const noexcept override { return loop_.settings(); }
  void post(std::function<void()> work) override;
  void transmit(std::string& bytes) override;
  void lend_storage(std::string& bytes) noexcept override;
  void flush() override;
  void drop() override;
  void resume() override;
  void settled() override;
  bool can_start_tls() const noexcept override;
  void start_tls() override;
  bool more_is_here() const noexcept override { return !last_here_; }
  bool transport_holds() override;
  std::string transport_trust() const override { return stream_ ? stream_->trust() : ""; }
  void protect(std::unique_ptr<SecurityLayer> layer) override;

 private:
  using Socket = asio::generic::stream_protocol::socket;

  enum class State {
    open,
    parting,  // a notice of disconnection is on its way; what still comes in is thrown away
    closed,
  };

  // TLS of a connection that has some, or is to have it.
  enum class Tls {
    none,
    answering,  // the answer to StartTLS is on its way, in clear
    shaking_hands,
    standing,
  };

  void begin(const std::string& peer);

  // ---- TLS
  // Messages can be exchanged.
  bool is_set_up() const noexcept { return tls_ == Tls::none || tls_ == Tls::standing; }
  void begin_handshake();
  void shake_hands();
  void tls_stands();
  Flow receive_some(char* to, std::size_t room, std::size_t& length);
  Flow send_some(std::size_t& length);
  void lose();

  // ---- reading
  std::int64_t largest_message() const noexcept;
  bool may_read() const noexcept;
  void readable();
  void read();
  void received(std::size_t length);
  void received_wrapped(std::string_view wire);
  void process();
  bool process_one();
  void make_room();
  void move_to_front() noexcept;
  bool unwrap(std::string_view wire);
  void nothing_yet();
  void consume(std::size_t length);
  void forget_input();
  std::string_view unread() const noexcept { return {in_.data() + begin_, end_ - begin_}; }
  std::shared_ptr<Client> self() { return std::static_pointer_cast<Client>(shared_from_this()); }

  Flow peek(char* to, std::size_t room, std::size_t& length) noexcept;

  // ---- writing
  bool wrap(std::string& bytes);
  std::size_t backlog() const noexcept { return out_.size() - out_sent_; }
  bool reads_enough() const noexcept;
  void writable();
  void write();
  void write_on();
  void all_sent();

  // ---- waiting
  // Waits for bytes, when some may be read.
  void watch() noexcept;
  // Calls `then` when the socket is ready. False, with the connection closed, without memory.
  bool await(Socket::wait_type what, void (Client::*then)()) noexcept;
  bool read_soon() noexcept;
  void go_on(void (Client::*then)()) noexcept;
  bool unread_in_system() noexcept;
  bool lost() noexcept;

  // ---- ending
  // The client met a limit: the same as disconnect and close, with a line of the error log.
  void cut_off(CutOff what, int code, const std::string& why);
  void cut_off_without_notice(CutOff what, const std::string& why);
  void tell_of(CutOff what, std::string_view why) noexcept;
  void look_at_deadlines(Clock::time_point now);
  bool has_bound_too_late(Clock::time_point now) const noexcept;
  bool does_not_read(Clock::time_point now);
  void part();
  void close(std::string_view why) noexcept;

  Loop& loop_;
  Descriptor arrived_;  // until it begins
  const asio::generic::stream_protocol protocol_;
  Socket socket_;
  ConnectionCounter::Ticket ticket_;
  State state_ = State::open;
  Tls tls_ = Tls::none;
  std::unique_ptr<TlsStream> stream_;     // once its handshake has begun
  std::unique_ptr<SecurityLayer> layer_;  // null: none

  ReceiveBuffer in_;  // bytes [begin_, end_) are received and not handled yet
  std::size_t begin_ = 0;
  std::size_t end_ = 0;
  bool processing_ = false;
  bool last_here_ = false;   // the message at hand is the last one that is here
  bool continuing_ = false;  // a continuation of process() is posted
  bool in_pieces_ = false;   // part of a record or frame is here that nothing can be told from

  std::string out_;  // bytes from out_sent_ on are to be written
  std::size_t out_sent_ = 0;
  bool writing_ = false;  // the system takes no more at the moment
  bool waiting_ = false;  // for bytes

  // When each began; meaningful while the condition lasts.
  Clock::time_point last_activity_ = Clock::now();    // nothing outstanding
  Clock::time_point message_begun_ = Clock::now();    // part of a message is here
  Pace pace_;                                         // something is unwritten
  Clock::time_point handshake_begun_ = Clock::now();  // TLS does not stand yet
  Clock::time_point parting_since_{};
  bool settled_ = false;
};

}  // namespace orv::server
