#include "publish/subschema.h"

#include <array>
#include <iterator>
#include <string>
#include <vector>

#include "publish/entry_builder.h"
#include "publish/root_dse.h"

namespace orv::server {
namespace {

// The syntaxes and rules of RFC 4517 that the server's schema is written in.
constexpr const char* kSyntaxes[] = {
    "( 1.3.6.1.4.1.1466.115.121.1.3 DESC 'Attribute Type Description' )",
    "( 1.3.6.1.4.1.1466.115.121.1.7 DESC 'Boolean' )",
    "( 1.3.6.1.4.1.1466.115.121.1.11 DESC 'Country String' )",
    "( 1.3.6.1.4.1.1466.115.121.1.12 DESC 'DN' )",
    "( 1.3.6.1.4.1.1466.115.121.1.15 DESC 'Directory String' )",
    "( 1.3.6.1.4.1.1466.115.121.1.16 DESC 'DIT Content Rule Description' )",
    "( 1.3.6.1.4.1.1466.115.121.1.17 DESC 'DIT Structure Rule Description' )",
    "( 1.3.6.1.4.1.1466.115.121.1.24 DESC 'Generalized Time' )",
    "( 1.3.6.1.4.1.1466.115.121.1.26 DESC 'IA5 String' )",
    "( 1.3.6.1.4.1.1466.115.121.1.27 DESC 'INTEGER' )",
    "( 1.3.6.1.4.1.1466.115.121.1.30 DESC 'Matching Rule Description' )",
    "( 1.3.6.1.4.1.1466.115.121.1.31 DESC 'Matching Rule Use Description' )",
    "( 1.3.6.1.4.1.1466.115.121.1.35 DESC 'Name Form Description' )",
    "( 1.3.6.1.4.1.1466.115.121.1.37 DESC 'Object Class Description' )",
    "( 1.3.6.1.4.1.1466.115.121.1.38 DESC 'OID' )",
    "( 1.3.6.1.4.1.1466.115.121.1.40 DESC 'Octet String' )",
    "( 1.3.6.1.4.1.1466.115.121.1.45 DESC 'SubtreeSpecification' )",
    "( 1.3.6.1.4.1.1466.115.121.1.50 DESC 'Telephone Number' )",
    "( 1.3.6.1.4.1.1466.115.121.1.54 DESC 'LDAP Syntax Description' )",
    "( 1.3.6.1.4.1.1466.115.121.1.58 DESC 'Substring Assertion' )",
    "( 1.3.6.1.1.16.1 DESC 'UUID' )",
};

constexpr const char* kMatchingRules[] = {
    "( 2.5.13.0 NAME 'objectIdentifierMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.38 )",
    "( 2.5.13.1 NAME 'distinguishedNameMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.12 )",
    "( 2.5.13.2 NAME 'caseIgnoreMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.15 )",
    "( 2.5.13.3 NAME 'caseIgnoreOrderingMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.15 )",
    "( 2.5.13.4 NAME 'caseIgnoreSubstringsMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.58 )",
    "( 2.5.13.5 NAME 'caseExactMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.15 )",
    "( 2.5.13.6 NAME 'caseExactOrderingMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.15 )",
    "( 2.5.13.7 NAME 'caseExactSubstringsMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.58 )",
    "( 2.5.13.13 NAME 'booleanMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.7 )",
    "( 2.5.13.14 NAME 'integerMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.27 )",
    "( 2.5.13.15 NAME 'integerOrderingMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.27 )",
    "( 2.5.13.17 NAME 'octetStringMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.40 )",
    "( 2.5.13.20 NAME 'telephoneNumberMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.50 )",
    "( 2.5.13.27 NAME 'generalizedTimeMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.24 )",
    "( 2.5.13.28 NAME 'generalizedTimeOrderingMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.24 )",
    "( 2.5.13.29 NAME 'integerFirstComponentMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.27 )",
    "( 2.5.13.30 NAME 'objectIdentifierFirstComponentMatch' SYNTAX 1.3.6.1.4.1.1466.115.121.1.38 )",
    "( 1.3.6.1.4.1.1466.109.114.1 NAME 'caseExactIA5Match' SYNTAX 1.3.6.1.4.1.1466.115.121.1.26 )",
    "( 1.3.6.1.4.1.1466.109.114.2 NAME 'caseIgnoreIA5Match' SYNTAX 1.3.6.1.4.1.1466.115.121.1.26 )",
    ("( 1.3.6.1.4.1.1466.109.114.3 NAME 'caseIgnoreIA5SubstringsMatch'"
     " SYNTAX 1.3.6.1.4.1.1466.115.121.1.58 )"),
    "( 1.3.6.1.1.16.2 NAME 'UUIDMatch' SYNTAX 1.3.6.1.1.16.1 )",
    "( 1.3.6.1.1.16.3 NAME 'UUIDOrderingMatch' SYNTAX 1.3.6.1.1.16.1 )",
};

template <typename Descriptions>
std::vector<std::string> descriptions_of(const Descriptions& elements) {
  std::vector<std::string> texts;
  texts.reserve(elements.size());
  for (const auto& element : elements) texts.push_back(element.description);
  return texts;
}

// Generalized Time of RFC 4517, 3.3.13, in UTC.
std::string generalized_time(std::time_t when) {
  std::tm parts{};
  gmtime_r(&when, &parts);
  std::array<char, 32> text{};
  std::strftime(text.data(), text.size(), "%Y%m%d%H%M%SZ", &parts);
  return text.data();
}

}  // namespace

EntryPtr make_subschema(const Schema& schema, std::time_t changed) noexcept {
  try {
    const std::string time = generalized_time(changed);
    return EntryBuilder(kSubschemaDn, kSubschemaNormalDn)
        .add("objectClass", {"top", "subentry", "subschema"})
        .add("cn", "subschema")
        .add("subtreeSpecification", "{ }")
        .add("subschemaSubentry", kSubschemaDn)
        .add("createTimestamp", time)
        .add("modifyTimestamp", time)
        .add("ldapSyntaxes", {std::begin(kSyntaxes), std::end(kSyntaxes)})
        .add("matchingRules", {std::begin(kMatchingRules), std::end(kMatchingRules)})
        .add("attributeTypes", descriptions_of(schema.attributes()))
        .add("objectClasses", descriptions_of(schema.object_classes()))
        .take();
  } catch (...) {
    return nullptr;
  }
}

}  // namespace orv::server
