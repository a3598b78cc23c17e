// What one request may cost: the work for six times as much is about six times as much, whatever is
// repeated or nested in it, and bounded where a limit is.
//
// Counted is the processor time of the thread, the least of several tries, in one run: no clock of
// the wall, and no number that depends on the machine.
#include <gtest/gtest.h>

#include <ctime>

#include <algorithm>
#include <functional>
#include <string>
#include <vector>

#include "cfg/dn.h"
#include "cfg/ldif.h"
#include "core_wire.h"
#include "ops/canonical.h"
#include "protocol/decoder.h"
#include "publish/match.h"
#include "publish/subschema.h"
#include "slapi/codepage.h"
#include "slapi/schema.h"

namespace orv::server::test {
namespace {

// Work that is the square of the size would be 36 times as much. Below that there is room for
// caches, for sanitizers, and for a machine that does other things.
constexpr double kMostGrowth = 20;
constexpr int kTimesMore = 6;
constexpr int kTries = 3;
// A neighbour in the cache may slow one size down and not the other; it does not always.
constexpr int kRounds = 5;

double processor_seconds() {
  timespec now{};
  clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) * 1e-9;
}

// Of `work` on an input of this size, made outside of what is measured.
using Measured = std::function<std::function<void()>(std::size_t size)>;

double least_time(const Measured& make, std::size_t size) {
  double least = 1e9;
  for (int i = 0; i < kTries; ++i) {
    const std::function<void()> work = make(size);
    const double begun = processor_seconds();
    work();
    least = std::min(least, processor_seconds() - begun);
  }
  return least;
}

void expect_no_more_than_linear(const Measured& make, std::size_t size) {
  double one = 0;
  double more = 0;
  for (int round = 0; round < kRounds; ++round) {
    one = least_time(make, size);
    more = least_time(make, size * kTimesMore);
    if (more < std::max(one, 50e-6) * kMostGrowth) return;
  }
  ADD_FAILURE() << one << " s for " << size << ", " << more << " s for " << kTimesMore << " times";
}

std::string repeat(std::string_view text, std::size_t times) {
  std::string all;
  all.reserve(text.size() * times);
  for (std::size_t i = 0; i < times; ++i) all += text;
  return all;
}

class Work : public testing::Test {
 protected:
  static void SetUpTestSuite() {
    ASSERT_EQ(cfg::register_attribute_types(builtin_schema().attribute_table()), 0);
    ASSERT_EQ(initIconvHandle(), 0);
  }
};

// ---- filters

std::string entry_with(const std::string& value) {
  std::string record = "dn: cn=x\ncn: x\n";
  cfg::append_ldif_line(record, "description", value);
  return record;
}

Measured match(const std::function<std::string(std::size_t)>& value,
               const std::function<std::string(std::size_t)>& filter) {
  return [value, filter](std::size_t size) {
    return [record = entry_with(value(size)), text = filter(size)] {
      bool matches = false;
      EXPECT_EQ(cfg::ldif_record_matches(record, text.c_str(), matches), 0);
    };
  };
}

std::string a(std::size_t size) {
  return std::string(size, 'a');
}

TEST_F(Work, OfALongSubstringIsTheSumOfTheLengths) {
  expect_no_more_than_linear(
      match(a, [](std::size_t size) { return "(description=*" + a(size / 2) + "b*)"; }), 50000);
  expect_no_more_than_linear(
      match(a, [](std::size_t size) { return "(description=*b" + a(size / 2) + "*)"; }), 50000);
  expect_no_more_than_linear(match(a,
                                   [](std::size_t size) {
                                     const std::string half = a(size / 4);
                                     return "(description=*" + half + "b" + half + "*)";
                                   }),
                             50000);
}

TEST_F(Work, OfASubstringOfBytesIsTheSumOfTheLengths) {
  const auto value = [](std::size_t size) { return repeat("ab ", size / 3); };
  expect_no_more_than_linear(
      match(value,
            [](std::size_t size) { return "(description=*" + repeat("ab ", size / 6) + "c*)"; }),
      60000);
}

TEST_F(Work, OfManyPiecesIsLinear) {
  for (const char* piece : {"a*", "aa*", "b*", "ab*"}) {
    SCOPED_TRACE(piece);
    expect_no_more_than_linear(match(a,
                                     [piece](std::size_t size) {
                                       return "(description=*" + repeat(piece, size / 8) + "c)";
                                     }),
                               20000);
  }
}

TEST_F(Work, OfOtherItemsOnLongValuesIsLinear) {
  for (const char* before : {"(description=", "(description>=", "(description<=", "(description~=",
                             "(description:caseExactMatch:="}) {
    SCOPED_TRACE(before);
    expect_no_more_than_linear(
        match(a, [before](std::size_t size) { return before + a(size) + "b)"; }), 50000);
  }
}

TEST_F(Work, OfManyItemsIsLinear) {
  expect_no_more_than_linear(
      match([](std::size_t) { return std::string("x"); },
            [](std::size_t size) { return "(|" + repeat("(description=*y*)", size) + ")"; }),
      1000);
}

TEST_F(Work, OfAFilterOnAPublishedEntryIsLinear) {
  const std::shared_ptr<const entry> schema = make_subschema(builtin_schema(), 0);
  ASSERT_TRUE(schema);
  for (const char* item : {"(attributeTypes=*)", "(attributeTypes=x)", "(objectClasses=2.5.6.0)",
                           "(cn=x)", "(attributeTypes=*x*)", "(!(attributeTypes=x))"}) {
    SCOPED_TRACE(item);
    expect_no_more_than_linear(
        [&schema, item](std::size_t size) {
          return [&schema, text = "(|" + repeat(item, size) + ")"] {
            static_cast<void>(entry_matches(*schema, text));
          };
        },
        50);
  }
}

// ---- names

TEST_F(Work, OfANameIsLinear) {
  const std::vector<std::string> parts = {"cn=x,",   "cn=x+",      "cn=\\61\\62,", "cn=#040178,",
                                          "cn=a b,", "2.5.4.3=x,", "cn=\xC3\x9F,", "  cn  =  x  ,"};
  for (const std::string& part : parts) {
    SCOPED_TRACE(part);
    expect_no_more_than_linear(
        [&part](std::size_t size) {
          return [text = repeat(part, size / part.size()) + "cn=y"] {
            std::string normal;
            static_cast<void>(cfg::normalize_dn(text, normal));
          };
        },
        4000);
  }
  for (const char* value : {"a", "\\,", "\\20", " ", "=", "\xC3\xA4", "\xCC\x88"}) {
    SCOPED_TRACE(value);
    expect_no_more_than_linear(
        [value](std::size_t size) {
          return [text = "cn=x" + repeat(value, size) + "y"] {
            std::string normal;
            static_cast<void>(cfg::normalize_dn(text, normal));
          };
        },
        4000);
  }
}

// ---- changes

ModifyRequest list_of(std::size_t size, bool one_type) {
  ModifyRequest request{"cn=x", {}};
  for (std::size_t i = 0; i < size; ++i)
    request.modifications.push_back(
        {static_cast<int>(i % 2),
         {one_type ? "description" : "seeAlso", {"value " + std::to_string(i)}}});
  return request;
}

TEST_F(Work, OfAListOfModificationsIsLinear) {
  for (const bool one_type : {true, false}) {
    for (const ListForm form : {ListForm::folded, ListForm::as_sent}) {
      SCOPED_TRACE(one_type);
      expect_no_more_than_linear(
          [one_type, form](std::size_t size) {
            return [request = list_of(size, one_type), form] {
              ldapmod* first = nullptr;
              static_cast<void>(make_modifications(builtin_schema(), request, form, first));
              free_modifications(first);
            };
          },
          250);
    }
  }
}

TEST_F(Work, OfManyValuesIsLinear) {
  expect_no_more_than_linear(
      [](std::size_t size) {
        AddRequest request{"cn=x,cn=configuration",
                           {{"objectClass", {"top", "container"}}, {"cn", {"x"}}}};
        Attribute many{"description", {}};
        for (std::size_t i = 0; i < size; ++i) many.values.push_back("v" + std::to_string(i));
        request.attributes.push_back(std::move(many));
        return [request = std::move(request)] {
          EntryPtr made;
          EXPECT_EQ(make_entry(builtin_schema(), request, made).code, 0);
        };
      },
      2000);
}

TEST_F(Work, OfAFilterThatIsRewrittenIsLinear) {
  for (const FilterUse use : {FilterUse::evaluate_for_administrators, FilterUse::show}) {
    expect_no_more_than_linear(
        [use](std::size_t size) {
          return [text = "(&" + repeat("(cn=*x*)(orv-slapdAdminPW=y)", size) + ")", use] {
            static_cast<void>(rewrite_filter(builtin_schema(), text, use));
          };
        },
        500);
  }
}

TEST_F(Work, OfManyAttributesIsLinear) {
  expect_no_more_than_linear(
      [](std::size_t size) {
        std::vector<std::string> names;
        for (std::size_t i = 0; i < size; ++i) names.push_back("x-" + std::to_string(i));
        return [names = std::move(names)] {
          static_cast<void>(canonical_names(builtin_schema(), names));
        };
      },
      250);
}

// ---- messages

TEST_F(Work, OfReadingAMessageIsLinear) {
  struct Shape {
    const char* name;
    std::function<std::string(std::size_t)> make;
  };
  const auto of_filter = [](const std::string& filter) {
    return message(1,
                   tlv(0x63, tlv(0x04, "") + std::string("\x0A\1\0\x0A\1\0\2\1\0\2\1\0\1\1\0", 15) +
                                 filter + tlv(0x30, "")));
  };
  const std::vector<Shape> shapes = {
      {"extensions",
       [](std::size_t n) { return message(1, tlv(0x42, "") + repeat("\x8F\1x", n)); }},
      {"controls",
       [](std::size_t n) {
         return message(1, tlv(0x4A, "cn=x"), repeat(tlv(0x30, tlv(0x04, "1.2.3")), n));
       }},
      {"items", [&](std::size_t n) { return of_filter(tlv(0xA1, repeat(tlv(0x87, "cn"), n))); }},
      {"pieces",
       [&](std::size_t n) {
         return of_filter(tlv(0xA4, tlv(0x04, "cn") + tlv(0x30, repeat(tlv(0x81, "a"), n))));
       }},
      {"long value",
       [&](std::size_t n) {
         return of_filter(tlv(0xA3, tlv(0x04, "cn") + tlv(0x04, std::string(n, '\xFF'))));
       }},
      {"depth",
       [&](std::size_t n) {
         // Innermost first would copy the whole for each level.
         std::vector<std::string> heads;
         std::size_t length = 4;
         for (std::size_t i = 0; i < n; ++i) {
           heads.push_back(std::string("\xA2\x84", 2) + static_cast<char>(length >> 24) +
                           static_cast<char>(length >> 16) + static_cast<char>(length >> 8) +
                           static_cast<char>(length));
           length += 6;
         }
         std::string filter;
         for (auto head = heads.rbegin(); head != heads.rend(); ++head) filter += *head;
         return of_filter(filter + tlv(0x87, "cn"));
       }},
  };
  DecoderLimits limits;
  limits.message_bytes = std::size_t{1} << 30;
  limits.controls = limits.attributes = limits.values = limits.filter_items = 1 << 30;
  limits.filter_depth = 64;
  for (const Shape& shape : shapes) {
    SCOPED_TRACE(shape.name);
    expect_no_more_than_linear(
        [&](std::size_t size) {
          return [&limits, bytes = shape.make(size)] {
            Message decoded;
            static_cast<void>(decode(bytes, limits, decoded));
          };
        },
        10000);
  }
}

// ---- schema texts

std::string schema_of(std::size_t size, bool many_names) {
  std::string text;
  if (many_names) {
    text = "attributeTypes: ( 1.2.3 NAME (";
    for (std::size_t i = 0; i < size; ++i) text += " 'name-" + std::to_string(i) + "'";
    return text + " ) SYNTAX 1.3.6.1.4.1.1466.115.121.1.15 )\n";
  }
  for (std::size_t i = 0; i < size; ++i)
    text += "attributeTypes: ( 1.2." + std::to_string(i) + " NAME 'type-" + std::to_string(i) +
            "' SYNTAX 1.3.6.1.4.1.1466.115.121.1.15 )\n";
  return text;
}

TEST_F(Work, OfASchemaWithThousandsOfNamesIsLinear) {
  for (const bool many_names : {true, false}) {
    SCOPED_TRACE(many_names);
    expect_no_more_than_linear(
        [many_names](std::size_t size) {
          return [text = schema_of(size, many_names)] {
            std::string error;
            EXPECT_TRUE(Schema::parse(text, error)) << error;
          };
        },
        500);
  }
}

TEST_F(Work, OfAClassWithThousandsOfAttributesIsLinear) {
  expect_no_more_than_linear(
      [](std::size_t size) {
        std::string text = schema_of(size, false) + "objectClasses: ( 1.3 NAME 'c' MAY ( type-0";
        for (std::size_t i = 1; i < size; ++i) text += " $ type-" + std::to_string(i);
        return [text = text + " ) )\n"] {
          std::string error;
          EXPECT_TRUE(Schema::parse(text, error)) << error;
        };
      },
      1000);
}

}  // namespace
}  // namespace orv::server::test
