// Filters: what a client library encodes comes back as the text that means the same.
#include <gtest/gtest.h>

#include <vector>

#include "cfg/result_codes.h"
#include "protocol/encoder.h"
#include "protocol_client.h"
#include "protocol_raw.h"

namespace orv::server {
namespace {

using namespace raw;

std::string text_of(const std::string& filter) {
  const Outcome outcome = raw::decode(message(search(filter)));
  if (outcome.decoded.state != DecodeState::decoded) return "not decoded: " + outcome.decoded.text;
  return std::get<SearchRequest>(outcome.message.request).filter;
}

Decoded refusal_of(const std::string& filter, const DecoderLimits& limits = {}) {
  return raw::decode(message(search(filter)), limits).decoded;
}

void expect_rejected(const char* what, const std::string& filter,
                     int code = result::protocol_error) {
  const Decoded decoded = refusal_of(filter);
  EXPECT_EQ(decoded.state, DecodeState::refused) << what;
  EXPECT_EQ(decoded.code, code) << what;
  EXPECT_EQ(decoded.response_tag, tag::search_done) << what;
}

void expect_fatal(const char* what, const std::string& filter) {
  EXPECT_EQ(refusal_of(filter).state, DecodeState::fatal) << what;
}

std::string substrings(std::initializer_list<std::string> pieces) {
  return tlv(0xA4, octets("cn") + sequence(pieces));
}

std::string nested(int depth, int tag = 0xA2) {
  const std::string item = presence();
  std::size_t length = item.size();
  std::vector<std::string> headers;
  for (int level = 1; level < depth; ++level) {
    headers.push_back(header(tag, length));
    length += headers.back().size();
  }
  std::string filter;
  for (auto one = headers.rbegin(); one != headers.rend(); ++one) filter += *one;
  return filter + item;
}

// ---- Against a client library

struct Spelling {
  const char* sent;
  const char* text;  // null: the same
};

class FilterOfAClient : public ::testing::TestWithParam<Spelling> {};

TEST_P(FilterOfAClient, KeepsItsMeaning) {
  ClientLibrary client;
  int id = 0;
  ASSERT_EQ(ldap_search_ext(client.handle(), "cn=configuration", LDAP_SCOPE_SUBTREE,
                            GetParam().sent, nullptr, 0, nullptr, nullptr, nullptr, 0, &id),
            LDAP_SUCCESS);
  const Outcome outcome = raw::decode(client.sent());
  ASSERT_EQ(outcome.decoded.state, DecodeState::decoded) << outcome.decoded.text;
  EXPECT_EQ(outcome.message.id, id);
  const char* expected = GetParam().text != nullptr ? GetParam().text : GetParam().sent;
  EXPECT_EQ(std::get<SearchRequest>(outcome.message.request).filter, expected);
}

// Sending the rebuilt text once more gives the same bytes: nothing was lost or added.
TEST_P(FilterOfAClient, EncodesToTheSameBytesAgain) {
  const auto encoded = [](const std::string& filter) {
    ClientLibrary client;
    int id = 0;
    EXPECT_EQ(ldap_search_ext(client.handle(), "", LDAP_SCOPE_BASE, filter.c_str(), nullptr, 0,
                              nullptr, nullptr, nullptr, 0, &id),
              LDAP_SUCCESS);
    return client.sent();
  };
  const std::string first = encoded(GetParam().sent);
  const Outcome outcome = raw::decode(first);
  ASSERT_EQ(outcome.decoded.state, DecodeState::decoded);
  EXPECT_EQ(encoded(std::get<SearchRequest>(outcome.message.request).filter), first);
}

INSTANTIATE_TEST_SUITE_P(
    All, FilterOfAClient,
    ::testing::Values(
        Spelling{"(objectClass=*)", nullptr}, Spelling{"objectClass=*", "(objectClass=*)"},
        Spelling{"(cn=Directory Manager)", nullptr}, Spelling{"(cn=)", nullptr},
        Spelling{"(cn>=a)", nullptr}, Spelling{"(cn<=a)", nullptr}, Spelling{"(cn~=a)", nullptr},
        Spelling{"(&(cn=a)(cn=b)(cn=c))", nullptr}, Spelling{"(|(cn=a)(!(cn=b)))", nullptr},
        Spelling{"(&(|(cn=a)(cn=b))(!(&(sn=c)(ou=*))))", nullptr}, Spelling{"(&(cn=a))", nullptr},
        Spelling{"(cn=a*)", nullptr}, Spelling{"(cn=*a)", nullptr}, Spelling{"(cn=*a*)", nullptr},
        Spelling{"(cn=a*b*c*d)", nullptr}, Spelling{"(cn=*a*b*)", nullptr},
        Spelling{"(cn=\\2a)", "(cn=\\2A)"},
        Spelling{"(cn=a\\28b\\29c\\5cd\\00e)", "(cn=a\\28b\\29c\\5Cd\\00e)"},
        Spelling{"(cn=a\\2a*\\29)", "(cn=a\\2A*\\29)"}, Spelling{"(cn=J\xC3\xBCrgen)", nullptr},
        Spelling{"(cn=\xE6\x97\xA5\xF0\x9F\x98\x80)", nullptr},
        Spelling{"(cn=J\\c3\\bcrgen)", "(cn=J\xC3\xBCrgen)"},
        Spelling{"(cn=\\ff\\fe)", "(cn=\\FF\\FE)"}, Spelling{"(cn=\\c3)", "(cn=\\C3)"},
        Spelling{"(cn:caseExactMatch:=x)", nullptr}, Spelling{"(cn:dn:2.5.13.5:=x)", nullptr},
        Spelling{"(:dn:caseExactMatch:=x)", nullptr}, Spelling{"(cn:=x\\2a)", "(cn:=x\\2A)"}),
    [](const auto& instance) { return "Number" + std::to_string(instance.index); });

// ---- From raw tags

TEST(FilterText, InvalidUtf8IsEscapedOctetByOctet) {
  EXPECT_EQ(text_of(equality("cn", "\xED\xA0\x80")), "(cn=\\ED\\A0\\80)");
  EXPECT_EQ(text_of(equality("cn", "\xC0\xAF")), "(cn=\\C0\\AF)");
  EXPECT_EQ(text_of(equality("cn", "a\x80z")), "(cn=a\\80z)");
  EXPECT_EQ(text_of(equality("cn", "\xF0\x9F\x98")), "(cn=\\F0\\9F\\98)");
  EXPECT_EQ(text_of(equality("cn", "\xC3\xA4\xC3")), "(cn=\xC3\xA4\\C3)");
}

TEST(FilterText, ValuesCannotSmuggleSyntax) {
  EXPECT_EQ(text_of(equality("cn", "a)(objectClass=*")), "(cn=a\\29\\28objectClass=\\2A)");
  EXPECT_EQ(text_of(substrings({tlv(0x80, "*)("), tlv(0x82, "\\")})), "(cn=\\2A\\29\\28*\\5C)");
}

TEST(FilterText, ExtensibleMatchesInEveryForm) {
  const std::string rule = tlv(0x81, "caseExactMatch");
  const std::string type = tlv(0x82, "cn");
  const std::string value = tlv(0x83, "v*");
  EXPECT_EQ(text_of(tlv(0xA9, rule + type + value)), "(cn:caseExactMatch:=v\\2A)");
  EXPECT_EQ(text_of(tlv(0xA9, rule + type + value + tlv(0x84, "\xFF"))),
            "(cn:dn:caseExactMatch:=v\\2A)");
  EXPECT_EQ(text_of(tlv(0xA9, type + value)), "(cn:=v\\2A)");
  EXPECT_EQ(text_of(tlv(0xA9, type + value + tlv(0x84, "\0"s))), "(cn:=v\\2A)");
  EXPECT_EQ(text_of(tlv(0xA9, type + value + tlv(0x84, "\xFF"))), "(cn:dn:=v\\2A)");
  EXPECT_EQ(text_of(tlv(0xA9, tlv(0x81, "2.5.13.2") + value)), "(:2.5.13.2:=v\\2A)");
  EXPECT_EQ(text_of(tlv(0xA9, rule + value + tlv(0x84, "\xFF"))), "(:dn:caseExactMatch:=v\\2A)");
}

TEST(FilterText, UnknownComponentOfAMatchIsIgnored) {
  EXPECT_EQ(text_of(tlv(0xA9, tlv(0x82, "cn") + tlv(0x83, "v") + tlv(0x85, "later"))), "(cn:=v)");
}

TEST(FilterText, AttributesWithOptionsAndNumbersAreKept) {
  EXPECT_EQ(text_of(equality("2.5.4.3;lang-de;x-y", "v")), "(2.5.4.3;lang-de;x-y=v)");
  EXPECT_EQ(text_of(presence("0.9.2342")), "(0.9.2342=*)");
}

TEST(FilterText, UnknownChoices_rejected) {
  for (int tag = 0; tag < 256; ++tag) {
    if ((tag >= 0xA0 && tag <= 0xA9 && tag != 0xA7) || tag == 0x87) continue;
    if ((tag & 0x1F) == 0x1F) continue;  // tags of several octets
    expect_rejected("choice", tlv(tag, "cn"));
  }
}

TEST(FilterText, EmptySets_rejected) {
  expect_rejected("and", tlv(0xA0, ""));
  expect_rejected("or", tlv(0xA1, ""));
  expect_rejected("inner and", tlv(0xA2, tlv(0xA0, "")));
}

TEST(FilterText, DamagedItems_rejected) {
  expect_fatal("not of nothing", tlv(0xA2, ""));
  expect_fatal("not of two", tlv(0xA2, presence() + presence()));
  expect_fatal("half an element in a set", tlv(0xA0, presence() + "\x87"));
  expect_fatal("no value", tlv(0xA3, octets("cn")));
  expect_fatal("three parts", tlv(0xA3, octets("cn") + octets("v") + octets("w")));
  expect_fatal("type as integer", tlv(0xA3, integer(1) + octets("v")));
  expect_fatal("no pieces", tlv(0xA4, octets("cn")));
  expect_fatal("pieces as a set", tlv(0xA4, octets("cn") + set({tlv(0x80, "a")})));
  expect_fatal("no match value", tlv(0xA9, tlv(0x82, "cn")));
  expect_fatal("components out of order", tlv(0xA9, tlv(0x83, "v") + tlv(0x82, "cn")));
  expect_fatal("component twice", tlv(0xA9, tlv(0x82, "cn") + tlv(0x82, "cn") + tlv(0x83, "v")));
  expect_fatal("constructed component", tlv(0xA9, tlv(0xA2, "cn") + tlv(0x83, "v")));
  expect_fatal("flag of two octets",
               tlv(0xA9, tlv(0x82, "cn") + tlv(0x83, "v") + tlv(0x84, "\xFF\xFF")));
}

TEST(FilterText, SubstringsOutOfOrder_rejected) {
  expect_rejected("none", substrings({}));
  expect_rejected("initial behind any", substrings({tlv(0x81, "a"), tlv(0x80, "b")}));
  expect_rejected("two initials", substrings({tlv(0x80, "a"), tlv(0x80, "b")}));
  expect_rejected("two finals", substrings({tlv(0x82, "a"), tlv(0x82, "b")}));
  expect_rejected("any behind final", substrings({tlv(0x82, "a"), tlv(0x81, "b")}));
  expect_rejected("unknown piece", substrings({tlv(0x83, "a")}));
  expect_rejected("octet string", substrings({octets("a")}));
  for (const int tag : {0x80, 0x81, 0x82}) expect_rejected("empty", substrings({tlv(tag, "")}));
}

TEST(FilterText, MatchesOutOfSyntax_rejected) {
  expect_rejected("neither rule nor type", tlv(0xA9, tlv(0x83, "v")));
  expect_rejected("rule", tlv(0xA9, tlv(0x81, "a:=b") + tlv(0x83, "v")));
  expect_rejected("empty rule", tlv(0xA9, tlv(0x81, "") + tlv(0x83, "v")));
  expect_rejected("type", tlv(0xA9, tlv(0x82, "a b") + tlv(0x83, "v")));
  expect_rejected("flag 01", tlv(0xA9, tlv(0x82, "cn") + tlv(0x83, "v") + tlv(0x84, "\1")));
}

TEST(FilterText, DepthBeyondTheLimit_rejected) {
  DecoderLimits limits;
  limits.filter_depth = 5;
  for (const int tag : {0xA0, 0xA1, 0xA2}) {
    EXPECT_EQ(refusal_of(nested(5, tag), limits).state, DecodeState::decoded);
    const Decoded decoded = refusal_of(nested(6, tag), limits);
    EXPECT_EQ(decoded.state, DecodeState::refused);
    EXPECT_EQ(decoded.code, result::admin_limit_exceeded);
  }
}

TEST(FilterText, DeepestFilterThatFitsAMessageIsRefusedWithoutRecursion) {
  DecoderLimits limits;
  limits.message_bytes = 1 << 24;
  const Decoded decoded = refusal_of(nested(200000), limits);
  EXPECT_EQ(decoded.state, DecodeState::refused);
  limits.filter_depth = 1 << 20;
  limits.filter_items = 1 << 20;
  EXPECT_EQ(refusal_of(nested(200000), limits).state, DecodeState::decoded);
}

TEST(FilterText, MoreItemsThanTheLimit_rejected) {
  DecoderLimits limits;
  limits.filter_items = 4;
  const std::string three = tlv(0xA0, presence() + presence() + presence());
  EXPECT_EQ(refusal_of(three, limits).state, DecodeState::decoded);
  const std::string four = tlv(0xA0, presence() + presence() + presence() + presence());
  EXPECT_EQ(refusal_of(four, limits).code, result::admin_limit_exceeded);
  const std::string pieces = substrings({tlv(0x81, "a"), tlv(0x81, "b"), tlv(0x81, "c")});
  EXPECT_EQ(refusal_of(pieces, limits).state, DecodeState::decoded);
  const std::string more =
      substrings({tlv(0x81, "a"), tlv(0x81, "b"), tlv(0x81, "c"), tlv(0x82, "d")});
  EXPECT_EQ(refusal_of(more, limits).code, result::admin_limit_exceeded);
}

}  // namespace
}  // namespace orv::server
