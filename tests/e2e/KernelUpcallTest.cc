// End to end: the kernel's side of the upcall asks the real daemon over its
// seqpacket socket which containers a launching app gets.
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <thread>

#include "e2e/VSATestDaemon.h"
#include "platform/VSADescriptorPassing.h"
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

VSAUpcallRequest requestFor(const std::vector<uint8_t>& memory) {
  VSAUpcallRequest request;
  request.replyPort = 77;
  request.descriptorSize = request.requestSize = static_cast<uint32_t>(memory.size());
  return request;
}

int connectSeqpacket(const std::string& path) {
  int fd = ::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, path.c_str(), sizeof addr.sun_path - 1);
  if (::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
    ::close(fd);
    return -1;
  }
  return fd;
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

// Only the bridge is the kernel: anyone else is answered once, with 5, and
// let go; and the bridge itself names at most so many groups in one launch.
TEST(KernelUpcall, OthersAreLetGoAfterOneRefusalAndGroupsAreBounded) {
  VSATestDaemon d;
  d.registerSelf("com.example.app", VSAValue::dictionary());
  d.registerUpcallTool();
  ASSERT_TRUE(d.start());
  auto memory = *launch("com.example.other").pack();
  auto request = requestFor(memory);
  VSAUpcallClient client;
  std::string why;
  ASSERT_TRUE(client.connect(d.upcallSocketPath(), &why)) << why;
  std::vector<uint8_t> reply;
  std::optional<std::vector<uint8_t>> replyMemory;
  ASSERT_TRUE(client.call(request.bytes(), &memory, &reply, &replyMemory, &why, 5000)) << why;
  auto refused = VSAUpcallReply::parse(reply.data(), reply.size());
  ASSERT_TRUE(refused);
  EXPECT_EQ(refused->returnCode, 5);
  EXPECT_FALSE(client.call(request.bytes(), &memory, &reply, &replyMemory, &why, 5000))
      << "a second request on the same connection was answered";

  // 129 groups through the bridge tool: refused with 4, and no group made.
  std::vector<std::string> args = {"--signing-id", "com.example.app", "--uid",
                                   "501",          "--persona",       "1000"};
  for (int i = 0; i <= 128; ++i) {
    args.push_back("--group");
    args.push_back("group.example.n" + std::to_string(i));
  }
  auto run = d.vessactl("vessa-upcall", args);
  EXPECT_NE(run.status, 0) << run.output;
  EXPECT_NE(d.daemonOutput().find("Too many items of type VS_KERN_REQUEST_APP_GROUP_ID"),
            std::string::npos);
  std::string groups = d.path("/private/var/mobile/Containers/Shared/AppGroup");
  size_t made = fs::exists(groups) ? std::distance(fs::directory_iterator(groups), {}) : 0;
  EXPECT_EQ(made, 0u);
  args.resize(args.size() - 2);  // 128 are fine
  EXPECT_EQ(d.vessactl("vessa-upcall", args).status, 0);
  EXPECT_EQ(d.stop(), 0);
}

// A bridge that sends many launches before it reads any answer gets every
// answer, in order: replies wait for room in its socket instead of being lost.
TEST(KernelUpcall, ABridgeThatReadsLateStillGetsEveryReply) {
  VSATestDaemon d;
  d.registerSelfAsKernelBridge();
  ASSERT_TRUE(d.start());
  VSAUpcallProcess home;  // no container asked for: the home directory only
  home.uid = 501;
  home.personaID = 1000;
  auto memory = *home.pack();
  int memfd = VSAMemfdWithBytes("request", memory, true);
  ASSERT_GE(memfd, 0);
  int fd = connectSeqpacket(d.upcallSocketPath());
  ASSERT_GE(fd, 0);
  constexpr int kRequests = 600;
  std::thread sender([&] {
    for (int i = 0; i < kRequests; ++i) {
      auto request = requestFor(memory);
      request.replyPort = static_cast<uint32_t>(i);
      if (VSASendWithDescriptor(fd, request.bytes(), memfd, 0) < 0) return;
    }
  });
  std::this_thread::sleep_for(std::chrono::seconds(1));  // nothing read meanwhile
  int received = 0;
  bool inOrder = true;
  for (; received < kRequests; ++received) {
    pollfd p{fd, POLLIN, 0};
    if (::poll(&p, 1, 5000) <= 0) break;
    uint8_t buffer[256];
    alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof(int) * 4)] = {};
    struct iovec iov = {buffer, sizeof buffer};
    struct msghdr msg = {};
    msg.msg_iov = &iov;
    msg.msg_iovlen = 1;
    msg.msg_control = control;
    msg.msg_controllen = sizeof control;
    ssize_t n = ::recvmsg(fd, &msg, MSG_CMSG_CLOEXEC);
    if (n <= 0) break;
    for (int passed : VSAReceivedDescriptors(msg)) ::close(passed);
    auto reply = VSAUpcallReply::parse(buffer, static_cast<size_t>(n));
    inOrder = inOrder && reply && reply->remotePort == static_cast<uint32_t>(received) &&
              reply->returnCode == 0;
  }
  ::shutdown(fd, SHUT_RDWR);
  sender.join();
  ::close(fd);
  ::close(memfd);
  EXPECT_EQ(received, kRequests);
  EXPECT_TRUE(inOrder);
  EXPECT_EQ(d.daemonOutput().find("Could not send an upcall reply"), std::string::npos);
  EXPECT_EQ(d.stop(), 0);
}

// A daemon started in a pid namespace of its own sees every peer from
// outside it with pid 0, the kernel's: such a peer must not be served as the
// kernel (nor at all), although nothing registered it as the bridge.
TEST(KernelUpcall, APeerSeenWithPidZeroIsNotTheKernel) {
  if (::access("/usr/bin/unshare", X_OK) != 0) GTEST_SKIP() << "no unshare(1)";
  VSATestDaemon d;
  d.setLaunchPrefix({"/usr/bin/unshare", "--pid", "--fork", "--kill-child=SIGTERM"});
  ASSERT_TRUE(d.start());
  auto memory = *launch("com.example.app").pack();
  auto request = requestFor(memory);
  VSAUpcallClient client;
  std::string why;
  ASSERT_TRUE(client.connect(d.upcallSocketPath(), &why)) << why;
  std::vector<uint8_t> reply;
  std::optional<std::vector<uint8_t>> replyMemory;
  bool answered = client.call(request.bytes(), &memory, &reply, &replyMemory, &why, 5000);
  auto parsed = answered ? VSAUpcallReply::parse(reply.data(), reply.size()) : std::nullopt;
  EXPECT_FALSE(parsed && parsed->returnCode == 0) << "served as the kernel";
  EXPECT_FALSE(fs::exists(d.path("/private/var/mobile/Containers/Data/Application")) &&
               !fs::is_empty(d.path("/private/var/mobile/Containers/Data/Application")));
  // unshare ends at once and hands its child SIGTERM: wait for that stop to
  // finish (its last step removes the pid file) before the root goes.
  d.crash();
  for (int i = 0; i < 1000 && fs::exists(d.path("/run/vessad/vessad.pid")); ++i)
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  EXPECT_FALSE(fs::exists(d.path("/run/vessad/vessad.pid")));
}

}  // namespace
