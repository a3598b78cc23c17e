// Lists of modifications whose order cannot matter: what is handed to the backend for what a client
// sent, and that it comes to the same.
#include "ops/modification_list.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <map>
#include <ostream>
#include <random>
#include <set>

#include "cfg/ldapmod.h"
#include "ops/equality.h"

namespace orv::server {

bool operator==(const TypeChange& a, const TypeChange& b) {
  return a.operation == b.operation && a.type == b.type && a.values == b.values;
}

void PrintTo(const TypeChange& change, std::ostream* out) {
  constexpr const char* kNames[] = {"add", "delete", "replace"};
  *out << kNames[change.operation] << ' ' << change.type;
  for (const std::string& value : change.values) *out << ' ' << value;
}

namespace {

constexpr const char* kText = "description";
constexpr const char* kSecret = "orv-slapdAdminPW";
constexpr const char* kClass = "objectClass";

TypeChange add(std::vector<std::string> values, std::string_view type = kText) {
  return {kModAdd, type, std::move(values)};
}
TypeChange remove(std::vector<std::string> values, std::string_view type = kText) {
  return {kModDelete, type, std::move(values)};
}
TypeChange replace(std::vector<std::string> values, std::string_view type = kText) {
  return {kModReplace, type, std::move(values)};
}

Refusal fold(const TypeChanges& given, TypeChanges& folded) {
  folded.clear();
  return fold_changes(builtin_schema(), given, folded);
}

int code_of(const TypeChanges& given) {
  TypeChanges folded;
  const Refusal refusal = fold(given, folded);
  EXPECT_EQ(refusal.code != 0, !refusal.text.empty()) << refusal.text;
  if (refusal) {
    EXPECT_TRUE(folded.empty());
  }
  return refusal.code;
}

TypeChanges folded(const TypeChanges& given) {
  TypeChanges made;
  const Refusal refusal = fold(given, made);
  EXPECT_EQ(refusal.code, 0) << refusal.text;
  return made;
}

// ---- the table

TEST(ModificationList, SingleModificationStaysWhatItIs) {
  for (const TypeChange& only :
       {add({"a", "b"}), remove({"a", "b"}), remove({}), replace({"a"}), replace({})})
    EXPECT_EQ(folded({only}), TypeChanges{only});
}

TEST(ModificationList, NeighboursOfOneCodeAreMergedInTheirOrder) {
  EXPECT_EQ(folded({add({"b"}), add({"a", "c"})}), TypeChanges{add({"b", "a", "c"})});
  EXPECT_EQ(folded({remove({"b"}), remove({"a"})}), TypeChanges{remove({"b", "a"})});
}

TEST(ModificationList, AddStandsBeforeDelete) {
  const TypeChanges wanted{add({"b"}), remove({"a"})};
  EXPECT_EQ(folded({remove({"a"}), add({"b"})}), wanted);
  EXPECT_EQ(folded({add({"b"}), remove({"a"})}), wanted);
  EXPECT_EQ(folded({add({"b"}), remove({"a"}), add({"c"})}),
            (TypeChanges{add({"b", "c"}), remove({"a"})}));
}

TEST(ModificationList, TypesStandInTheOrderOfTheirFirstAppearance) {
  EXPECT_EQ(
      folded({replace({"1"}, "orv-slapdPort"), remove({"a"}), add({"x"}, "cn"),
              replace({"2"}, "orv-slapdPort"), add({"b"})}),
      (TypeChanges{replace({"2"}, "orv-slapdPort"), add({"b"}), remove({"a"}), add({"x"}, "cn")}));
}

TEST(ModificationList, DeleteOfAllWithOthersBehindItIsAReplace) {
  EXPECT_EQ(folded({remove({}), add({"a"})}), TypeChanges{replace({"a"})});
  EXPECT_EQ(folded({remove({}), add({"a"}), add({"b"}), remove({"a"})}),
            TypeChanges{replace({"b"})});
  EXPECT_EQ(folded({remove({}), replace({"a"})}), TypeChanges{replace({"a"})});
  EXPECT_EQ(folded({remove({}), replace({})}), TypeChanges{replace({})});
}

TEST(ModificationList, EverythingBehindAReplaceIsFoldedIntoIt) {
  EXPECT_EQ(folded({replace({"a"}), replace({"b"})}), TypeChanges{replace({"b"})});
  EXPECT_EQ(folded({replace({"a"}), add({"b"})}), TypeChanges{replace({"a", "b"})});
  EXPECT_EQ(folded({replace({"a", "b"}), remove({"A"})}), TypeChanges{replace({"b"})});
  EXPECT_EQ(folded({replace({}), add({"b"})}), TypeChanges{replace({"b"})});
}

TEST(ModificationList, FoldThatEndsEmptyIsAReplaceWithoutValues) {
  EXPECT_EQ(folded({replace({"a"}), remove({"a"})}), TypeChanges{replace({})});
  EXPECT_EQ(folded({replace({"a"}), remove({})}), TypeChanges{replace({})});
  EXPECT_EQ(folded({replace({"bad"}), replace({})}), TypeChanges{replace({})});
  EXPECT_EQ(folded({remove({}), add({"a"}), remove({"a"})}), TypeChanges{replace({})});
}

TEST(ModificationList, ReplaceKeepsTheOrderOfItsValues) {
  EXPECT_EQ(folded({replace({"c", "a", "b"}), remove({"a"}), add({"a"})}),
            TypeChanges{replace({"c", "b", "a"})});
}

TEST(ModificationList, ValuesBeforeAReplaceOrADeleteOfAllAreRefused) {
  EXPECT_EQ(code_of({add({"a"}), replace({"b"})}), 53);
  EXPECT_EQ(code_of({remove({"a"}), replace({"b"})}), 53);
  EXPECT_EQ(code_of({add({"a"}), remove({})}), 53);
  EXPECT_EQ(code_of({remove({"a"}), remove({})}), 53);
  EXPECT_EQ(code_of({remove({"old"}, kSecret), replace({"new"}, kSecret)}), 53);
}

TEST(ModificationList, SameValueAddedAndDeletedIsRefused) {
  EXPECT_EQ(code_of({add({"a"}), remove({"a"})}), 53);
  EXPECT_EQ(code_of({remove({"a"}), add({"A"})}), 53);
  EXPECT_EQ(code_of({add({"a"}), remove({"b"}), remove({"c", "a"})}), 53);
}

TEST(ModificationList, EqualValuesAreRefused) {
  EXPECT_EQ(code_of({add({"a", "A"})}), 20);
  EXPECT_EQ(code_of({replace({"a", "a"})}), 20);
  EXPECT_EQ(code_of({remove({"a"}), remove({"a"})}), 20);
  EXPECT_EQ(code_of({add({"a"}), add({"b"}), add({"A"})}), 20);
  EXPECT_EQ(code_of({replace({"a"}), add({"A"})}), 20);
  EXPECT_EQ(code_of({remove({}), add({"a"}), add({"a"})}), 20);
}

TEST(ModificationList, ValuesThatTheListItselfTookAwayCannotBeDeleted) {
  EXPECT_EQ(code_of({replace({"a"}), remove({"b"})}), 16);
  EXPECT_EQ(code_of({remove({}), remove({"a"})}), 16);
  EXPECT_EQ(code_of({remove({}), remove({})}), 16);
  EXPECT_EQ(code_of({replace({}), remove({})}), 16);
  EXPECT_EQ(code_of({replace({"a"}), remove({"a"}), remove({"a"})}), 16);
}

TEST(ModificationList, PasswordsAreComparedAsTheyWereSent) {
  EXPECT_EQ(folded({remove({"old"}, kSecret), add({"OLD"}, kSecret)}),
            (TypeChanges{add({"OLD"}, kSecret), remove({"old"}, kSecret)}));
  EXPECT_EQ(code_of({remove({"x"}, kSecret), add({"x"}, kSecret)}), 53);
}

TEST(ModificationList, OfOneTypeIsNotInTheWayOfAnother) {
  EXPECT_EQ(code_of({add({"x"}, "cn"), replace({"x"}), remove({"y"}, "cn")}), 0);
}

TEST(ModificationList, DeletedRolesStandBehindWhatElseIsTakenAway) {
  constexpr const char* kRole = "orv-slapdAdminRole";
  EXPECT_EQ(code_of({remove({"A", "B"}, kRole), remove({"x"})}), 53);
  EXPECT_EQ(code_of({remove({"A"}, kRole), add({"C"}, kRole), replace({"x"})}), 53);
  EXPECT_EQ(code_of({remove({"A"}, kRole), add({"y"}), remove({}, "cn")}), 53);
  EXPECT_EQ(code_of({remove({"x"}), remove({"A", "B"}, kRole)}), 0);
  EXPECT_EQ(code_of({remove({"A", "B"}, kRole), add({"x"})}), 0);
  EXPECT_EQ(code_of({add({"A"}, kRole), remove({"x"})}), 0);
  EXPECT_EQ(code_of({replace({"A"}, kRole), remove({"x"})}), 0);
  EXPECT_EQ(code_of({remove({}, kRole), remove({"x"})}), 0);
}

// ---- classes

int class_code(const TypeChange& change) {
  return check_class_changes(builtin_schema(), {add({"x"}), change}).code;
}

TEST(ClassChanges, AuxiliaryClassesComeAndGo) {
  EXPECT_EQ(class_code(add({"orv-replicationContext"}, kClass)), 0);
  EXPECT_EQ(class_code(remove({"orv-replicationContext"}, kClass)), 0);
}

TEST(ClassChanges, EverythingElseIsProhibited) {
  for (const char* const name : {"orv-slapdSupplier", "orv-slapdPta", "top", "unknown"}) {
    EXPECT_EQ(class_code(add({name}, kClass)), 69) << name;
    EXPECT_EQ(class_code(remove({name}, kClass)), 69) << name;
  }
  EXPECT_EQ(class_code(add({"orv-replicationContext", "orv-slapdSupplier"}, kClass)), 69);
  EXPECT_EQ(class_code(remove({}, kClass)), 69);
  EXPECT_EQ(class_code(replace({}, kClass)), 69);
  EXPECT_EQ(class_code(replace({"orv-replicationContext"}, kClass)), 69);
}

// ---- names

int name_code(std::string_view dn, const TypeChanges& changes) {
  return check_name_stays(builtin_schema(), dn, changes).code;
}

TEST(NameStays, ValuesOfTheNameCannotBeTakenAway) {
  EXPECT_EQ(name_code("cn=Some  Name,cn=configuration", {remove({"some name"}, "cn")}), 67);
  EXPECT_EQ(name_code("cn=x,cn=configuration", {remove({}, "cn")}), 67);
  EXPECT_EQ(name_code("cn=x,cn=configuration", {replace({}, "cn")}), 67);
  EXPECT_EQ(name_code("cn=x,cn=configuration", {replace({"y"}, "cn")}), 67);
  EXPECT_EQ(name_code("2.5.4.3=\\78,cn=configuration", {remove({"X"}, "cn")}), 67);
  EXPECT_EQ(name_code("cn=x+description=y,cn=configuration", {remove({"y"})}), 67);
}

TEST(NameStays, OtherValuesOfTheTypeMayChange) {
  EXPECT_EQ(name_code("cn=x,cn=configuration", {add({"y"}, "cn"), remove({"z"}, "cn")}), 0);
  EXPECT_EQ(name_code("cn=x,cn=configuration", {replace({"y", "X"}, "cn")}), 0);
  EXPECT_EQ(name_code("cn=x,cn=configuration", {remove({"x"})}), 0);
  EXPECT_EQ(name_code("cn=x,cn=configuration", {remove({"configuration"}, "cn")}), 0);
}

// ---- the same in every order

// An entry: for each type the keys of its values.
using Model = std::map<std::string, std::set<std::string>, std::less<>>;

std::string key_of(std::string_view type, const std::string& value) {
  return equality_key(builtin_schema(), type, value);
}

// One modification as RFC 4511, 4.6, has it.
int apply(Model& entry, const TypeChange& change) {
  std::set<std::string>& held = entry[std::string(change.type)];
  if (change.operation == kModReplace) held.clear();
  if (change.operation == kModDelete) {
    if (held.empty()) return 16;
    if (change.values.empty()) held.clear();
    for (const std::string& value : change.values)
      if (held.erase(key_of(change.type, value)) == 0) return 16;
    return 0;
  }
  for (const std::string& value : change.values)
    if (!held.insert(key_of(change.type, value)).second) return 20;
  return 0;
}

// All or nothing.
int apply_all(Model& entry, const TypeChanges& changes) {
  Model copy = entry;
  for (const TypeChange& change : changes)
    if (const int code = apply(copy, change)) return code;
  entry = std::move(copy);
  return 0;
}

// How the backend writes a list: one record for each type and code, where the first of them stood.
TypeChanges grouped(const TypeChanges& changes) {
  TypeChanges records;
  for (const TypeChange& change : changes) {
    const auto same = std::find_if(records.begin(), records.end(), [&](const TypeChange& record) {
      return record.type == change.type && record.operation == change.operation;
    });
    if (same == records.end())
      records.push_back(change);
    else
      same->values.insert(same->values.end(), change.values.begin(), change.values.end());
  }
  return records;
}

// A delete of all that has others of its type behind it does not fail any more.
Model with_something_to_delete(const Model& entry, const TypeChanges& given) {
  Model filled = entry;
  std::map<std::string_view, int> count;
  for (const TypeChange& change : given) ++count[change.type];
  std::set<std::string_view> seen;
  for (const TypeChange& change : given) {
    const bool first = seen.insert(change.type).second;
    std::set<std::string>& held = filled[std::string(change.type)];
    if (first && count[change.type] > 1 && change.operation == kModDelete &&
        change.values.empty() && held.empty())
      held.insert("something");
  }
  return filled;
}

class RandomLists : public testing::Test {
 protected:
  static constexpr int kLists = 20000;
  static constexpr std::string_view kTypes[] = {kText, "orv-slapdDigestAdminUser", kSecret};
  static constexpr const char* kValues[] = {"a", "A", "b", "c", "bad", "bad2"};

