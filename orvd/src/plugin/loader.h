// Loading a backend plug-in: open the library, find its entry point, call it, check what it stored.
//
// A later step that fails undoes the earlier ones: handlers that were stored are taken out of the
// parameter block again before the library they point into is closed. Controls that the entry point
// announced stay announced; a server that refuses its plug-in does not go on to serve.
//
// Each refusal has a number and, under that number, a paragraph for the operator in
// docs/plugin-messages.md.
//
// Threads: load at start, from one thread.
#pragma once

#include <string>

#include "slapi/pblock.h"

namespace orv::server {

// Numbers of the refusals; never reused for another meaning.
enum class PluginMessage : int {
  none = 0,
  no_file = 301,  // no such file, or it may not be read
  not_a_regular_file = 302,
  not_loadable = 303,  // the system's loader refuses it
  no_entry_point = 304,
  entry_point_failed = 305,
  entry_point_threw = 306,
  missing_handler = 307,
  no_memory = 308,
};

struct PluginError {
  PluginMessage number = PluginMessage::none;
  std::string text;  // one line, beginning with the number
};

// Owns a loaded library; closes it on destruction. Whoever holds handlers of the library must be
// done with them by then.
class LoadedPlugin {
 public:
  LoadedPlugin() = default;
  explicit LoadedPlugin(void* library) noexcept : library_(library) {}
  LoadedPlugin(LoadedPlugin&& other) noexcept : library_(other.release()) {}
  LoadedPlugin& operator=(LoadedPlugin&& other) noexcept;
  ~LoadedPlugin();

  explicit operator bool() const noexcept { return library_ != nullptr; }

  // Gives up ownership: the library then stays mapped until the process ends. For a plug-in that
  // was started: code of its own may still be reached through what it registered.
  void* release() noexcept;

 private:
  void* library_ = nullptr;
};

// Loads the plug-in at `path`, calls its entry point `init_symbol` (C linkage, int(pblock*)) with
// `pb`, and checks that all handlers the server cannot do without are there. Returns an empty owner
// on failure, with the cause in `error` and the handlers of `pb` cleared. Does not throw.
LoadedPlugin load_plugin(const std::string& path, const char* init_symbol, pblock* pb,
                         PluginError& error) noexcept;

}  // namespace orv::server
