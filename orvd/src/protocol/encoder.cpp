// Answers are written straight into the connection's buffer: all lengths are computed first, then
// every octet is copied once. liblber's writer would collect nested elements in blocks of its own,
// shift them when their lengths are known, and have the result copied out again; on the path of
// every search that costs more than the rest of the answer. Lengths are minimal and definite, so
// what comes out is the same.
#include "protocol/encoder.h"

#include <cstring>
#include <new>

#include "cfg/result_codes.h"

namespace orv::server {
namespace {

namespace universal {
constexpr unsigned char integer = 0x02;
constexpr unsigned char octets = 0x04;
constexpr unsigned char boolean = 0x01;
constexpr unsigned char enumerated = 0x0A;
constexpr unsigned char sequence = 0x30;
constexpr unsigned char set = 0x31;
}  // namespace universal

constexpr unsigned char kControls = 0xA0;
constexpr unsigned char kSaslCredentials = 0x87;
constexpr unsigned char kResponseName = 0x8A;
constexpr unsigned char kResponseValue = 0x8B;
constexpr const char* kDisconnectionOid = "1.3.6.1.4.1.1466.20036";

// ---- Lengths

std::size_t octets_of_length(std::size_t length) noexcept {
  if (length < 0x80) return 1;
  std::size_t octets = 1;
  while (length != 0) {
    ++octets;
    length >>= 8;
  }
  return octets;
}

// Of a whole element with a tag of one octet.
std::size_t element_size(std::size_t contents) noexcept {
  return 1 + octets_of_length(contents) + contents;
}

std::size_t octets_of_integer(std::int32_t value) noexcept {
  std::size_t octets = 1;
  while (octets < 4 && (value < -(1 << (8 * octets - 1)) || value >= 1 << (8 * octets - 1)))
    ++octets;
  return octets;
}

std::size_t integer_size(std::int32_t value) noexcept {
  return 2 + octets_of_integer(value);
}

// ---- Writing, into room that was made before

class Writer {
 public:
  explicit Writer(char* at) noexcept : at_(at) {}

  void header(unsigned char tag, std::size_t length) noexcept {
    put(tag);
    if (length < 0x80) {
      put(static_cast<unsigned char>(length));
      return;
    }
    const std::size_t octets = octets_of_length(length) - 1;
    put(static_cast<unsigned char>(0x80U | octets));
    for (std::size_t i = octets; i-- > 0;) put(static_cast<unsigned char>(length >> (8 * i)));
  }
  void octets(unsigned char tag, std::string_view bytes) noexcept {
    header(tag, bytes.size());
    copy(bytes);
  }
  void copy(std::string_view bytes) noexcept {
    if (bytes.empty()) return;
    std::memcpy(at_, bytes.data(), bytes.size());
    at_ += bytes.size();
  }
  void integer(unsigned char tag, std::int32_t value) noexcept {
    const std::size_t octets = octets_of_integer(value);
    header(tag, octets);
    const auto bits = static_cast<std::uint32_t>(value);
    for (std::size_t i = octets; i-- > 0;) put(static_cast<unsigned char>(bits >> (8 * i)));
  }
  void boolean(bool value) noexcept {
    header(universal::boolean, 1);
    put(value ? 0xFF : 0);
  }

