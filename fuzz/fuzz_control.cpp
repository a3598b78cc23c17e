// Values of controls and extended operations on foreign bytes. The first octet says which.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>
#include <vector>

#include "cfg/text.h"
#include "protocol/control_values.h"
#include "protocol/encoder.h"

namespace {

using namespace orv::server;

void require(bool holds) {
  if (!holds) std::abort();
}

// A reading that fails leaves what there was alone, and says one of the codes that it may.
void require_code(int code) {
  require(code == 0 || code == 2 || code == 11);
}

void check_assertion(std::string_view value) {
  std::string filter = "before";
  const int code = read_assertion(value, {8, 100}, filter);
  require_code(code);
  require(code == 0 ? filter.front() == '(' && filter.back() == ')' : filter == "before");
  require(orv::cfg::is_valid_utf8(filter) && filter.find('\0') == std::string::npos);
}

void check_selection(std::string_view value) {
  std::vector<std::string> names{"before"};
  const int code = read_attribute_selection(value, 10, names);
  require_code(code);
  require(code == 0 ? names.size() <= 10 : names.size() == 1);
  for (const std::string& name : names) require(orv::cfg::is_valid_utf8(name));
}

void check_page(std::string_view value) {
  PagedResultsControl control;
  const int code = read_paged_results(value, control);
  require_code(code);
  require(control.size >= 0 && control.cookie.size() <= value.size());
  if (code != 0 || control.cookie.size() > 100) return;
  PagedResultsControl again;
  const Control answer = paged_results_answer(control.size, control.cookie);
  require(read_paged_results(*answer.value, again) == 0);
  require(again.size == control.size && again.cookie == control.cookie);
}

void check_cancel(std::string_view value) {
  std::int32_t id = -1;
  const int code = read_cancel(value, id);
  require_code(code);
  require(code == 0 ? id >= 0 : id == -1);
}

void check_message(std::string_view value) {
  const std::string_view operation = operation_in(value);
  std::string out;
  if (encode_again(out, value, 7, nullptr)) require(operation_in(out).size() <= value.size());
  require(operation.size() <= value.size());
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size == 0) return 0;
  // A block of its own, so that a look beyond the end is seen.
  const std::string value(reinterpret_cast<const char*>(data) + 1, size - 1);
  switch (data[0] % 5) {
    case 0:
      check_assertion(value);
      break;
    case 1:
      check_selection(value);
      break;
    case 2:
      check_page(value);
      break;
    case 3:
      check_cancel(value);
      break;
    default:
      check_message(value);
  }
  return 0;
}
