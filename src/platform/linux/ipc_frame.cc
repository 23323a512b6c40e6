#include "platform/linux/ipc_frame.h"

#include <algorithm>
#include <utility>

namespace brisvale::ipc {
namespace {

// A buffer that once held a large frame is given back rather than kept per connection.
constexpr size_t kRetainedBufferCapacity = 64 * 1024;

uint32_t ReadBigEndian32(const uint8_t* bytes) {
  return (uint32_t{bytes[0]} << 24) | (uint32_t{bytes[1]} << 16) | (uint32_t{bytes[2]} << 8) |
         uint32_t{bytes[3]};
}

}  // namespace

const char* FrameErrorText(FrameError error) {
  switch (error) {
    case FrameError::ZeroLength:
      return "frame length is zero";
    case FrameError::TooLong:
      return "frame length exceeds 4 MiB";
    case FrameError::Undecodable:
      return "frame is not a binary property list";
    case FrameError::NotDictionary:
      return "frame is not a dictionary";
  }
  return "malformed frame";
}

std::optional<FrameReader::Failure> FrameReader::Fail(FrameError error, std::string detail) {
  failure_ = Failure{error, std::move(detail)};
  buffer_ = {};
  return failure_;
}

std::optional<FrameReader::Failure> FrameReader::Feed(std::span<const uint8_t> bytes,
                                                      std::vector<plist::Dictionary>& frames) {
  if (failure_) return failure_;

  auto checkLength = [](uint32_t length) -> std::optional<FrameError> {
    if (length == 0) return FrameError::ZeroLength;
    if (length > kMaxFramePayload) return FrameError::TooLong;
    return std::nullopt;
  };
  auto decode = [&](std::span<const uint8_t> payload) -> std::optional<Failure> {
    std::string error;
    std::optional<plist::Value> value = plist::ReadBinary(payload, &error);
    if (!value) return Failure{FrameError::Undecodable, std::move(error)};
    const plist::Dictionary* dictionary = value->dictionary();
    if (!dictionary) return Failure{FrameError::NotDictionary, {}};
    frames.push_back(*dictionary);
    return std::nullopt;
  };

  size_t pos = 0;
  while (pos < bytes.size()) {
    if (buffer_.empty()) {
      // Whole frames are decoded straight from the input without a copy.
      const size_t remaining = bytes.size() - pos;
      if (remaining < kFrameHeaderSize) {
        buffer_.assign(bytes.begin() + pos, bytes.end());
        break;
      }
      const uint32_t length = ReadBigEndian32(bytes.data() + pos);
      if (auto error = checkLength(length)) return Fail(*error);
      if (remaining - kFrameHeaderSize < length) {
        buffer_.assign(bytes.begin() + pos, bytes.end());
        break;
      }
      if (auto failure = decode(bytes.subspan(pos + kFrameHeaderSize, length))) {
        return Fail(failure->error, std::move(failure->detail));
      }
      pos += kFrameHeaderSize + length;
      continue;
    }

    if (buffer_.size() < kFrameHeaderSize) {
      const size_t take = std::min(kFrameHeaderSize - buffer_.size(), bytes.size() - pos);
      buffer_.insert(buffer_.end(), bytes.begin() + pos, bytes.begin() + pos + take);
      pos += take;
      if (buffer_.size() < kFrameHeaderSize) break;
      if (auto error = checkLength(ReadBigEndian32(buffer_.data()))) return Fail(*error);
    }
    const size_t frameSize = kFrameHeaderSize + ReadBigEndian32(buffer_.data());
    const size_t take = std::min(frameSize - buffer_.size(), bytes.size() - pos);
    buffer_.insert(buffer_.end(), bytes.begin() + pos, bytes.begin() + pos + take);
    pos += take;
    if (buffer_.size() < frameSize) break;

    auto failure = decode(std::span<const uint8_t>(buffer_).subspan(kFrameHeaderSize));
    if (failure) return Fail(failure->error, std::move(failure->detail));
    if (buffer_.capacity() > kRetainedBufferCapacity) {
      buffer_ = {};
    } else {
      buffer_.clear();
    }
  }
  return std::nullopt;
}

std::optional<plist::Bytes> EncodeFrame(const plist::Dictionary& body) {
  plist::Bytes payload = plist::WriteBinary(plist::Value(body));
  if (payload.empty() || payload.size() > kMaxFramePayload) return std::nullopt;
  plist::Bytes frame;
  frame.reserve(kFrameHeaderSize + payload.size());
  const auto length = static_cast<uint32_t>(payload.size());
  frame.push_back(static_cast<uint8_t>(length >> 24));
  frame.push_back(static_cast<uint8_t>(length >> 16));
  frame.push_back(static_cast<uint8_t>(length >> 8));
  frame.push_back(static_cast<uint8_t>(length));
  frame.insert(frame.end(), payload.begin(), payload.end());
  return frame;
}

}  // namespace brisvale::ipc
