// Files in PEM.
//
// Threads: functions are thread-safe; the queue of errors is each thread's own.
#pragma once

#include <openssl/asn1.h>
#include <openssl/bio.h>
#include <sys/stat.h>

#include <ctime>
#include <string>

#include "cfg/openssl_owners.h"

namespace orv::server {

// The first of the queued errors of this thread in words, "" when there is none; empties the queue.
std::string queued_error();

// Puts the file, what is wrong with it and the queued error into `error`; false.
bool fail(std::string& error, const std::string& file, const std::string& what);

// Seconds of the epoch; 0 for a time that cannot be read, which has passed then.
std::time_t seconds_of(const ASN1_TIME* time) noexcept;

// For OpenSSL, in the place of somebody who could be asked for a passphrase.
int no_passphrase(char* to, int size, int writing, void* data);

// What a file says that may hold a key: read without the buffers of the C library, which keep it,
// and wiped at the end.
class PemText {
 public:
  // Larger files are refused.
  static constexpr off_t kMostOfCertificates = off_t{1} << 20;
  static constexpr off_t kMostOfAuthorities = off_t{1} << 24;
  static constexpr off_t kMostOfRevocations = off_t{1} << 26;
  enum class Holds { certificates, key };

  PemText() = default;
  ~PemText();
  PemText(const PemText&) = delete;
  PemText& operator=(const PemText&) = delete;

  // False with the cause: it cannot be read, is not a regular file (nobody waits at a pipe), is
  // larger than `most` bytes or grew meanwhile, or others may read it who must not.
  bool read(const std::string& file, Holds holds, off_t most, std::string& error);

  // Refers to the text; null without memory.
  Bio bio() const { return Bio(BIO_new_mem_buf(text_.data(), static_cast<int>(text_.size()))); }
  const std::string& text() const noexcept { return text_; }

 private:
  bool fill(int file, const std::string& name, std::string& error);
  std::string text_;
};

}  // namespace orv::server
