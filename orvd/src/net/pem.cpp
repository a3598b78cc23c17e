#include "net/pem.h"

#include <fcntl.h>
#include <openssl/err.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "cfg/secret.h"
#include "descriptor.h"

namespace orv::server {

std::string queued_error() {
  const unsigned long code = ERR_peek_error();
  const char* const reason = code != 0 ? ERR_reason_error_string(code) : nullptr;
  std::string text = reason ? reason : "";
  if (code != 0 && !reason) {
    char buffer[160];
    ERR_error_string_n(code, buffer, sizeof buffer);
    text = buffer;
  }
  ERR_clear_error();
  return text;
}

bool fail(std::string& error, const std::string& file, const std::string& what) {
  const std::string why = queued_error();
  error = file + ": " + what + (why.empty() ? "" : ": " + why);
  return false;
}

std::time_t seconds_of(const ASN1_TIME* time) noexcept {
  std::tm parts{};
  return ASN1_TIME_to_tm(time, &parts) == 1 ? ::timegm(&parts) : 0;
}

int no_passphrase(char*, int, int, void*) {
  return -1;
}

namespace {

// Why what was opened is not read; "" when it may be.
std::string refusal(const std::string& file, const struct stat& status, PemText::Holds holds,
                    off_t most) {
  if (!S_ISREG(status.st_mode)) return file + ": not a regular file";
  if (status.st_size > most) return file + ": too large";
  if (holds != PemText::Holds::key || (status.st_mode & (S_IRWXO | S_IWGRP)) == 0) return "";
  return file +
         ": others may read the private key, or change it; take these rights away "
         "(chmod 600)";
}

}  // namespace

PemText::~PemText() {
  cfg::wipe(text_);
}

bool PemText::read(const std::string& file, Holds holds, off_t most, std::string& error) {
  const Descriptor opened(::open(file.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
  struct stat status {};
  if (!opened || ::fstat(opened.number(), &status) != 0) {
    error = file + ": " + std::strerror(errno);
    return false;
  }
  error = refusal(file, status, holds, most);
  if (!error.empty()) return false;
  // One byte more than there should be, to see that nothing follows; and never moved, so that a key
  // is in one place.
  text_.resize(static_cast<std::size_t>(status.st_size) + 1);
  return fill(opened.number(), file, error);
}

bool PemText::fill(int file, const std::string& name, std::string& error) {
  std::size_t length = 0;
  while (length < text_.size()) {
    const ssize_t read = ::read(file, text_.data() + length, text_.size() - length);
    if (read < 0 && errno == EINTR) continue;
    if (read < 0) error = name + ": " + std::strerror(errno);
    if (read <= 0) break;
    length += static_cast<std::size_t>(read);
  }
  if (length == text_.size()) error = name + ": was written to while it was read";
  text_.resize(length);
  return error.empty();
}

}  // namespace orv::server
