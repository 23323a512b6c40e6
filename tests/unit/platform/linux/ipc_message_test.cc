// Transport keys kept apart from the dictionary a handler sees.
#include "platform/linux/ipc_message.h"

#include <gtest/gtest.h>

namespace brisvale::ipc {
namespace {

plist::Value Int(int64_t value) { return plist::Value::Int(value); }

TEST(TransportKeysTest, AreSplitFromTheBody) {
  struct Case {
    const char* name;
    plist::Dictionary frame;
    std::optional<int64_t> token;
    bool isReply;
    bool valid;
  };
  const Case cases[] = {
      {"request with id", {{"vexa.id", Int(7)}, {"A", "b"}}, 7, false, true},
      {"request without id", {{"A", "b"}}, std::nullopt, false, true},
      {"reply", {{"vexa.reply-to", Int(9)}, {"A", "b"}}, 9, true, true},
      {"id that is text", {{"vexa.id", "7"}, {"A", "b"}}, std::nullopt, false, false},
      {"reply-to that is data", {{"vexa.reply-to", plist::Value(plist::Bytes{1})}}, std::nullopt, false, false},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    std::string error;
    std::optional<Message> message = MessageFromFrame(c.frame, &error);
    ASSERT_EQ(message.has_value(), c.valid);
    if (!c.valid) {
      EXPECT_FALSE(error.empty());
      continue;
    }
    EXPECT_EQ(message->body, (plist::Dictionary{{"A", "b"}}));
    EXPECT_EQ(message->isReply, c.isReply);
    ASSERT_EQ(message->replyToken.has_value(), c.token.has_value());
    if (c.token) {
      EXPECT_EQ(message->replyToken->value, *c.token);
    }
  }
}

TEST(TransportKeysTest, ReplyIsAddressedToTheRequestAndHandlerKeysCannotForgeIt) {
  Message request = *MessageFromFrame({{"vexa.id", Int(42)}, {"Q", "x"}}, nullptr);
  Message reply = *CreateReply(request);
  reply.body.set("Status", "Success");
  reply.body.set("vexa.id", Int(1));  // a handler cannot smuggle routing keys through
  EXPECT_EQ(FrameFromMessage(reply), (plist::Dictionary{{"Status", "Success"}, {"vexa.reply-to", Int(42)}}));

  Message anonymous = *MessageFromFrame({{"Q", "x"}}, nullptr);
  EXPECT_EQ(FrameFromMessage(*CreateReply(anonymous)), plist::Dictionary{});
}

}  // namespace
}  // namespace brisvale::ipc
