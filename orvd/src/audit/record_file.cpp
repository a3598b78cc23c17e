#include "audit/record_file.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

namespace orv::server {
namespace {

constexpr std::string_view kVersion = "version: 1\n\n";
constexpr std::string_view kEndOfAnything = "\n\n";

// What has to follow the text in the file before a record may begin.
std::string_view separator(int descriptor, off_t size) noexcept {
  if (size == 0) return kVersion;
  char end[2] = {'\n', '\n'};
  const off_t length = size < 2 ? size : 2;
  if (::pread(descriptor, end + 2 - length, static_cast<std::size_t>(length), size - length) !=
      length)
    return kEndOfAnything;
  if (end[1] != '\n') return kEndOfAnything;
  return end[0] == '\n' ? "" : "\n";
}

}  // namespace

RecordFile::RecordFile(std::string path, AppendedFile file)
    : path_(std::move(path)),
      file_(std::move(file)),
      before_next_(separator(file_.descriptor.number(), file_.size)) {}

int RecordFile::append(std::string_view record) noexcept {
  if (!before_next_.empty()) {
    if (const int failure = append_whole(before_next_)) return failure;
    before_next_ = {};
  }
  return append_whole(record);
}

int RecordFile::append_whole(std::string_view text) noexcept {
  const int descriptor = file_.descriptor.number();
  struct stat before {};
  if (::fstat(descriptor, &before) != 0) return errno;
  std::size_t written = 0;
  while (written < text.size()) {
    const ssize_t now = ::write(descriptor, text.data() + written, text.size() - written);
    if (now > 0) {
      written += static_cast<std::size_t>(now);
      continue;
    }
    if (now < 0 && errno == EINTR) continue;
    const int failure = now < 0 ? errno : ENOSPC;
    if (written > 0 && ::ftruncate(descriptor, before.st_size) != 0) before_next_ = kEndOfAnything;
    return failure;
  }
  return 0;
}

}  // namespace orv::server
