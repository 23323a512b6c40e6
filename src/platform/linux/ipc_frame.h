// The wire format of the message transport: each frame is a u32 big-endian payload
// length followed by that many bytes of a binary property list whose root is a
// dictionary. FrameReader turns a byte stream from an untrusted peer into frames; it
// never sizes a buffer from a length it has read, only from bytes that have arrived.
// Nothing here touches a socket, so arbitrary bytes can be fed to it.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "base/plist.h"

namespace brisvale::ipc {

inline constexpr size_t kFrameHeaderSize = 4;
inline constexpr size_t kMaxFramePayload = size_t{4} << 20;  // 4 MiB

enum class FrameError {
  ZeroLength,     // a header announcing an empty payload
  TooLong,        // a header announcing more than kMaxFramePayload bytes
  Undecodable,    // the payload is not a binary property list
  NotDictionary,  // the payload decodes, but its root is not a dictionary
};

// A short human-readable reason, for log lines.
const char* FrameErrorText(FrameError error);

class FrameReader {
 public:
  struct Failure {
    FrameError error;
    std::string detail;  // the decoder's message, when there is one
  };

  // Takes the next bytes of the stream. Complete frames are appended to `frames` in
  // order; the first malformed frame ends the stream: the failure is returned (frames
  // before it are still appended) and every later call returns it again.
  std::optional<Failure> Feed(std::span<const uint8_t> bytes, std::vector<plist::Dictionary>& frames);

  // True while part of a frame has arrived and the rest has not.
  bool HasPartialFrame() const { return !buffer_.empty(); }
  // The bytes held for the incomplete frame.
  size_t BufferedBytes() const { return buffer_.capacity(); }
  bool Failed() const { return failure_.has_value(); }

 private:
  std::optional<Failure> Fail(FrameError error, std::string detail = {});

  // The incomplete frame so far (header included), grown only as its bytes arrive.
  std::vector<uint8_t> buffer_;
  std::optional<Failure> failure_;
};

// The frame carrying `body`; none when its payload would exceed kMaxFramePayload.
std::optional<plist::Bytes> EncodeFrame(const plist::Dictionary& body);

}  // namespace brisvale::ipc
