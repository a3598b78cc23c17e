// Reminds an administrator of what ends at a date: once a day from some time before on.
//
// Threads: belongs to one thread.
#pragma once

#include <ctime>
#include <string>
#include <string_view>

namespace orv::server {

class ExpiryReminder {
 public:
  static constexpr std::time_t kDay = 24 * 60 * 60;

  // Begins `ahead` seconds before the end.
  explicit ExpiryReminder(std::time_t ahead) noexcept : ahead_(ahead) {}

  enum class Due { nothing, ends_soon, has_ended };
  // What is to be told at `now` of a thing that is good until `end`, in seconds of the epoch. Once
  // a day, and besides when it has just ended or is another thing than that of the call before.
  // Throws std::bad_alloc.
  Due due(std::string_view thing, std::time_t end, std::time_t now);

 private:
  const std::time_t ahead_;
  std::string thing_;  // of which was told last
  Due told_ = Due::nothing;
  std::time_t told_at_ = 0;
};

}  // namespace orv::server
