#include "slapi/pblock.h"

#include <array>
#include <cstring>
#include <new>

namespace orv {
namespace {

constexpr int kOk = 0;
constexpr int kRefused = -1;

enum class Kind { pointer, required_pointer, integer, handler, instance_start };

struct Parameter {
  int number;
  Kind kind;
};

// Every parameter there is; a block has one value for each row.
constexpr std::array kParameters{
    Parameter{parameter::target_dn, Kind::required_pointer},
    Parameter{parameter::add_entry, Kind::required_pointer},
    Parameter{parameter::modifications, Kind::pointer},
    Parameter{parameter::search_scope, Kind::integer},
    Parameter{parameter::search_filter, Kind::pointer},
    Parameter{parameter::search_filter_text, Kind::pointer},
    Parameter{parameter::search_attributes, Kind::pointer},
    Parameter{parameter::search_types_only, Kind::integer},
    Parameter{parameter::backend, Kind::required_pointer},
    Parameter{parameter::connection, Kind::required_pointer},
    Parameter{parameter::operation, Kind::required_pointer},
    Parameter{parameter::bind_function, Kind::handler},
    Parameter{parameter::unbind_function, Kind::handler},
    Parameter{parameter::search_function, Kind::handler},
    Parameter{parameter::compare_function, Kind::handler},
    Parameter{parameter::modify_function, Kind::handler},
    Parameter{parameter::modify_rdn_function, Kind::handler},
    Parameter{parameter::add_function, Kind::handler},
    Parameter{parameter::delete_function, Kind::handler},
    Parameter{parameter::abandon_function, Kind::handler},
    Parameter{parameter::configuration_function, Kind::handler},
    Parameter{parameter::close_function, Kind::handler},
    Parameter{parameter::server_function_15, Kind::handler},
    Parameter{parameter::server_function_16, Kind::handler},
    Parameter{parameter::instance_start_function, Kind::instance_start},
    Parameter{parameter::persistent_search_switch, Kind::integer},
    Parameter{parameter::search_response_control, Kind::pointer},
    Parameter{parameter::persistent_search_monitor, Kind::pointer},
    Parameter{parameter::entry_before_delete, Kind::pointer},
};

constexpr std::size_t kUnknown = kParameters.size();

constexpr int kLowest = -157;
constexpr int kHighest = 210;

// The row of each number between the lowest and the highest.
constexpr auto kRows = [] {
  std::array<unsigned char, kHighest - kLowest + 1> rows{};
  for (unsigned char& row : rows) row = kUnknown;
  for (std::size_t row = 0; row < kParameters.size(); ++row)
    rows.at(static_cast<std::size_t>(kParameters[row].number - kLowest)) =
        static_cast<unsigned char>(row);
  return rows;
}();

constexpr std::size_t row_of(int number) noexcept {
  if (number < kLowest || number > kHighest) return kUnknown;
  return kRows[static_cast<std::size_t>(number - kLowest)];
}

union Value {
  void* pointer;
  int integer;
  Handler handler;
  InstanceStart start;
};

bool holds_pointer(Kind kind) noexcept {
  return kind == Kind::pointer || kind == Kind::required_pointer;
}

template <typename T>
void store(void* target, T value) noexcept {
  std::memcpy(target, &value, sizeof value);
}

}  // namespace

struct pblock {
  std::array<Value, kParameters.size()> values{};
};

namespace {

// Where a value of one of these kinds goes in `pb`; null when it may not.
Value* slot_for(pblock* pb, int number, bool (*accepts)(Kind)) noexcept {
  const std::size_t row = row_of(number);
  if (pb == nullptr || row == kUnknown || !accepts(kParameters[row].kind)) return nullptr;
  return &pb->values[row];
}

int set_pointer(pblock* pb, int number, void* value) noexcept {
  Value* const slot = slot_for(pb, number, holds_pointer);
  if (slot == nullptr) return kRefused;
  slot->pointer = value;
  return kOk;
}

}  // namespace

pblock* slapi_pblock_new() {
  return new (std::nothrow) pblock;
}

void slapi_pblock_destroy(pblock* pb) {
  delete pb;
}

int slapi_pblock_get(pblock* pb, int number, void* value) {
  const std::size_t row = row_of(number);
  if (pb == nullptr || value == nullptr || row == kUnknown) return kRefused;
  const Value& held = pb->values[row];
  switch (kParameters[row].kind) {
    case Kind::required_pointer:
      if (held.pointer == nullptr) return kRefused;
      [[fallthrough]];
    case Kind::pointer:
      store(value, held.pointer);
      return kOk;
    case Kind::integer:
      store(value, held.integer);
      return kOk;
    case Kind::handler:
      store(value, held.handler);
      return kOk;
    case Kind::instance_start:
      store(value, held.start);
      return kOk;
  }
  return kRefused;
}

int slapi_pblock_iget(pblock* pb, int number, void* value) {
  return slapi_pblock_get(pb, number, value);
}

int slapi_pblock_set(pblock* pb, int number, void* value) {
  return set_pointer(pb, number, value);
}

// Read-only parameters (the target DN, the filter's text) share the slots of the others; whoever
// gets them declares a pointer to const.
int slapi_pblock_set(pblock* pb, int number, const void* value) {
  return set_pointer(pb, number, const_cast<void*>(value));
}

int slapi_pblock_set(pblock* pb, int number, int value) {
  Value* const slot = slot_for(pb, number, [](Kind kind) { return kind == Kind::integer; });
  if (slot == nullptr) return kRefused;
  slot->integer = value;
  return kOk;
}

int slapi_pblock_set(pblock* pb, int number, Handler value) {
  Value* const slot = slot_for(pb, number, [](Kind kind) { return kind == Kind::handler; });
  if (slot == nullptr) return kRefused;
  slot->handler = value;
  return kOk;
}

int slapi_pblock_set(pblock* pb, int number, InstanceStart value) {
  Value* const slot = slot_for(pb, number, [](Kind kind) { return kind == Kind::instance_start; });
  if (slot == nullptr) return kRefused;
  slot->start = value;
  return kOk;
}

int slapi_pblock_set(pblock* pb, int number, std::nullptr_t) {
  const std::size_t row = row_of(number);
  if (row == kUnknown) return kRefused;
  switch (kParameters[row].kind) {
    case Kind::handler:
      return slapi_pblock_set(pb, number, Handler{nullptr});
    case Kind::instance_start:
      return slapi_pblock_set(pb, number, InstanceStart{nullptr});
    default:
      return set_pointer(pb, number, nullptr);
  }
}

Handler slapi_pblock_handler(const pblock* pb, int number) {
  const std::size_t row = row_of(number);
  if (pb == nullptr || row == kUnknown || kParameters[row].kind != Kind::handler) return nullptr;
  return pb->values[row].handler;
}

InstanceStart slapi_pblock_instance_start(const pblock* pb) {
  constexpr std::size_t row = row_of(parameter::instance_start_function);
  return pb == nullptr ? nullptr : pb->values[row].start;
}

pblock* getGlobalPBlock() {
  static pblock global;
  return &global;
}

}  // namespace orv
