// Object classes in the file: those that the schema knows stand under their own names.
#include "cfg/object_class_table.h"

#include "cfg_fixture.h"

namespace orv::cfg_test {
namespace {

class ObjectClassTest : public CfgTest {
 protected:
  void SetUp() override {
    CfgTest::SetUp();
    ASSERT_EQ(cfg::register_object_classes({{"top", "2.5.6.0", {}},
                                            {"orv-slapdSupplier", "2.25.31", {"supplier", "x"}},
                                            {"container", "2.25.32", {}}}),
              0);
  }
  void TearDown() override { ASSERT_EQ(cfg::register_object_classes({}), 0); }

  // What is said about an entry with this line as its third, without the name of the file.
  std::string refusal_of(const std::string& line) {
    const std::string said = refusal("dn: cn=top\ncn: top\n" + line + "\n");
    EXPECT_EQ(said.substr(0, path_.size() + 2), path_ + ": ");
    return said.substr(path_.size() + 2);
  }

  // The values that come back for an entry with this line.
  Values read_of(const std::string& line) {
    const CfgSession session = open("dn: cn=top\ncn: top\n" + line + "\n");
    const std::vector<FoundEntry> found =
        search(session, "cn=top", kScopeBase, nullptr, {"objectClass"});
    return found.size() == 1 && found[0].attributes.size() == 1 ? found[0].attributes[0].second
                                                                : Values{"not read"};
  }
};

constexpr const char* kSupplierAt = "the object class must be written as orv-slapdSupplier";

struct Spelling {
  const char* line;
  const char* place;
};

TEST_F(ObjectClassTest, KnownClassUnderAnotherNameIsRefusedWhereItStands) {
  const Spelling spellings[] = {
      {"objectClass: 2.25.31", "line 3, column 14"},
      {"objectClass:2.25.31", "line 3, column 13"},
      {"objectClass: supplier", "line 3, column 14"},
      {"objectClass: SUPPLIER", "line 3, column 14"},
      {"objectClass: x", "line 3, column 14"},
      {"objectClass:   supplier\r", "line 3, column 16"},
      {"OBJECTCLASS: 2.25.31", "line 3, column 14"},
      {"2.5.4.0: supplier", "line 3, column 10"},
      {"objectClass: orv-slapdSupplier ", "line 3, column 14"},
      {"objectClass: ORV-SLAPDSUPPLIER  ", "line 3, column 14"},
      {"objectClass:: IG9ydi1zbGFwZFN1cHBsaWVy", "line 3, column 15"},  // a blank before the name
      {"objectClass:: Mi4yNS4zMQ==", "line 3, column 15"},
      {"objectClass: supp\n lier", "line 3, column 14"},
      {"objectClass: 2.25\n .31", "line 3, column 14"},
      {"# a comment\nobjectClass: supplier", "line 4, column 14"},
      {"objectClass: top\ndescription: 2.25.31\nobjectClass: 2.25.31", "line 5, column 14"},
  };
  for (const Spelling& spelling : spellings) {
    EXPECT_EQ(refusal_of(spelling.line), std::string(spelling.place) + ": " + kSupplierAt)
        << spelling.line;
  }
}

TEST_F(ObjectClassTest, OwnNameInAnyLetterCaseAndUnknownClassesComeBackAsStored) {
  EXPECT_EQ(read_of("objectClass: orv-slapdSupplier"), Values{"orv-slapdSupplier"});
  EXPECT_EQ(read_of("objectclass: ORV-slapdSUPPLIER"), Values{"ORV-slapdSUPPLIER"});
  EXPECT_EQ(read_of("objectClass: orv-slapd\n Supplier"), Values{"orv-slapdSupplier"});
  EXPECT_EQ(read_of("objectClass:: Y29udGFpbmVy"), Values{"container"});
  for (const char* unknown : {"other", "2.25.99", "2.25.3", "2.25.311", "suppliers", ""}) {
    EXPECT_EQ(read_of(std::string("objectClass: ") + unknown), Values{unknown});
  }
}

TEST_F(ObjectClassTest, OtherAttributesMayHoldTheNamesOfClasses) {
  const CfgSession session =
      open("dn: cn=top\ncn: 2.25.31\ndescription: supplier\nobjectClasz: 2.25.31\n");
  EXPECT_EQ(search(session, "cn=top", kScopeBase, "(cn=2.25.31)").size(), 1U);
}

TEST_F(ObjectClassTest, OwnNameOfOneClassIsNoOtherNameOfAnother) {
  ASSERT_EQ(cfg::register_object_classes({{"a", "1.1", {"b"}}, {"b", "1.2", {}}}), 0);
  EXPECT_EQ(read_of("objectClass: b"), Values{"b"});
}

TEST_F(ObjectClassTest, WithoutATableEveryValueIsReadAsItIs) {
  ASSERT_EQ(cfg::register_object_classes({}), 0);
  EXPECT_EQ(read_of("objectClass: 2.25.31"), Values{"2.25.31"});
}

TEST_F(ObjectClassTest, TypeIsKnownWithoutAnAttributeTableToo) {
  ASSERT_EQ(cfg::register_attribute_types({}), 0);
  EXPECT_EQ(refusal_of("objectclass: supplier"), std::string("line 3, column 14: ") + kSupplierAt);
}

}  // namespace
}  // namespace orv::cfg_test
