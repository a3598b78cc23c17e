#include "auth/digest_response.h"

#include <gtest/gtest.h>

#include <string>

namespace orv::server {
namespace {

TEST(DigestResponse, IsAListOfDirectives) {
  for (const char* const text :
       {"username=\"boss\"", "username=\"boss\",realm=\"x\",nc=00000001,qop=auth",
        " username = \"a\\\"b,username=c\" , ,\tqop=auth-int,,", "digest-uri=\"ldap/localhost\"",
        ",,a=b", "a=\"\"", "username=\"\xc3\xa4\"", "cipher=rc4-40,a=b"})
    EXPECT_TRUE(is_digest_response(text)) << text;
}

TEST(DigestResponse, NamesNothingTwice) {
  for (const char* const text : {"username=\"a\",username=\"a\"", "a=b,c=d,a=b", "a=b,A=b",
                                 "a=b,,a =\"c\"", "username=\"x\", USERNAME=x"})
    EXPECT_FALSE(is_digest_response(text)) << text;
}

TEST(DigestResponse, IsNothingElse) {
  using namespace std::string_literals;
  for (const std::string& text : {""s,        ","s,       " "s,          "a"s,
                                  "=b"s,      "a="s,      "a=,b=c"s,     "a=\"b"s,
                                  "a=\"b\\"s, "a=b c=d"s, "a=\"b\"c"s,   "a b=c"s,
                                  "a=b;c=d"s, "a/b=c"s,   "a=b/c"s,      "a=\"b\0\",c=d"s,
                                  "a\0=b"s,   "a=b\0"s,   "a=\"\\\0\""s, "\xff=b"s,
                                  "a=\xff"s,  "\x7f=b"s})
    EXPECT_FALSE(is_digest_response(text)) << text;
}

}  // namespace
}  // namespace orv::server
