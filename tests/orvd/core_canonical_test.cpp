// One spelling: what clients write, as handlers get it.
#include "ops/canonical.h"

#include <gtest/gtest.h>

#include "cfg/attribute_table.h"
#include "slapi/codepage.h"

namespace orv::server {
namespace {

class Canonical : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    ASSERT_EQ(cfg::register_attribute_types(builtin_schema().attribute_table()), 0);
  }
  const Schema& schema = builtin_schema();

  int add_code(const AddRequest& request) {
    EntryPtr made;
    return make_entry(schema, request, made).code;
  }
  int modify_code(const ModifyRequest& request, ListForm form = ListForm::folded) {
    ldapmod* first = nullptr;
    const int code = make_modifications(schema, request, form, first).code;
    free_modifications(first);
    return code;
  }
};

std::vector<std::string> values_of(const attr* a) {
  std::vector<std::string> values;
  for (int i = 0; a && i < a->count; ++i) values.emplace_back(a->values[i]->bv_val);
  return values;
}

TEST_F(Canonical, EntryHasCanonicalTypesAndClassesWithTheClassesFirst) {
  EntryPtr made;
  const AddRequest request{"CN=x, 2.5.4.3=Configuration",
                           {{"CN", {"x"}}, {"OBJECTCLASS", {"TOP", "Container"}}}};
  ASSERT_EQ(make_entry(schema, request, made).code, 0);
  EXPECT_STREQ(made->normalized_dn, "CN=X,CN=CONFIGURATION");
  EXPECT_STREQ(made->attributes->type, "objectClass");
  EXPECT_EQ(made->object_classes, made->attributes);
  EXPECT_EQ(values_of(made->object_classes), (std::vector<std::string>{"top", "container"}));
  EXPECT_STREQ(made->attributes->next->type, "cn");
}

TEST_F(Canonical, EntryLacksNoValueOfItsRdn) {
  EntryPtr made;
  ASSERT_EQ(
      make_entry(schema, {"cn=x,cn=configuration", {{"objectClass", {"container"}}}}, made).code,
      0);
  EXPECT_EQ(values_of(attr_find(made.get(), "cn", 0, 0)), std::vector<std::string>{"x"});
}

TEST_F(Canonical, EntryIsRefusedForWhatTheBackendMustNotSee) {
  const std::string dn = "cn=x,cn=configuration";
  EXPECT_EQ(add_code({"no dn", {{"cn", {"x"}}}}), 34);
  EXPECT_EQ(add_code({dn, {}}), 2);
  EXPECT_EQ(add_code({dn, {{"cn", {}}}}), 2);
  EXPECT_EQ(add_code({dn, {{"noSuchType", {"x"}}}}), 17);
  EXPECT_EQ(add_code({dn, {{"cn;lang-en", {"x"}}}}), 17);
  EXPECT_EQ(add_code({dn, {{"cn", {std::string("x\0y", 3)}}}}), 21);
  EXPECT_EQ(add_code({dn, {{"cn", {"\xC3("}}}}), 21);
  EXPECT_EQ(add_code({dn, {{"cn", {"x"}}, {"2.5.4.3", {"y"}}}}), 20);
  EXPECT_EQ(add_code({dn, {{"cn", {"x", "x"}}}}), 20);
}

TEST_F(Canonical, EqualValuesAreFoundByTheEqualityOfTheirType) {
  const std::string dn = "cn=x,cn=configuration";
  const auto code = [&](const char* type, std::vector<std::string> values) {
    return add_code({dn, {{type, std::move(values)}}});
  };
  EXPECT_EQ(code("description", {"x", "X"}), 20);
  EXPECT_EQ(code("description", {"a b", "a  b"}), 20);
  EXPECT_EQ(code("description", {"\xC3\xA9", "e\xCC\x81"}), 20);
  EXPECT_EQ(code("description", {"x", "y"}), 0);
  EXPECT_EQ(code("objectClass", {"top", "2.5.6.0"}), 20);
  EXPECT_EQ(code("orv-slapdPtaSubtree", {"o=x", "O = X"}), 20);
  EXPECT_EQ(code("orv-slapdDigestAdminUser", {"x", "X"}), 0);
  EXPECT_EQ(code("orv-slapdAdminPW", {"x", "X"}), 0);
  EXPECT_EQ(code("orv-slapdAdminPW", {"x", "x"}), 20);
  // What is no value of the type is not for this check to refuse.
  EXPECT_EQ(code("orv-slapdPtaSubtree", {"no dn", "o=x"}), 0);
}

