// A whole daemon context on a temporary system root, for tests of the
// container operations: a "mobile" user and a "systemusers" group, the
// real file system under a fault-injecting layer, client connections with
// chosen grants, and helpers that look at what is on disk.
#pragma once

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <map>
#include <string>

#include "VSATestTempDir.h"
#include "daemon/VSAClientConnection.h"
#include "operations/VSACommandStageForDelete.h"
#include "platform/VSAFaultInjectingFileSystem.h"
#include "platform/VSALinuxFileSystem.h"

class VSAContainerTestRoot : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = temp_.path();
    VSAWriteMobileUser(root_);
    std::ofstream(root_ + "/etc/group") << "mobile:x:501:\nsystemusers:x:600:\n";
    startContext();
  }

  // A daemon context on the root, over a fresh fault-injecting file system.
  void startContext() {
    context_.reset();  // one database opener at a time
    context_ = std::make_unique<VSADaemonContext>(
        VSASystemRoot(root_), [this](std::shared_ptr<VSAFileSystem> real) {
          faults_ = std::make_shared<VSAFaultInjectingFileSystem>(std::move(real));
          return faults_;
        });
    user_ = context_->userIdentityCache->userIdentityForPersonalPersona();
  }
  // What a restart does to the root after a crash: the old context (its
  // cache, its file system with any planned crash) is dropped, and a new
  // one runs the setup and cleanup of every start.
  void restart() {
    context_.reset();
    startContext();
    auto c = installer();
    c->keeperSetup();
    std::promise<void> done;
    c->keeperCleanupWithCompletion([&] { done.set_value(); });
    done.get_future().wait();
  }

  std::unique_ptr<VSAClientConnection> connection(const std::string& bundle, bool allowOther,
                                                  bool unrestricted,
                                                  std::optional<VSAValue> lookup = std::nullopt,
                                                  std::optional<VSAValue> wipeList = std::nullopt) {
    auto client =
        std::make_shared<VSAClientIdentity>(bundle, 501, 501, 1234, user_, VSAValue::dictionary(),
                                            false, std::array<uint8_t, 32>{}, false);
    return std::make_unique<VSAClientConnection>(*context_, client, true, allowOther, unrestricted,
                                                 std::move(lookup), std::move(wipeList),
                                                 std::make_shared<VSACommandQueue>());
  }
  std::unique_ptr<VSAClientConnection> installer() {
    return connection("com.example.installer", true, true);
  }
  VSAContainerIdentityRef identity(const std::string& id,
                                   VSAContainerClass c = VSAClass::kDataApplication) {
    return VSAContainerIdentity::containerIdentityWithUserIdentity(user_, id, c, nullptr);
  }
  VSAMetadataRef create(VSAClientConnection& c, const std::string& id, VSAResultCode* code,
                        bool transient = false,
                        VSAContainerClass cls = VSAClass::kDataApplication) {
    *code = VSAResult::kSuccess;
    return c.createOrLookupContainerWithContainerIdentity(
        identity(id, cls), {.createIfNecessary = true, .transient = transient}, code);
  }
  static void put(const std::string& path, const std::string& text) { std::ofstream(path) << text; }
  static std::string read(const std::string& path) {
    std::ifstream in(path);
    return std::string(std::istreambuf_iterator<char>(in), {});
  }
  // The live container of `id`, never created.
  VSAMetadataRef lookup(const std::string& id, VSAContainerClass c = VSAClass::kDataApplication) {
    VSAResultCode code = VSAResult::kSuccess;
    return installer()->createOrLookupContainerWithContainerIdentity(identity(id, c), {}, &code);
  }
  static size_t entries(const std::string& dir) {
    if (!std::filesystem::exists(dir)) return 0;
    return static_cast<size_t>(std::distance(std::filesystem::directory_iterator(dir), {}));
  }
  std::string classDirectory(VSAContainerClass c = VSAClass::kDataApplication,
                             bool transient = false) {
    return *context_->globalConfiguration->containerDirectoryURLForUserIdentity(user_, c,
                                                                                transient);
  }
  std::string staging(VSAContainerClass c = VSAClass::kDataApplication) {
    return context_->globalConfiguration->stagingDirectoryURLForUserIdentity(user_, c);
  }
  // Runs one stage-for-delete command of the context's environment; its code.
  VSAResultCode stage(std::vector<VSAContainerIdentityRef> identities) {
    VSACommandQueue queue;
    queue.insertCommand(VSACommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
        context_->stageEnvironment, std::move(identities), true, nullptr));
    VSAResultCode code = VSAResult::kSuccess;
    bool ok = queue.executeAllUntilExhaustedOrError(&code);
    EXPECT_EQ(ok, code == VSAResult::kSuccess) << code;
    return code;
  }
  // What a container is made of: each item below it, with its type, mode,
  // owner and protection class (the contents of files differ per container).
  static std::map<std::string, std::string> shapeOf(const std::string& dir) {
    std::map<std::string, std::string> shape;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(dir)) {
      struct stat st;
      if (::lstat(entry.path().c_str(), &st) != 0) continue;
      char protection[16] = {};
      ssize_t size = ::lgetxattr(entry.path().c_str(), kVSAProtectionClassXattr, protection,
                                 sizeof(protection) - 1);
      shape[std::filesystem::relative(entry.path(), dir).string()] =
          std::to_string(st.st_mode) + " " + std::to_string(st.st_uid) + ":" +
          std::to_string(st.st_gid) + " class " + (size > 0 ? protection : "none");
    }
    return shape;
  }
  VSAResultCode emptyDeathRow() {
    std::promise<VSAResultCode> done;
    context_->deathRow->deleteContainersOnDeathRowWithCompletion(
        [&](VSAResultCode code) { done.set_value(code); });
    return done.get_future().get();
  }

  VSATestTempDir temp_{"vessa-lifecycle"};
  std::string root_;
  std::shared_ptr<VSAFaultInjectingFileSystem> faults_;
  std::unique_ptr<VSADaemonContext> context_;
  VSAUserIdentityRef user_;
};
