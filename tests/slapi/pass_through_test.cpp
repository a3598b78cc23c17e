// Attribute mappings and URLs of pass-through authentication.

#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "slapi/services.h"

namespace orv {
namespace {

int verify(const std::string& mapping) {
  return verifyAttributeMapping(mapping.c_str(), nullptr, nullptr);
}

TEST(AttributeMapping, IsPairsOfTypes) {
  for (const char* good :
       {"uid=mail", "uid = mail", " uid=mail , cn=givenName ", "2.5.4.3=x-remote", "UID=anything",
        "commonName=1.2.840.1", "uid=uid,mail=mail"})
    EXPECT_EQ(verify(good), 0) << good;
}

TEST(AttributeMapping, OfAnotherFormIsRefusedWith21) {
  EXPECT_EQ(verifyAttributeMapping(nullptr, nullptr, nullptr), 21);
  for (const char* bad : {"",
                          " ",
                          "uid",
                          "uid=",
                          "=mail",
                          "=",
                          "uid=mail,",
                          ",uid=mail",
                          "uid=mail,,cn=sn",
                          "uid=mail, ",
                          "uid==mail",
                          "uid=mail=cn",
                          "uid mail",
                          "uid=ma il",
                          "u id=mail",
                          "uid=(mail)",
                          "uid=mail;lang-en",
                          "uid=1",
                          "uid=1.02",
                          "uid=\xC3\xA4",
                          "uid=mail\n",
                          "uid=mail;cn=sn",
                          "uid:mail",
                          "\tuid=mail",
                          "uid=*",
                          "uid=-x"})
    EXPECT_EQ(verify(bad), 21) << bad;
}

TEST(AttributeMapping, NamesTypesOfThisServerOnTheLeft) {
  EXPECT_EQ(verify("shoeSize=mail"), 21);
  EXPECT_EQ(verify("uid=shoeSize"), 0);
}

TEST(AttributeMapping, MapsEachTypeOnce) {
  EXPECT_EQ(verify("uid=mail,cn=mail"), 0);
  EXPECT_EQ(verify("uid=mail,uid=cn"), 21);
  EXPECT_EQ(verify("uid=mail,USERID=cn"), 21);
  EXPECT_EQ(verify("cn=mail,2.5.4.3=sn"), 21);
}

TEST(AttributeMapping, NeverMapsAPassword) {
  for (const char* bad : {"orv-slapdAdminPW=uid", "uid=orv-slapdAdminPW", "ORV-SLAPDMASTERPW=uid",
                          "2.25.83817390626969804497818767862655265745.1.2=uid",
                          "uid=2.25.83817390626969804497818767862655265745.1.9"})
    EXPECT_EQ(verify(bad), 21) << bad;
}

TEST(AttributeMapping, IsBounded) {
  const char* const types[] = {"cn", "sn",    "c",   "l",         "st",          "street",
                               "o",  "ou",    "dc",  "uid",       "description", "mail",
                               "gn", "title", "ref", "altServer", "vendorName"};
  std::string mapping;
  int pairs = 0;
  for (const char* type : types) {
    mapping += std::string(pairs == 0 ? "" : ",") + type + "=x";
    EXPECT_EQ(verify(mapping), ++pairs <= 16 ? 0 : 21) << mapping;
  }
  EXPECT_EQ(verify("uid=" + std::string(1020, 'x')), 0);
  EXPECT_EQ(verify("uid=" + std::string(1021, 'x')), 21);
}

// ---- URLs ------------------------------------------------------------------------------------

struct UrlDeleter {
  void operator()(LDAPURLDesc* description) const { ldap_free_urldesc(description); }
};
using Url = std::unique_ptr<LDAPURLDesc, UrlDeleter>;

Url parse(const char* text) {
  LDAPURLDesc other{};
  LDAPURLDesc* description = &other;  // what stood there before is not looked at
  const int rc = ldap_url_parse(text, &description);
  EXPECT_EQ(rc == 0, description != nullptr) << text;
  return Url(description);
}

TEST(LdapUrl, IsTakenApart) {
  const Url url = parse("ldaps://ldap.example.com:1636/ou=people,o=x?cn?sub?(cn=*)");
  ASSERT_NE(url, nullptr);
  EXPECT_STREQ(url->scheme, "ldaps");
  EXPECT_STREQ(url->host, "ldap.example.com");
  EXPECT_EQ(url->port, 1636);
  EXPECT_STREQ(url->dn, "ou=people,o=x");
}

TEST(LdapUrl, HasDefaults) {
  const Url url = parse("ldap://h");
  ASSERT_NE(url, nullptr);
  EXPECT_EQ(url->port, 389);
  EXPECT_STREQ(url->dn, "");
  const Url without_host = parse("ldap://");
  ASSERT_NE(without_host, nullptr);
  EXPECT_STREQ(without_host->host, "");
}

TEST(LdapUrl, IsReadInTheFormsThatClientsAccept) {
  for (const char* text : {"<URL:ldap://h>", "<ldap://h>", "ldap://[::1]:389", "LDAP://h",
                           "ldapi://%2Frun%2Fx", "ldap://h/o=caf%C3%A9"})
    EXPECT_NE(parse(text), nullptr) << text;
}

TEST(LdapUrl, OfAnotherKindIsRefused) {
  for (const char* text : {"", "h", "http://h", "ldap:h", "ldap://h:port", "ldap//h"})
    EXPECT_EQ(parse(text), nullptr) << text;
  EXPECT_EQ(parse(nullptr), nullptr);
}

TEST(LdapUrl, NeedsSomewhereToPutTheDescription) {
  EXPECT_NE(ldap_url_parse("ldap://h", nullptr), 0);
}

TEST(LdapUrl, ReleaseOfNullDoesNothing) {
  ldap_free_urldesc(nullptr);
}

}  // namespace
}  // namespace orv
