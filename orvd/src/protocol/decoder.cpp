#include "protocol/decoder.h"

#include <new>
#include <utility>

#include "cfg/result_codes.h"
#include "protocol/ber_parser.h"
#include "protocol/encoder.h"
#include "protocol/filter_text.h"
#include "protocol/syntax.h"

namespace orv::server {
namespace {

namespace request_tag {
constexpr ber_tag_t bind = 0x60;
constexpr ber_tag_t unbind = 0x42;
constexpr ber_tag_t search = 0x63;
constexpr ber_tag_t modify = 0x66;
constexpr ber_tag_t add = 0x68;
constexpr ber_tag_t del = 0x4A;
constexpr ber_tag_t modify_dn = 0x6C;
constexpr ber_tag_t compare = 0x6E;
constexpr ber_tag_t abandon = 0x50;
constexpr ber_tag_t extended = 0x77;
}  // namespace request_tag

constexpr ber_tag_t kSequence = 0x30;
constexpr ber_tag_t kSet = 0x31;
constexpr ber_tag_t kControls = 0xA0;
constexpr ber_tag_t kSimple = 0x80;
constexpr ber_tag_t kSasl = 0xA3;
constexpr ber_tag_t kNewSuperior = 0x80;
constexpr ber_tag_t kExtendedName = 0x80;
constexpr ber_tag_t kExtendedValue = 0x81;

constexpr std::int32_t kProtocolVersion = 3;
constexpr std::size_t kMaxLengthOctets = 8;

// Reads one message. Its functions return false after noting in `verdict_` why the message cannot
// be served: `refuse` for contents that RFC 4511 does not allow, `broken` for an encoding that
// leaves in doubt where anything begins (4.1.1).
class MessageReader {
 public:
  MessageReader(const DecoderLimits& limits, Message& message)
      : limits_(limits), message_(message) {}

  Decoded read(std::string_view frame) {
    message_ = Message{};
    try {
      if (read_envelope(frame)) verdict_.state = DecodeState::decoded;
    } catch (const std::bad_alloc&) {
      refuse(result::no_memory, "out of memory");
    }
    return finish();
  }

 private:
  struct Verdict {
    DecodeState state = DecodeState::fatal;
    int code = 0;
    const char* text = "";
  };

  bool refuse(int code, const char* text) noexcept {
    verdict_ = {DecodeState::refused, code, text};
    return false;
  }
  bool refuse(const char* text) noexcept { return refuse(result::protocol_error, text); }
  bool broken(const char* text) noexcept {
    verdict_ = {DecodeState::fatal, result::protocol_error, text};
    return false;
  }

  // A refusal needs an answer to travel in: before the operation is known, and for those that are
  // never answered, the connection ends instead.
  Decoded finish() {
    if (verdict_.state == DecodeState::refused && response_tag_ == 0) {
      verdict_.state = DecodeState::fatal;
    }
    Decoded decoded{verdict_.state, verdict_.code, 0, verdict_.text};
    if (verdict_.state == DecodeState::refused) decoded.response_tag = response_tag_;
    return decoded;
  }

  // ---- Elements

  bool take(std::string_view& rest, ber_tag_t tag, std::string_view& contents) noexcept {
    Element element;
    if (!parser_.take(rest, element)) return broken("malformed element");
    if (element.tag != tag) return broken("unexpected element");
    contents = element.contents;
    return true;
  }

  bool end(std::string_view rest) noexcept {
    return parser_.skip_extensions(rest) || broken("trailing bytes");
  }

  static bool next_is(std::string_view rest, unsigned char tag) noexcept {
    return !rest.empty() && static_cast<unsigned char>(rest.front()) == tag;
  }

  bool take_number(std::string_view& rest, ber_tag_t tag, std::int32_t& number) noexcept {
    std::string_view contents;
    if (!take(rest, tag, contents)) return false;
    switch (read_integer(contents, number)) {
      case IntegerState::good:
        return true;
      case IntegerState::empty:
        return broken("integer without octets");
      case IntegerState::out_of_range:
        break;
    }
    return refuse("integer out of range");
  }

  bool take_choice(std::string_view& rest, std::int32_t last, int& choice,
                   const char* text) noexcept {
    std::int32_t number = 0;
    if (!take_number(rest, LBER_ENUMERATED, number)) return false;
    if (number > last) return refuse(text);
    choice = number;
    return true;
  }

  bool take_boolean(std::string_view& rest, bool& flag) noexcept {
    std::string_view contents;
    if (!take(rest, LBER_BOOLEAN, contents)) return false;
    if (contents.size() != 1) return broken("boolean of other than one octet");
    const auto octet = static_cast<unsigned char>(contents.front());
    // RFC 4511, 5.1: true is FF and nothing else.
    if (octet != 0 && octet != 0xFF) return refuse("boolean is neither 00 nor FF");
    flag = octet != 0;
    return true;
  }

