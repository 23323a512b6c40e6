// The transport's length-prefixed frames: encoding, incremental decoding and limits.
#include "platform/linux/ipc_frame.h"

#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <vector>

#include "derwriter/der_writer.h"

namespace brisvale::ipc {
namespace {

using derwriter::Bytes;
using derwriter::Concat;

Bytes Header(uint32_t length) {
  return {uint8_t(length >> 24), uint8_t(length >> 16), uint8_t(length >> 8), uint8_t(length)};
}

Bytes Framed(const Bytes& payload) { return Concat({Header(static_cast<uint32_t>(payload.size())), payload}); }

const plist::Dictionary kFirst{{"RequestType", "CopyDevices"}, {"vexa.id", plist::Value::Int(1)}};
const plist::Dictionary kSecond{{"Blob", plist::Value(Bytes(70000, 0xAB))}};

TEST(FrameReaderTest, SameResultHoweverTheBytesAreSplit) {
  const Bytes first = *EncodeFrame(kFirst);
  const Bytes second = *EncodeFrame(kSecond);
  const std::string xml = plist::WriteXml(plist::Value(kFirst));
  const struct {
    const char* name;
    Bytes input;
    std::vector<plist::Dictionary> frames;
    std::optional<FrameError> error;
    bool partial = false;
  } cases[] = {
      {"one frame", first, {kFirst}, {}},
      {"two frames, one large", Concat({first, second}), {kFirst, kSecond}, {}},
      {"header split from nothing", Bytes{0, 0}, {}, {}, true},
      {"frame then a half frame", Concat({first, Bytes(second.begin(), second.begin() + 100)}), {kFirst}, {}, true},
      {"zero length", Header(0), {}, FrameError::ZeroLength},
      {"one byte over the limit, header alone", Header(kMaxFramePayload + 1), {}, FrameError::TooLong},
      {"largest length, header alone, waits", Header(kMaxFramePayload), {}, {}, true},
      {"all ones length", Header(0xFFFFFFFF), {}, FrameError::TooLong},
      {"xml payload", Framed(Bytes(xml.begin(), xml.end())), {}, FrameError::Undecodable},
      {"array root", Framed(plist::WriteBinary(plist::Array{"a"})), {}, FrameError::NotDictionary},
      // The bytes after a failure are still fed: a reader that has failed stays failed.
      {"good frame survives a bad one after it", Concat({first, Header(0), first}), {kFirst}, FrameError::ZeroLength},
  };
  for (const auto& c : cases) {
    for (size_t chunk : {c.input.size(), size_t{1}, size_t{3}, size_t{4093}}) {
      SCOPED_TRACE(std::string(c.name) + ", chunks of " + std::to_string(chunk));
      FrameReader reader;
      std::vector<plist::Dictionary> frames;
      std::optional<FrameError> error;
      for (size_t pos = 0; pos < c.input.size(); pos += chunk) {
        const std::span<const uint8_t> piece(c.input.data() + pos, std::min(chunk, c.input.size() - pos));
        if (auto failure = reader.Feed(piece, frames)) error = failure->error;
      }
      EXPECT_EQ(frames, c.frames);
      EXPECT_EQ(error, c.error);
      if (!c.error) {
        EXPECT_EQ(reader.HasPartialFrame(), c.partial);
      }
    }
  }
}

TEST(FrameReaderTest, OversizedBodiesAreNotEncoded) {
  EXPECT_FALSE(EncodeFrame(plist::Dictionary{{"Blob", plist::Value(Bytes(kMaxFramePayload, 0))}}));
}

}  // namespace
}  // namespace brisvale::ipc
