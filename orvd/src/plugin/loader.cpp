#include "plugin/loader.h"

#include <dlfcn.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <exception>
#include <utility>

namespace orv::server {
namespace {

using EntryPoint = int (*)(pblock*);

struct HandlerSlot {
  int number;
  const char* name;
  bool required;
};

// What the server calls. The optional ones are answered by the server itself when they are missing.
constexpr HandlerSlot kHandlers[] = {
    {parameter::bind_function, "bind", true},
    {parameter::unbind_function, "unbind", true},
    {parameter::search_function, "search", true},
    {parameter::compare_function, "compare", false},
    {parameter::modify_function, "modify", true},
    {parameter::modify_rdn_function, "rename", false},
    {parameter::add_function, "add", true},
    {parameter::delete_function, "delete", true},
    {parameter::abandon_function, "abandon", false},
    {parameter::configuration_function, "configuration", false},
    {parameter::close_function, "close", true},
    {parameter::server_function_15, "server function -15", false},
    {parameter::server_function_16, "server function -16", false},
};

class PluginLoad {
 public:
  PluginLoad(const std::string& path, const char* init_symbol, pblock* pb, PluginError& error)
      : path_(path), init_symbol_(init_symbol), pb_(pb), error_(error) {}

  LoadedPlugin run() {
    if (!check_file() || !open() || !find_entry_point()) return {};
    if (!call_entry_point() || !check_handlers()) {
      clear_handlers();
      return {};
    }
    return std::move(library_);
  }

  void clear_handlers() noexcept {
    for (const HandlerSlot& slot : kHandlers) slapi_pblock_set(pb_, slot.number, nullptr);
    slapi_pblock_set(pb_, parameter::instance_start_function, nullptr);
  }

 private:
  bool refuse(PluginMessage number, const std::string& reason) {
    error_.number = number;
    error_.text = std::to_string(static_cast<int>(number)) + " plug-in " + path_ + ": " + reason;
    return false;
  }

  // The loader's own words for a directory or a missing file are no help, and a bare name would
  // send it looking in the system's folders.
  bool check_file() {
    struct stat status {};
    if (stat(path_.c_str(), &status) != 0) {
      return refuse(PluginMessage::no_file, std::strerror(errno));
    }
    return S_ISREG(status.st_mode) ||
           refuse(PluginMessage::not_a_regular_file, "not a regular file");
  }

  bool open() {
    const std::string file = path_.find('/') == std::string::npos ? "./" + path_ : path_;
    // Every symbol is resolved now: one that is missing refuses the plug-in at start instead of
    // ending the server at the first operation that needs it.
    handle_ = dlopen(file.c_str(), RTLD_NOW | RTLD_LOCAL);
    library_ = LoadedPlugin(handle_);
    if (library_) return true;
    const char* reason = dlerror();
    return refuse(PluginMessage::not_loadable, reason != nullptr ? reason : "cannot be loaded");
  }

  bool find_entry_point() {
    entry_point_ = reinterpret_cast<EntryPoint>(dlsym(handle_, init_symbol_));
    return entry_point_ != nullptr ||
           refuse(PluginMessage::no_entry_point, std::string("no entry point ") + init_symbol_);
  }

  // An exception is looked at and destroyed here: its code is in the library, which is still open.
  bool call_entry_point() {
    int code = 0;
    try {
      code = entry_point_(pb_);
    } catch (const std::exception& thrown) {
      return refuse(PluginMessage::entry_point_threw,
                    std::string(init_symbol_) + " threw: " + thrown.what());
    } catch (...) {
      return refuse(PluginMessage::entry_point_threw, std::string(init_symbol_) + " threw");
    }
    return code == 0 || refuse(PluginMessage::entry_point_failed,
                               std::string(init_symbol_) + " returned " + std::to_string(code));
  }

  bool check_handlers() {
    for (const HandlerSlot& slot : kHandlers) {
      if (slot.required && slapi_pblock_handler(pb_, slot.number) == nullptr) {
        return missing(slot.name, slot.number);
      }
    }
    return slapi_pblock_instance_start(pb_) != nullptr ||
           missing("instance start", parameter::instance_start_function);
  }

  bool missing(const char* name, int number) {
    return refuse(
        PluginMessage::missing_handler,
        std::string("no ") + name + " handler (parameter " + std::to_string(number) + ")");
  }

  const std::string& path_;
  const char* init_symbol_;
  pblock* pb_;
  PluginError& error_;
  LoadedPlugin library_;
  void* handle_ = nullptr;  // borrowed from library_, valid after open()
  EntryPoint entry_point_ = nullptr;
};

}  // namespace

LoadedPlugin& LoadedPlugin::operator=(LoadedPlugin&& other) noexcept {
  std::swap(library_, other.library_);
  return *this;
}

LoadedPlugin::~LoadedPlugin() {
  if (library_ != nullptr) dlclose(library_);
}

void* LoadedPlugin::release() noexcept {
  return std::exchange(library_, nullptr);
}

LoadedPlugin load_plugin(const std::string& path, const char* init_symbol, pblock* pb,
                         PluginError& error) noexcept {
  PluginLoad load(path, init_symbol, pb, error);
  try {
    return load.run();
  } catch (...) {
    load.clear_handlers();
    error.number = PluginMessage::no_memory;
    error.text.assign("308 no memory");
    return {};
  }
}

}  // namespace orv::server
