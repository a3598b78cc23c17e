// The server's side of TLS: what all connections share, and the TLS of one connection.
//
// TLS 1.2 and 1.3 with forward secret, authenticated suites only; no renegotiation, no compression,
// and no resumption: connections of this protocol live long, and each new one has its client's
// certificate checked anew.
//
// Threads: contexts are immutable and shared, the holder is thread-safe; a stream belongs to its
// connection's loop.
#pragma once

#include <openssl/types.h>
#include <sys/types.h>
#include <unistd.h>

#include <cstddef>
#include <ctime>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>

#include "auth/sasl.h"
#include "net/trust.h"
#include "settings.h"

namespace orv::server {

class TlsContext {
 public:
  // Reads certificate, key and authorities. Null, with the cause and the file in `error`, when one
  // of them is missing, damaged or too weak, when the key is not the certificate's or others may
  // read it, or when clients' certificates are asked for and nobody is named who may sign them, or
  // others than root and `user` could change who that is.
  static std::shared_ptr<const TlsContext> load(const TlsSettings& settings, std::string& error,
                                                uid_t user = ::geteuid());
  ~TlsContext();
  TlsContext(const TlsContext&) = delete;
  TlsContext& operator=(const TlsContext&) = delete;

  ssl_ctx_st* get() const noexcept { return context_; }
  // Hash of the server's certificate: the channel binding of RFC 5929, 4.
  const std::string& end_point() const noexcept { return end_point_; }
  // For the log: subject and end of the server's certificate.
  const std::string& description() const noexcept { return description_; }
  // When that ends, in seconds of the epoch.
  std::time_t good_until() const noexcept { return good_until_; }
  // Names which certificates of clients are believed (load_trust).
  const std::string& trust() const noexcept { return trust_.name; }
  // When lists of revoked certificates are too old (Trust).
  std::time_t revocations_good_until() const noexcept { return trust_.revocations_good_until; }

 private:
  explicit TlsContext(ssl_ctx_st* context) noexcept : context_(context) {}
  ssl_ctx_st* const context_;
  std::string end_point_;
  std::string description_;
  Trust trust_;
  std::time_t good_until_ = 0;
};

// The context for connections that begin TLS from now on.
class TlsHolder {
 public:
  std::shared_ptr<const TlsContext> current() const {
    const std::lock_guard lock(mutex_);
    return context_;
  }
  void put(std::shared_ptr<const TlsContext> context) {
    const std::lock_guard lock(mutex_);
    context_ = std::move(context);
  }

 private:
  mutable std::mutex mutex_;
  std::shared_ptr<const TlsContext> context_;
};

// What became of an attempt to move bytes that must not wait.
enum class Flow {
  moved,
  needs_input,   // again when the socket can be read
  needs_output,  // again when the socket can be written
  ended,         // the peer has finished in order
  failed,
};

class TlsStream {
 public:
  // `socket` does not block and outlives the stream. Throws std::bad_alloc.
  TlsStream(std::shared_ptr<const TlsContext> context, int socket);
  ~TlsStream();
  TlsStream(const TlsStream&) = delete;
  TlsStream& operator=(const TlsStream&) = delete;

  // Goes on with the handshake; `moved` when it is done.
  Flow shake_hands();
  // At least one byte when `moved`.
  Flow read(char* to, std::size_t room, std::size_t& length);
  Flow write(const char* from, std::size_t size, std::size_t& length);
  // Copies what could be read next, and leaves it there.
  Flow peek(char* to, std::size_t room, std::size_t& length);

  // Whether something can be read without the socket.
  bool has_more() const noexcept;
  // Whether the beginning of a record is here, and not its end.
  bool has_part_of_record() const noexcept;
  // Tells the peer that nothing follows, if the socket takes that at once.
  void say_goodbye() noexcept;

  // After the handshake: version, cipher, and the subject of the client's certificate. Throws
  // std::bad_alloc.
  void describe(TransportFacts& facts) const;
  // The same: whether the client has shown a certificate, which was good then; and why it is not at
  // `now` (seconds of the epoch) by what is believed now. "" when it is, or none was shown. Throws
  // std::bad_alloc.
  bool shows_certificate() const noexcept;
  std::string certificate_problem(const TlsContext* in_force, std::time_t now);
  // By what it was judged last; "" when none was shown.
  const std::string& trust() const noexcept { return trust_; }
  // Why it failed, mostly in OpenSSL's words; "" for a connection that was lost.
  const std::string& failure() const noexcept { return failure_; }

 private:
  static long before_or_after_socket(bio_st* bio, int operation, const char* data, std::size_t size,
                                     int argument, long number, int result, std::size_t* moved);
  bool spend_read() noexcept;
  Flow outcome(int returned);
  std::shared_ptr<const TlsContext> context_;
  ssl_st* const ssl_;
  bool broken_ = false;  // nothing more can be said
  int reads_left_ = 0;   // of the socket, for the call under way
  std::string failure_;
  std::string trust_;  // by which the client's certificate was judged
  Judgement judgement_;
};

}  // namespace orv::server
