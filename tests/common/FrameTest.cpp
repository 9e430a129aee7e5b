#include "common/Frame.h"

#include <gtest/gtest.h>

#include <random>
#include <string>
#include <vector>

#include "common/MsgPack.h"

namespace qn {
namespace {

using protocol::ConnectionError;
using protocol::kMaxBodyBytes;

std::string Header(std::uint32_t length) {
  std::string h(4, '\0');
  for (int i = 0; i < 4; ++i)
    h[static_cast<std::size_t>(i)] = static_cast<char>(length >> (24 - 8 * i));
  return h;
}

std::vector<Value> SampleValues() {
  return {Value(Array{1, 7, 42}), Value("x"), Value(Dictionary{{"k", Array{1, 2, 3}}}),
          Value(std::string(70000, 'z')), Value()};
}

std::string SampleStream() {
  std::string stream;
  for (const Value& v : SampleValues()) EXPECT_TRUE(AppendFrame(stream, v));
  return stream;
}

// Feeds `stream` in pieces of the given sizes (cycled) and collects the decoded bodies.
std::vector<Value> FeedInPieces(FrameDecoder& decoder, std::string_view stream,
                                const std::vector<std::size_t>& sizes) {
  std::vector<Value> out;
  std::size_t at = 0, piece = 0;
  while (at < stream.size()) {
    std::size_t n = std::min(sizes[piece++ % sizes.size()], stream.size() - at);
    decoder.Feed(stream.substr(at, n));
    at += n;
    while (auto body = decoder.Next()) {
      auto decoded = DecodeMsgPack(*body);
      EXPECT_TRUE(std::holds_alternative<Value>(decoded));
      if (auto* v = std::get_if<Value>(&decoded)) out.push_back(*v);
    }
  }
  return out;
}

TEST(FrameTest, AnyChunkingYieldsEveryBodyInOrder) {
  const std::string stream = SampleStream() + SampleStream();
  std::vector<Value> expected = SampleValues();
  const std::vector<Value> again = SampleValues();
  expected.insert(expected.end(), again.begin(), again.end());
  std::mt19937 random(1234);
  for (int round = 0; round < 22; ++round) {
    std::vector<std::size_t> sizes;
    if (round == 0) sizes = {1};              // a byte at a time
    if (round == 1) sizes = {stream.size()};  // all at once
    for (int i = 0; round > 1 && i < 16; ++i) sizes.push_back(1 + random() % 9000);
    FrameDecoder decoder;
    EXPECT_EQ(FeedInPieces(decoder, stream, sizes), expected) << round;
    EXPECT_FALSE(decoder.error());
    EXPECT_EQ(decoder.buffered(), 0u);
  }
}

TEST(FrameTest, ZeroLengthIsAPermanentError) {
  FrameDecoder decoder;
  std::string stream;
  AppendFrame(stream, Value(7));
  stream += Header(0);
  stream += SampleStream();
  decoder.Feed(stream);
  EXPECT_TRUE(decoder.Next());  // the good frame before it still comes out
  EXPECT_FALSE(decoder.Next());
  ASSERT_TRUE(decoder.error());
  EXPECT_EQ(decoder.error()->code, ConnectionError::kBadLength);
  EXPECT_EQ(decoder.buffered(), 0u);
  decoder.Feed(SampleStream());  // discarded
  EXPECT_FALSE(decoder.Next());
  EXPECT_EQ(decoder.buffered(), 0u);
}

TEST(FrameTest, OversizedLengthFailsAsSoonAsTheHeaderArrives) {
  FrameDecoder decoder;
  std::string header = Header(kMaxBodyBytes + 1);
  for (std::size_t i = 0; i < 3; ++i) {
    decoder.Feed(header.substr(i, 1));
    EXPECT_FALSE(decoder.Next());
    EXPECT_FALSE(decoder.error());
  }
  decoder.Feed(header.substr(3));
  EXPECT_FALSE(decoder.Next());
  ASSERT_TRUE(decoder.error());
  EXPECT_EQ(decoder.error()->code, ConnectionError::kBadLength);
  EXPECT_NE(decoder.error()->message.find("1048577"), std::string::npos);

  FrameDecoder huge;
  huge.Feed(Header(0xffffffff));
  EXPECT_FALSE(huge.Next());
  EXPECT_TRUE(huge.error());
}

TEST(FrameTest, ExactlyTheMaximumIsAccepted) {
  FrameDecoder decoder;
  decoder.Feed(Header(kMaxBodyBytes));
  decoder.Feed(std::string(kMaxBodyBytes - 1, 'a'));
  EXPECT_FALSE(decoder.Next());
  EXPECT_FALSE(decoder.error());
  decoder.Feed("b");
  auto body = decoder.Next();
  ASSERT_TRUE(body);
  EXPECT_EQ(body->size(), kMaxBodyBytes);
  EXPECT_EQ(body->back(), 'b');
}

}  // namespace
}  // namespace qn