  bool take_octets(std::string_view& rest, std::string_view& contents) noexcept {
    return take(rest, LBER_OCTETSTRING, contents);
  }

  bool take_dn(std::string_view& rest, std::string& dn) {
    std::string_view contents;
    return take_octets(rest, contents) && accept_dn(contents, dn);
  }

  bool accept_dn(std::string_view contents, std::string& dn) {
    if (!is_clean_text(contents)) return refuse(result::invalid_dn_syntax, "invalid DN");
    dn = contents;
    return true;
  }

  bool take_type(std::string_view& rest, std::string& type) {
    std::string_view contents;
    if (!take_octets(rest, contents)) return false;
    if (!is_attribute_description(contents)) return refuse("attribute description not valid");
    type = contents;
    return true;
  }

  // ---- The envelope (RFC 4511, 4.1.1)

  bool read_envelope(std::string_view frame) {
    if (frame.size() > limits_.message_bytes) return broken("message too large");
    std::string_view rest;
    if (!take(frame, kSequence, rest)) return false;
    if (!frame.empty()) return broken("trailing bytes");
    if (!read_id(rest)) return false;
    Element operation;
    if (!parser_.take(rest, operation)) return broken("malformed element");
    std::string_view controls;
    const bool has_controls = next_is(rest, kControls);
    if (has_controls && !take(rest, kControls, controls)) return false;
    // A second list of controls is no extension that somebody will define.
    if (next_is(rest, kControls) || !parser_.skip_extensions(rest)) return broken("trailing bytes");
    return read_operation(operation) && (!has_controls || read_controls(controls));
  }

  // 0 is what the server's own notices carry, so no request may.
  bool read_id(std::string_view& rest) noexcept {
    std::int32_t id = 0;
    if (!take_number(rest, LBER_INTEGER, id) || id == 0) return broken("message id not valid");
    message_.id = id;
    return true;
  }

  bool read_operation(const Element& operation) {
    const std::string_view body = operation.contents;
    switch (operation.tag) {
      case request_tag::bind:
        return answered_by(tag::bind_response) && read_bind(body);
      case request_tag::unbind:
        return read_unbind(body);
      case request_tag::search:
        return answered_by(tag::search_done) && read_search(body);
      case request_tag::modify:
        return answered_by(tag::modify_response) && read_modify(body);
      case request_tag::add:
        return answered_by(tag::add_response) && read_add(body);
      case request_tag::del:
        return answered_by(tag::delete_response) && read_delete(body);
      case request_tag::modify_dn:
        return answered_by(tag::modify_dn_response) && read_modify_dn(body);
      case request_tag::compare:
        return answered_by(tag::compare_response) && read_compare(body);
      case request_tag::abandon:
        return read_abandon(body);
      case request_tag::extended:
        return answered_by(tag::extended_response) && read_extended(body);
      default:
        return broken("unknown operation");
    }
  }

  bool answered_by(int response_tag) noexcept {
    response_tag_ = response_tag;
    return true;
  }

  // ---- Controls (4.1.11)

  bool read_controls(std::string_view rest) {
    while (!rest.empty()) {
      std::string_view body;
      if (!take(rest, kSequence, body)) return false;
      if (!has_room(message_.controls.size(), limits_.controls)) {
        return refuse(result::admin_limit_exceeded, "too many controls");
      }
      if (!read_control(body, message_.controls.emplace_back())) return false;
    }
    return true;
  }

  bool read_control(std::string_view rest, Control& control) {
    std::string_view contents;
    if (!take_octets(rest, contents)) return false;
    if (!is_numeric_oid(contents)) return refuse("control type is not an OID");
    control.oid = contents;
    if (next_is(rest, LBER_BOOLEAN) && !take_boolean(rest, control.critical)) return false;
    if (next_is(rest, LBER_OCTETSTRING)) {
      if (!take_octets(rest, contents)) return false;
      control.value.emplace(contents);
    }
    return end(rest);
  }

  static bool has_room(std::size_t used, int limit) noexcept {
    return limit > 0 && used < static_cast<std::size_t>(limit);
  }

  // ---- Bind and unbind (4.2, 4.3)