 private:
  void put(unsigned char octet) noexcept { *at_++ = static_cast<char>(octet); }
  char* at_;
};

// Makes room for one element with `contents` octets behind what is in `out`. Throws std::bad_alloc.
Writer make_room(std::string& out, std::size_t size) {
  const std::size_t before = out.size();
  out.resize(before + size);
  return Writer(out.data() + before);
}

// ---- Controls, in either of the two forms they come in

struct ControlView {
  std::string_view oid;
  bool critical;
  const char* value;  // null: none
  std::size_t value_length;
};

ControlView view(const Control& control) noexcept {
  const bool has_value = control.value.has_value();
  return {control.oid, control.critical, has_value ? control.value->data() : nullptr,
          has_value ? control.value->size() : 0};
}

ControlView view(const LDAPControl& control) noexcept {
  return {control.oid != nullptr ? std::string_view(control.oid) : std::string_view(),
          control.critical != 0, control.value.bv_val, control.value.bv_len};
}

std::size_t contents_size(const ControlView& control) noexcept {
  std::size_t size = element_size(control.oid.size());
  if (control.critical) size += 3;
  if (control.value != nullptr) size += element_size(control.value_length);
  return size;
}

void write(Writer& writer, const ControlView& control) noexcept {
  writer.header(universal::sequence, contents_size(control));
  writer.octets(universal::octets, control.oid);
  if (control.critical) writer.boolean(true);
  if (control.value != nullptr) {
    writer.octets(universal::octets, {control.value, control.value_length});
  }
}

// Calls `visit` for each control of a vector, or of a null-terminated array.
template <typename Visit>
void each(const std::vector<Control>* controls, Visit visit) {
  if (controls == nullptr) return;
  for (const Control& control : *controls) visit(view(control));
}
template <typename Visit>
void each(LDAPControl** controls, Visit visit) {
  if (controls == nullptr) return;
  for (; *controls != nullptr; ++controls) visit(view(**controls));
}

// Size of what stands inside the list; 0 when no list is to be written.
template <typename Controls>
std::size_t controls_size(Controls controls) noexcept {
  std::size_t size = 0;
  each(controls, [&](const ControlView& control) { size += element_size(contents_size(control)); });
  return size;
}

// ---- The envelope

struct Envelope {
  std::int32_t message_id;
  unsigned char operation_tag;
  std::size_t operation;  // octets inside the operation
  std::size_t controls;   // octets inside the list of controls
};

std::size_t contents_size(const Envelope& envelope) noexcept {
  return integer_size(envelope.message_id) + element_size(envelope.operation) +
         (envelope.controls != 0 ? element_size(envelope.controls) : 0);
}

Writer open_envelope(std::string& out, const Envelope& envelope) {
  const std::size_t contents = contents_size(envelope);
  Writer writer = make_room(out, element_size(contents));
  writer.header(universal::sequence, contents);
  writer.integer(universal::integer, envelope.message_id);
  writer.header(envelope.operation_tag, envelope.operation);
  return writer;
}

template <typename Controls>
void close_envelope(Writer& writer, const Envelope& envelope, Controls controls) noexcept {
  if (envelope.controls == 0) return;
  writer.header(kControls, envelope.controls);
  each(controls, [&](const ControlView& control) { write(writer, control); });
}

// ---- Results

std::size_t optional_size(const std::string* bytes) noexcept {
  return bytes != nullptr ? element_size(bytes->size()) : 0;
}

std::size_t result_size(const ResultAnswer& answer) noexcept {
  return integer_size(answer.code) + element_size(answer.matched_dn.size()) +
         element_size(answer.text.size()) + optional_size(answer.sasl_credentials) +
         (answer.response_name.empty() ? 0 : element_size(answer.response_name.size())) +
         optional_size(answer.response_value);
}

void append_result(std::string& out, const ResultAnswer& answer) {
  const Envelope envelope{answer.message_id, static_cast<unsigned char>(answer.response_tag),
                          result_size(answer), controls_size(answer.controls)};
  Writer writer = open_envelope(out, envelope);
  writer.integer(universal::enumerated, answer.code);
  writer.octets(universal::octets, answer.matched_dn);
  writer.octets(universal::octets, answer.text);
  if (answer.sasl_credentials != nullptr) writer.octets(kSaslCredentials, *answer.sasl_credentials);
  if (!answer.response_name.empty()) writer.octets(kResponseName, answer.response_name);
  if (answer.response_value != nullptr) writer.octets(kResponseValue, *answer.response_value);
  close_envelope(writer, envelope, answer.controls);
}

// ---- Entries

// An attribute that was asked for, with the sizes of what it becomes.
struct Chosen {
  const attr* attribute;
  std::size_t values;    // octets inside the set
  std::size_t contents;  // octets inside the attribute
};

std::string_view bytes_of(const berval& value) noexcept {
  return value.bv_val != nullptr ? std::string_view(value.bv_val, value.bv_len)
                                 : std::string_view();
}

template <typename Visit>
void each_value(const attr& attribute, bool types_only, Visit visit) {
  if (types_only || attribute.values == nullptr) return;
  for (berval** value = attribute.values; *value != nullptr; ++value) visit(bytes_of(**value));
}

std::size_t values_size(const attr& attribute, bool types_only) noexcept {
  std::size_t size = 0;
  each_value(attribute, types_only,
             [&](std::string_view value) { size += element_size(value.size()); });
  return size;
}

std::vector<Chosen> choose(const entry& e, const AttributeSelection& selection, bool types_only) {
  std::vector<Chosen> chosen;
  chosen.reserve(32);
  for (const attr* a = e.attributes; a != nullptr; a = a->next) {
    if (a->type == nullptr || !selection.wants(a->type)) continue;
    const std::size_t values = values_size(*a, types_only);
    chosen.push_back({a, values, element_size(std::strlen(a->type)) + element_size(values)});
  }
  return chosen;
}

void append_entry(std::string& out, std::int32_t message_id, const entry& e,
                  const AttributeSelection& selection, bool types_only, LDAPControl** controls) {
  const std::vector<Chosen> chosen = choose(e, selection, types_only);
  const std::string_view dn = e.dn != nullptr ? e.dn : "";
  std::size_t list = 0;
  for (const Chosen& c : chosen) list += element_size(c.contents);
  const Envelope envelope{message_id, static_cast<unsigned char>(tag::search_entry),
                          element_size(dn.size()) + element_size(list), controls_size(controls)};
  Writer writer = open_envelope(out, envelope);
  writer.octets(universal::octets, dn);
  writer.header(universal::sequence, list);
  for (const Chosen& c : chosen) {
    writer.header(universal::sequence, c.contents);
    writer.octets(universal::octets, c.attribute->type);
    writer.header(universal::set, c.values);
    each_value(*c.attribute, types_only,
               [&](std::string_view value) { writer.octets(universal::octets, value); });
  }
  close_envelope(writer, envelope, controls);
}

// ---- Messages that are encoded already

// Takes the header of an element off the front of `rest`: its tag and the length of its contents,
// which must be there.
bool take_header(std::string_view& rest, unsigned char& tag, std::size_t& length) noexcept {
  if (rest.size() < 2) return false;
  tag = static_cast<unsigned char>(rest[0]);
  length = static_cast<unsigned char>(rest[1]);
  rest.remove_prefix(2);
  if (length >= 0x80) {
    const std::size_t octets = length & 0x7FU;
    if (octets > sizeof length || octets > rest.size()) return false;
    length = 0;
    for (const char octet : rest.substr(0, octets))
      length = length << 8 | static_cast<unsigned char>(octet);
    rest.remove_prefix(octets);
  }
  return length <= rest.size();
}

void append_again(std::string& out, std::string_view message, std::int32_t message_id,
                  const std::vector<Control>* controls) {
  std::string_view contents = operation_in(message);
  unsigned char tag = 0;
  std::size_t length = 0;
  if (!take_header(contents, tag, length)) throw std::bad_alloc();
  const Envelope envelope{message_id, tag, length, controls_size(controls)};
  Writer writer = open_envelope(out, envelope);
  writer.copy(contents);
  close_envelope(writer, envelope, controls);
}

// Room is made before the first octet is written, so a failure leaves `out` as it was.
template <typename Append>
bool without_memory_is_false(Append append) noexcept {
  try {
    append();
    return true;
  } catch (...) {
    return false;
  }
}

}  // namespace

bool encode_result(std::string& out, const ResultAnswer& answer) noexcept {
  return without_memory_is_false([&] { append_result(out, answer); });
}

bool encode_entry(std::string& out, std::int32_t message_id, const entry& e,
                  const AttributeSelection& selection, bool types_only,
                  LDAPControl** controls) noexcept {
  return without_memory_is_false(
      [&] { append_entry(out, message_id, e, selection, types_only, controls); });
}

std::string_view operation_in(std::string_view message) noexcept {
  unsigned char tag = 0;
  std::size_t length = 0;
  if (!take_header(message, tag, length) || tag != universal::sequence) return {};
  if (!take_header(message, tag, length) || tag != universal::integer) return {};
  message.remove_prefix(length);
  const std::string_view operation = message;
  if (!take_header(message, tag, length)) return {};
  return operation.substr(0, operation.size() - message.size() + length);
}

bool encode_again(std::string& out, std::string_view message, std::int32_t message_id,
                  const std::vector<Control>* controls) noexcept {
  return without_memory_is_false([&] { append_again(out, message, message_id, controls); });
}

bool encode_notice_of_disconnection(std::string& out, int code, std::string_view text) noexcept {
  ResultAnswer notice{};
  notice.response_tag = tag::extended_response;
  notice.code = code;
  notice.text = text;
  notice.response_name = kDisconnectionOid;
  return encode_result(out, notice);
}

}  // namespace orv::server
