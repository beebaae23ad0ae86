#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <memory>
#include <vector>

#include "VSATestReplies.h"
#include "base/VSACommands.h"
#include "platform/VSAFrameCodec.h"
#include "platform/VSAIPCMessage.h"

namespace {

class ReplyContext : public ::testing::Test {
 protected:
  void SetUp() override {
    int fds[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
    peer_ = fds[1];
    connection_ = std::make_shared<VSAIPCConnection>(fds[0], 1, *VSAAuditToken::fromSocket(fds[0]));
  }
  void TearDown() override { ::close(peer_); }

  // A request as the listener delivers it: holding a transaction and counted
  // as in flight on its connection until it is finished.
  VSAIPCMessageRef receive(const VSAValue& body) {
    connection_->requestBegan();
    std::shared_ptr<void> inFlight(nullptr, [c = connection_](void*) { c->requestEnded(); });
    return std::make_shared<VSAIPCMessage>(connection_, body, "", transactions_->open(),
                                           std::move(inFlight));
  }
  std::vector<VSAValue> replies() { return VSADrainReplies(peer_); }

  int peer_ = -1;
  VSAIPCConnectionRef connection_;
  std::shared_ptr<VSATransactions> transactions_ = std::make_shared<VSATransactions>();
};

TEST_F(ReplyContext, KeepsWhatALateReplyNeedsAndReleasesTheRequest) {
  VSAValue body = VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kSetDataProtection)},
                                       {"MessageID", VSAValue(9u)},
                                       {"Padding", VSAValue(std::vector<uint8_t>(1 << 20, 0x5a))}};
  auto message = receive(body);
  std::weak_ptr<VSAIPCMessage> released = message;
  VSAIPCReplyContextRef context = message->replyContext();
  ASSERT_TRUE(context);
  message.reset();
  // The request (and its megabyte) is gone; the request is still being served.
  EXPECT_TRUE(released.expired());
  EXPECT_EQ(transactions_->openCount(), 1);
  EXPECT_EQ(connection_->requestsInFlight(), 1u);
  EXPECT_FALSE(context->replied());

  VSAValue reply = context->createReply();
  reply.set("ReplyError", VSAValue(1u));
  ASSERT_TRUE(context->sendReply(reply));
  EXPECT_TRUE(context->replied());
  EXPECT_EQ(transactions_->openCount(), 0);
  EXPECT_EQ(connection_->requestsInFlight(), 0u);
  EXPECT_FALSE(context->sendReply(reply));  // once only
  auto got = replies();
  ASSERT_EQ(got.size(), 1u);
  EXPECT_EQ(got[0].get("MessageID")->uint64Value(), 9u);
  EXPECT_EQ(got[0].get("ReplyError")->uint64Value(), 1u);
  EXPECT_FALSE(got[0].get("Padding"));
}

TEST_F(ReplyContext, TheMessageAndItsContextAnswerOnceBetweenThem) {
  auto message = receive(VSAValue::Dictionary{{"MessageID", VSAValue("abc")}});
  auto context = message->replyContext();
  ASSERT_TRUE(message->sendReply(*message->createReply()));
  EXPECT_TRUE(context->replied());
  EXPECT_FALSE(context->sendReply(context->createReply()));
  auto got = replies();
  ASSERT_EQ(got.size(), 1u);
  EXPECT_EQ(*got[0].get("MessageID")->stringValue(), "abc");

  // A dropped, unanswered request is finished when its context goes too.
  auto dropped = receive(VSAValue::Dictionary{{"MessageID", VSAValue(2u)}});
  auto kept = dropped->replyContext();
  dropped.reset();
  EXPECT_EQ(connection_->requestsInFlight(), 1u);
  kept.reset();
  EXPECT_EQ(connection_->requestsInFlight(), 0u);
  EXPECT_EQ(transactions_->openCount(), 0);

  // A body that is not a dictionary has no reply context.
  auto garbage = std::make_shared<VSAIPCMessage>(connection_, VSAValue(1u), "", nullptr);
  EXPECT_FALSE(garbage->replyContext());
  EXPECT_FALSE(garbage->sendReply(VSAValue::dictionary()));
}

}  // namespace