TEST_F(Canonical, ValueOfTheRdnIsLookedForByTheEqualityOfItsType) {
  EntryPtr made;
  ASSERT_EQ(make_entry(schema, {"cn=O  Brien\\20,cn=x", {{"cn", {"o brien"}}}}, made).code, 0);
  EXPECT_EQ(values_of(attr_find(made.get(), "cn", 0, 0)), std::vector<std::string>{"o brien"});
  ASSERT_EQ(make_entry(schema,
                       {"orv-slapdDigestAdminUser=X", {{"orv-slapdDigestAdminUser", {"x"}}}}, made)
                .code,
            0);
  EXPECT_EQ(values_of(attr_find(made.get(), "orv-slapdDigestAdminUser", 0, 0)),
            (std::vector<std::string>{"x", "X"}));
}

TEST_F(Canonical, ObjectClassInTheRdnTakesItsNameAndStandsFirst) {
  for (const char* const type : {"objectClass", "2.5.4.0"}) {
    const std::string rdn = std::string(type) + "=2.5.6.0";
    EntryPtr made;
    ASSERT_EQ(make_entry(schema, {rdn + "+cn=x,cn=y", {{"objectClass", {"container"}}}}, made).code,
              0);
    EXPECT_EQ(values_of(made->object_classes), (std::vector<std::string>{"container", "top"}));
    ASSERT_EQ(make_entry(schema, {rdn + ",cn=y", {{"objectClass", {"TOP"}}}}, made).code, 0);
    EXPECT_EQ(values_of(made->object_classes), std::vector<std::string>{"top"});
    ASSERT_EQ(make_entry(schema, {rdn + ",cn=y", {{"cn", {"x"}}}}, made).code, 0);
    EXPECT_STREQ(made->attributes->type, "objectClass");
    EXPECT_EQ(values_of(made->object_classes), std::vector<std::string>{"top"});
  }
}

TEST_F(Canonical, PasswordInTheRdnIsRefused) {
  const std::vector<Attribute> classes{{"objectClass", {"container"}}};
  EXPECT_EQ(add_code({"orv-slapdAdminPW=x,cn=configuration", classes}), 64);
  EXPECT_EQ(add_code({"cn=x+orv-slapdMasterPW=y,cn=configuration", classes}), 64);
}

TEST_F(Canonical, EntryIsNamedByOneValueOfAnAttribute) {
  const std::vector<Attribute> classes{{"objectClass", {"container"}}};
  for (const char* dn : {"cn=x+cn=y,cn=configuration", "cn=x+description=z+commonName=y,cn=a",
                         "cn=x+2.5.4.3=x,cn=configuration"})
    EXPECT_EQ(add_code({dn, classes}), 64) << dn;
  EXPECT_EQ(add_code({"cn=x+description=y,cn=configuration", classes}), 0);
  EXPECT_EQ(add_code({"cn=x,cn=a+cn=b,cn=configuration", classes}), 0);
}

TEST_F(Canonical, AttributesOfTheServerAreRefused) {
  EXPECT_EQ(add_code({"cn=x", {{"createTimestamp", {"20260101000000Z"}}}}), 19);
  EXPECT_EQ(modify_code({"cn=x", {{2, {"createTimestamp", {"20260101000000Z"}}}}}), 19);
}

