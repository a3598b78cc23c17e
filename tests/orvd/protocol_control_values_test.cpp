// Values of controls and extended operations, and messages that are encoded once more.
#include "protocol/control_values.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "protocol/encoder.h"
#include "protocol_raw.h"

namespace orv::server {
namespace {

using raw::integer;
using raw::tlv;

TEST(AssertionValue, IsAFilter) {
  const std::string value = tlv(0xA3, tlv(0x04, "cn") + tlv(0x04, "a*b"));
  std::string filter;
  EXPECT_EQ(read_assertion(value, {4, 10}, filter), 0);
  EXPECT_EQ(filter, "(cn=a\\2Ab)");
  EXPECT_EQ(read_assertion(tlv(0xA2, tlv(0xA2, value)), {2, 10}, filter), 11);
  EXPECT_EQ(read_assertion(value + "x", {4, 10}, filter), 2);
  EXPECT_EQ(read_assertion("", {4, 10}, filter), 2);
  EXPECT_EQ(read_assertion(tlv(0xA3, tlv(0x04, "c n") + tlv(0x04, "x")), {4, 10}, filter), 2);
  EXPECT_EQ(read_assertion(tlv(0xA0, ""), {4, 10}, filter), 2);
}

TEST(AttributeSelectionValue, IsAListOfNames) {
  std::vector<std::string> names{"before"};
  EXPECT_EQ(read_attribute_selection(tlv(0x30, ""), 2, names), 0);
  EXPECT_TRUE(names.empty());
  const std::string two = tlv(0x04, "cn;lang-de") + tlv(0x04, "+");
  EXPECT_EQ(read_attribute_selection(tlv(0x30, two), 2, names), 0);
  EXPECT_EQ(names, (std::vector<std::string>{"cn;lang-de", "+"}));
  EXPECT_EQ(read_attribute_selection(tlv(0x30, two), 1, names), 11);
  EXPECT_EQ(read_attribute_selection(tlv(0x31, two), 2, names), 2);
  EXPECT_EQ(read_attribute_selection(tlv(0x30, tlv(0x02, "\1")), 2, names), 2);
  EXPECT_EQ(read_attribute_selection(tlv(0x30, tlv(0x04, "\xC3(")), 2, names), 2);
  EXPECT_EQ(read_attribute_selection(tlv(0x30, two) + tlv(0x30, ""), 2, names), 2);
  EXPECT_EQ(names.size(), 2U);  // left alone on failure
}

TEST(PagedResultsValue, HoldsASizeThatIsNotNegativeAndACookie) {
  PagedResultsControl control;
  const auto value = [](const std::string& size, const std::string& cookie) {
    return tlv(0x30, size + tlv(0x04, cookie));
  };
  EXPECT_EQ(read_paged_results(value(integer(2147483647), "abc"), control), 0);
  EXPECT_EQ(control.size, 2147483647);
  EXPECT_EQ(control.cookie, "abc");
  EXPECT_EQ(read_paged_results(value(integer(0), ""), control), 0);
  EXPECT_EQ(control.size, 0);
  EXPECT_EQ(control.cookie, "");
  EXPECT_EQ(read_paged_results(value(tlv(0x02, "\xFF"), ""), control), 2);
  EXPECT_EQ(read_paged_results(value(tlv(0x02, ""), ""), control), 2);
  EXPECT_EQ(read_paged_results(value(tlv(0x02, std::string("\0\x80\0\0\0", 5)), ""), control), 2);
  EXPECT_EQ(read_paged_results(value(integer(1), "") + "x", control), 2);
  EXPECT_EQ(read_paged_results(tlv(0x30, integer(1)), control), 2);
  EXPECT_EQ(read_paged_results(tlv(0x30, integer(1) + tlv(0x04, "") + tlv(0x04, "")), control), 2);
}

TEST(PagedResultsValue, IsReadBackAsItIsWritten) {
  for (const std::int32_t total : {0, 1, 127, 128, 255, 256, 65535, 8388608, 2147483647}) {
    const Control answer = paged_results_answer(total, "0123456789abcdef");
    PagedResultsControl control;
    ASSERT_EQ(read_paged_results(*answer.value, control), 0) << total;
    EXPECT_EQ(control.size, total);
    EXPECT_EQ(control.cookie, "0123456789abcdef");
    EXPECT_FALSE(answer.critical);
  }
}

TEST(CancelValue, IsAMessageId) {
  std::int32_t id = 0;
  EXPECT_EQ(read_cancel(tlv(0x30, integer(300)), id), 0);
  EXPECT_EQ(id, 300);
  EXPECT_EQ(read_cancel(tlv(0x30, integer(300)) + "x", id), 2);
  EXPECT_EQ(read_cancel(tlv(0x30, integer(1) + integer(1)), id), 2);
  EXPECT_EQ(read_cancel(integer(1), id), 2);
  EXPECT_EQ(read_cancel(tlv(0x30, ""), id), 2);
}

std::string result_message(std::int32_t id, std::string_view text,
                           const std::vector<Control>* controls = nullptr) {
  ResultAnswer answer{};
  answer.message_id = id;
  answer.response_tag = tag::search_done;
  answer.text = text;
  answer.controls = controls;
  std::string message;
  EXPECT_TRUE(encode_result(message, answer));
  return message;
}

TEST(EncodedMessages, AreTheSameUnderAnotherIdAndWithOtherControls) {
  const std::vector<Control> none{{"1.2.3", false, "before"}};
  const std::vector<Control> some{{"1.2.3", true, "x"}, {"1.2.4", false, std::nullopt}};
  // Lengths of one, two and three octets.
  for (const std::size_t length : {0U, 200U, 70000U}) {
    const std::string text(length, 'x');
    std::string out = "before";
    ASSERT_TRUE(encode_again(out, result_message(1, text, &none), 70000, &some));
    EXPECT_EQ(out, "before" + result_message(70000, text, &some));
    out.clear();
    ASSERT_TRUE(encode_again(out, result_message(70000, text, &some), 1, nullptr));
    EXPECT_EQ(out, result_message(1, text));
  }
}

TEST(EncodedMessages, AreNotMadeOfWhatIsNone) {
  const std::string whole = result_message(1, "text");
  EXPECT_EQ(operation_in(whole).front(), static_cast<char>(tag::search_done));
  for (std::size_t length = 0; length < whole.size(); ++length) {
    std::string out = "before";
    EXPECT_EQ(operation_in(whole.substr(0, length)), "");
    EXPECT_FALSE(encode_again(out, whole.substr(0, length), 2, nullptr));
    EXPECT_EQ(out, "before");
  }
}

}  // namespace
}  // namespace orv::server
