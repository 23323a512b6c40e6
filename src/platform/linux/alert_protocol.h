// What the daemon and an alert agent say to each other on the agent socket. Each alert
// is one connection: the daemon connects and sends {"Type": "Show", ...}, later perhaps
// {"Type": "Cancel"}; the agent answers once with {"Type": "Response", "Flags": n}.
// Frames are those of the message transport (u32 big-endian length, then a binary
// property list with a dictionary root).
//
// AnswerReader takes the agent's bytes, which the daemon does not trust: it holds at
// most one small frame and decides after at most kMaxAnswerPayload bytes of payload.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "base/plist.h"
#include "platform/user_alert.h"

namespace brisvale::alert {

inline constexpr const char* kAlertAgentSocketPath = "/var/run/vexa/alert-agent";
// An answer is a handful of bytes; anything near this is not one.
inline constexpr size_t kMaxAnswerPayload = 1024;

// The frame that shows `description`, or cancels the alert.
plist::Bytes EncodeShowFrame(const Description& description, AlertLevel level,
                             std::optional<uint32_t> timeoutSeconds);
plist::Bytes EncodeCancelFrame();
// The agent's answer frame.
plist::Bytes EncodeResponseFrame(uint32_t flags);

struct Answer {
  enum class State { Incomplete, Answered, Malformed } state = State::Incomplete;
  uint32_t flags = 0;       // when Answered
  std::string problem;      // when Malformed: why, for the log
};

class AnswerReader {
 public:
  // Takes the next bytes. Once it has said Answered or Malformed it keeps saying so and
  // ignores everything after: an agent that answers twice is heard once.
  Answer Feed(std::span<const uint8_t> bytes);

 private:
  Answer Decide(Answer answer);
  std::vector<uint8_t> frame_;  // header and payload so far, never beyond one frame
  std::optional<Answer> decided_;
};

}  // namespace brisvale::alert
