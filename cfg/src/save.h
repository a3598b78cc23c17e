// Putting a new version of the configuration file in the place of the old one.
//
// Beside the configuration file a save uses these names: ".lock" (the advisory lock; it stays),
// ".new" (the new version until it is flushed), ".swap" (the new version until it is in place, the
// old one afterwards). What a writer that was stopped left of them, the next one clears away. A
// ".swap" that is neither the version before the interrupted change nor the change itself is
// somebody's edit; it is kept under the name with ".rescued" added, or ".rescued-2" and so on.
#pragma once

#include <functional>
#include <string>

#include "file_calls.h"
#include "file_text.h"

namespace orv::cfg {

struct SaveJob {
  const char* config_file;  // may be a symbolic link, which stays
  const char* save_file;    // keeps the version before; "" when none is wanted
  const FileText& before;   // as read; the file must still be this
  FileText& after;          // as it shall be; receives the new file's identity on success
  // Whether the new version may be put in place; asked while it is on its way to the disk. May
  // throw std::bad_alloc.
  std::function<bool()> is_acceptable;
};

// 0, and then the new version survives a power failure. Otherwise the old file is in place:
// 51 somebody else holds the lock, or the file is not `before`; 53 no permission, or read-only
// media; 80 other errors of the file system, or `after` is not acceptable; 90; with the cause in
// words, which names the file. Only when every call from the failure on fails as well the file may
// be left as the new version, and a line on the diagnostics stream says so. Where the file system
// cannot exchange two names, an edit between the last look at the file and the renaming over it is
// lost.
int save(FileCalls& files, const SaveJob& job, std::string& cause) noexcept;

}  // namespace orv::cfg
