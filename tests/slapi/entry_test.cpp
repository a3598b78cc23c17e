#include "slapi/entry.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "cfg/matching.h"
#include "slapi/codepage.h"
#include "slapi/owners.h"
#include "values.h"

namespace orv {
namespace {

using test::texts_of;
using test::to_text;
using test::Values;
using testing::ElementsAre;
using testing::IsEmpty;

EntryPtr empty_entry() {
  return EntryPtr(static_cast<entry*>(std::calloc(1, sizeof(entry))));
}

int merge(const EntryPtr& e, const char* type, std::initializer_list<std::string> texts) {
  Values values(texts);
  return attr_merge(e.get(), type, values.list(), 1, 1, nullptr);
}

int find(const attr* a, const std::string& text) {
  std::string bytes = text;
  const berval value{bytes.size(), bytes.data()};
  return value_find(a, &value, a == nullptr ? 0 : a->syntax, 1);
}

TEST(AttrMerge, CreatesAttributesInTheOrderOfTheCalls) {
  const EntryPtr e = empty_entry();
  EXPECT_EQ(merge(e, "objectClass", {"top", "container"}), 0);
  EXPECT_EQ(merge(e, "cn", {"a"}), 0);
  EXPECT_EQ(merge(e, "description", {"b", "c"}), 0);
  EXPECT_EQ(merge(e, "cn", {"d"}), 0);
  EXPECT_EQ(to_text(*e), "objectClass=top|container|; cn=a|d|; description=b|c|; ");
  EXPECT_EQ(attr_find(e.get(), "cn", 0, 0)->count, 2);
}

TEST(AttrMerge, CopiesWhatItIsGiven) {
  const EntryPtr e = empty_entry();
  std::string type = "cn";
  std::string text = "value";
  berval value{text.size(), text.data()};
  berval* list[] = {&value, nullptr};
  ASSERT_EQ(attr_merge(e.get(), type.c_str(), list, 1, 1, nullptr), 0);
  type = "xx";
  text = "other";
  value.bv_len = 1;
  EXPECT_EQ(to_text(*e), "cn=value|; ");
}

TEST(AttrMerge, TerminatesEachValueWithANul) {
  const EntryPtr e = empty_entry();
  char bytes[] = {'a', 'b', 'c'};
  berval value{2, bytes};
  berval* list[] = {&value, nullptr};
  ASSERT_EQ(attr_merge(e.get(), "cn", list, 1, 1, nullptr), 0);
  EXPECT_STREQ(e->attributes->values[0]->bv_val, "ab");
}

TEST(AttrMerge, MakesAnEmptyValueOfNullBytes) {
  const EntryPtr e = empty_entry();
  berval value{0, nullptr};
  berval* list[] = {&value, nullptr};
  ASSERT_EQ(attr_merge(e.get(), "cn", list, 1, 1, nullptr), 0);
  EXPECT_STREQ(e->attributes->values[0]->bv_val, "");
  EXPECT_EQ(e->attributes->values[0]->bv_len, 0U);
}

TEST(AttrMerge, OfAnEmptyListCreatesAnAttributeWithoutValues) {
  const EntryPtr e = empty_entry();
  ASSERT_EQ(merge(e, "cn", {}), 0);
  ASSERT_NE(e->attributes, nullptr);
  EXPECT_EQ(e->attributes->count, 0);
  ASSERT_NE(e->attributes->values, nullptr);
  EXPECT_EQ(e->attributes->values[0], nullptr);
  EXPECT_EQ(merge(e, "objectClass", {}), 0);
  EXPECT_THAT(texts_of(e->object_class_list), IsEmpty());
  EXPECT_NE(e->object_class_list, nullptr);
}

TEST(AttrMerge, RefusesAValueThatIsThereByTheTypesOwnRule) {
  const EntryPtr e = empty_entry();
  ASSERT_EQ(merge(e, "cn", {"Some  Name"}), 0);
  ASSERT_EQ(merge(e, "orv-slapdLog", {"/A"}), 0);
  ASSERT_EQ(merge(e, "orv-slapdAdminDN", {"cn=Root, O=x"}), 0);
  EXPECT_EQ(merge(e, "CN", {"new", " some name "}), 20);
  EXPECT_EQ(merge(e, "orv-slapdLog", {"/A"}), 20);
  EXPECT_EQ(merge(e, "orv-slapdAdminDN", {"CN=root,o=X"}), 20);
  EXPECT_EQ(to_text(*e), "cn=Some  Name|; orv-slapdLog=/A|; orv-slapdAdminDN=cn=Root, O=x|; ");
  EXPECT_EQ(e->attributes->count, 1);
  EXPECT_EQ(merge(e, "orv-slapdLog", {"/a"}), 0);
}

TEST(AttrMerge, FoldsLettersBeyondAscii) {
  const EntryPtr e = empty_entry();
  ASSERT_EQ(merge(e, "cn", {"J\xC3\xBCrgen"}), 0);
  EXPECT_EQ(merge(e, "cn", {"J\xC3\x9CRGEN"}), 20);
  EXPECT_EQ(merge(e, "cn", {"Jurgen"}), 0);
}

TEST(AttrMerge, ComparesValuesAsFiltersDo) {
  const EntryPtr e = empty_entry();
  ASSERT_EQ(merge(e, "orv-slapdPort", {"389"}), 0);
  EXPECT_EQ(merge(e, "orv-slapdPort", {" 0389"}), 20);
  ASSERT_EQ(merge(e, "createTimestamp", {"20240229120000Z"}), 0);
  EXPECT_EQ(merge(e, "createTimestamp", {"2024022913+0100"}), 20);
  ASSERT_EQ(merge(e, "vendorName", {"A\xCC\x88"}), 0);
  EXPECT_EQ(merge(e, "vendorName", {"\xC3\x84"}), 20);
}

TEST(AttrMerge, TakesAValueOfAnotherSyntaxAsEqualToItselfOnly) {
  const EntryPtr e = empty_entry();
  ASSERT_EQ(merge(e, "orv-slapdPort", {"many", "1"}), 0);
  EXPECT_EQ(merge(e, "orv-slapdPort", {"Many"}), 0);
  EXPECT_EQ(merge(e, "orv-slapdPort", {"many"}), 20);
  ASSERT_EQ(merge(e, "orv-slapdAdminDN", {"nobody"}), 0);
  EXPECT_EQ(merge(e, "orv-slapdAdminDN", {"Nobody"}), 0);
  EXPECT_EQ(merge(e, "orv-slapdAdminDN", {"nobody"}), 20);
}

TEST(AttrMerge, DoesNotTakeAValueOfAnotherSyntaxForACanonicalForm) {
  const EntryPtr e = empty_entry();
  std::string form;
  ASSERT_EQ(cfg::canonical_value(cfg::MatchingRule::generalized_time, "19700101000000Z", form), 0);
  ASSERT_EQ(merge(e, "createTimestamp", {"19700101000000Z"}), 0);
  EXPECT_EQ(merge(e, "createTimestamp", {form}), 0);
}

TEST(AttrMerge, FindsAValueThatIsAddedTwiceAtOnce) {
  const EntryPtr e = empty_entry();
  ASSERT_EQ(merge(e, "cn", {"a"}), 0);
  EXPECT_EQ(merge(e, "cn", {"b", "B"}), 20);
  EXPECT_EQ(to_text(*e), "cn=a|; ");
}

TEST(AttrMerge, DoesNotLookForDuplicatesInANewAttributeNorUnasked) {
  const EntryPtr e = empty_entry();
  EXPECT_EQ(merge(e, "cn", {"a", "a"}), 0);
  Values again{"a"};
  EXPECT_EQ(attr_merge(e.get(), "cn", again.list(), 1, 0, nullptr), 0);
  EXPECT_EQ(to_text(*e), "cn=a|a|a|; ");
}

TEST(AttrMerge, TellsNothingAboutASecretsContent) {
  for (const char* type : {"orv-slapdAdminPW", "orv-slapdMasterPW", "ORV-SLAPDADMINPW"}) {
    const EntryPtr e = empty_entry();
    ASSERT_EQ(merge(e, type, {"guess"}), 0);
    EXPECT_EQ(merge(e, type, {"guess"}), 0) << type;
    EXPECT_THAT(texts_of(e->attributes), ElementsAre("guess", "guess"));
  }
}

TEST(AttrMerge, RefusesNullArguments) {
  const EntryPtr e = empty_entry();
  Values values{"a"};
  EXPECT_EQ(attr_merge(nullptr, "cn", values.list(), 1, 1, nullptr), -1);
  EXPECT_EQ(attr_merge(e.get(), nullptr, values.list(), 1, 1, nullptr), -1);
  EXPECT_EQ(attr_merge(e.get(), "cn", nullptr, 1, 1, nullptr), -1);
  EXPECT_EQ(e->attributes, nullptr);
}

// Comparing all pairs would take hours here.
TEST(AttrMerge, ComparesLargeListsInLinearTime) {
  std::vector<std::string> first;
  std::vector<std::string> second;
  for (int i = 0; i < 300000; ++i) {
    first.push_back("a" + std::to_string(i));
    second.push_back("b" + std::to_string(i));
  }
  const EntryPtr e = empty_entry();
  Values first_values(std::move(first));
  Values second_values(std::move(second));
  ASSERT_EQ(attr_merge(e.get(), "cn", first_values.list(), 1, 1, nullptr), 0);
  ASSERT_EQ(attr_merge(e.get(), "cn", second_values.list(), 1, 1, nullptr), 0);
  EXPECT_EQ(e->attributes->count, 600000);
  EXPECT_EQ(attr_merge(e.get(), "cn", second_values.list(), 1, 1, nullptr), 20);
}

TEST(AttrMerge, ConvertsWhatGoesIntoAnEntryOfTheFile) {
  set_local_code_page("ISO-8859-1");
  ASSERT_EQ(initIconvHandle(), 0);
  const EntryPtr e = empty_entry();
  e->local_code_page = true;
  EXPECT_EQ(merge(e, "cn", {"caf\xC3\xA9"}), 0);
  EXPECT_THAT(texts_of(e->attributes), ElementsAre("caf\xE9"));
  EXPECT_EQ(merge(e, "cn", {"caf\xC3\xA9"}), 20);
  EXPECT_EQ(merge(e, "cn", {"\xE2\x82\xAC"}), 21);
  EXPECT_EQ(e->attributes->count, 1);
  e->local_code_page = false;
  EXPECT_EQ(merge(e, "cn", {"\xE2\x82\xAC"}), 0);
  set_local_code_page("UTF-8");
  ASSERT_EQ(initIconvHandle(), 0);
}

TEST(AttrMerge, IgnoresTheCaseOfLettersOfTheFilesCodePage) {
  set_local_code_page("ISO-8859-1");
  ASSERT_EQ(initIconvHandle(), 0);
  const EntryPtr e = empty_entry();
  e->local_code_page = true;
  EXPECT_EQ(merge(e, "cn", {"\xC3\x96L"}), 0);
  EXPECT_EQ(merge(e, "cn", {"\xC3\xB6l"}), 20);
  set_local_code_page("UTF-8");
  ASSERT_EQ(initIconvHandle(), 0);
}

TEST(ObjectClassReference, FollowsEveryMergeAndDelete) {
  const EntryPtr e = empty_entry();
  EXPECT_EQ(merge(e, "cn", {"a"}), 0);
  EXPECT_EQ(e->object_classes, nullptr);
  EXPECT_EQ(merge(e, "OBJECTCLASS", {"top"}), 0);
  EXPECT_EQ(e->object_classes, attr_find(e.get(), "objectClass", 0, 0));
  EXPECT_THAT(texts_of(e->object_class_list), ElementsAre("top"));
  EXPECT_EQ(merge(e, "objectClass", {"orv-slapdPta", "container"}), 0);
  EXPECT_THAT(texts_of(e->object_class_list), ElementsAre("top", "orv-slapdPta", "container"));
  EXPECT_EQ(e->object_class_list[1].bytes, e->object_classes->values[1]->bv_val);
  EXPECT_EQ(merge(e, "objectClass", {"TOP"}), 20);
  EXPECT_THAT(texts_of(e->object_class_list), ElementsAre("top", "orv-slapdPta", "container"));
  EXPECT_EQ(attr_delete(e.get(), "cn", nullptr), 0);
  EXPECT_NE(e->object_classes, nullptr);
  EXPECT_EQ(attr_delete(e.get(), "objectclass", nullptr), 0);
  EXPECT_EQ(e->object_classes, nullptr);
  EXPECT_EQ(e->object_class_list, nullptr);
}

TEST(AttrDelete, TakesOneAttributeOut) {
  const EntryPtr e = empty_entry();
  for (const char* type : {"cn", "description", "orv-slapdLog"})
    ASSERT_EQ(merge(e, type, {"x"}), 0);
  EXPECT_EQ(attr_delete(e.get(), "DESCRIPTION", nullptr), 0);
  EXPECT_EQ(to_text(*e), "cn=x|; orv-slapdLog=x|; ");
  EXPECT_EQ(attr_delete(e.get(), "description", nullptr), 1);
  EXPECT_EQ(attr_delete(e.get(), "cn", nullptr), 0);
  EXPECT_EQ(attr_delete(e.get(), "orv-slapdLog", nullptr), 0);
  EXPECT_EQ(e->attributes, nullptr);
  EXPECT_EQ(attr_delete(nullptr, "cn", nullptr), -1);
  EXPECT_EQ(attr_delete(e.get(), nullptr, nullptr), -1);
}

TEST(AttrFind, IgnoresLetterCaseAndAcceptsNull) {
  const EntryPtr e = empty_entry();
  ASSERT_EQ(merge(e, "orv-slapdAdminDN", {"cn=a"}), 0);
  EXPECT_EQ(attr_find(e.get(), "ORV-SLAPDADMINDN", 0, 0), e->attributes);
  EXPECT_EQ(attr_find(e.get(), "orv-slapdAdminD", 0, 0), nullptr);
  EXPECT_EQ(attr_find(nullptr, "cn", 0, 0), nullptr);
  EXPECT_EQ(attr_find(e.get(), nullptr, 0, 0), nullptr);
}

TEST(ValueFind, SaysZeroForPresent) {
  const EntryPtr e = empty_entry();
  ASSERT_EQ(merge(e, "objectClass", {"top", "orv-slapdPta"}), 0);
  const attr* const classes = e->object_classes;
  EXPECT_EQ(find(classes, "ORV-slapdpta"), 0);
  EXPECT_EQ(find(classes, "top"), 0);
  EXPECT_NE(find(classes, "container"), 0);
  EXPECT_NE(find(classes, ""), 0);
}

TEST(ValueFind, KnowsAnObjectClassByItsOid) {
  const EntryPtr e = empty_entry();
  ASSERT_EQ(merge(e, "objectClass", {"top"}), 0);
  EXPECT_EQ(find(e->object_classes, "2.5.6.0"), 0);
  EXPECT_EQ(find(e->object_classes, " TOP "), 0);
  EXPECT_NE(find(e->object_classes, "2.5.6.1"), 0);
  ASSERT_EQ(merge(e, "objectClass", {"noSuchClass"}), 0);
  EXPECT_EQ(find(e->object_classes, "NOSUCHCLASS"), 0);
}

TEST(ValueFind, SaysAbsentForNullAndEmptyAttributes) {
  const EntryPtr e = empty_entry();
  ASSERT_EQ(merge(e, "cn", {}), 0);
  std::string text = "a";
  const berval value{1, text.data()};
  attr zeroed{};
  EXPECT_NE(find(nullptr, "a"), 0);
  EXPECT_NE(find(e->attributes, "a"), 0);
  EXPECT_NE(value_find(&zeroed, &value, 0, 1), 0);
  EXPECT_NE(value_find(e->attributes, nullptr, 0, 1), 0);
}

TEST(ValueFind, LooksTheRuleUpForAnAttributeMadeByHand) {
  char type[] = "orv-slapdDigestAdminUser";
  char text[] = "Admin";
  berval held{5, text};
  berval* values[] = {&held, nullptr};
  attr by_hand{type, values, 1, 0, nullptr};
  EXPECT_EQ(find(&by_hand, "Admin"), 0);
  EXPECT_NE(find(&by_hand, "admin"), 0);
}

TEST(ValueFindShortList, IgnoresLetterCaseAndComparesWholeValues) {
  const ShortValue list[] = {{"top", 3}, {"orv-slapdSupplier", 17}, {nullptr, 0}};
  EXPECT_EQ(value_find_short_list(list, "ORV-SLAPDSUPPLIER", 17), 0);
  EXPECT_EQ(value_find_short_list(list, "orv-slapdSupplierX", 17), 0);
  EXPECT_EQ(value_find_short_list(list, "orv-slapdSupplierX", 18), 1);
  EXPECT_EQ(value_find_short_list(list, "to", 2), 1);
  EXPECT_EQ(value_find_short_list(list, "", 0), 1);
  EXPECT_EQ(value_find_short_list(nullptr, "top", 3), 1);
  EXPECT_EQ(value_find_short_list(list, nullptr, 0), 1);
}

TEST(Release, AcceptsNullAndPartsThatPluginsMade) {
  entry_free(nullptr);
  charray_free(nullptr);
  auto* const e = static_cast<entry*>(std::calloc(1, sizeof(entry)));
  e->dn = strdup("cn=a");
  e->normalized_dn = strdup("CN=A");
  e->requested_dn = strdup("cn=A");
  e->attributes = static_cast<attr*>(std::calloc(1, sizeof(attr)));
  entry_free(e);
  auto** const array = static_cast<char**>(std::calloc(3, sizeof(char*)));
  array[0] = strdup("a");
  array[1] = strdup("b");
  charray_free(array);
}

}  // namespace
}  // namespace orv
