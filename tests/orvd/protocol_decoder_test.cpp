// Requests: what is understood, what is refused with an answer, what ends the connection.
#include <gtest/gtest.h>

#include "cfg/result_codes.h"
#include "protocol/encoder.h"
#include "protocol_raw.h"

namespace orv::server {
namespace {

using namespace raw;

template <typename Request>
Request accepted(const std::string& frame) {
  Outcome outcome = raw::decode(frame);
  EXPECT_EQ(outcome.decoded.state, DecodeState::decoded) << outcome.decoded.text;
  EXPECT_EQ(outcome.decoded.code, 0);
  EXPECT_EQ(outcome.message.id, 7);
  EXPECT_TRUE(std::holds_alternative<Request>(outcome.message.request));
  return std::holds_alternative<Request>(outcome.message.request)
             ? std::get<Request>(outcome.message.request)
             : Request{};
}

struct BadMessage {
  const char* what;
  std::string frame;
};

void expect_fatal(const BadMessage& bad) {
  const Decoded decoded = raw::decode(bad.frame).decoded;
  EXPECT_EQ(decoded.state, DecodeState::fatal) << bad.what;
  EXPECT_EQ(decoded.code, result::protocol_error) << bad.what;
  EXPECT_EQ(decoded.response_tag, 0) << bad.what;
  EXPECT_FALSE(decoded.text.empty()) << bad.what;
}

void expect_refused(const BadMessage& bad, int code, int response_tag,
                    const DecoderLimits& limits = {}) {
  const Outcome outcome = raw::decode(bad.frame, limits);
  EXPECT_EQ(outcome.decoded.state, DecodeState::refused) << bad.what;
  EXPECT_EQ(outcome.decoded.code, code) << bad.what;
  EXPECT_EQ(outcome.decoded.response_tag, response_tag) << bad.what;
  EXPECT_EQ(outcome.message.id, 7) << bad.what;
  EXPECT_FALSE(outcome.decoded.text.empty()) << bad.what;
}

// ---- Understood

TEST(Decoder, SimpleBind) {
  const auto bind = accepted<BindRequest>(message(simple_bind("cn=root", "secret\0x"s)));
  EXPECT_EQ(bind.version, 3);
  EXPECT_EQ(bind.name, "cn=root");
  EXPECT_TRUE(bind.simple);
  EXPECT_EQ(bind.password, "secret\0x"s);
}

TEST(Decoder, SaslBindWithAndWithoutCredentials) {
  const auto with = accepted<BindRequest>(
      message(tlv(0x60, integer(3) + octets("") + tlv(0xA3, octets("EXTERNAL") + octets("u:me")))));
  EXPECT_FALSE(with.simple);
  EXPECT_EQ(with.mechanism, "EXTERNAL");
  EXPECT_EQ(with.credentials, "u:me");
  const auto without = accepted<BindRequest>(
      message(tlv(0x60, integer(3) + octets("") + tlv(0xA3, octets("GSSAPI")))));
  EXPECT_EQ(without.credentials, std::nullopt);
}

TEST(Decoder, Unbind) {
  accepted<UnbindRequest>(message(tlv(0x42, "")));
}

TEST(Decoder, SearchWithEverything) {
  const auto search = accepted<SearchRequest>(message(
      tlv(0x63, join({octets("cn=configuration"), enumerated(1), enumerated(3), integer(500),
                      integer(0x7FFFFFFF), boolean(true), equality("cn", "x"),
                      sequence({octets("cn"), octets("*"), octets("+"), octets("1.1")})}))));
  EXPECT_EQ(search.base, "cn=configuration");
  EXPECT_EQ(search.scope, 1);
  EXPECT_EQ(search.deref, 3);
  EXPECT_EQ(search.size_limit, 500);
  EXPECT_EQ(search.time_limit, 0x7FFFFFFF);
  EXPECT_TRUE(search.types_only);
  EXPECT_EQ(search.filter, "(cn=x)");
  EXPECT_EQ(search.attributes, (std::vector<std::string>{"cn", "*", "+", "1.1"}));
}

TEST(Decoder, SelectorOfAnotherFeatureIsKept) {
  const auto request = accepted<SearchRequest>(message(search(presence(), octets("@person"))));
  EXPECT_EQ(request.attributes, std::vector<std::string>{"@person"});
}

TEST(Decoder, AddKeepsOrderAndBytes) {
  const auto request = accepted<AddRequest>(
      message(add("cn=x", {attribute("objectClass", {octets("top"), octets("container")}),
                           attribute("2.5.4.3;lang-de", {octets("a\0b"s), octets("")})})));
  EXPECT_EQ(request.dn, "cn=x");
  ASSERT_EQ(request.attributes.size(), 2U);
  EXPECT_EQ(request.attributes[0].type, "objectClass");
  EXPECT_EQ(request.attributes[0].values, (std::vector<std::string>{"top", "container"}));
  EXPECT_EQ(request.attributes[1].type, "2.5.4.3;lang-de");
  EXPECT_EQ(request.attributes[1].values, (std::vector<std::string>{"a\0b"s, ""}));
}

TEST(Decoder, ModifyKeepsCodesInOrder) {
  const auto request = accepted<ModifyRequest>(
      message(modify("cn=x", {change(2, attribute("cn", {})), change(1, attribute("sn", {})),
                              change(0, attribute("sn", {octets("v")}))})));
  ASSERT_EQ(request.modifications.size(), 3U);
  EXPECT_EQ(request.modifications[0].operation, 2);
  EXPECT_EQ(request.modifications[1].operation, 1);
  EXPECT_EQ(request.modifications[2].operation, 0);
  EXPECT_TRUE(request.modifications[0].attribute.values.empty());
  EXPECT_EQ(request.modifications[2].attribute.values, std::vector<std::string>{"v"});
}

TEST(Decoder, Delete) {
  EXPECT_EQ(accepted<DeleteRequest>(message(del("cn=x"))).dn, "cn=x");
}

TEST(Decoder, RenameWithAndWithoutNewSuperior) {
  const auto plain = accepted<ModifyDnRequest>(message(modify_dn("cn=x")));
  EXPECT_EQ(plain.dn, "cn=x");
  EXPECT_FALSE(plain.new_superior);
  const auto moved = accepted<ModifyDnRequest>(message(
      tlv(0x6C, join({octets("cn=y"), octets("cn=z"), boolean(false), tlv(0x80, "cn=above")}))));
  EXPECT_EQ(moved.dn, "cn=y");
  EXPECT_EQ(moved.new_rdn, "cn=z");
  EXPECT_FALSE(moved.delete_old_rdn);
  EXPECT_EQ(moved.new_superior, "cn=above");
  EXPECT_TRUE(accepted<ModifyDnRequest>(
                  message(tlv(0x6C, join({octets("cn=y"), octets("cn=z"), boolean(true)}))))
                  .delete_old_rdn);
}

TEST(Decoder, Compare) {
  EXPECT_EQ(accepted<CompareRequest>(message(compare("cn=x"))).dn, "cn=x");
}

TEST(Decoder, Abandon) {
  EXPECT_EQ(accepted<AbandonRequest>(message(abandon(300))).message_id, 300);
}

TEST(Decoder, ExtendedWithAndWithoutValue) {
  const auto without = accepted<ExtendedRequest>(message(extended("1.3.6.1.4.1.4203.1.11.3")));
  EXPECT_EQ(without.oid, "1.3.6.1.4.1.4203.1.11.3");
  EXPECT_EQ(without.value, std::nullopt);
  const auto with = accepted<ExtendedRequest>(message(tlv(0x77, tlv(0x80, "1.2") + tlv(0x81, ""))));
  EXPECT_EQ(with.value, "");
}

TEST(Decoder, ControlsInEveryForm) {
  const std::string list =
      controls({sequence({octets("1.2.3")}), sequence({octets("1.2.4"), boolean(true)}),
                sequence({octets("1.2.5"), octets("v")}),
                sequence({octets("1.2.6"), boolean(false), octets("")})});
  const Outcome outcome = raw::decode(message(del("cn=x"), list));
  ASSERT_EQ(outcome.decoded.state, DecodeState::decoded) << outcome.decoded.text;
  const std::vector<Control>& read = outcome.message.controls;
  ASSERT_EQ(read.size(), 4U);
  EXPECT_EQ(read[0].oid, "1.2.3");
  EXPECT_FALSE(read[0].critical);
  EXPECT_EQ(read[0].value, std::nullopt);
  EXPECT_TRUE(read[1].critical);
  EXPECT_EQ(read[2].value, "v");
  EXPECT_FALSE(read[3].critical);
  EXPECT_EQ(read[3].value, "");
}

TEST(Decoder, EmptyListOfControlsIsNone) {
  const Outcome outcome = raw::decode(message(del("cn=x"), controls({})));
  EXPECT_EQ(outcome.decoded.state, DecodeState::decoded);
  EXPECT_TRUE(outcome.message.controls.empty());
}

TEST(Decoder, LargestMessageIdIsAccepted) {
  const Outcome outcome = raw::decode(message(del("cn=x"), "", 0x7FFFFFFF));
  EXPECT_EQ(outcome.decoded.state, DecodeState::decoded);
  EXPECT_EQ(outcome.message.id, 0x7FFFFFFF);
}

TEST(Decoder, LongFormsOfInnerLengthsAreAccepted) {
  for (int form = 1; form <= 8; ++form) {
    const std::string body =
        tlv_long(0x04, "cn=x", form) +
        tlv_long(0x30, tlv_long(0x30, octets("cn") + set({octets("v")}), form), form);
    const Outcome outcome = raw::decode(tlv(0x30, integer(7) + tlv_long(0x68, body, form)));
    EXPECT_EQ(outcome.decoded.state, DecodeState::decoded) << form << outcome.decoded.text;
  }
}

TEST(Decoder, UnknownTrailingElementsOfSequencesAreIgnored) {
  const std::string more = tlv(0x9E, "later");
  const std::string frames[] = {
      tlv(0x30, integer(7) + del("cn=x") + more),
      tlv(0x30, integer(7) + del("cn=x") + controls({sequence({octets("1.2"), more})}) + more),
      message(tlv(0x60, integer(3) + octets("") + tlv(0x80, "") + more)),
      message(tlv(0x77, tlv(0x80, "1.2") + more)),
  };
  for (const std::string& frame : frames) {
    EXPECT_EQ(raw::decode(frame).decoded.state, DecodeState::decoded);
  }
}

TEST(Decoder, OldContentsOfTheMessageAreGone) {
  Message message;
  message.controls.resize(3);
  ASSERT_EQ(server::decode(raw::message(del("cn=x")), {}, message).state, DecodeState::decoded);
  EXPECT_TRUE(message.controls.empty());
}

// ---- Fatal: what RFC 4511, 4.1.1 answers with a notice of disconnection

TEST(Decoder, DamagedEnvelopes_rejected) {
  const std::string op = del("cn=x");
  const BadMessage kCases[] = {
      {"nothing", ""},
      {"empty message", tlv(0x30, "")},
      {"wrong outer tag", tlv(0x31, integer(7) + op)},
      {"id alone", tlv(0x30, integer(7))},
      {"no id", tlv(0x30, op)},
      {"id 0", message(op, "", 0)},
      {"negative id", tlv(0x30, tlv(0x02, "\xFF") + op)},
      {"id of 2^31", tlv(0x30, tlv(0x02, "\0\x80\0\0\0"s) + op)},
      {"id of four octets and negative", tlv(0x30, tlv(0x02, "\x80\0\0\0"s) + op)},
      {"id of five octets", tlv(0x30, tlv(0x02, "\0\0\0\0\1"s) + op)},
      {"id without octets", tlv(0x30, tlv(0x02, "") + op)},
      {"id as enumerated", tlv(0x30, enumerated(7) + op)},
      {"bytes behind the message", message(op) + "x"},
      {"second message behind it", message(op) + message(op)},
      {"half an element behind the operation", tlv(0x30, integer(7) + op + "\x04"s)},
      {"second operation", tlv(0x30, integer(7) + op + octets("x"))},
      {"two lists of controls", tlv(0x30, integer(7) + op + controls({}) + controls({}))},
      {"indefinite length of the operation", tlv(0x30, integer(7) + "\x68\x80\0\0"s)},
      {"indefinite length of the message", "\x30\x80\x02\x01\x07\x42\0\0\0"s},
      {"length of nine octets", tlv(0x30, integer(7) + tlv_long(0x4A, "cn=x", 9))},
      {"length beyond the message", tlv(0x30, integer(7) + "\x4A\x05" + "cn=x")},
      {"length beyond everything",
       tlv(0x30, integer(7) + "\x4A\x88\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF" + "cn=x")},
  };
  for (const BadMessage& bad : kCases) expect_fatal(bad);
}

TEST(Decoder, UnknownOperations_rejected) {
  for (int tag = 0; tag < 256; ++tag) {
    const bool known = std::string_view("\x60\x42\x63\x66\x68\x4A\x6C\x6E\x50\x77", 10)
                           .find(static_cast<char>(tag)) != std::string_view::npos;
    if (!known) expect_fatal({"unknown operation", message(tlv(tag, "cn=x"))});
  }
}

TEST(Decoder, OperationsInTheOtherForm_rejected) {
  for (const int tag : {0x40, 0x62, 0x43, 0x46, 0x48, 0x6A, 0x4C, 0x4E, 0x70, 0x57}) {
    expect_fatal({"primitive for constructed or the reverse", message(tlv(tag, "cn=x"))});
  }
}

TEST(Decoder, DamagedStructures_rejected) {
  const std::string dn = octets("cn=x");
  const BadMessage kCases[] = {
      {"unbind with contents", message(tlv(0x42, "x"))},
      {"abandon without id", message(tlv(0x50, ""))},
      {"abandon of a negative id", message(tlv(0x50, "\xFF"))},
      {"bind: empty", message(tlv(0x60, ""))},
      {"bind: no version", message(tlv(0x60, dn + tlv(0x80, "")))},
      {"bind: no name", message(tlv(0x60, integer(3) + tlv(0x80, "")))},
      {"bind: no credentials", message(tlv(0x60, integer(3) + dn))},
      {"bind: constructed name", message(tlv(0x60, integer(3) + tlv(0x24, dn) + tlv(0x80, "")))},
      {"bind: trailing octets", message(tlv(0x60, integer(3) + dn + tlv(0x80, "") + dn))},
      {"bind: version without octets", message(tlv(0x60, tlv(0x02, "") + dn + tlv(0x80, "")))},
      {"bind: SASL without mechanism", message(tlv(0x60, integer(3) + dn + tlv(0xA3, "")))},
      {"search: empty", message(tlv(0x63, ""))},
      {"search: no selectors", message(tlv(0x63, join({dn, enumerated(0), enumerated(0), integer(0),
                                                       integer(0), boolean(false), presence()})))},
      {"search: scope as integer", message(tlv(0x63, dn + integer(0)))},
      {"search: boolean of two octets",
       message(tlv(0x63, join({dn, enumerated(0), enumerated(0), integer(0), integer(0),
                               tlv(0x01, "\xFF\xFF"), presence(), sequence({})})))},
      {"search: selectors as a set",
       message(tlv(0x63, join({dn, enumerated(0), enumerated(0), integer(0), integer(0),
                               boolean(false), presence(), set({})})))},
      {"search: selector as integer", message(search(presence(), integer(1)))},
      {"add: no list", message(tlv(0x68, dn))},
      {"add: attribute as a set", message(tlv(0x68, dn + sequence({set({})})))},
      {"add: no values element", message(add("cn=x", {sequence({octets("cn")})}))},
      {"add: values as a sequence", message(add("cn=x", {sequence({octets("cn"), sequence({})})}))},
      {"add: value as integer", message(add("cn=x", {attribute("cn", {integer(1)})}))},
      {"modify: no list", message(tlv(0x66, dn))},
      {"modify: change without code", message(modify("cn=x", {sequence({attribute("cn", {})})}))},
      {"modify: change without attribute", message(modify("cn=x", {sequence({enumerated(0)})}))},
      {"rename: no flag", message(tlv(0x6C, dn + octets("cn=y")))},
      {"compare: no assertion", message(tlv(0x6E, dn))},
      {"compare: half an assertion", message(tlv(0x6E, dn + sequence({octets("cn")})))},
      {"extended: no name", message(tlv(0x77, ""))},
      {"extended: name as octet string", message(tlv(0x77, octets("1.2")))},
      {"control as octet string", message(del("cn=x"), controls({octets("1.2")}))},
      {"control without type", message(del("cn=x"), controls({sequence({boolean(true)})}))},
      {"control with two values",
       message(del("cn=x"), controls({sequence({octets("1.2"), octets(""), octets("")})}))},
  };
  for (const BadMessage& bad : kCases) expect_fatal(bad);
}

// ---- Refused: understood well enough to be answered

TEST(Decoder, OtherProtocolVersions_rejected) {
  for (const int version : {0, 1, 2, 4, 127, 128}) {
    expect_refused({"version", message(simple_bind("cn=root", "x", version))},
                   result::protocol_error, tag::bind_response);
  }
  expect_refused({"layout of another version", message(tlv(0x60, integer(4) + boolean(true)))},
                 result::protocol_error, tag::bind_response);
  expect_refused({"negative version", message(tlv(0x60, tlv(0x02, "\xFD") + octets("")))},
                 result::protocol_error, tag::bind_response);
}

TEST(Decoder, UnknownKindOfAuthentication_rejected) {
  for (const int tag : {0x81, 0x82, 0x83, 0xA0, 0x84, 0xA9}) {
    expect_refused({"choice", message(tlv(0x60, integer(3) + octets("") + tlv(tag, "")))},
                   result::auth_method_not_supported, tag::bind_response);
  }
}

TEST(Decoder, NamesThatAreNoText_rejected) {
  for (const std::string& dn : {"cn=\xFF"s, "cn=a\0b"s, "cn=\xC0\xAF"s, "cn=\xED\xA0\x80"s}) {
    const int code = result::invalid_dn_syntax;
    expect_refused({"bind", message(simple_bind(dn, ""))}, code, tag::bind_response);
    expect_refused({"search", message(search(presence(), "", dn))}, code, tag::search_done);
    expect_refused({"add", message(add(dn, {}))}, code, tag::add_response);
    expect_refused({"delete", message(del(dn))}, code, tag::delete_response);
    expect_refused({"modify", message(modify(dn, {}))}, code, tag::modify_response);
    expect_refused({"rename", message(modify_dn(dn))}, code, tag::modify_dn_response);
    expect_refused({"compare", message(compare(dn))}, code, tag::compare_response);
  }
}

TEST(Decoder, AttributeDescriptionsOutOfSyntax_rejected) {
  for (const std::string& type :
       {""s, "1"s, "1."s, ".1"s, "1..2"s, "01.2"s, "1.02"s, "c n"s, "-cn"s, "1cn"s, "cn;"s,
        "cn;;x"s, "cn;a b"s, "cn\0"s, "cn)"s, "cn=x"s, "c\xC3\xA9"s, "cn_x"s, ";lang"s}) {
    expect_refused({type.c_str(), message(add("cn=x", {attribute(type, {octets("v")})}))},
                   result::protocol_error, tag::add_response);
    expect_refused({type.c_str(), message(modify("cn=x", {change(1, attribute(type, {}))}))},
                   result::protocol_error, tag::modify_response);
    expect_refused({type.c_str(), message(search(presence(type)))}, result::protocol_error,
                   tag::search_done);
    expect_refused({type.c_str(), message(search(equality(type, "v")))}, result::protocol_error,
                   tag::search_done);
  }
}

TEST(Decoder, SelectorsThatAreNoText_rejected) {
  for (const std::string& name : {"c\0n"s, "\xFF"s}) {
    expect_refused({"selector", message(search(presence(), octets(name)))}, result::protocol_error,
                   tag::search_done);
  }
}

TEST(Decoder, NumbersOutOfRange_rejected) {
  const auto parts = [](int scope, int deref, const std::string& size, const std::string& time,
                        const std::string& flag) {
    return message(tlv(0x63, join({octets(""), enumerated(scope), enumerated(deref), size, time,
                                   flag, presence(), sequence({})})));
  };
  const std::string none = integer(0);
  const BadMessage kCases[] = {
      {"scope 3", parts(3, 0, none, none, boolean(false))},
      {"dereferencing 4", parts(0, 4, none, none, boolean(false))},
      {"negative size limit", parts(0, 0, tlv(0x02, "\xFF"), none, boolean(false))},
      {"time limit of 2^31", parts(0, 0, none, tlv(0x02, "\0\x80\0\0\0"s), boolean(false))},
      {"boolean 01", parts(0, 0, none, none, tlv(0x01, "\1"))},
  };
  for (const BadMessage& bad : kCases)
    expect_refused(bad, result::protocol_error, tag::search_done);
}

TEST(Decoder, UnknownKindsOfModification_rejected) {
  for (const int code : {3, 4, 127, 128}) {
    expect_refused(
        {"code", message(modify("cn=x", {change(code, attribute("cn", {octets("v")}))}))},
        result::protocol_error, tag::modify_response);
  }
}

TEST(Decoder, RequestsWithNothingInThem_rejected) {
  const int code = result::protocol_error;
  expect_refused({"no attributes", message(add("cn=x", {}))}, code, tag::add_response);
  expect_refused({"no values", message(add("cn=x", {attribute("cn", {})}))}, code,
                 tag::add_response);
  expect_refused({"no changes", message(modify("cn=x", {}))}, code, tag::modify_response);
  expect_refused({"nothing to add", message(modify("cn=x", {change(0, attribute("cn", {}))}))},
                 code, tag::modify_response);
}

TEST(Decoder, NamesOfControlsAndOperationsOutOfSyntax_rejected) {
  for (const std::string& oid : {""s, "cn"s, "1"s, "1.2\0"s, "1.2.\xFF"s, "1.2 "s}) {
    expect_refused({"extended", message(extended(oid))}, result::protocol_error,
                   tag::extended_response);
    expect_refused({"control", message(del("cn=x"), controls({sequence({octets(oid)})}))},
                   result::protocol_error, tag::delete_response);
  }
  // Nothing answers an abandon, so there is nothing to say it in.
  expect_fatal({"abandon", message(abandon(1), controls({sequence({octets("x")})}))});
}

TEST(Decoder, CriticalityOtherThanTrueOrFalse_rejected) {
  expect_refused(
      {"01", message(del("cn=x"), controls({sequence({octets("1.2"), tlv(0x01, "\1")})}))},
      result::protocol_error, tag::delete_response);
}

// ---- Limits

TEST(Decoder, MessagesBeyondTheLimit_rejected) {
  const std::string frame = message(del("cn=x"));
  DecoderLimits limits;
  limits.message_bytes = frame.size();
  EXPECT_EQ(raw::decode(frame, limits).decoded.state, DecodeState::decoded);
  limits.message_bytes = frame.size() - 1;
  EXPECT_EQ(raw::decode(frame, limits).decoded.state, DecodeState::fatal);
}

TEST(Decoder, MoreOfAnythingThanItsLimit_rejected) {
  const auto expect_limit = [](const char* what, const std::string& frame, int tag,
                               int DecoderLimits::*limit, int most) {
    DecoderLimits limits;
    limits.*limit = most;
    EXPECT_EQ(raw::decode(frame, limits).decoded.state, DecodeState::decoded) << what;
    limits.*limit = most - 1;
    expect_refused({what, frame}, result::admin_limit_exceeded, tag, limits);
  };
  const std::string c = sequence({octets("1.2")});
  const std::string a = attribute("cn", {octets("v"), octets("w")});
  expect_limit("controls", message(del("cn=x"), controls({c, c, c})), tag::delete_response,
               &DecoderLimits::controls, 3);
  expect_limit("attributes", message(add("cn=x", {a, a, a})), tag::add_response,
               &DecoderLimits::attributes, 3);
  expect_limit("values", message(add("cn=x", {a, a})), tag::add_response, &DecoderLimits::values,
               4);
  expect_limit("modifications", message(modify("cn=x", {change(0, a), change(2, a)})),
               tag::modify_response, &DecoderLimits::attributes, 2);
  expect_limit("selectors", message(search(presence(), octets("a") + octets("b"))),
               tag::search_done, &DecoderLimits::attributes, 2);
}

// ---- Damage at every place

std::vector<std::string> one_of_each() {
  const std::string list = controls({sequence({octets("1.2.3"), boolean(true), octets("v")})});
  return {
      message(simple_bind("cn=root", "secret"), list),
      message(search(tlv(0xA0, equality("cn", "x") + tlv(0xA2, presence("sn"))), octets("cn")),
              list),
      message(add("cn=x", {attribute("cn", {octets("x")}), attribute("sn", {octets("y")})}), list),
      message(modify("cn=x", {change(2, attribute("cn", {octets("x")}))}), list),
      message(del("cn=x"), list),
      message(modify_dn("cn=x"), list),
      message(compare("cn=x"), list),
      message(abandon(9), list),
      message(extended("1.2.3"), list)};
}

TEST(Decoder, MessagesTruncatedAtEveryByte_rejected) {
  for (const std::string& whole : one_of_each()) {
    ASSERT_EQ(raw::decode(whole).decoded.state, DecodeState::decoded);
    for (std::size_t length = 0; length < whole.size(); ++length) {
      EXPECT_EQ(raw::decode(whole.substr(0, length)).decoded.state, DecodeState::fatal) << length;
    }
  }
}

// The outer length is right, what it holds ends too early.
TEST(Decoder, OperationsTruncatedAtEveryByte_rejected) {
  const std::string bodies[] = {simple_bind("cn=root", "secret"),
                                search(equality("cn", "x"), octets("cn")),
                                add("cn=x", {attribute("cn", {octets("x")})}),
                                modify("cn=x", {change(2, attribute("cn", {octets("x")}))}),
                                modify_dn("cn=x"),
                                compare("cn=x"),
                                extended("1.2.3")};
  for (const std::string& operation : bodies) {
    const int tag = static_cast<unsigned char>(operation[0]);
    const std::string contents = operation.substr(2);
    for (std::size_t length = 0; length < contents.size(); ++length) {
      const std::string cut = message(tlv(tag, contents.substr(0, length)));
      EXPECT_EQ(raw::decode(cut).decoded.state, DecodeState::fatal) << tag << " at " << length;
    }
  }
}

TEST(Decoder, EveryOctetReplacedByEveryOtherNeverConfusesIt) {
  for (const std::string& whole : one_of_each()) {
    for (std::size_t at = 0; at < whole.size(); ++at) {
      std::string damaged = whole;
      for (int octet = 0; octet < 256; ++octet) {
        damaged[at] = static_cast<char>(octet);
        const Outcome outcome = raw::decode(damaged);
        if (outcome.decoded.state == DecodeState::decoded) {
          EXPECT_GT(outcome.message.id, 0);
        } else {
          EXPECT_NE(outcome.decoded.code, 0);
        }
        EXPECT_EQ(outcome.decoded.state == DecodeState::refused, outcome.decoded.response_tag != 0);
      }
    }
  }
}

}  // namespace
}  // namespace orv::server