TEST_F(Canonical, TextOutsideTheCodePageOfTheFileIsRefusedWithItsPlace) {
  set_local_code_page("ISO-8859-1");
  ASSERT_EQ(initIconvHandle(), 0);
  EntryPtr made;
  const Refusal refusal = make_entry(
      schema, {"cn=x", {{"description", {"caf\xC3\xA9", "caf\xC3\xA9 \xE2\x82\xAC"}}}}, made);
  EXPECT_EQ(refusal.code, 21);
  EXPECT_NE(refusal.text.find("character 6 "), std::string::npos) << refusal.text;
  EXPECT_NE(refusal.text.find("description"), std::string::npos) << refusal.text;
  EXPECT_EQ(add_code({"cn=x", {{"description", {"caf\xC3\xA9"}}}}), 0);
  EXPECT_EQ(add_code({"cn=\xE2\x82\xAC", {{"description", {"x"}}}}), 21);
  EXPECT_EQ(check_target_code_page("CN=CAF\xC3\x89").code, 34);
  EXPECT_EQ(check_target_code_page("CN=CAFE").code, 0);
  set_local_code_page("UTF-8");
  ASSERT_EQ(initIconvHandle(), 0);
  EXPECT_EQ(check_target_code_page("CN=CAF\xC3\x89").code, 0);
}

TEST_F(Canonical, ModificationsKeepTheClientsOrderAndHaveCountedValues) {
  ldapmod* first = nullptr;
  const ModifyRequest request{"cn=configuration",
                              {{2, {"ORV-SLAPDPORT", {"389"}}}, {1, {"description", {}}}}};
  ASSERT_EQ(make_modifications(schema, request, ListForm::folded, first).code, 0);
  EXPECT_EQ(first->mod_op, kModReplace | kModBvalues);
  EXPECT_STREQ(first->mod_type, "orv-slapdPort");
  EXPECT_STREQ(first->mod_vals.modv_bvals[0]->bv_val, "389");
  EXPECT_EQ(first->mod_vals.modv_bvals[0]->bv_len, 3U);
  EXPECT_EQ(first->mod_vals.modv_bvals[1], nullptr);
  ASSERT_NE(first->mod_next, nullptr);
  EXPECT_EQ(first->mod_next->mod_op, kModDelete | kModBvalues);
  EXPECT_EQ(first->mod_next->mod_vals.modv_bvals, nullptr);  // no values: no array
  EXPECT_EQ(first->mod_next->mod_next, nullptr);
  free_modifications(first);
}

TEST_F(Canonical, ModificationsAreHandedOverFoldedOrAsTheyCame) {
  const ModifyRequest request{"cn=configuration",
                              {{1, {"description", {"a"}}}, {0, {"2.5.4.13", {"b"}}}}};
  ldapmod* first = nullptr;
  ASSERT_EQ(make_modifications(schema, request, ListForm::folded, first).code, 0);
  EXPECT_EQ(first->operation(), kModAdd);
  EXPECT_STREQ(first->mod_vals.modv_bvals[0]->bv_val, "b");
  ASSERT_NE(first->mod_next, nullptr);
  EXPECT_EQ(first->mod_next->operation(), kModDelete);
  free_modifications(first);
  first = nullptr;
  ASSERT_EQ(make_modifications(schema, request, ListForm::as_sent, first).code, 0);
  EXPECT_EQ(first->operation(), kModDelete);
  EXPECT_STREQ(first->mod_type, "description");
  ASSERT_NE(first->mod_next, nullptr);
  EXPECT_EQ(first->mod_next->operation(), kModAdd);
  EXPECT_STREQ(first->mod_next->mod_type, "description");
  free_modifications(first);
}

TEST_F(Canonical, ListsThatCannotBeFoldedAreRefusedUnlessTheyGoAsTheyCame) {
  const ModifyRequest late{"cn=x", {{0, {"description", {"a"}}}, {2, {"description", {"b"}}}}};
  EXPECT_EQ(modify_code(late), 53);
  EXPECT_EQ(modify_code(late, ListForm::as_sent), 0);
}

