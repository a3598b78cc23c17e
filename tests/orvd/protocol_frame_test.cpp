// Framing: where a message ends in a stream of bytes.
#include <gtest/gtest.h>

#include "protocol_raw.h"

namespace orv::server {
namespace {

using namespace raw;

constexpr std::size_t kLimit = 1000;

TEST(Frame, NothingReceivedNeedsMore) {
  EXPECT_EQ(next_frame("", kLimit).state, FrameState::need_more);
}

TEST(Frame, EveryPrefixOfAMessageNeedsMoreAndTheWholeIsComplete) {
  const std::string whole = message(search(presence(), octets("cn")));
  for (std::size_t length = 0; length < whole.size(); ++length) {
    const Frame frame = next_frame(std::string_view(whole).substr(0, length), kLimit);
    EXPECT_EQ(frame.state, FrameState::need_more) << length;
    EXPECT_EQ(frame.length, length >= 2 ? whole.size() : 0);
  }
  const Frame frame = next_frame(whole, kLimit);
  EXPECT_EQ(frame.state, FrameState::complete);
  EXPECT_EQ(frame.length, whole.size());
}

TEST(Frame, MessageSentBytewiseIsCutOutOfTheStream) {
  const std::string first = message(search(equality("cn", std::string(300, 'x'))));
  const std::string second = message(tlv(0x42, ""), "", 8);
  std::string received;
  std::vector<std::string> frames;
  for (const char octet : first + second) {
    received += octet;
    const Frame frame = next_frame(received, kLimit);
    ASSERT_NE(frame.state, FrameState::malformed);
    ASSERT_NE(frame.state, FrameState::too_big);
    if (frame.state != FrameState::complete) continue;
    frames.push_back(received.substr(0, frame.length));
    received.erase(0, frame.length);
  }
  EXPECT_EQ(frames, (std::vector<std::string>{first, second}));
}

TEST(Frame, FollowingBytesDoNotBelongToTheFrame) {
  const std::string whole = message(del("cn=x"));
  EXPECT_EQ(next_frame(whole + "\x30", kLimit).length, whole.size());
}

TEST(Frame, EveryFormOfLengthIsRead) {
  const std::string body = integer(7) + del("cn=x");
  for (int octets = 1; octets <= 8; ++octets) {
    const std::string whole = tlv_long(0x30, body, octets);
    const Frame frame = next_frame(whole, kLimit);
    EXPECT_EQ(frame.state, FrameState::complete) << octets;
    EXPECT_EQ(frame.length, whole.size());
    EXPECT_EQ(next_frame(whole.substr(0, 1 + static_cast<std::size_t>(octets)), kLimit).state,
              FrameState::need_more);
    EXPECT_EQ(raw::decode(whole).decoded.state, DecodeState::decoded) << octets;
  }
}

TEST(Frame, LengthOfMoreThanEightOctets_rejected) {
  EXPECT_EQ(next_frame(tlv_long(0x30, "", 9), kLimit).state, FrameState::malformed);
  EXPECT_EQ(next_frame("\x30\xFF", kLimit).state, FrameState::malformed);
}

TEST(Frame, IndefiniteLength_rejected) {
  EXPECT_EQ(next_frame("\x30\x80", kLimit).state, FrameState::malformed);
}

TEST(Frame, EveryOtherFirstOctet_rejected) {
  for (int octet = 0; octet < 256; ++octet) {
    if (octet == 0x30) continue;
    const std::string start(1, static_cast<char>(octet));
    EXPECT_EQ(next_frame(start, kLimit).state, FrameState::malformed) << octet;
  }
}

TEST(Frame, LimitCountsTheHeader) {
  const std::string exactly = tlv(0x30, std::string(kLimit - 4, 'x'));
  ASSERT_EQ(exactly.size(), kLimit);
  EXPECT_EQ(next_frame(exactly, kLimit).state, FrameState::complete);
  const std::string more = tlv(0x30, std::string(kLimit - 3, 'x'));
  EXPECT_EQ(next_frame(more.substr(0, 4), kLimit).state, FrameState::too_big);
}

TEST(Frame, TooBigIsKnownBeforeTheLengthIsWhole) {
  EXPECT_EQ(next_frame("\x30\x84\x7F", kLimit).state, FrameState::need_more);
  EXPECT_EQ(next_frame("\x30\x84\x7F\xFF", kLimit).state, FrameState::too_big);
  EXPECT_EQ(next_frame("\x30\x88\xFF\xFF", kLimit).state, FrameState::too_big);
  EXPECT_EQ(next_frame("\x30\x88\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF", kLimit).state,
            FrameState::too_big);
}

}  // namespace
}  // namespace orv::server
