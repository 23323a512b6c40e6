#include "platform/linux/alert_protocol.h"

#include <algorithm>

namespace brisvale::alert {
namespace {

constexpr size_t kHeaderSize = 4;

plist::Bytes Frame(const plist::Dictionary& body) {
  plist::Bytes payload = plist::WriteBinary(plist::Value(body));
  uint32_t length = static_cast<uint32_t>(payload.size());
  plist::Bytes frame{static_cast<uint8_t>(length >> 24), static_cast<uint8_t>(length >> 16),
                     static_cast<uint8_t>(length >> 8), static_cast<uint8_t>(length)};
  frame.resize(kHeaderSize + payload.size());
  std::copy(payload.begin(), payload.end(), frame.begin() + kHeaderSize);
  return frame;
}

}  // namespace

plist::Bytes EncodeShowFrame(const Description& description, AlertLevel level,
                             std::optional<uint32_t> timeoutSeconds) {
  plist::Dictionary body{{"Type", plist::Value("Show")},
                         {"TopMost", plist::Value::Bool(description.topMost)},
                         {"Level", plist::Value::Int(static_cast<int>(level))},
                         {"Timeout", plist::Value::Int(timeoutSeconds.value_or(0))}};
  if (description.title) body.set("Title", plist::Value(*description.title));
  if (description.message) body.set("Message", plist::Value(*description.message));
  if (description.defaultButtonTitle) {
    body.set("DefaultButtonTitle", plist::Value(*description.defaultButtonTitle));
  }
  return Frame(body);
}

plist::Bytes EncodeCancelFrame() { return Frame({{"Type", plist::Value("Cancel")}}); }

plist::Bytes EncodeResponseFrame(uint32_t flags) {
  return Frame({{"Type", plist::Value("Response")}, {"Flags", plist::Value::Int(flags)}});
}

Answer AnswerReader::Decide(Answer answer) {
  decided_ = answer;
  frame_.clear();
  frame_.shrink_to_fit();
  return answer;
}

Answer AnswerReader::Feed(std::span<const uint8_t> bytes) {
  if (decided_) return *decided_;
  auto malformed = [this](std::string problem) {
    return Decide(Answer{Answer::State::Malformed, 0, std::move(problem)});
  };
  // Take only what the current frame still needs: the header, then the payload it
  // announces once that announcement has been checked.
  uint32_t length = 0;
  for (;;) {
    if (frame_.size() >= kHeaderSize) {
      length = uint32_t{frame_[0]} << 24 | uint32_t{frame_[1]} << 16 |
               uint32_t{frame_[2]} << 8 | uint32_t{frame_[3]};
      if (length == 0 || length > kMaxAnswerPayload) {
        return malformed("frame length " + std::to_string(length));
      }
    }
    size_t wanted = frame_.size() >= kHeaderSize ? kHeaderSize + length : kHeaderSize;
    if (frame_.size() == wanted && length != 0) break;
    if (bytes.empty()) return {};
    size_t take = std::min(wanted - frame_.size(), bytes.size());
    frame_.insert(frame_.end(), bytes.begin(), bytes.begin() + take);
    bytes = bytes.subspan(take);
  }

  std::string error;
  std::optional<plist::Value> body =
      plist::ReadBinary(std::span(frame_).subspan(kHeaderSize), &error);
  if (!body) return malformed("undecodable: " + error);
  const std::string* type = body->getString("Type");
  if (!body->dictionary() || !type || *type != "Response") return malformed("not a response");
  const plist::Value* flagsValue = body->get("Flags");
  std::optional<plist::Integer> flags = flagsValue ? flagsValue->integer() : std::nullopt;
  if (!flags || flags->value < 0 || flags->value > UINT32_MAX) {
    return malformed("no response flags");
  }
  return Decide(Answer{Answer::State::Answered, static_cast<uint32_t>(flags->value), {}});
}

}  // namespace brisvale::alert
