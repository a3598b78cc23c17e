// Modification records: the list form of entries, their release, and values taken out of entries.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "entries.h"
#include "messages.h"
#include "slapi/codepage.h"
#include "slapi/strings.h"

namespace orv {
namespace {

using test::make_entry;
using test::to_text;

// Releases a list the way backends do.
struct ListDeleter {
  void operator()(ldapmod** array) const {
    free_ldmll(array[0]);
    std::free(array);
  }
};
using List = std::unique_ptr<ldapmod*, ListDeleter>;

std::vector<std::string> texts_of(char** strings) {
  std::vector<std::string> texts;
  for (; strings != nullptr && *strings != nullptr; ++strings) texts.emplace_back(*strings);
  return texts;
}

// ---- The list form of attributes -------------------------------------------------------------

TEST(ListOfAttributes, HoldsEachTypeWithItsValuesInOrder) {
  const EntryPtr e = make_entry(
      nullptr, {{"objectClass", {"top", "container"}}, {"cn", {"box"}}, {"description", {""}}});
  const List list(EntryToLDAPMod(e->attributes));
  ASSERT_NE(list, nullptr);
  const struct {
    const char* type;
    std::vector<std::string> values;
  } expected[] = {{"objectClass", {"top", "container"}}, {"cn", {"box"}}, {"description", {""}}};
  std::size_t i = 0;
  for (const auto& row : expected) {
    const ldapmod* const record = list.get()[i++];
    ASSERT_NE(record, nullptr);
    EXPECT_EQ(record->mod_op, kModAdd);
    EXPECT_STREQ(record->mod_type, row.type);
    EXPECT_EQ(texts_of(record->mod_vals.modv_strvals), row.values);
    EXPECT_EQ(record->mod_next, list.get()[i]) << "linked in the order of the array";
  }
  EXPECT_EQ(list.get()[i], nullptr);
}

TEST(ListOfAttributes, OwnsEverythingInIt) {
  EntryPtr e = make_entry(nullptr, {{"cn", {"box"}}});
  const List list(EntryToLDAPMod(e->attributes));
  e.reset();
  EXPECT_STREQ(list.get()[0]->mod_type, "cn");
  EXPECT_STREQ(list.get()[0]->mod_vals.modv_strvals[0], "box");
}

TEST(ListOfAttributes, ReadsValuesUpToTheirNul) {
  char text[] = "box";
  berval value{4, text};  // a translated value counts its NUL
  berval* values[] = {&value, nullptr};
  char type[] = "cn";
  attr a{type, values, 1, 0, nullptr};
  const List list(EntryToLDAPMod(&a));
  EXPECT_EQ(texts_of(list.get()[0]->mod_vals.modv_strvals), std::vector<std::string>{"box"});
}

TEST(ListOfAttributes, HasANullArrayForNoValues) {
  char type[] = "cn";
  berval* none[] = {nullptr};
  for (berval** values : {static_cast<berval**>(nullptr), static_cast<berval**>(none)}) {
    attr a{type, values, 0, 0, nullptr};
    const List list(EntryToLDAPMod(&a));
    EXPECT_EQ(list.get()[0]->mod_vals.modv_strvals, nullptr);
  }
}

// What a translation leaves that failed for one value and not for the last: written, that would be
// an empty value in the place of the client's.
TEST(ListOfAttributes, WithAValueWithoutATextIsOneRecordThatNoChangeAccepts) {
  char type[] = "cn";
  char text[] = "box";
  berval lost{0, nullptr};
  berval kept{4, text};
  berval* values[] = {&lost, &kept, nullptr};
  attr a{type, values, 2, 0, nullptr};
  attr before{type, &values[1], 1, 0, &a};
  for (attr* const attributes : {&a, &before}) {
    const List list(EntryToLDAPMod(attributes));
    ASSERT_NE(list, nullptr);
    ASSERT_NE(list.get()[0], nullptr);
    EXPECT_EQ(list.get()[0]->mod_type, nullptr);
    EXPECT_EQ(list.get()[1], nullptr);
  }
}

TEST(ListOfAttributes, KeepsAnEmptyText) {
  char type[] = "cn";
  char text[] = "";
  berval value{1, text};
  berval* values[] = {&value, nullptr};
  attr a{type, values, 1, 0, nullptr};
  const List list(EntryToLDAPMod(&a));
  EXPECT_EQ(texts_of(list.get()[0]->mod_vals.modv_strvals), std::vector<std::string>{""});
}

TEST(ListOfAttributes, IsNullForNoAttributes) {
  EXPECT_EQ(EntryToLDAPMod(nullptr), nullptr);
}

// The list as a backend translates it: other records, the same type texts.
struct Translated {
  std::vector<attr> records;
  Translated(const entry& e, std::size_t count) {
    for (const attr* a = e.attributes; a != nullptr && records.size() < count; a = a->next)
      records.push_back(attr{a->type, a->values, a->count, a->syntax, nullptr});
    for (std::size_t i = 0; i + 1 < records.size(); ++i) records[i].next = &records[i + 1];
  }
};

EntryPtr checked_container() {
  EntryPtr e = make_entry(
      "cn=box",
      {{"objectClass", {"top", "container"}}, {"cn", {"box"}}, {"description", {"blue"}}});
  EXPECT_EQ(ldcf_api_schema_check(e.get(), 0, 0), 0);
  return e;
}

TEST(ListOfAttributes, IsWholeForTheEntryThatWasChecked) {
  const EntryPtr e = checked_container();
  Translated whole(*e, 3);
  const List list(EntryToLDAPMod(whole.records.data()));
  EXPECT_STREQ(list.get()[0]->mod_type, "objectClass");
}

TEST(ListOfAttributes, ThatWasCutShortIsOneRecordThatNoChangeAccepts) {
  const EntryPtr e = checked_container();
  Translated cut(*e, 2);
  const List list(EntryToLDAPMod(cut.records.data()));
  ASSERT_NE(list, nullptr);
  ASSERT_NE(list.get()[0], nullptr);
  EXPECT_EQ(list.get()[0]->mod_type, nullptr);
  EXPECT_EQ(list.get()[0]->mod_vals.modv_strvals, nullptr);
  EXPECT_EQ(list.get()[0]->mod_next, nullptr);
  EXPECT_EQ(list.get()[1], nullptr);
}

TEST(ListOfAttributes, IsHeldAgainstTheCheckedEntryOnce) {
  const EntryPtr e = checked_container();
  Translated cut(*e, 2);
  { const List refused(EntryToLDAPMod(cut.records.data())); }
  const List list(EntryToLDAPMod(cut.records.data()));
  EXPECT_STREQ(list.get()[0]->mod_type, "objectClass");
}

TEST(ListOfAttributes, OfAnotherEntryIsNotHeldAgainstTheCheckedOne) {
  const EntryPtr checked = checked_container();
  const EntryPtr other = make_entry(nullptr, {{"cn", {"box"}}});
  const List list(EntryToLDAPMod(other->attributes));
  EXPECT_STREQ(list.get()[0]->mod_type, "cn");
}

// ---- Release ---------------------------------------------------------------------------------

ldapmod* make_record(int op, const char* type, const std::vector<std::string>& values) {
  auto* const record = static_cast<ldapmod*>(std::calloc(1, sizeof(ldapmod)));
  record->mod_op = op;
  record->mod_type = strdup(type);
  const bool counted = (op & kModBvalues) != 0;
  if (values.empty()) return record;
  if (counted) {
    record->mod_vals.modv_bvals =
        static_cast<berval**>(std::calloc(values.size() + 1, sizeof(berval*)));
  } else {
    record->mod_vals.modv_strvals =
        static_cast<char**>(std::calloc(values.size() + 1, sizeof(char*)));
  }
  for (std::size_t i = 0; i < values.size(); ++i) {
    if (!counted) {
      record->mod_vals.modv_strvals[i] = strdup(values[i].c_str());
      continue;
    }
    auto* const value = static_cast<berval*>(std::malloc(sizeof(berval)));
    *value = {values[i].size(), strdup(values[i].c_str())};
    record->mod_vals.modv_bvals[i] = value;
  }
  return record;
}

// What is not released here shows in the leak sanitizer's run and in the memory tests.
TEST(Release, TakesEitherFormOfValues) {
  ldapmod* const first = make_record(kModReplace, "cn", {"a", "b"});
  first->mod_next = make_record(kModAdd | kModBvalues, "sn", {"c"});
  first->mod_next->mod_next = make_record(kModDelete, "description", {});
  free_ldmll(first);
  auto** const array = static_cast<ldapmod**>(std::calloc(3, sizeof(ldapmod*)));
  array[0] = make_record(kModReplace, "cn", {"a"});
  array[1] = make_record(kModDelete | kModBvalues, "cn", {"a"});
  ldap_mods_free(array, 1);
}

TEST(Release, LeavesTheArrayWhenAskedTo) {
  ldapmod* array[] = {make_record(kModReplace, "cn", {"a"}), nullptr};
  ldap_mods_free(array, 0);
}

TEST(Release, OfNullDoesNothing) {
  free_ldmll(nullptr);
  ldap_mods_free(nullptr, 1);
}

// ---- Values taken out of an entry ------------------------------------------------------------

struct RecordDeleter {
  void operator()(ldapmod* record) const { free_ldmll(record); }
};

int delete_values(entry& e, const char* type, const std::vector<std::string>& values,
                  int flag = kModBvalues) {
  const std::unique_ptr<ldapmod, RecordDeleter> record(
      make_record(kModDelete | flag, type, values));
  return delete_values_from_entry(&e, record.get());
}

EntryPtr box() {
  return make_entry("cn=box", {{"objectClass", {"top", "container", "referral"}},
                               {"cn", {"box", "Crate"}},
                               {"orv-slapdAdminPW", {"old", "new"}}});
}

TEST(DeleteValues, WithoutValuesTakesTheAttribute) {
  const EntryPtr e = box();
  EXPECT_EQ(delete_values(*e, "CN", {}), 0);
  EXPECT_EQ(to_text(*e), "objectClass=top|container|referral|; orv-slapdAdminPW=old|new|; ");
}

TEST(DeleteValues, GoesByTheEqualityRule) {
  for (const int flag : {0, static_cast<int>(kModBvalues)}) {
    const EntryPtr e = box();
    EXPECT_EQ(delete_values(*e, "cn", {"CRATE"}, flag), 0);
    EXPECT_EQ(test::texts_of(attr_find(e.get(), "cn", 0, 0)), std::vector<std::string>{"box"});
    EXPECT_EQ(attr_find(e.get(), "cn", 0, 0)->count, 1);
  }
}

TEST(DeleteValues, IgnoresTheCaseOfLettersOfTheFilesCodePage) {
  set_local_code_page("ISO-8859-1");
  ASSERT_EQ(initIconvHandle(), 0);
  const EntryPtr e = make_entry("cn=box", {{"cn", {"\xD6L", "STRASSE"}}});
  e->local_code_page = true;
  EXPECT_EQ(delete_values(*e, "cn", {"\xC3\xB6l"}), 0);
  EXPECT_EQ(delete_values(*e, "cn",
                          {"stra\xC3\x9F"
                           "e"}),
            0);
  EXPECT_EQ(attr_find(e.get(), "cn", 0, 0), nullptr);
  set_local_code_page("UTF-8");
  ASSERT_EQ(initIconvHandle(), 0);
}

TEST(DeleteValues, TakesTheAttributeWithItsLastValue) {
  const EntryPtr e = box();
  EXPECT_EQ(delete_values(*e, "cn", {"crate", "box"}), 0);
  EXPECT_EQ(attr_find(e.get(), "cn", 0, 0), nullptr);
}

TEST(DeleteValues, OfWhatIsNotThereIs16AndLeavesTheEntryAsItIs) {
  const EntryPtr e = box();
  const std::string before = to_text(*e);
  EXPECT_EQ(delete_values(*e, "cn", {"box", "bag"}), 16);
  EXPECT_EQ(delete_values(*e, "cn", {"box", "BOX"}), 16) << "named twice, there once";
  EXPECT_EQ(delete_values(*e, "description", {}), 16);
  EXPECT_EQ(delete_values(*e, "description", {"x"}), 16);
  EXPECT_EQ(to_text(*e), before);
}

TEST(DeleteValues, KeepsTheObjectClassesRight) {
  const EntryPtr e = box();
  EXPECT_EQ(delete_values(*e, "objectClass", {"2.16.840.1.113730.3.2.6"}), 0);
  EXPECT_EQ(e->object_classes, e->attributes);
  EXPECT_EQ(test::texts_of(e->object_class_list), (std::vector<std::string>{"top", "container"}));
  EXPECT_EQ(delete_values(*e, "objectClass", {}), 0);
  EXPECT_EQ(e->object_classes, nullptr);
  EXPECT_EQ(e->object_class_list, nullptr);
}

TEST(DeleteValues, OfAPasswordTakesTheEarliestWhateverTheGuess) {
  for (const char* guess : {"old", "new", "wrong"}) {
    const EntryPtr e = box();
    EXPECT_EQ(delete_values(*e, "orv-slapdAdminPW", {guess}), 0) << guess;
    EXPECT_EQ(test::texts_of(attr_find(e.get(), "orv-slapdAdminPW", 0, 0)),
              std::vector<std::string>{"new"});
    EXPECT_EQ(delete_values(*e, "orv-slapdAdminPW", {guess}), 0);
    EXPECT_EQ(delete_values(*e, "orv-slapdAdminPW", {guess}), 16) << "there is none";
  }
  const EntryPtr e = box();
  EXPECT_EQ(delete_values(*e, "orv-slapdAdminPW", {"a", "b", "c"}), 16);
}

TEST(DeleteValues, AnswersNullWith80) {
  ldapmod record{};
  const EntryPtr e = box();
  EXPECT_EQ(delete_values_from_entry(nullptr, &record), 80);
  EXPECT_EQ(delete_values_from_entry(e.get(), nullptr), 80);
  EXPECT_EQ(delete_values_from_entry(e.get(), &record), 80);
}

TEST(DeleteValues, ComparesInTheCodePageOfTheEntry) {
  set_local_code_page("ISO-8859-1");
  ASSERT_EQ(initIconvHandle(), 0);
  const EntryPtr e = make_entry(nullptr, {{"cn", {"caf\xE9", "box"}}});
  e->local_code_page = true;
  EXPECT_EQ(delete_values(*e, "cn", {"\xE6\x97\xA5"}), 21);
  EXPECT_EQ(delete_values(*e, "cn", {"caf\xC3\xA9"}), 0);
  EXPECT_EQ(to_text(*e), "cn=box|; ");
  set_local_code_page("UTF-8");
  ASSERT_EQ(initIconvHandle(), 0);
}

}  // namespace
}  // namespace orv