  int up_to(int most) { return std::uniform_int_distribution<int>(0, most)(random); }

  TypeChange change() {
    TypeChange made{up_to(2), kTypes[up_to(2)], {}};
    const int wanted = made.operation == kModAdd ? 1 + up_to(1) : up_to(2);
    std::set<std::string> keys;
    for (int i = 0; i < wanted; ++i) {
      const std::string value = kValues[up_to(5)];
      if (keys.insert(key_of(made.type, value)).second) made.values.push_back(value);
    }
    return made;
  }

  TypeChanges list() {
    TypeChanges made;
    for (int left = 1 + up_to(4); left > 0; --left) made.push_back(change());
    return made;
  }

  Model entry() {
    Model made;
    for (const std::string_view type : kTypes)
      for (const char* const value : kValues)
        if (up_to(2) == 0) made[std::string(type)].insert(key_of(type, value));
    return made;
  }

  std::mt19937 random{20260101};
};

TEST_F(RandomLists, EndAsInTheClientsOrderOrAreRefused) {
  int alike = 0;
  int refused = 0;
  for (int i = 0; i < kLists; ++i) {
    const TypeChanges given = list();
    const Model before = entry();
    SCOPED_TRACE(testing::PrintToString(given));
    Model clients = with_something_to_delete(before, given);
    const int wanted = apply_all(clients, given);
    TypeChanges made;
    const Refusal refusal = fold(given, made);
    if (refusal) {
      ++refused;
      EXPECT_FALSE(refusal.text.empty());
      // Only 53 may refuse what would have succeeded.
      if (wanted == 0) {
        ASSERT_EQ(refusal.code, 53);
      }
      continue;
    }
    Model written = before;
    const int code = apply_all(written, grouped(made));
    Model checked = before;
    ASSERT_EQ(apply_all(checked, made), code);
    ASSERT_EQ(code == 0, wanted == 0) << testing::PrintToString(made);
    ASSERT_EQ(checked, written);
    if (code != 0) continue;
    ++alike;
    ASSERT_EQ(written, clients) << testing::PrintToString(made);
  }
  // Both happen often enough to mean something.
  EXPECT_GT(alike, kLists / 20);
  EXPECT_GT(refused, kLists / 20);
}

TEST_F(RandomLists, HoldOneModificationOfATypeOrAnAddAndThenADelete) {
  for (int i = 0; i < kLists; ++i) {
    const TypeChanges given = list();
    TypeChanges made;
    if (fold(given, made)) continue;
    SCOPED_TRACE(testing::PrintToString(given));
    std::vector<std::string_view> wanted;
    for (const TypeChange& change : given)
      if (std::find(wanted.begin(), wanted.end(), change.type) == wanted.end())
        wanted.push_back(change.type);
    std::vector<std::string_view> types;
    for (std::size_t at = 0; at < made.size(); ++at) {
      types.push_back(made[at].type);
      const bool pair = at + 1 < made.size() && made[at + 1].type == made[at].type;
      if (!pair) continue;
      ASSERT_EQ(made[at].operation, kModAdd);
      ASSERT_EQ(made[at + 1].operation, kModDelete);
      ASSERT_FALSE(made[at + 1].values.empty());
      ++at;
    }
    ASSERT_EQ(types, wanted);
    TypeChanges again;
    ASSERT_EQ(fold(made, again).code, 0);
    ASSERT_EQ(again, made);
  }
}

// A rule as the backend has them: it looks at the first modification of a type, and there at the
// first value that is put in. For types of one value, which the schema guards.
bool rule_refuses(const TypeChanges& list, std::string_view type) {
  const auto first = std::find_if(list.begin(), list.end(),
                                  [&](const TypeChange& change) { return change.type == type; });
  return first != list.end() && first->operation != kModDelete && !first->values.empty() &&
         first->values.front().starts_with("bad");
}

TEST_F(RandomLists, BringNothingPastARuleThatItWouldHaveRefusedAlone) {
  int tried = 0;
  for (int i = 0; i < kLists; ++i) {
    const TypeChanges given = list();
    Model before;  // nothing bad is there
    for (const std::string_view type : kTypes)
      if (up_to(1) == 0) before[std::string(type)].insert(key_of(type, "a"));
    TypeChanges made;
    Model after = before;
    if (fold(given, made) || apply_all(after, grouped(made)) != 0) continue;
    for (const std::string_view type : kTypes) {
      const std::set<std::string>& held = after[std::string(type)];
      if (held.size() != 1) continue;  // the schema check
      const bool bad =
          *held.begin() == key_of(type, "bad") || *held.begin() == key_of(type, "bad2");
      if (!bad) continue;
      ++tried;
      ASSERT_TRUE(rule_refuses(made, type)) << testing::PrintToString(given);
    }
  }
  EXPECT_GT(tried, 100);
}

}  // namespace
}  // namespace orv::server