  bool read_bind(std::string_view rest) {
    auto& request = message_.request.emplace<BindRequest>();
    if (!take_number(rest, LBER_INTEGER, request.version)) return false;
    // Looked at first: the rest may be laid out differently in another version.
    if (request.version != kProtocolVersion) return refuse("only protocol version 3 is served");
    if (!take_dn(rest, request.name)) return false;
    Element credentials;
    if (!parser_.take(rest, credentials)) return broken("malformed element");
    switch (credentials.tag) {
      case kSimple:
        request.password = credentials.contents;
        break;
      case kSasl:
        if (!read_sasl(credentials.contents, request)) return false;
        break;
      default:
        return refuse(result::auth_method_not_supported, "unknown kind of authentication");
    }
    return end(rest);
  }

  bool read_sasl(std::string_view rest, BindRequest& request) {
    request.simple = false;
    std::string_view contents;
    if (!take_octets(rest, contents)) return false;
    if (!is_clean_text(contents)) return refuse("mechanism name not valid");
    request.mechanism = contents;
    if (next_is(rest, LBER_OCTETSTRING)) {
      if (!take_octets(rest, contents)) return false;
      request.credentials.emplace(contents);
    }
    return end(rest);
  }

  bool read_unbind(std::string_view body) {
    message_.request.emplace<UnbindRequest>();
    return body.empty() || broken("unbind with contents");
  }

  // ---- Search (4.5)

  bool read_search(std::string_view rest) {
    auto& request = message_.request.emplace<SearchRequest>();
    if (!take_dn(rest, request.base)) return false;
    if (!take_choice(rest, 2, request.scope, "unknown search scope")) return false;
    if (!take_choice(rest, 3, request.deref, "unknown treatment of aliases")) return false;
    if (!take_number(rest, LBER_INTEGER, request.size_limit)) return false;
    if (!take_number(rest, LBER_INTEGER, request.time_limit)) return false;
    if (!take_boolean(rest, request.types_only)) return false;
    return read_filter(rest, request.filter) && read_selectors(rest, request.attributes) &&
           end(rest);
  }

  bool read_filter(std::string_view& rest, std::string& text) {
    Element filter;
    if (!parser_.take(rest, filter)) return broken("malformed filter");
    const FilterLimits limits{limits_.filter_depth, limits_.filter_items};
    const FilterOutcome outcome = filter_to_text(parser_, filter, limits, text);
    if (outcome.broken) return broken(outcome.text);
    return outcome.code == 0 || refuse(outcome.code, outcome.text);
  }

  // Selectors that are no attribute descriptions ("@person") are kept: what the server does not
  // know selects nothing (4.5.1.8).
  bool read_selectors(std::string_view& rest, std::vector<std::string>& names) {
    std::string_view list;
    if (!take(rest, kSequence, list)) return false;
    while (!list.empty()) {
      std::string_view name;
      if (!take_octets(list, name)) return false;
      if (!has_room(names.size(), limits_.attributes)) return too_many_attributes();
      if (!is_clean_text(name)) return refuse("attribute selector not valid");
      names.emplace_back(name);
    }
    return true;
  }

  bool too_many_attributes() noexcept {
    return refuse(result::admin_limit_exceeded, "too many attributes");
  }

  // ---- Add, delete, modify (4.6 to 4.8)

  bool read_attribute(std::string_view rest, Attribute& attribute) {
    std::string_view values;
    return take_type(rest, attribute.type) && take(rest, kSet, values) &&
           read_values(values, attribute.values) && end(rest);
  }

  // As many as there is room for.
  std::size_t count_values(std::string_view rest) noexcept {
    const auto most = static_cast<std::size_t>(limits_.values);
    std::size_t count = 0;
    Element element;
    while (count < most && parser_.take(rest, element)) ++count;
    return count;
  }

  bool read_values(std::string_view rest, std::vector<std::string>& values) {
    // Room for all of them at once: short texts that move leave their characters behind, and these
    // may be passwords.
    values.reserve(count_values(rest));
    while (!rest.empty()) {
      std::string_view value;
      if (!take_octets(rest, value)) return false;
      if (!has_room(values_read_, limits_.values)) {
        return refuse(result::admin_limit_exceeded, "too many values");
      }
      ++values_read_;
      values.emplace_back(value);
    }
    return true;
  }

  bool read_add(std::string_view rest) {
    auto& request = message_.request.emplace<AddRequest>();
    std::string_view list;
    if (!take_dn(rest, request.dn) || !take(rest, kSequence, list)) return false;
    if (list.empty()) return refuse("entry without attributes");
    while (!list.empty()) {
      std::string_view body;
      if (!take(list, kSequence, body)) return false;
      if (!has_room(request.attributes.size(), limits_.attributes)) return too_many_attributes();
      Attribute& attribute = request.attributes.emplace_back();
      if (!read_attribute(body, attribute)) return false;
      if (attribute.values.empty()) return refuse("attribute without values");
    }
    return end(rest);
  }

