// The transport keys of a frame: the routing information a client adds to its
// messages ("vexa.id") and the daemon adds to replies ("vexa.reply-to"). They are
// split from the body on receipt and added back on sending, so handlers never see them.
#pragma once

#include <optional>
#include <string>

#include "base/plist.h"
#include "platform/ipc_service.h"

namespace brisvale::ipc {

inline constexpr char kMessageIdKey[] = "vexa.id";
inline constexpr char kReplyToKey[] = "vexa.reply-to";

// The message a received frame carries; none (with the reason in `error`) when a
// transport key holds something other than an integer.
std::optional<Message> MessageFromFrame(plist::Dictionary frame, std::string* error);

// The frame body that carries `message`: a reply is addressed by "vexa.reply-to", any
// other message with a token carries it as its "vexa.id".
plist::Dictionary FrameFromMessage(const Message& message);

}  // namespace brisvale::ipc