TEST_F(Canonical, ModificationsOfClassesAndNamesAreRefused) {
  EXPECT_EQ(modify_code({"cn=x", {{2, {"2.5.4.0", {"top"}}}}}), 69);
  EXPECT_EQ(modify_code({"cn=x,cn=configuration", {{1, {"cn", {"X"}}}}}), 67);
  EXPECT_EQ(modify_code({"2.5.4.3=x,cn=configuration", {{2, {"commonName", {"y"}}}}}), 67);
}

TEST_F(Canonical, ModificationsAreRefusedForWhatTheBackendMustNotSee) {
  const std::string dn = "cn=configuration";
  EXPECT_EQ(modify_code({dn, {}}), 2);
  EXPECT_EQ(modify_code({dn, {{0, {"cn", {}}}}}), 2);
  EXPECT_EQ(modify_code({dn, {{2, {"noSuchType", {"x"}}}}}), 17);
  EXPECT_EQ(modify_code({dn, {{2, {"cn", {"x"}}}, {2, {"orv-slapdAdminPW;x", {"y"}}}}}), 17);
  EXPECT_EQ(modify_code({dn, {{2, {"cn", {std::string("\0", 1)}}}}}), 21);
}

TEST_F(Canonical, RequestedNamesAreCanonicalAndUnknownOnesStay) {
  const TextArray names = canonical_names(schema, {"CN", "2.5.4.0", "*", "bogus"});
  EXPECT_STREQ(names.get()[0], "cn");
  EXPECT_STREQ(names.get()[1], "objectClass");
  EXPECT_STREQ(names.get()[2], "*");
  EXPECT_STREQ(names.get()[3], "bogus");
  EXPECT_EQ(names.get()[4], nullptr);
  EXPECT_EQ(canonical_names(schema, {}), nullptr);
}

TEST_F(Canonical, HiddenAttributesCannotBeAskedForTheirValueInAnySpelling) {
  const auto hidden = [&](std::string_view filter) {
    return rewrite_filter(schema, filter, FilterUse::evaluate_for_administrators);
  };
  const std::string undefined = "(orv-slapdAdminPW=-)";
  EXPECT_EQ(hidden("(orv-slapdAdminDN=cn=root)"), undefined);
  EXPECT_EQ(hidden("(ORV-SLAPDADMINDN;x=cn=root)"), undefined);
  EXPECT_EQ(hidden("(orv-slapdAdminDN=cn*)"), undefined);
  EXPECT_EQ(hidden("(orv-slapdAdminDN>=a)"), undefined);
  EXPECT_EQ(hidden("(orv-slapdAdminDN~=a)"), undefined);
  EXPECT_EQ(hidden("(orv-slapdAdminDN:2.5.13.1:=cn=root)"), undefined);
  EXPECT_EQ(hidden("(:2.5.13.2:=cn=root)"), undefined);
  EXPECT_EQ(hidden("(orv-slapdAdminGroupEnabled=TRUE)"), undefined);
  EXPECT_EQ(hidden("(!(orv-slapdAdminDN=cn=root))"), "(!" + undefined + ")");
  EXPECT_EQ(hidden("(&(cn=a)(|(orv-slapdAdminDN=x)(cn=b\\29)))"),
            "(&(cn=a)(|" + undefined + "(cn=b\\29)))");
  EXPECT_EQ(hidden("(orv-slapdAdminDN=*)"), "(orv-slapdAdminDN=*)");
  const SchemaAttribute* const known = schema.attribute("orv-slapdAdminDN");
  ASSERT_NE(known, nullptr);
  EXPECT_EQ(hidden("(" + known->oid + "=cn=root)"), undefined);
}

