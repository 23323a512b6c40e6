#include "platform/linux/ipc_message.h"

#include <utility>

namespace brisvale::ipc {

std::optional<Message> MessageFromFrame(plist::Dictionary frame, std::string* error) {
  Message message;
  for (const char* key : {kMessageIdKey, kReplyToKey}) {
    const plist::Value* value = frame.find(key);
    if (!value) continue;
    std::optional<plist::Integer> token = value->integer();
    if (!token) {
      if (error) *error = std::string("\"") + key + "\" is not an integer";
      return std::nullopt;
    }
    message.replyToken = *token;
    message.isReply = key == kReplyToKey;
  }
  frame.erase(kMessageIdKey);
  frame.erase(kReplyToKey);
  message.body = std::move(frame);
  return message;
}

plist::Dictionary FrameFromMessage(const Message& message) {
  plist::Dictionary frame = message.body;
  frame.erase(kMessageIdKey);
  frame.erase(kReplyToKey);
  if (message.replyToken) {
    frame.set(message.isReply ? kReplyToKey : kMessageIdKey, plist::Value(*message.replyToken));
  }
  return frame;
}

}  // namespace brisvale::ipc
