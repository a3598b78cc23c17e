// Search filters: one entry, many filters, and what each is.
#include "cfg_fixture.h"

namespace orv::cfg_test {
namespace {

constexpr const char* kEntry =
    "dn: cn=Top+ou=Unit,o=Home\nobjectClass: top\nobjectClass: orv-slapdTop\ncn: Top\n"
    "cn:  Two   Words \ndescription:: w4RyZ2VyIFN0cmHDn2U=\nexactText: Mixed Case\n"
    "bytes: a b\nmember: CN = Some One , O=x\nnumber: 42\nnumber: -7\nflag: TRUE\n"
    "telephoneNumber: +49 30-12 34\nmoment: 20240229120000Z\norv-slapdAdminPW: topsecret\n"
    "cn: Ghost \xE2\x80\x8B\nfree: Text\nlong: one\n  two\n  three\no: a*b(c)d\\e\n";

struct FilterCase {
  const char* filter;
  bool matches;
};

const FilterCase kCases[] = {
    // forms
    {"(objectclass=*)", true},
    {"objectclass=*", true},
    {"objectclass", true},
    {" ( cn=top ) ", true},
    {"orv-slapdAdminPW", true},
    {"ou", false},
    {"unknown", false},
    {"2.5.4.3", true},
    {"&(cn=top)(free=text)", true},
    {"|(cn=x)(cn=top)", true},
    {"!(cn=x)", true},
    {"(&)", true},
    {"(|)", false},
    {"(& (cn=top) (cn=two words) )", true},
    // truth values
    {"(&(cn=top)(cn=x))", false},
    {"(|(cn=x)(cn=y))", false},
    {"(!(cn=top))", false},
    {"(!(ou=x))", true},
    {"(!(neverheard=x))", false},
    {"(|(neverheard=x)(cn=top))", true},
    {"(&(neverheard=x)(cn=top))", false},
    {"(!(&(neverheard=x)(cn=x)))", true},
    {"(!(|(neverheard=x)(cn=x)))", false},
    {"(!(neverheard=*))", false},
    // equality
    {"(cn=TOP)", true},
    {"(cn= top )", true},
    {"(cn=two words)", true},
    {"(cn=twowords)", false},
    {"(cn=ghost)", true},
    {"(cn=ghost x)", false},
    {"(cn=to)", false},
    {"(commonName=top)", true},
    {"(2.5.4.3=top)", true},
    {"(cn~=top)", true},
    {"(cn=)", false},
    {"(description=\xC3\xA4rger stra\xC3\x9F"
     "e)",
     true},
    {"(description=A\xCC\x88RGER STRASSE)", true},
    {"(description=arger strasse)", false},
    {"(free=text)", true},
    {"(FREE=TEXT)", true},
    {"(long=one two three)", true},
    {"(exactText=Mixed Case)", true},
    {"(exactText=Mixed   Case )", true},
    {"(exactText=mixed case)", false},
    {"(bytes=a b)", true},
    {"(bytes=A b)", false},
    {"(bytes=a  b)", false},
    {"(member=cn=some one,o=X)", true},
    {"(member=cn=some,o=x)", false},
    {"(member=nonsense)", false},
    {"(!(member=nonsense))", false},
    {"(number=42)", true},
    {"(number=042)", true},
    {"(count=-7)", true},
    {"(number=4)", false},
    {"(number=x)", false},
    {"(!(number=x))", false},
    {"(flag=true)", true},
    {"(flag=FALSE)", false},
    {"(flag=yes)", false},
    {"(!(flag=yes))", false},
    {"(telephoneNumber=+4930 1234)", true},
    {"(telephoneNumber=+49301235)", false},
    {"(moment=20240229120000Z)", true},
    {"(moment=202402291200Z)", true},
    {"(moment=2024022913+0100)", true},
    {"(moment=20240229115959.999Z)", false},
    {"(moment=tomorrow)", false},
    {"(moment=20240229120000)", false},
    {"(objectclass=ORV-SLAPDTOP)", true},
    {"(objectclass=orv-slapd)", false},
    {"(cn;lang-en=top)", false},
    {"(!(cn;lang-en=top))", false},
    // escapes
    {"(o=a\\2ab\\28c\\29d\\5ce)", true},
    {"(o=\\61\\2a\\62\\28c\\29d\\5Ce)", true},
    {"(cn=top\\00)", false},
    // order
    {"(number>=42)", true},
    {"(number>=43)", false},
    {"(number<=-7)", true},
    {"(number<=-8)", false},
    {"(number>=9)", true},
    {"(number>=x)", false},
    {"(moment>=20240229T)", false},
    {"(moment>=20240229110000Z)", true},
    {"(moment<=20240229110000Z)", false},
    {"(moment>=2024022912.5Z)", false},
    {"(moment<=2024022912.5Z)", true},
    {"(free>=tex)", true},
    {"(free>=texu)", false},
    {"(free<=texu)", true},
    {"(exactText<=a)", true},
    {"(exactText>=a)", false},
    // substrings
    {"(cn=t*)", true},
    {"(cn=*p)", true},
    {"(cn=*o*)", true},
    {"(cn=t*o*p)", true},
    {"(cn=*w*rd*)", true},
    {"(cn=two *)", true},
    {"(cn=* words)", true},
    {"(cn=*two words*)", true},
    {"(cn=two* *words)", true},
    {"(cn=o*)", false},
    {"(cn=*o)", false},
    {"(cn=top*top)", false},
    {"(cn=to*op)", false},
    {"(cn=**)", true},
    {"(cn=*o**p)", true},
    {"(cn=two  wo*)", true},
    {"(description=\xC3\x84*stra\xC3\x9F*)", true},
    {"(exactText=M*C*)", true},
    {"(exactText=m*)", false},
    {"(bytes=a *)", true},
    {"(bytes=A*)", false},
    {"(telephoneNumber=+4930*34)", true},
    {"(number=4*)", false},
    {"(!(number=4*))", false},
    {"(member=cn*)", false},
    {"(o=a\\2a*)", true},
    {"(o=*\\28c\\29*)", true},
    {"(neverheard=a*)", false},
    // extensible
    {"(cn:=TOP)", true},
    {"(cn:caseExactMatch:=Top)", true},
    {"(cn:2.5.13.5:=top)", false},
    {"(cn:dn:=TOP)", true},
    {"(ou:=unit)", false},
    {"(ou:dn:=unit)", true},
    {"(o:DN:=home)", true},
    {"(o:dn:2.5.13.5:=home)", false},
    {"(ou:dn:caseExactMatch:=Unit)", true},
    {"(:caseIgnoreMatch:=text)", true},
    {"(:caseIgnoreMatch:=42)", false},
    {"(:integerMatch:=42)", true},
    {"(:dn:caseIgnoreMatch:=unit)", true},
    {"(:caseIgnoreMatch:=unit)", false},
    {"(cn:unknownRule:=top)", false},
    {"(!(cn:unknownRule:=top))", false},
    {"(objectClass:objectIdentifierFirstComponentMatch:=top)", false},
    {"(!(objectClass:objectIdentifierFirstComponentMatch:=top))", false},
    {"(!(number:2.5.13.29:=1))", false},
    {"(neverheard:=x)", false},
    {"(!(ou:=x))", true},
    // secrets
    {"(orv-slapdAdminPW=*)", true},
    {"(orv-slapdAdminPW=topsecret)", false},
    {"(!(orv-slapdAdminPW=topsecret))", false},
    {"(!(orv-slapdAdminPW=wrong))", false},
    {"(orv-slapdAdminPW>=a)", false},
    {"(orv-slapdAdminPW<=z)", false},
    {"(orv-slapdAdminPW~=topsecret)", false},
    {"(orv-slapdAdminPW=top*)", false},
    {"(!(orv-slapdAdminPW=x*))", false},
    {"(adminPassword=topsecret)", false},
    {"(1.9.6=topsecret)", false},
    {"(orv-slapdAdminPW:octetStringMatch:=topsecret)", false},
    {"(!(orv-slapdAdminPW:caseExactMatch:=x))", false},
    {"(orv-slapdAdminPW:dn:=topsecret)", false},
    {"(:octetStringMatch:=topsecret)", false},
    {"(!(:octetStringMatch:=topsecret))", true},
    {"(!(:octetStringMatch:=wrong))", true},
};

class FilterTest : public CfgTest, public ::testing::WithParamInterface<FilterCase> {};

TEST_P(FilterTest, MatchesAsItShould) {
  const CfgSession session = open(kEntry);
  EXPECT_EQ(search(session, "ou=unit+cn=top,o=home", 0, GetParam().filter).size(),
            GetParam().matches ? 1U : 0U)
      << GetParam().filter;
}

INSTANTIATE_TEST_SUITE_P(Table, FilterTest, ::testing::ValuesIn(kCases));

class UnreadableFilterTest : public CfgTest {};

TEST_F(UnreadableFilterTest, IsAProtocolError) {
  const CfgSession session = open(kEntry);
  for (const char* filter : {"",
                             " ",
                             "(",
                             ")",
                             "()",
                             "(cn",
                             "cn)",
                             "(cn=a",
                             "cn=a)",
                             "(cn=a)b",
                             "(cn=a)(cn=b)",
                             "((cn=a))",
                             "(=a)",
                             "=a",
                             "(&cn=a)",
                             "(!)",
                             "(!(cn=a)(cn=b))",
                             "(!cn=a)",
                             "(cn=\\)",
                             "(cn=\\2)",
                             "(cn=\\zz)",
                             "(cn=a(b)",
                             "(cn>=a*b)",
                             "(cn~=*)",
                             "(:=a)",
                             "(:dn:=a)",
                             "(cn::=a)",
                             "(cn:dn::=a)",
                             "(c n=a)",
                             "(-cn=a)",
                             "(1x=a)",
                             "(cn:b c:=a)",
                             "(cn:=a*b)",
                             "*",
                             "(*)",
                             "(&(cn=a)",
                             "(cn=a*\\g)"}) {
    EXPECT_EQ(search_code(session, "cn=top+ou=unit,o=home", 0, filter), 2) << filter;
  }
}

TEST_F(UnreadableFilterTest, NestingIsLimited) {
  const CfgSession session = open(kEntry);
  const auto nested = [](int depth) {
    std::string filter;
    for (int i = 1; i < depth; ++i) filter += "(&";
    return filter + "(cn=top)" + std::string(static_cast<std::size_t>(depth - 1), ')');
  };
  EXPECT_EQ(search_code(session, "cn=top+ou=unit,o=home", 0, nested(64).c_str()), 0);
  EXPECT_EQ(search_code(session, "cn=top+ou=unit,o=home", 0, nested(65).c_str()), 2);
  EXPECT_EQ(search_code(session, "cn=top+ou=unit,o=home", 0, nested(100000).c_str()), 2);
  EXPECT_EQ(search_code(session, "cn=top+ou=unit,o=home", 0, std::string(100000, '(').c_str()), 2);
}

}  // namespace
}  // namespace orv::cfg_test
