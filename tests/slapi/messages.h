// Collects the messages that a test provokes.
#pragma once

#include <string>
#include <vector>

#include "slapi/log.h"

namespace orv::test {

class MessageRecorder {
 public:
  MessageRecorder() {
    messages().clear();
    set_message_sink(record);
  }
  ~MessageRecorder() { set_message_sink(nullptr); }
  MessageRecorder(const MessageRecorder&) = delete;
  MessageRecorder& operator=(const MessageRecorder&) = delete;

  // "set/number text" each; forgets them.
  std::vector<std::string> take() {
    std::vector<std::string> taken;
    taken.swap(messages());
    return taken;
  }

 private:
  static std::vector<std::string>& messages() {
    thread_local std::vector<std::string> list;
    return list;
  }
  static void record(int /*severity*/, int set, int number, const char* text) noexcept {
    messages().push_back(std::to_string(set) + "/" + std::to_string(number) + " " + text);
  }
};

}  // namespace orv::test
