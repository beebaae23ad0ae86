// End to end: the kernel's side of the upcall asks the real daemon over its
// seqpacket socket which containers a launching app gets.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>

#include "e2e/VSATestDaemon.h"
#include "platform/VSAUpcallClient.h"
#include "upcall/VSAUpcallMessage.h"
#include "upcall/VSAUpcallPayload.h"

namespace fs = std::filesystem;

namespace {

VSAUpcallProcess launch(const char* id) {
  VSAUpcallProcess p;
  p.codeSignatureID = id;
  p.uid = 501;
  p.personaID = 1000;
  p.sandboxType = 0;
  p.groups = {"group.example.shared"};
  return p;
}

// One upcall from this process: the reply and its buffer, if any.
std::optional<VSAUpcallReply> call(VSATestDaemon& d, const std::vector<uint8_t>& message,
                                   const std::vector<uint8_t>* memory,
                                   std::optional<std::vector<uint8_t>>* replyMemory) {
  VSAUpcallClient client;
  std::string why;
  std::vector<uint8_t> reply;
  if (!client.connect(d.upcallSocketPath(), &why) ||
      !client.call(message, memory, &reply, replyMemory, &why)) {
    ADD_FAILURE() << why;
    return std::nullopt;
  }
  return VSAUpcallReply::parse(reply.data(), reply.size());
}

TEST(KernelUpcall, TheKernelBridgeGetsTheAppsContainersAndOthersGetFive) {
  VSATestDaemon d;
  d.registerSelfAsKernelBridge();
  d.registerUpcallTool();
  ASSERT_TRUE(d.start());
  struct stat st;
  ASSERT_EQ(::stat(d.upcallSocketPath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);

  auto memory = *launch("com.example.app").pack();
  VSAUpcallRequest request;
  request.replyPort = 77;
  request.descriptorSize = request.requestSize = static_cast<uint32_t>(memory.size());
  std::optional<std::vector<uint8_t>> replyMemory;
  auto reply = call(d, request.bytes(), &memory, &replyMemory);
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->returnCode, 0);
  EXPECT_EQ(reply->id, kVSAUpcallGetProcessContainersID + 100);
  EXPECT_EQ(reply->remotePort, 77u);
  ASSERT_TRUE(replyMemory);
  EXPECT_EQ(reply->replySize, replyMemory->size());
  auto answer = VSAUpcallAnswer::read(*replyMemory);
  EXPECT_FALSE(answer.malformed);
  EXPECT_EQ(answer.success, 1u);
  ASSERT_TRUE(answer.dataContainer);
  EXPECT_TRUE(fs::is_directory(*answer.dataContainer));
  ASSERT_EQ(answer.groups.size(), 1u);
  EXPECT_TRUE(fs::is_directory(answer.groups[0].second));

  // Malformed on the wire: no memfd, a size that disagrees, a longer packet.
  EXPECT_EQ(call(d, request.bytes(), nullptr, &replyMemory)->returnCode, -300);
  std::vector<uint8_t> shorter(memory.begin(), memory.end() - 8);
  EXPECT_EQ(call(d, request.bytes(), &shorter, &replyMemory)->returnCode, -300);
  auto longer = request.bytes();
  longer.resize(64);
  EXPECT_EQ(call(d, longer, &memory, &replyMemory)->returnCode, -300);
  EXPECT_FALSE(replyMemory);

  // The tool, registered as the bridge, prints the same data container.
  auto run = d.vessactl("vessa-upcall", {"--signing-id", "com.example.app", "--uid", "501",
                                         "--persona", "1000", "--group", "group.example.shared"});
  EXPECT_EQ(run.status, 0) << run.output;
  EXPECT_NE(run.output.find(*answer.dataContainer), std::string::npos) << run.output;

  // A peer that is not the kernel bridge is answered with 5.
  d.registerSelf("com.example.app", VSAValue::dictionary());
  auto other = *launch("com.example.other").pack();
  request.descriptorSize = request.requestSize = static_cast<uint32_t>(other.size());
  EXPECT_EQ(call(d, request.bytes(), &other, &replyMemory)->returnCode, 5);
  EXPECT_EQ(d.stop(), 0);
}

}  // namespace
