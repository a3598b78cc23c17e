// A file to whose end records are appended, each whole or not at all, as far as the system lets it.
//
// Threads: one at a time.
#pragma once

#include <string>
#include <string_view>

#include "guarded_file.h"

namespace orv::server {

class RecordFile {
 public:
  // `file` is open for reading too. `path` is what it is called in complaints.
  RecordFile(std::string path, AppendedFile file);

  const std::string& path() const noexcept { return path_; }
  FileIdentity identity() const noexcept { return file_.identity; }

  // Writes a record, which ends with an empty line, behind an empty line or at the beginning of the
  // file, also when whoever wrote here last was cut off. 0 or an error number: then what was
  // written of the record is taken back, and where that fails too, the next record begins behind an
  // empty line nevertheless.
  int append(std::string_view record) noexcept;

 private:
  int append_whole(std::string_view text) noexcept;

  const std::string path_;
  const AppendedFile file_;
  std::string_view before_next_;  // a constant: what has to stand before the next record
};

}  // namespace orv::server
