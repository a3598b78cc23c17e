// DN parser: whatever it accepts has a normal form that is stable and keeps its shape.
#include <cstdint>
#include <cstdlib>
#include <string>

#include "cfg/dn.h"
#include "cfg/result_codes.h"

using namespace orv::cfg;

namespace {

void require(bool holds) {
  if (!holds) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string text(reinterpret_cast<const char*>(data), size);
  Dn dn;
  std::string normal;
  const bool parsed = parse_dn(text, dn) == orv::result::success;
  const bool normalized = normalize_dn(text, normal) == orv::result::success;
  // A DN whose normal form outgrows the limit parses and has none.
  require(parsed || !normalized);
  if (!normalized) return 0;

  std::string again;
  require(normalize_dn(normal, again) == orv::result::success && again == normal);
  Dn of_normal;
  require(parse_dn(normal, of_normal) == orv::result::success && of_normal.size() == dn.size());

  std::string light;
  std::string of_light;
  require(normalize_dn_light(text, light) == orv::result::success);
  if (light.size() <= kMaxDnLength) {
    require(normalize_dn(light, of_light) == orv::result::success && of_light == normal);
  }
  std::string canonical;
  std::string of_canonical;
  require(canonicalize_dn_types(text, canonical) == orv::result::success);
  if (canonical.size() <= kMaxDnLength) {
    require(normalize_dn(canonical, of_canonical) == orv::result::success);
    require(of_canonical == normal);
  }
  std::size_t depth = 0;
  for (std::string_view above = normal; !above.empty(); above = parent_of_normal_dn(above)) {
    require(normal_dn_is_at_or_below(normal, above));
    ++depth;
  }
  require(depth == dn.size());
  return 0;
}