TEST_F(Canonical, ObjectClassesAreAskedForUnderTheirCanonicalNames) {
  for (const FilterUse use : {FilterUse::evaluate, FilterUse::evaluate_for_administrators}) {
    const auto evaluated = [&](std::string_view filter) {
      return rewrite_filter(schema, filter, use);
    };
    EXPECT_EQ(evaluated("(objectClass=2.5.6.0)"), "(objectClass=top)");
    EXPECT_EQ(evaluated("(2.5.4.0=2.5.6.0)"), "(2.5.4.0=top)");
    EXPECT_EQ(evaluated("(objectClass=2\\2e5.6.0)"), "(objectClass=top)");
    EXPECT_EQ(evaluated("(&(cn=2.5.6.0)(!(OBJECTCLASS=TOP)))"),
              "(&(cn=2.5.6.0)(!(OBJECTCLASS=top)))");
    EXPECT_EQ(evaluated("(objectClass:2.5.13.0:=2.5.6.0)"), "(objectClass:2.5.13.0:=top)");
    EXPECT_EQ(evaluated("(objectClass=*)"), "(objectClass=*)");
    EXPECT_EQ(evaluated("(objectClass=2.5.6*)"), "(objectClass=2.5.6*)");
    EXPECT_EQ(evaluated("(objectClass=bogus\\2a)"), "(objectClass=bogus\\2a)");
  }
}

TEST_F(Canonical, ValuesThatAreHiddenFromMembersAreEvaluatedForWhoSeesThem) {
  EXPECT_EQ(rewrite_filter(schema, "(orv-slapdAdminDN=cn=root)", FilterUse::evaluate),
            "(orv-slapdAdminDN=cn=root)");
}

TEST_F(Canonical, FiltersAreShownWithoutValuesOfSecrets) {
  EXPECT_EQ(rewrite_filter(schema, "(&(cn=a)(orv-slapdAdminPW=guess))", FilterUse::show),
            "(&(cn=a)(orv-slapdAdminPW=***))");
  EXPECT_EQ(rewrite_filter(schema, "(orv-slapdAdminPW=*)", FilterUse::show),
            "(orv-slapdAdminPW=*)");
}

TEST_F(Canonical, FiltersAreShownWithoutWhatMayBeASecret) {
  const auto shown = [this](const std::string& filter) {
    return rewrite_filter(schema, filter, FilterUse::show);
  };
  // Under a name that nobody knows, or none.
  EXPECT_EQ(shown("(|(orv-slapdAdminPasswd>=guess)(1.2.3=g*s)(unknown=*))"),
            "(|(orv-slapdAdminPasswd>=***)(1.2.3=***)(unknown=*))");
  EXPECT_EQ(shown("(:2.5.13.5:=guess)"), "(:2.5.13.5:=***)");
  EXPECT_EQ(shown("(orv-slapdAdminPW;x-a:dn:=guess)"), "(orv-slapdAdminPW;x-a:dn:=***)");
  // In a DN, also where its characters are escaped.
  EXPECT_EQ(shown("(orv-slapdAdminDN=cn=a,orv-slapdAdminPW=guess)"), "(orv-slapdAdminDN=***)");
  EXPECT_EQ(shown("(cn=orv-slapdAdminPW\\3dgu\\28ess)"), "(cn=***)");
  EXPECT_EQ(shown("(orv-slapdAdminDN=cn=a,userPassword=guess)"), "(orv-slapdAdminDN=***)");
  EXPECT_EQ(shown("(orv-slapdAdminDN=cn=a,o=b)"), "(orv-slapdAdminDN=cn=a,o=b)");
  // What should be a DN and is not.
  EXPECT_EQ(shown("(orv-slapdAdminDN=orv-slapdAdminPW=guess,,)"), "(orv-slapdAdminDN=***)");
  EXPECT_EQ(shown("(orv-slapdAdminDN=guess*)"), "(orv-slapdAdminDN=***)");
  // What was cut off.
  EXPECT_EQ(shown("(&(cn=a)(cn=orv-slapdAdminPW=guess\\2"), "(&(cn=a)(cn=***");
  // All else.
  EXPECT_EQ(shown("(&(cn=a*b)(!(description~=c=d))(description;x-a=e)(cn:2.5.13.5:=f))"),
            "(&(cn=a*b)(!(description~=c=d))(description;x-a=e)(cn:2.5.13.5:=f))");
}

}  // namespace
}  // namespace orv::server
