// The transport's length-prefixed frames: encoding, incremental decoding and limits.
#include "platform/linux/ipc_frame.h"

#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <vector>

namespace brisvale::ipc {
namespace {

using Bytes = std::vector<uint8_t>;

Bytes Header(uint32_t length) {
  return {uint8_t(length >> 24), uint8_t(length >> 16), uint8_t(length >> 8), uint8_t(length)};
}

Bytes Framed(const Bytes& payload) {
  Bytes frame = Header(static_cast<uint32_t>(payload.size()));
  frame.insert(frame.end(), payload.begin(), payload.end());
  return frame;
}

Bytes Binary(const plist::Value& value) { return plist::WriteBinary(value); }

Bytes Concat(std::initializer_list<Bytes> parts) {
  Bytes all;
  for (const Bytes& part : parts) all.insert(all.end(), part.begin(), part.end());
  return all;
}

const plist::Dictionary kFirst{{"RequestType", "CopyDevices"}, {"vexa.id", plist::Value::Int(1)}};
const plist::Dictionary kSecond{{"Blob", plist::Value(Bytes(70000, 0xAB))}};

struct Case {
  const char* name;
  Bytes input;
  std::vector<plist::Dictionary> frames;
  std::optional<FrameError> error;
  bool partial = false;
};

std::vector<Case> Cases() {
  const Bytes first = Framed(Binary(kFirst));
  const Bytes second = Framed(Binary(kSecond));
  const std::string xml = plist::WriteXml(plist::Value(kFirst));
  return {
      {"one frame", first, {kFirst}, {}},
      {"two frames, one large", Concat({first, second}), {kFirst, kSecond}, {}},
      {"header split from nothing", Bytes{0, 0}, {}, {}, true},
      {"frame then a half frame", Concat({first, Bytes(second.begin(), second.begin() + 100)}), {kFirst}, {}, true},
      {"zero length", Header(0), {}, FrameError::ZeroLength},
      {"one byte over the limit, header alone", Header(kMaxFramePayload + 1), {}, FrameError::TooLong},
      {"largest length, header alone, waits", Header(kMaxFramePayload), {}, {}, true},
      {"all ones length", Header(0xFFFFFFFF), {}, FrameError::TooLong},
      {"garbage payload", Framed(Bytes{'h', 'e', 'l', 'l', 'o'}), {}, FrameError::Undecodable},
      {"xml payload", Framed(Bytes(xml.begin(), xml.end())), {}, FrameError::Undecodable},
      {"array root", Framed(Binary(plist::Array{"a"})), {}, FrameError::NotDictionary},
      {"string root", Framed(Binary(plist::Value("text"))), {}, FrameError::NotDictionary},
      {"good frame survives a bad one after it", Concat({first, Header(0), first}), {kFirst}, FrameError::ZeroLength},
  };
}

struct Outcome {
  std::vector<plist::Dictionary> frames;
  std::optional<FrameError> error;
  bool partial;
};

Outcome FeedInChunks(const Bytes& input, size_t chunk) {
  FrameReader reader;
  Outcome outcome;
  for (size_t pos = 0; pos < input.size() && !outcome.error; pos += chunk) {
    const size_t size = std::min(chunk, input.size() - pos);
    auto failure = reader.Feed(std::span<const uint8_t>(input).subspan(pos, size), outcome.frames);
    if (failure) outcome.error = failure->error;
  }
  outcome.partial = reader.HasPartialFrame();
  return outcome;
}

TEST(FrameReaderTest, SameResultHoweverTheBytesAreSplit) {
  for (const Case& c : Cases()) {
    for (size_t chunk : {c.input.size(), size_t{1}, size_t{3}, size_t{4093}}) {
      if (chunk == 0) continue;
      SCOPED_TRACE(std::string(c.name) + ", chunks of " + std::to_string(chunk));
      Outcome outcome = FeedInChunks(c.input, chunk);
      EXPECT_EQ(outcome.frames, c.frames);
      EXPECT_EQ(outcome.error, c.error);
      if (!c.error) {
        EXPECT_EQ(outcome.partial, c.partial);
      }
    }
  }
}

TEST(FrameReaderTest, StaysFailedAfterAnError) {
  FrameReader reader;
  std::vector<plist::Dictionary> frames;
  ASSERT_TRUE(reader.Feed(Header(0), frames));
  auto again = reader.Feed(Framed(Binary(kFirst)), frames);
  ASSERT_TRUE(again);
  EXPECT_EQ(again->error, FrameError::ZeroLength);
  EXPECT_TRUE(frames.empty());
}

TEST(FrameReaderTest, EncodedFramesReadBackAndOversizedBodiesAreRefused) {
  std::optional<Bytes> frame = EncodeFrame(kSecond);
  ASSERT_TRUE(frame);
  EXPECT_EQ(FeedInChunks(*frame, 1000).frames, std::vector<plist::Dictionary>{kSecond});

  const plist::Dictionary huge{{"Blob", plist::Value(Bytes(kMaxFramePayload, 0))}};
  EXPECT_FALSE(EncodeFrame(huge));
}

}  // namespace
}  // namespace brisvale::ipc
