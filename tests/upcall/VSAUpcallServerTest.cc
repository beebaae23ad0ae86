// The upcall server over a whole daemon context: the containers a launching
// process gets, the reply items in order, and the return codes of bad,
// foreign and unknown requests.
#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "VSAContainerTestRoot.h"
#include "VSATestLog.h"
#include "daemon/VSAKernelUpcall.h"
#include "upcall/VSAPackBuffer.h"
#include "upcall/VSAUpcallPayload.h"
#include "upcall/VSAUpcallServer.h"

namespace fs = std::filesystem;

namespace {

class Upcall : public VSAContainerTestRoot {
 protected:
  void SetUp() override {
    VSAContainerTestRoot::SetUp();
    server_ = std::make_unique<VSAUpcallServer>(VSAKernelUpcall::environmentFor(*context_));
  }
  static VSAUpcallProcess app(const char* id) {
    VSAUpcallProcess p;
    p.codeSignatureID = id;
    p.uid = 501;
    p.personaID = 1000;  // the personal persona of the test root
    p.sandboxType = 0;
    return p;
  }
  static VSAUpcallRequest requestFor(const std::vector<uint8_t>& memory) {
    VSAUpcallRequest r;
    r.descriptorSize = r.requestSize = static_cast<uint32_t>(memory.size());
    return r;  // an all-zero audit token: pid 0, the kernel
  }
  // Serves `process`; the reply's return code, and its items in `answer`.
  int32_t serve(const VSAUpcallProcess& process, VSAUpcallAnswer* answer,
                std::vector<uint16_t>* order = nullptr) {
    auto memory = *process.pack();
    auto outcome = server_->demux_server(requestFor(memory), memory.data(), memory.size());
    EXPECT_EQ(outcome.reply.id, kVSAUpcallGetProcessContainersID + 100);
    if (outcome.reply.returnCode == 0) {
      *answer = VSAUpcallAnswer::read(outcome.buffer);
      if (order) *order = valueTypes(outcome.buffer);
    } else {
      EXPECT_TRUE(outcome.buffer.empty());
    }
    return outcome.reply.returnCode;
  }
  static std::vector<uint16_t> valueTypes(std::vector<uint8_t> bytes) {
    std::vector<uint16_t> types;
    sb_packbuff* b =
        sb_packbuff_init_with_buffer(bytes.data(), bytes.size(), true, SB_PACKBUFF_DEALLOC_NONE);
    uint16_t t = 0;
    while (sb_packbuff_get_item_value_type(b, &t) && sb_packbuff_skip_item(b) == 0)
      types.push_back(t);
    sb_packbuff_free(b);
    return types;
  }
  std::unique_ptr<VSAUpcallServer> server_;
};

TEST_F(Upcall, ALaunchGetsEveryContainerInOrderAndTheyExist) {
  auto p = app("com.example.app");
  p.groups = {"group.example.one", "group.example.two"};
  p.systemContainerID = "com.example.app.system";
  p.systemGroups = {"systemgroup.com.example.shared"};
  VSAUpcallAnswer a;
  std::vector<uint16_t> order;
  ASSERT_EQ(serve(p, &a, &order), 0);
  EXPECT_EQ(order, (std::vector<uint16_t>{100, 1, 2, 3, 4, 3, 4, 101, 102, 103, 0}));
  ASSERT_TRUE(a.success);
  EXPECT_EQ(*a.success, 1u);
  EXPECT_EQ(*a.home, user_->homeDirectoryURL());
  ASSERT_TRUE(a.dataContainer);
  EXPECT_EQ(fs::path(*a.dataContainer).parent_path(),
            fs::path(classDirectory(VSAClass::kDataApplication)));
  EXPECT_EQ(*a.temporaryDirectory, *a.dataContainer + "/tmp");
  ASSERT_EQ(a.groups.size(), 2u);
  EXPECT_EQ(a.groups[0].first, "group.example.one");
  EXPECT_EQ(a.groups[1].first, "group.example.two");
  for (const auto& [id, path] : a.groups) EXPECT_TRUE(fs::is_directory(path)) << id;
  EXPECT_TRUE(fs::is_directory(*a.systemContainer));
  ASSERT_EQ(a.systemGroups.size(), 1u);
  EXPECT_TRUE(fs::is_directory(a.systemGroups[0].second));
  // A second launch finds the same containers.
  VSAUpcallAnswer again;
  ASSERT_EQ(serve(p, &again), 0);
  EXPECT_EQ(again.dataContainer, a.dataContainer);
  EXPECT_EQ(again.groups, a.groups);
}

TEST_F(Upcall, ClassesHomeAndTheContainerIdentifier) {
  VSAUpcallAnswer a;
  std::vector<uint16_t> order;
  // Neither identifier: the home directory and the flag only.
  VSAUpcallProcess bare;
  bare.uid = 501;
  bare.personaID = 1000;
  ASSERT_EQ(serve(bare, &a, &order), 0);
  EXPECT_EQ(order, (std::vector<uint16_t>{100, 0}));
  EXPECT_EQ(*a.success, 1u);
  // uid 0 is answered with root's home.
  bare.uid = 0;
  ASSERT_EQ(serve(bare, &a), 0);
  EXPECT_EQ(*a.home, root_ + "/private/var/root");
  // A plug-in whose code signing says class 2 is served plug-in data (4).
  VSACommandQueue q;
  std::string plugin = "com.example.plugin";
  ASSERT_EQ(context_->codeSigningMapping->processCodeSigningInfo(
                VSAValue::Dictionary{{kVSAEntitlementsKey, VSAValue::dictionary()}}, &plugin,
                VSAValue::Dictionary{
                    {kVSAOptionDataContainerClass, VSAValue(VSAClass::kDataApplication)}},
                &q),
            1u);
  auto p = app("com.example.plugin");
  p.sandboxType = 1;
  ASSERT_EQ(serve(p, &a), 0);
  EXPECT_EQ(fs::path(*a.dataContainer).parent_path(),
            fs::path(classDirectory(VSAClass::kDataPlugin)));
  // The container identifier wins over the signing identifier.
  p = app("com.example.signer");
  p.containerID = "com.example.container";
  ASSERT_EQ(serve(p, &a), 0);
  auto named = installer()->createOrLookupContainerWithContainerIdentity(
      identity("com.example.container"), {}, nullptr);
  ASSERT_TRUE(named);
  EXPECT_EQ(*a.dataContainer, named->url());
}

TEST_F(Upcall, AContainerThatCannotBeMadeClearsTheFlagAndStopsPacking) {
  auto p = app("com.example.app");
  p.groups = {"group.example.fine", "../escape", "group.example.after"};
  VSAUpcallAnswer a;
  std::vector<uint16_t> order;
  ASSERT_EQ(serve(p, &a, &order), 0);
  EXPECT_EQ(*a.success, 0u);
  // Nothing is packed once the flag is down, but the flag itself.
  EXPECT_EQ(order, std::vector<uint16_t>{0});
  EXPECT_FALSE(fs::exists(classDirectory(VSAClass::kAppGroup) + "/../escape"));
}

TEST_F(Upcall, TheContainersAreLoggedAndAReplyWhoseCopyFailedCarriesNoMemory) {
  auto p = app("com.example.app");
  p.groups = {"group.example.one"};
  p.systemContainerID = "com.example.app.system";
  p.systemGroups = {"systemgroup.com.example.shared"};
  auto memory = *p.pack();
  VSATestLog log;
  ASSERT_TRUE(log.open(root_ + "/test.log"));
  auto served = server_->demux_server(requestFor(memory), memory.data(), memory.size());
  ASSERT_EQ(served.reply.returnCode, 0);
  EXPECT_TRUE(served.memory);
  EXPECT_GT(served.reply.replySize, 0u);
  auto a = VSAUpcallAnswer::read(served.buffer);
  ASSERT_TRUE(a.dataContainer && a.systemContainer);
  std::string text = log.text();
  for (const std::string& line :
       {std::string("UPCALL-Containers for com.example.app(501):"),
        "dataContainerURL: " + *a.dataContainer, "tempContainerURL: " + *a.temporaryDirectory,
        "homeDirURL: " + *a.home, std::string("groupURLs: "),
        "systemContainerURL: " + *a.systemContainer, std::string("systemGroupURLs: "),
        std::string("packbuff bytes: ")})
    EXPECT_NE(text.find(line), std::string::npos) << line;
  EXPECT_NE(text.find(a.groups[0].second, text.find("groupURLs: ")), std::string::npos);
  EXPECT_NE(text.find(a.systemGroups[0].second, text.find("systemGroupURLs: ")), std::string::npos);

  // The kernel's copy cannot be made: the reply says so with a size of 0.
  auto env = VSAKernelUpcall::environmentFor(*context_);
  env.copyReplyMemory = [](const std::vector<uint8_t>&) {
    errno = EMFILE;
    return VSAUniqueFd();
  };
  VSAUpcallServer failing(std::move(env));
  auto unsent = failing.demux_server(requestFor(memory), memory.data(), memory.size());
  EXPECT_EQ(unsent.reply.returnCode, 0);
  EXPECT_FALSE(unsent.memory);
  EXPECT_EQ(unsent.reply.replySize, 0u);
  auto bytes = unsent.reply.bytes();
  ASSERT_EQ(bytes.size(), 56u);
  auto sizeAt = [&](size_t offset) {
    uint32_t v;
    std::memcpy(&v, bytes.data() + offset, 4);
    return v;
  };
  EXPECT_EQ(sizeAt(40), 0u);  // the descriptor's size
  EXPECT_EQ(sizeAt(52), 0u);  // the reply size
  EXPECT_TRUE(log.contains("fails: " + std::to_string(EMFILE))) << log.text();
  EXPECT_TRUE(log.contains("vm_read("));
}

TEST_F(Upcall, BadForeignAndUnknownRequestsGetTheirReturnCodes) {
  auto memory = *app("com.example.app").pack();
  auto serveRequest = [&](VSAUpcallRequest r, const std::vector<uint8_t>& m, size_t size) {
    return server_->demux_server(r, m.data(), size).reply;
  };
  VSAUpcallRequest good = requestFor(memory);
  EXPECT_EQ(serveRequest(good, memory, memory.size()).returnCode, 0);
  struct Case {
    const char* what;
    std::function<void(VSAUpcallRequest&)> change;
    int32_t expected;
  } cases[] = {
      {"the other id of the pair", [](auto& r) { r.id = 322514901; }, -303},
      {"an unknown id", [](auto& r) { r.id = 7; }, -303},
      {"not complex", [](auto& r) { r.bits = 0; }, -300},
      {"two descriptors", [](auto& r) { r.descriptorCount = 2; }, -300},
      {"not out-of-line memory", [](auto& r) { r.descriptorType = 2; }, -300},
      {"sizes disagree", [](auto& r) { r.requestSize += 8; }, -300},
      {"a short message", [](auto& r) { r.messageLength = 52; }, -300},
      {"a trailer of another type", [](auto& r) { r.trailerType = 1; }, -309},
      {"a short trailer", [](auto& r) { r.trailerSize = 16; }, -309},
      {"a sender that is not the kernel", [](auto& r) { r.auditToken[20] = 42; }, 5},
  };
  for (const auto& k : cases) {
    VSAUpcallRequest r = good;
    k.change(r);
    auto reply = serveRequest(r, memory, memory.size());
    EXPECT_EQ(reply.returnCode, k.expected) << k.what;
    EXPECT_EQ(reply.bytes().size(), 36u) << k.what;
  }
  // The memory itself disagrees with the descriptor.
  EXPECT_EQ(serveRequest(good, memory, memory.size() - 8).returnCode, -300);
  // An item of an unknown kind, a persona nobody has, an unreadable item.
  sb_packbuff* b = sb_packbuff_new(0);
  sb_packbuff_pack_uint32(b, 9, 1);
  std::vector<uint8_t> nine(
      static_cast<uint8_t*>(sb_packbuff_get_bytes(b)),
      static_cast<uint8_t*>(sb_packbuff_get_bytes(b)) + sb_packbuff_get_size(b));
  sb_packbuff_free(b);
  EXPECT_EQ(serveRequest(requestFor(nine), nine, nine.size()).returnCode, 4);
  auto stranger = app("com.example.app");
  stranger.personaID = 4242;
  auto strangerMemory = *stranger.pack();
  EXPECT_EQ(
      serveRequest(requestFor(strangerMemory), strangerMemory, strangerMemory.size()).returnCode,
      4);
  std::vector<uint8_t> inlineForString = nine;
  inlineForString[2] = 0;  // value type 0 (a string) carried by an inline item
  EXPECT_EQ(
      serveRequest(requestFor(inlineForString), inlineForString, inlineForString.size()).returnCode,
      5);
}

}  // namespace
