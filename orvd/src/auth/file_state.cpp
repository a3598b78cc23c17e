#include "auth/file_state.h"

#include <sys/stat.h>

namespace orv::server {
namespace {

bool same(const std::timespec& a, const std::timespec& b) noexcept {
  return a.tv_sec == b.tv_sec && a.tv_nsec == b.tv_nsec;
}

bool folder_of(const std::string& path, struct stat& status) noexcept {
  try {
    const std::size_t slash = path.rfind('/');
    const std::string folder = slash == std::string::npos ? "." : path.substr(0, slash + 1);
    return stat(folder.c_str(), &status) == 0;
  } catch (...) {
    return false;
  }
}

}  // namespace

FileState::FileState(const std::string& path) noexcept {
  struct stat status {};
  if (path.empty()) return;
  there_ = stat(path.c_str(), &status) == 0;
  if (!there_ && !folder_of(path, status)) return;
  device_ = status.st_dev;
  inode_ = status.st_ino;
  size_ = status.st_size;
  modified_ = status.st_mtim;
  changed_ = status.st_ctim;
}

bool FileState::operator==(const FileState& other) const noexcept {
  return there_ == other.there_ && device_ == other.device_ && inode_ == other.inode_ &&
         size_ == other.size_ && same(modified_, other.modified_) && same(changed_, other.changed_);
}

}  // namespace orv::server
