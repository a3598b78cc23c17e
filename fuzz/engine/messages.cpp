#include "messages.h"

#include <cstdint>
#include <iterator>
#include <string_view>

#include "ops/controls.h"
#include "ops/persistent_search.h"
#include "protocol/control_values.h"
#include "world.h"

namespace orv::fuzz {
namespace {

constexpr const char* kNames[] = {
    kRoot,        kMember, kSupplier,  "",       "cn=nobody", "CN=CONFIGURATION",
    "cn=\\72oot", "no DN", "cn=root,", "cn=,o=x"};
constexpr const char* kPasswords[] = {kSecret, "wrong", "", "*", "{ssha}x"};
constexpr const char* kEntries[] = {"cn=configuration",
                                    "CN=ADMINGROUP,CN=CONFIGURATION",
                                    "cn=member,cn=admingroup,cn=configuration",
                                    "cn=schemas,cn=configuration",
                                    "cn=old,cn=schemas,cn=configuration",
                                    "cn=new,cn=schemas,cn=configuration",
                                    "cn=\\6eew,cn=schemas, cn=configuration",
                                    "cn=master server,cn=configuration",
                                    "cn=pwdpolicy admin,cn=configuration",
                                    "cn=log management,cn=configuration",
                                    "cn=kerberos,cn=configuration",
                                    "",
                                    "cn=schema",
                                    "cn=nobody,cn=nowhere",
                                    "cn=a+cn=b,cn=configuration",
                                    "=,=",
                                    "cn=#0403,cn=configuration"};
constexpr const char* kTypes[] = {"cn",
                                  "objectClass",
                                  "description",
                                  "orv-slapdAdminDN",
                                  "orv-slapdAdminPW",
                                  "orv-slapdAdminRole",
                                  "orv-slapdMasterDN",
                                  "orv-slapdMasterPW",
                                  "orv-slapdSizeLimit",
                                  "orv-slapdSuffix",
                                  "orv-slapdKrbAdminDN",
                                  "orv-slapdAdminGroupEnabled",
                                  "orv-slapdPwEncryption",
                                  "pwdMinLength",
                                  "2.5.4.3",
                                  "cn;lang-en",
                                  "orv-restartSettings",
                                  "unknown",
                                  "*",
                                  "+",
                                  "1.1",
                                  ""};
constexpr const char* kValues[] = {"new",
                                   "old",
                                   "top",
                                   "container",
                                   "one",
                                   "orv-slapdConfigEntry",
                                   "TRUE",
                                   "AuditAdmin",
                                   "NoAdmin",
                                   "ServerConfigGroupMember",
                                   "cn=member",
                                   "cn=root",
                                   "100",
                                   "-1",
                                   "orv-slapdAdminGroupMember",
                                   "none",
                                   "AES256",
                                   "SSHA512",
                                   "",
                                   "abcd1234efgh!?",
                                   "orv-slapdReplication",
                                   "orv-slapdSupplier"};
constexpr const char* kControlTypes[] = {server::kPersistentSearchOid,
                                         server::kManageDsaItOid,
                                         server::kEntryChangeOid,
                                         server::kPagedResultsOid,
                                         server::kAssertionOid,
                                         "1.2.3",
                                         "",
                                         "no OID",
                                         server::kPreReadOid,
                                         server::kPostReadOid};
constexpr const char* kMechanisms[] = {"EXTERNAL", "question", "QUESTION",
                                       "PLAIN",    "",         "DIGEST-MD5"};
constexpr const char* kCredentials[] = {"",      kSecret,      "wrong", "layer",
                                        "throw", "dn:cn=root", "u:root"};
constexpr const char* kOids[] = {"1.3.6.1.4.1.1466.20037", "1.3.6.1.4.1.4203.1.11.3", "1.3.6.1.1.8",
                                 "1.2.3", ""};
constexpr std::size_t kMostInAList = 6;

std::string length_octets(Choices& choices, std::size_t length) {
  std::string octets;
  for (std::size_t rest = length; rest > 0; rest >>= 8)
    octets.insert(octets.begin(), static_cast<char>(rest & 0xFFU));
  // Longer forms than needed are BER, too.
  const bool longer = choices.rarely(32);
  if (longer) octets.insert(octets.begin(), '\0');
  if (length < 0x80 && !longer) return std::string(1, static_cast<char>(length));
  return static_cast<char>(0x80U | octets.size()) + octets;
}

std::string tlv(Choices& choices, int tag, const std::string& content) {
  return static_cast<char>(tag) + length_octets(choices, content.size()) + content;
}

std::string integer(Choices& choices, int tag, std::int32_t value) {
  std::string octets;
  auto bits = static_cast<std::uint32_t>(value);
  do {
    octets.insert(octets.begin(), static_cast<char>(bits & 0xFFU));
    bits >>= 8;
  } while (bits > 0);
  if (value >= 0 && (static_cast<unsigned char>(octets[0]) & 0x80U) != 0)
    octets.insert(octets.begin(), '\0');
  return tlv(choices, tag, octets);
}

// A small number, or any.
std::int32_t some_number(Choices& choices) {
  const unsigned kind = choices.byte();
  return kind == 255 ? choices.number() : static_cast<std::int32_t>(kind % 5);
}

template <typename List>
std::string text(Choices& choices, const List& list) {
  if (choices.rarely(16)) return choices.raw();
  return std::string(choices.pick(list));
}

template <typename List>
std::string octets(Choices& choices, const List& list, int tag = 0x04) {
  return tlv(choices, tag, text(choices, list));
}

template <typename Make>
std::string some(Choices& choices, Make make) {
  std::string all;
  for (std::size_t count = choices.below(kMostInAList); count > 0; --count) all += make();
  return all;
}

std::string boolean(Choices& choices) {
  constexpr char kOctets[] = {'\0', '\xFF', '\1'};
  const char octet = kOctets[choices.below(16) % 3];
  return tlv(choices, 0x01, std::string(1, octet));
}

std::string bind(Choices& choices) {
  std::string body = integer(choices, 0x02, choices.rarely(16) ? some_number(choices) : 3);
  body += octets(choices, kNames);
  switch (choices.below(8)) {
    case 0:
    case 1: {
      std::string sasl = octets(choices, kMechanisms);
      if (!choices.rarely(4)) sasl += octets(choices, kCredentials);
      body += tlv(choices, 0xA3, sasl);
      break;
    }
    case 2:
      body += octets(choices, kPasswords, static_cast<int>(choices.byte()));
      break;
    default:
      body += octets(choices, kPasswords, 0x80);
  }
  return tlv(choices, 0x60, body);
}

std::string filter(Choices& choices, int depth);

std::string substrings(Choices& choices) {
  const std::string parts = some(
      choices, [&] { return octets(choices, kValues, 0x80 + static_cast<int>(choices.below(4))); });
  return tlv(choices, 0xA4, octets(choices, kTypes) + tlv(choices, 0x30, parts));
}

std::string extensible(Choices& choices) {
  std::string body;
  if (choices.rarely(2)) body += octets(choices, kTypes, 0x81);
  if (choices.rarely(2)) body += octets(choices, kTypes, 0x82);
  body += octets(choices, kValues, 0x83);
  if (choices.rarely(4)) body += tlv(choices, 0x84, std::string(1, '\xFF'));
  return tlv(choices, 0xA9, body);
}

std::string filter(Choices& choices, int depth) {
  const std::size_t kind = choices.below(11);
  if (depth == 0 && kind < 3) return octets(choices, kTypes, 0x87);
  switch (kind) {
    case 0:
    case 1:
      return tlv(choices, kind == 0 ? 0xA0 : 0xA1,
                 some(choices, [&] { return filter(choices, depth - 1); }));
    case 2:
      return tlv(choices, 0xA2, filter(choices, depth - 1));
    case 3:
      return substrings(choices);
    case 4:
      return extensible(choices);
    case 5:
    case 6:
    case 7:
    case 8: {
      constexpr int kTags[] = {0xA3, 0xA5, 0xA6, 0xA8};
      return tlv(choices, kTags[kind - 5], octets(choices, kTypes) + octets(choices, kValues));
    }
    default:
      return octets(choices, kTypes, 0x87);
  }
}

std::string search(Choices& choices) {
  std::string body = octets(choices, kEntries);
  body += integer(
      choices, 0x0A,
      choices.rarely(16) ? some_number(choices) : static_cast<std::int32_t>(choices.below(3)));
  body += integer(choices, 0x0A, some_number(choices));
  body += integer(choices, 0x02, some_number(choices));
  body += integer(choices, 0x02, 0);  // a limit of seconds would make runs differ
  body += boolean(choices);
  body += filter(choices, 10);
  body += tlv(choices, 0x30, some(choices, [&] { return octets(choices, kTypes); }));
  return tlv(choices, 0x63, body);
}

std::string values(Choices& choices) {
  return tlv(choices, 0x31, some(choices, [&] { return octets(choices, kValues); }));
}

std::string attribute(Choices& choices) {
  return tlv(choices, 0x30, octets(choices, kTypes) + values(choices));
}

std::string fixed_attribute(Choices& choices, const char* type,
                            std::initializer_list<const char*> held) {
  std::string all;
  for (const char* value : held) all += tlv(choices, 0x04, value);
  return tlv(choices, 0x30, tlv(choices, 0x04, type) + tlv(choices, 0x31, all));
}

// Entries that the rules let in, so that something is there to be changed.
std::string good_attributes(Choices& choices) {
  switch (choices.below(3)) {
    case 0:
      return fixed_attribute(choices, "objectClass", {"top", "container"}) +
             fixed_attribute(choices, "cn", {"new"});
    case 1:
      return fixed_attribute(choices, "objectClass",
                             {"top", "orv-slapdConfigEntry", "orv-slapdAdminGroupMember"}) +
             fixed_attribute(choices, "cn", {"new"}) +
             fixed_attribute(choices, "orv-slapdAdminDN", {"cn=new"}) +
             fixed_attribute(choices, "orv-slapdAdminPW", {"abcd1234efgh!?"}) +
             fixed_attribute(choices, "orv-slapdAdminRole", {"AuditAdmin"});
    default:
      return fixed_attribute(choices, "objectClass",
                             {"top", "orv-slapdConfigEntry", "orv-slapdSupplier"}) +
             fixed_attribute(choices, "cn", {"new"}) +
             fixed_attribute(choices, "orv-slapdMasterDN", {"cn=other"}) +
             fixed_attribute(choices, "orv-slapdMasterSuffix", {"o=x"});
  }
}

std::string add(Choices& choices) {
  std::string attributes;
  if (choices.rarely(2)) attributes = good_attributes(choices);
  attributes += some(choices, [&] { return attribute(choices); });
  return tlv(choices, 0x68, octets(choices, kEntries) + tlv(choices, 0x30, attributes));
}

std::string modify(Choices& choices) {
  const std::string changes = some(choices, [&] {
    const auto operation = static_cast<std::int32_t>(choices.below(64) % 4);
    return tlv(choices, 0x30, integer(choices, 0x0A, operation) + attribute(choices));
  });
  return tlv(choices, 0x66, octets(choices, kEntries) + tlv(choices, 0x30, changes));
}

std::string rename(Choices& choices) {
  std::string body = octets(choices, kEntries) + octets(choices, kEntries) + boolean(choices);
  if (choices.rarely(2)) body += octets(choices, kEntries, 0x80);
  return tlv(choices, 0x6C, body);
}

std::string compare(Choices& choices) {
  const std::string assertion = octets(choices, kTypes) + octets(choices, kValues);
  return tlv(choices, 0x6E, octets(choices, kEntries) + tlv(choices, 0x30, assertion));
}

// Mostly of something that may be outstanding.
std::string cancel_value(Choices& choices) {
  const std::int32_t target =
      choices.rarely(8) ? choices.number() : static_cast<std::int32_t>(choices.below(16));
  return tlv(choices, 0x30, integer(choices, 0x02, target));
}

std::string extended(Choices& choices) {
  const std::string oid = text(choices, kOids);
  std::string body = tlv(choices, 0x80, oid);
  if (oid == server::kCancelOid && !choices.rarely(8))
    body += tlv(choices, 0x81, cancel_value(choices));
  else if (choices.rarely(4))
    body += octets(choices, kValues, 0x81);
  return tlv(choices, 0x77, body);
}

std::string operation(Choices& choices) {
  switch (choices.below(24)) {
    case 0:
    case 1:
    case 2:
    case 3:
      return bind(choices);
    case 4:
    case 5:
    case 6:
    case 7:
    case 8:
      return search(choices);
    case 9:
    case 10:
    case 11:
      return add(choices);
    case 12:
    case 13:
    case 14:
      return modify(choices);
    case 15:
    case 16:
      return octets(choices, kEntries, 0x4A);
    case 17:
      return rename(choices);
    case 18:
      return compare(choices);
    case 19:
    case 20:
      return extended(choices);
    case 21:
    case 22:
      return integer(
          choices, 0x50,
          choices.rarely(8) ? choices.number() : static_cast<std::int32_t>(choices.below(16)));
    default:
      return tlv(choices, 0x42, choices.rarely(8) ? choices.raw() : "");
  }
}

std::string page(Choices& choices, const std::string& cookie) {
  constexpr std::int32_t kSizes[] = {1, 2, 3, 0, 100, -1, INT32_MAX, INT32_MIN};
  const std::int32_t size = kSizes[choices.below(std::size(kSizes))];
  const std::string sent = choices.rarely(2) ? cookie : choices.rarely(4) ? choices.raw() : "";
  return tlv(choices, 0x30, integer(choices, 0x02, size) + tlv(choices, 0x04, sent));
}

// A value that a control of this name can have, unless it is one of anything.
std::string control_value(Choices& choices, std::string_view type, const std::string& cookie) {
  if (choices.rarely(8)) return choices.raw();
  if (choices.rarely(16)) type = choices.pick(kControlTypes);
  if (type == server::kAssertionOid) return filter(choices, 4);
  if (type == server::kPagedResultsOid) return page(choices, cookie);
  if (type == server::kPreReadOid || type == server::kPostReadOid)
    return tlv(choices, 0x30, some(choices, [&] { return octets(choices, kTypes); }));
  const std::string wishes = integer(choices, 0x02, static_cast<std::int32_t>(choices.below(17))) +
                             boolean(choices) + boolean(choices);
  return tlv(choices, 0x30, wishes);
}

std::string controls(Choices& choices, const std::string& cookie) {
  const std::string all = some(choices, [&] {
    const std::string type = text(choices, kControlTypes);
    std::string body = tlv(choices, 0x04, type);
    if (choices.rarely(2)) body += boolean(choices);
    if (type == server::kManageDsaItOid ? choices.rarely(8) : !choices.rarely(3))
      body += tlv(choices, 0x04, control_value(choices, type, cookie));
    return tlv(choices, 0x30, body);
  });
  return tlv(choices, 0xA0, all);
}

void damage(Choices& choices, std::string& message) {
  for (std::size_t times = choices.below(4) + 1; times > 0 && !message.empty(); --times) {
    const std::size_t place = (choices.byte() << 8 | choices.byte()) % message.size();
    switch (choices.below(6)) {
      case 0:
        message.resize(place);
        break;
      case 1:
        message.insert(place, choices.raw());
        break;
      case 2:
        message.erase(place, choices.below(8) + 1);
        break;
      case 3:
        message.insert(place, message.substr(place, choices.below(32)));
        break;
      default:
        message[place] = static_cast<char>(choices.byte());
    }
  }
}

}  // namespace

std::string make_message(Choices& choices, std::int32_t id, const std::string& cookie) {
  const unsigned form = choices.byte() % 16;
  if (form == 15) return choices.raw();
  std::string body = integer(choices, 0x02, id) + operation(choices);
  if (form >= 10) body += controls(choices, cookie);
  std::string message = tlv(choices, 0x30, body);
  if (form >= 13) damage(choices, message);
  return message;
}

}  // namespace orv::fuzz
