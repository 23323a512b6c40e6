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
  };
  const Case cases[] = {
      {"request with id", {{"vexa.id", Int(7)}, {"A", "b"}}, 7, false},
      {"request without id", {{"A", "b"}}, std::nullopt, false},
      {"reply", {{"vexa.reply-to", Int(9)}, {"A", "b"}}, 9, true},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    std::optional<Message> message = MessageFromFrame(c.frame, nullptr);
    ASSERT_TRUE(message);
    EXPECT_EQ(message->body, (plist::Dictionary{{"A", "b"}}));
    EXPECT_EQ(message->isReply, c.isReply);
    EXPECT_EQ(message->replyToken ? std::optional(message->replyToken->value) : std::nullopt, c.token);
  }
  std::string error;
  EXPECT_FALSE(MessageFromFrame({{"vexa.reply-to", "9"}, {"A", "b"}}, &error));
  EXPECT_EQ(error, "\"vexa.reply-to\" is not an integer");
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
