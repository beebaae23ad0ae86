#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <climits>
#include <filesystem>
#include <fstream>

#include "VSATestReplies.h"
#include "base/VSACommands.h"
#include "base/VSAPlist.h"
#include "daemon/VSAClientConnection.h"
#include "daemon/VSAEntitlements.h"
#include "daemon/VSARelayDispatcher.h"
#include "platform/VSAFrameCodec.h"

namespace {

using namespace std::chrono_literals;

class FailingCommand : public VSACommand {
 public:
  VSACommandNumber command() const override { return VSACommands::kStageForDelete; }
  bool fromQueue(VSACommandQueue&, VSAResultCode* error) override {
    *error = 41;
    return false;
  }
};

void succeed(const VSAValue&, VSAValue& reply, VSAClientConnection&, VSAResultCode*) {
  reply.set("ReplyPath", VSAValue("/x"));
}
void fail(const VSAValue&, VSAValue&, VSAClientConnection&, VSAResultCode* result) { *result = 21; }
void queueFailure(const VSAValue&, VSAValue&, VSAClientConnection& c, VSAResultCode*) {
  c.commandQueue()->insertCommand(std::make_shared<FailingCommand>());
}
// Replies itself, as emptying death row and changing data protection do on success.
void replyLater(const VSAValue&, VSAValue&, VSAClientConnection& c, VSAResultCode*) {
  VSAValue reply = *c.relayMessage()->createReply();
  reply.set("ReplyError", VSAValue(1u));
  reply.set("Late", VSAValue(true));
  c.relayMessage()->sendReply(reply);
}

const char* kAllowed = kVSAEntitlementAllowed;

// A table whose entries all succeed, but for a few arbitrary slots (1 fails,
// 2 is misnumbered, 3 queues a failing command, 5 has no handler) and the two
// commands the dispatcher leaves to their handlers to answer.
std::array<VSACommandTableEntry, kVSACommandCount> testTable() {
  std::array<VSACommandTableEntry, kVSACommandCount> t{};
  for (VSACommandNumber i = 0; i < kVSACommandCount; ++i)
    t[i] = {i, succeed, kAllowed, true, false, false};
  t[1].handler = fail;
  t[2].command = 7;
  t[3].handler = queueFailure;
  t[5].handler = nullptr;
  t[VSACommands::kDeleteDeathRow] = {
      VSACommands::kDeleteDeathRow, replyLater, kAllowed, false, false, false};
  t[VSACommands::kSetDataProtection] = {
      VSACommands::kSetDataProtection, fail, kAllowed, false, false, false};
  return t;
}

class VSARelayDispatcherTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char tmpl[] = "/tmp/vessa-dispatch-XXXXXX";
    root_ = mkdtemp(tmpl);
    std::filesystem::create_directories(root_ + "/etc/vessad/clients.d");
    std::filesystem::create_directories(root_ + "/usr/bin");
    std::ofstream(root_ + "/etc/passwd") << "mobile:x:501:501::/private/var/mobile:/bin/sh\n";
    char buf[PATH_MAX];
    ssize_t n = readlink("/proc/self/exe", buf, sizeof buf - 1);
    std::filesystem::create_symlink(std::string(buf, n), root_ + "/usr/bin/tester");
    VSAErrorRef error;
    ASSERT_TRUE(VSA_writeToURL(
        VSAValue::Dictionary{{"Executable", VSAValue("/usr/bin/tester")},
                             {"SigningIdentifier", VSAValue("com.example.tester")},
                             {"Entitlements", VSAValue::Dictionary{{kAllowed, VSAValue(true)}}}},
        root_ + "/etc/vessad/clients.d/tester.plist", 0, &error));
    context_ = std::make_unique<VSADaemonContext>(VSASystemRoot(root_));
    int fds[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
    peer_ = fds[1];
    connection_ = std::make_shared<VSAIPCConnection>(fds[0], 1, *VSAAuditToken::fromSocket(fds[0]),
                                                     context_->clientRegistry.get());
  }
  void TearDown() override {
    ::close(peer_);
    std::filesystem::remove_all(root_);
  }

  // Dispatches one request and returns the replies that reached the peer.
  std::vector<VSAValue> dispatch(const VSAValue& body) {
    auto message =
        std::make_shared<VSAIPCMessage>(connection_, body, "", context_->transactions->open());
    dispatcher_->processRelayEvent(message);
    message.reset();
    return VSADrainReplies(peer_);
  }