  bool read_delete(std::string_view body) {
    return accept_dn(body, message_.request.emplace<DeleteRequest>().dn);
  }

  bool read_modify(std::string_view rest) {
    auto& request = message_.request.emplace<ModifyRequest>();
    std::string_view list;
    if (!take_dn(rest, request.dn) || !take(rest, kSequence, list)) return false;
    if (list.empty()) return refuse("empty list of changes");
    while (!list.empty()) {
      std::string_view body;
      if (!take(list, kSequence, body)) return false;
      if (!has_room(request.modifications.size(), limits_.attributes)) return too_many_attributes();
      if (!read_modification(body, request.modifications.emplace_back())) return false;
    }
    return end(rest);
  }

  bool read_modification(std::string_view rest, Modification& modification) {
    std::string_view body;
    if (!take_choice(rest, 2, modification.operation, "unknown kind of modification")) return false;
    if (!take(rest, kSequence, body)) return false;
    if (!read_attribute(body, modification.attribute)) return false;
    if (modification.operation == 0 && modification.attribute.values.empty()) {
      return refuse("nothing to add");
    }
    return end(rest);
  }

  // ---- What is only answered (4.9, 4.10)

  bool read_modify_dn(std::string_view rest) {
    auto& request = message_.request.emplace<ModifyDnRequest>();
    if (!take_dn(rest, request.dn) || !take_dn(rest, request.new_rdn)) return false;
    if (!take_boolean(rest, request.delete_old_rdn)) return false;
    if (next_is(rest, kNewSuperior)) {
      std::string_view superior;
      if (!take(rest, kNewSuperior, superior)) return false;
      if (!accept_dn(superior, request.new_superior.emplace())) return false;
    }
    return end(rest);
  }

  bool read_compare(std::string_view rest) {
    auto& request = message_.request.emplace<CompareRequest>();
    std::string_view assertion;
    std::string type;
    std::string_view value;
    return take_dn(rest, request.dn) && take(rest, kSequence, assertion) &&
           take_type(assertion, type) && take_octets(assertion, value) && end(assertion) &&
           end(rest);
  }

  // ---- Abandon and extended operations (4.11, 4.12)

  bool read_abandon(std::string_view body) {
    auto& request = message_.request.emplace<AbandonRequest>();
    return read_integer(body, request.message_id) == IntegerState::good ||
           broken("message id not valid");
  }

  bool read_extended(std::string_view rest) {
    auto& request = message_.request.emplace<ExtendedRequest>();
    std::string_view contents;
    if (!take(rest, kExtendedName, contents)) return false;
    if (!is_numeric_oid(contents)) return refuse("operation name is not an OID");
    request.oid = contents;
    if (next_is(rest, kExtendedValue)) {
      if (!take(rest, kExtendedValue, contents)) return false;
      request.value.emplace(contents);
    }
    return end(rest);
  }

  const DecoderLimits& limits_;
  Message& message_;
  BerParser parser_;
  Verdict verdict_;
  int response_tag_ = 0;
  std::size_t values_read_ = 0;
};

}  // namespace

Frame next_frame(std::string_view received, std::size_t message_bytes) noexcept {
  if (received.empty()) return {FrameState::need_more, 0};
  if (static_cast<unsigned char>(received[0]) != kSequence) return {FrameState::malformed, 0};
  if (received.size() == 1) return {FrameState::need_more, 0};
  const auto first = static_cast<unsigned char>(received[1]);
  std::size_t header = 2;
  std::size_t contents = first;
  if (first >= 0x80) {
    const std::size_t octets = first & 0x7FU;
    if (octets == 0 || octets > kMaxLengthOctets) return {FrameState::malformed, 0};
    header += octets;
    contents = 0;
    for (const char octet : received.substr(2, octets)) {
      contents = contents << 8 | static_cast<unsigned char>(octet);
      // Further octets only make it longer; there is no need to wait for them.
      if (contents > message_bytes) return {FrameState::too_big, 0};
    }
    if (received.size() < header) return {FrameState::need_more, 0};
  }
  if (header > message_bytes || contents > message_bytes - header) {
    return {FrameState::too_big, 0};
  }
  const std::size_t length = header + contents;
  return {received.size() < length ? FrameState::need_more : FrameState::complete, length};
}

Decoded decode(std::string_view frame, const DecoderLimits& limits, Message& message) noexcept {
  try {
    return MessageReader(limits, message).read(frame);
  } catch (...) {
    return {DecodeState::fatal, result::no_memory, 0, {}};
  }
}

}  // namespace orv::server
