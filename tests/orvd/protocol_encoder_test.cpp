// Answers: what is encoded here is what a client library reads.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <map>

#include "cfg/result_codes.h"
#include "protocol/encoder.h"
#include "protocol_client.h"
#include "protocol_raw.h"
#include "server_entries.h"

namespace orv::server {
namespace {

using namespace raw;
using ::testing::ElementsAre;

struct ReadMessage {
  LDAPMessage* message = nullptr;
  int type = -1;
  ReadMessage() = default;
  ReadMessage(ReadMessage&& other) noexcept
      : message(std::exchange(other.message, nullptr)), type(other.type) {}
  ~ReadMessage() {
    if (message != nullptr) ldap_msgfree(message);
  }
};

ReadMessage next_answer(ClientLibrary& client, int id) {
  ReadMessage read;
  timeval patience{10, 0};
  read.type = ldap_result(client.handle(), id, LDAP_MSG_ONE, &patience, &read.message);
  return read;
}

int start_search(ClientLibrary& client) {
  int id = 0;
  EXPECT_EQ(ldap_search_ext(client.handle(), "", LDAP_SCOPE_BASE, "(objectClass=*)", nullptr, 0,
                            nullptr, nullptr, nullptr, 0, &id),
            LDAP_SUCCESS);
  client.sent();
  return id;
}

using Shown = std::map<std::string, std::vector<std::string>>;

struct ShownEntry {
  std::string dn;
  Shown attributes;
};

// What the client library sees of an entry.
ShownEntry shown(const entry& e, const AttributeSelection& selection, bool types_only = false) {
  ClientLibrary client;
  const int id = start_search(client);
  std::string bytes;
  EXPECT_TRUE(encode_entry(bytes, id, e, selection, types_only, nullptr));
  EXPECT_TRUE(client.receive(bytes));
  const ReadMessage read = next_answer(client, id);
  EXPECT_EQ(read.type, LDAP_RES_SEARCH_ENTRY);
  ShownEntry result;
  if (read.type != LDAP_RES_SEARCH_ENTRY) return result;
  char* dn = ldap_get_dn(client.handle(), read.message);
  result.dn = dn;
  ldap_memfree(dn);
  BerElement* cursor = nullptr;
  for (char* type = ldap_first_attribute(client.handle(), read.message, &cursor); type != nullptr;
       type = ldap_next_attribute(client.handle(), read.message, cursor)) {
    std::vector<std::string>& values = result.attributes[type];
    ::berval** list = ldap_get_values_len(client.handle(), read.message, type);
    for (::berval** value = list; value != nullptr && *value != nullptr; ++value) {
      values.emplace_back((*value)->bv_val, (*value)->bv_len);
    }
    ldap_value_free_len(list);
    ldap_memfree(type);
  }
  ber_free(cursor, 0);
  return result;
}

AttributeSelection select(std::initializer_list<const char*> names) {
  AttributeSelection selection;
  Names list(names);
  EXPECT_TRUE(selection.assign(list.get()));
  return selection;
}

EntryPtr sample() {
  EntryPtr e = make_entry("cn=Sample,cn=configuration");
  add_values(e, "objectClass", {"top", "container"});
  add_values(e, "cn", {"Sample"});
  add_values(e, "description",
             {std::string(127, 'a'), std::string(128, 'b'), std::string(255, 'c'),
              std::string(256, 'd'), std::string(70000, 'e'), ""});
  add_values(e, "createTimestamp", {"20240101000000Z"});
  return e;
}

// ---- Entries

TEST(EncodeEntry, ClientSeesNameTypesAndValues) {
  const EntryPtr e = sample();
  const ShownEntry seen = shown(*e, {});
  EXPECT_EQ(seen.dn, "cn=Sample,cn=configuration");
  EXPECT_EQ(seen.attributes.size(), 3U);
  EXPECT_THAT(seen.attributes.at("objectClass"), ElementsAre("top", "container"));
  EXPECT_THAT(seen.attributes.at("description"),
              ElementsAre(std::string(127, 'a'), std::string(128, 'b'), std::string(255, 'c'),
                          std::string(256, 'd'), std::string(70000, 'e'), ""));
}

TEST(EncodeEntry, TypesOnlyShowsNoValues) {
  const EntryPtr e = sample();
  const ShownEntry seen = shown(*e, {}, true);
  EXPECT_EQ(seen.attributes, (Shown{{"objectClass", {}}, {"cn", {}}, {"description", {}}}));
}

TEST(EncodeEntry, EntryWithoutAttributesAndName) {
  const EntryPtr e = make_entry("");
  const ShownEntry seen = shown(*e, {});
  EXPECT_EQ(seen.dn, "");
  EXPECT_TRUE(seen.attributes.empty());
  entry zero{};
  std::string bytes;
  EXPECT_TRUE(encode_entry(bytes, 7, zero, {}, false, nullptr));
  EXPECT_EQ(bytes, tlv(0x30, integer(7) + tlv(0x64, octets("") + sequence({}))));
}

TEST(EncodeEntry, LengthsAroundEveryStepAreMinimal) {
  for (const std::size_t length :
       {0U, 1U, 100U, 117U, 126U, 127U, 128U, 240U, 255U, 256U, 65535U, 65536U, 200000U}) {
    const std::string value(length, 'v');
    const EntryPtr e = make_entry("cn=x");
    add_values(e, "cn", {value});
    std::string bytes = "before";
    ASSERT_TRUE(encode_entry(bytes, 300, *e, {}, false, nullptr));
    const std::string list = sequence({sequence({octets("cn"), set({octets(value)})})});
    EXPECT_EQ(bytes, "before" + tlv(0x30, integer(300) + tlv(0x64, octets("cn=x") + list)));
  }
}

TEST(EncodeEntry, ControlsTravelBehindTheEntry) {
  std::string oid1 = "1.2.3";
  std::string oid2 = "1.2.4";
  std::string value = "v\0w"s;
  orv::LDAPControl first{oid1.data(), {value.size(), value.data()}, 1};
  orv::LDAPControl second{oid2.data(), {0, nullptr}, 0};
  orv::LDAPControl* list[] = {&first, &second, nullptr};
  const EntryPtr e = make_entry("cn=x");
  std::string bytes;
  ASSERT_TRUE(encode_entry(bytes, 7, *e, {}, false, list));
  EXPECT_EQ(bytes, message(tlv(0x64, octets("cn=x") + sequence({})),
                           controls({sequence({octets("1.2.3"), boolean(true), octets(value)}),
                                     sequence({octets("1.2.4")})})));
}

TEST(EncodeEntry, EmptyListOfControlsIsLeftOut) {
  orv::LDAPControl* none[] = {nullptr};
  const EntryPtr e = make_entry("cn=x");
  std::string bytes;
  ASSERT_TRUE(encode_entry(bytes, 7, *e, {}, false, none));
  EXPECT_EQ(bytes, message(tlv(0x64, octets("cn=x") + sequence({}))));
}

// ---- Which attributes

std::vector<std::string> types_shown(std::initializer_list<const char*> names) {
  const EntryPtr e = sample();
  std::vector<std::string> types;
  for (const auto& [type, values] : shown(*e, select(names), true).attributes)
    types.push_back(type);
  return types;  // in the order of their names
}

TEST(Selection, NothingAskedForIsAllUserAttributes) {
  AttributeSelection selection;
  ASSERT_TRUE(selection.assign(nullptr));
  EXPECT_TRUE(selection.wants("cn"));
  EXPECT_FALSE(selection.wants("createTimestamp"));
  EXPECT_THAT(types_shown({}), ElementsAre("cn", "description", "objectClass"));
  EXPECT_THAT(types_shown({"*"}), ElementsAre("cn", "description", "objectClass"));
}

TEST(Selection, PlusIsAllOperationalAttributes) {
  EXPECT_THAT(types_shown({"+"}), ElementsAre("createTimestamp"));
  EXPECT_THAT(types_shown({"*", "+"}),
              ElementsAre("cn", "createTimestamp", "description", "objectClass"));
  EXPECT_THAT(types_shown({"+", "cn"}), ElementsAre("cn", "createTimestamp"));
}

TEST(Selection, NamesAreFoundInEverySpelling) {
  EXPECT_THAT(types_shown({"CN"}), ElementsAre("cn"));
  EXPECT_THAT(types_shown({"commonName"}), ElementsAre("cn"));
  EXPECT_THAT(types_shown({"2.5.4.3"}), ElementsAre("cn"));
  EXPECT_THAT(types_shown({"CREATETIMESTAMP"}), ElementsAre("createTimestamp"));
  EXPECT_THAT(types_shown({"*", "createTimestamp"}),
              ElementsAre("cn", "createTimestamp", "description", "objectClass"));
}

TEST(Selection, NoAttributesUnlessSomethingElseIsNamed) {
  EXPECT_THAT(types_shown({"1.1"}), ElementsAre());
  EXPECT_THAT(types_shown({"1.1", "cn"}), ElementsAre("cn"));
  EXPECT_THAT(types_shown({"1.1", "*"}), ElementsAre("cn", "description", "objectClass"));
}

TEST(Selection, UnknownNamesSelectNothing) {
  EXPECT_THAT(types_shown({"noSuchType"}), ElementsAre());
  EXPECT_THAT(types_shown({"@person", "", "cn;lang-de"}), ElementsAre());
  EXPECT_TRUE(select({"noSuchType"}).wants("NOSUCHTYPE"));
}

TEST(Selection, AssigningAgainForgetsTheFormer) {
  AttributeSelection selection = select({"+", "cn"});
  Names other{"sn"};
  ASSERT_TRUE(selection.assign(other.get()));
  EXPECT_FALSE(selection.wants("cn"));
  EXPECT_FALSE(selection.wants("createTimestamp"));
  EXPECT_TRUE(selection.wants("sn"));
}

// ---- Results

TEST(EncodeResult, ClientSeesCodeNameAndText) {
  for (const int code : {0, 1, 32, 53, 90, 92, 118, 127, 128, 4096, 70000}) {
    ClientLibrary client;
    const int id = start_search(client);
    std::string bytes;
    ResultAnswer answer{};
    answer.message_id = id;
    answer.response_tag = tag::search_done;
    answer.code = code;
    answer.matched_dn = "cn=configuration";
    answer.text = "because";
    ASSERT_TRUE(encode_result(bytes, answer));
    ASSERT_TRUE(client.receive(bytes));
    const ReadMessage read = next_answer(client, id);
    ASSERT_EQ(read.type, LDAP_RES_SEARCH_RESULT);
    int seen = -1;
    char* matched = nullptr;
    char* text = nullptr;
    ASSERT_EQ(ldap_parse_result(client.handle(), read.message, &seen, &matched, &text, nullptr,
                                nullptr, 0),
              LDAP_SUCCESS);
    EXPECT_EQ(seen, code);
    EXPECT_STREQ(matched, "cn=configuration");
    EXPECT_STREQ(text, "because");
    ldap_memfree(matched);
    ldap_memfree(text);
  }
}

TEST(EncodeResult, ExtendedAnswerCarriesNameAndValue) {
  ClientLibrary client;
  int id = 0;
  ASSERT_EQ(ldap_extended_operation(client.handle(), "1.3.6.1.4.1.4203.1.11.3", nullptr, nullptr,
                                    nullptr, &id),
            LDAP_SUCCESS);
  const Outcome request = raw::decode(client.sent());
  EXPECT_EQ(std::get<ExtendedRequest>(request.message.request).oid, "1.3.6.1.4.1.4203.1.11.3");
  const std::string value = "dn:cn=root";
  ResultAnswer answer{};
  answer.message_id = request.message.id;
  answer.response_tag = tag::extended_response;
  answer.response_name = "1.2.3";
  answer.response_value = &value;
  std::string bytes;
  ASSERT_TRUE(encode_result(bytes, answer));
  ASSERT_TRUE(client.receive(bytes));
  const ReadMessage read = next_answer(client, id);
  ASSERT_EQ(read.type, LDAP_RES_EXTENDED);
  char* name = nullptr;
  ::berval* data = nullptr;
  ASSERT_EQ(ldap_parse_extended_result(client.handle(), read.message, &name, &data, 0),
            LDAP_SUCCESS);
  EXPECT_STREQ(name, "1.2.3");
  ASSERT_NE(data, nullptr);
  EXPECT_EQ(std::string(data->bv_val, data->bv_len), value);
  ldap_memfree(name);
  ber_bvfree(data);
}

TEST(EncodeResult, SaslCredentialsTravelInTheBindAnswer) {
  const std::string challenge = "nonce\0x"s;
  ResultAnswer answer{};
  answer.message_id = 7;
  answer.response_tag = tag::bind_response;
  answer.code = result::sasl_bind_in_progress;
  answer.sasl_credentials = &challenge;
  std::string bytes;
  ASSERT_TRUE(encode_result(bytes, answer));
  EXPECT_EQ(
      bytes,
      message(tlv(0x61, join({enumerated(14), octets(""), octets(""), tlv(0x87, challenge)}))));
}

TEST(EncodeResult, ControlsTravelBehindTheResult) {
  const std::vector<Control> list{{"1.2.3", true, "v"}, {"1.2.4", false, ""}, {"1.2.5", false, {}}};
  ResultAnswer answer{};
  answer.message_id = 7;
  answer.response_tag = tag::search_done;
  answer.controls = &list;
  std::string bytes;
  ASSERT_TRUE(encode_result(bytes, answer));
  EXPECT_EQ(bytes, message(tlv(0x65, join({enumerated(0), octets(""), octets("")})),
                           controls({sequence({octets("1.2.3"), boolean(true), octets("v")}),
                                     sequence({octets("1.2.4"), octets("")}),
                                     sequence({octets("1.2.5")})})));
}

TEST(EncodeResult, NoticeOfDisconnectionIsUnsolicited) {
  std::string bytes;
  ASSERT_TRUE(encode_notice_of_disconnection(bytes, result::protocol_error, "malformed element"));
  EXPECT_EQ(bytes, message(tlv(0x78, join({enumerated(2), octets(""), octets("malformed element"),
                                           tlv(0x8A, "1.3.6.1.4.1.1466.20036")})),
                           "", 0));
}

}  // namespace
}  // namespace orv::server