  std::string root_;
  std::unique_ptr<VSADaemonContext> context_;
  std::unique_ptr<VSARelayDispatcher> dispatcher_;
  VSAIPCConnectionRef connection_;
  int peer_ = -1;
  std::array<VSACommandTableEntry, kVSACommandCount> table_ = testTable();
};

VSAValue request(VSACommandNumber command) {
  return VSAValue::Dictionary{{"Command", VSAValue(command)}, {"MessageID", VSAValue(77u)}};
}

TEST_F(VSARelayDispatcherTest, TableChecksAnswer49) {
  dispatcher_ = std::make_unique<VSARelayDispatcher>(*context_, table_.data(), table_.size());
  for (VSAValue body : {request(2), request(5), request(33), request(UINT64_MAX),
                        VSAValue(VSAValue::Dictionary{{"Command", VSAValue(int64_t(-1))}}),
                        VSAValue(VSAValue::Dictionary{{"Command", VSAValue("0")}}),
                        VSAValue(VSAValue::Dictionary{{"NoCommand", VSAValue(1)}})}) {
    auto replies = dispatch(body);
    ASSERT_EQ(replies.size(), 1u) << body.description();
    EXPECT_EQ(replies[0].get("ReplyError")->uint64Value(), 49u);
  }
}

TEST_F(VSARelayDispatcherTest, ReplyCarriesHandlerKeysCodeAndMessageID) {
  dispatcher_ = std::make_unique<VSARelayDispatcher>(*context_, table_.data(), table_.size());
  auto ok = dispatch(request(0));
  ASSERT_EQ(ok.size(), 1u);
  EXPECT_EQ(ok[0].get("ReplyError")->uint64Value(), 1u);
  EXPECT_EQ(*ok[0].get("ReplyPath")->stringValue(), "/x");
  EXPECT_EQ(ok[0].get("MessageID")->uint64Value(), 77u);
  auto failed = dispatch(request(1));
  ASSERT_EQ(failed.size(), 1u);
  EXPECT_EQ(failed[0].get("ReplyError")->uint64Value(), 21u);
}

TEST_F(VSARelayDispatcherTest, AFailingQueuedCommandBecomesTheResult) {
  dispatcher_ = std::make_unique<VSARelayDispatcher>(*context_, table_.data(), table_.size());
  auto replies = dispatch(request(3));
  ASSERT_EQ(replies.size(), 1u);
  EXPECT_EQ(replies[0].get("ReplyError")->uint64Value(), 41u);
}

TEST_F(VSARelayDispatcherTest, SelfReplyingCommandsReplyExactlyOnce) {
  dispatcher_ = std::make_unique<VSARelayDispatcher>(*context_, table_.data(), table_.size());
  auto late = dispatch(request(VSACommands::kDeleteDeathRow));
  ASSERT_EQ(late.size(), 1u);
  EXPECT_TRUE(late[0].get("Late"));
  auto failed = dispatch(request(VSACommands::kSetDataProtection));
  ASSERT_EQ(failed.size(), 1u);
  EXPECT_EQ(failed[0].get("ReplyError")->uint64Value(), 21u);
  EXPECT_TRUE(context_->transactions->waitUntilIdle(1s));
}

TEST_F(VSARelayDispatcherTest, RealTableRetiredCommandAndMissingHandlers) {
  dispatcher_ = std::make_unique<VSARelayDispatcher>(*context_);
  auto retired = dispatch(request(VSACommands::kRetired));
  ASSERT_EQ(retired.size(), 1u);
  EXPECT_EQ(retired[0].get("ReplyError")->uint64Value(), 49u);
  auto high = dispatch(request(33));  // past the last command
  ASSERT_EQ(high.size(), 1u);
  EXPECT_EQ(high[0].get("ReplyError")->uint64Value(), 49u);
}

TEST_F(VSARelayDispatcherTest, MessageWithoutReplyContextCancelsTheConnection) {
  dispatcher_ = std::make_unique<VSARelayDispatcher>(*context_);
  auto message = std::make_shared<VSAIPCMessage>(connection_, std::nullopt, "garbage",
                                                 context_->transactions->open());
  dispatcher_->processRelayEvent(message);
  EXPECT_TRUE(connection_->isCancelled());
  uint8_t b;
  EXPECT_EQ(recv(peer_, &b, 1, 0), 0) << "peer sees the connection closed, no reply";
}

}  // namespace
