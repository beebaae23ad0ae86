#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <future>

#include "VSAFakeCodeSigning.h"
#include "VSATestTempDir.h"
#include "base/VSALocks.h"
#include "base/VSAPlist.h"
#include "dataprotection/VSADataProtectionManager.h"
#include "dataprotection/VSADataProtectionUpdateFile.h"
#include "model/FakePersonaService.h"
#include "platform/VSALinuxFileSystem.h"

namespace fs = std::filesystem;
using Kind = VSAPersonaAttributes::Kind;

namespace {

class Protection : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = temp_.path();
    VSAWriteMobileUser(root_);
    VSASystemRoot root(root_);
    auto users = std::make_shared<VSAUserDatabase>(root);
    fileSystem_ = std::make_shared<VSALinuxFileSystem>([this] { return locked_.load(); });
    config_ = std::make_shared<VSAGlobalConfiguration>(
        root, std::make_shared<VSADeviceProperties>(root), users,
        std::make_shared<VSAFileManager>(fileSystem_, users));
    personas_ = std::make_shared<FakePersonaService>();
    personas_->personas = std::vector<VSAPersonaAttributes>{
        FakePersonaService::persona(Kind::Personal, 1000, "P", {})};
    identities_ = VSAUserIdentityCache::create({personas_, users, 501, 501, true, nullptr});
    auto cache = VSAContainerCache::create(
        {identities_, config_, std::make_shared<VSASandboxService>(root),
         std::make_shared<VSANotificationCenter>(root), testLocks_, &codeSigning_, &wellknown_});
    auto env = std::make_shared<VSADataProtectionEnvironment>();
    env->configuration = config_;
    env->userIdentityCache = identities_;
    env->containerCache = cache;
    env->transactions = transactions_;
    env->lockStateQueue = lockStateQueue_;
    env->locks = locks_;
    env->testLocks = testLocks_;
    env->codeSigning = &codeSigning_;
    env_ = env;
    manager_ = std::make_unique<VSADataProtectionManager>(env_);
    user_ = identities_->userIdentityForPersonalPersona();
  }

  // A data container on disk with a small tree; returns its metadata.
  VSAMetadataRef container(const char* id, VSAContainerClass c = VSAClass::kDataApplication) {
    VSAUUID uuid = VSAUUID::random();
    std::string dir =
        *config_->containerDirectoryURLForUserIdentity(user_, c, false) + "/" + uuid.string();
    fs::create_directories(dir + "/Library/Caches");
    std::ofstream(dir + "/Library/file") << "data";
    auto identity =
        VSAConcreteContainerIdentity::containerIdentityWithUUID(uuid, user_, id, c, nullptr);
    auto m = std::make_shared<VSAMetadata>(identity, std::nullopt, dir, std::nullopt);
    EXPECT_TRUE(m->writeMetadataToDiskWithError(*config_, nullptr));
    return m;
  }
  int classOf(const std::string& path) {
    int c = -1;
    EXPECT_EQ(fileSystem_->getProtectionClass(path, &c), 0) << path;
    return c;
  }
  void setClassOfTree(const std::string& dir, int c) {
    ASSERT_EQ(fileSystem_->setProtectionClass(dir, c), 0);
    for (auto& e : fs::recursive_directory_iterator(dir))
      ASSERT_EQ(fileSystem_->setProtectionClass(e.path().string(), c), 0);
  }
  VSADataProtectionChangeOperation::Ref operation(const VSAMetadataRef& m, int32_t c, bool retry) {
    return VSADataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
        m, c, retry, kVSAProtectionChangeTypeDefault, fileQueue_, env_);
  }
  std::string updateFile(const VSAMetadataRef& m) {
    return VSADataProtectionChangeOperation::urlForProtectionOperationWithContainerIdentity(
        *m->containerIdentity(), *config_);
  }
  // Sets a class through the manager and waits for its single completion.
  VSAResultCode setClass(const VSAMetadataRef& m, int32_t c, bool thirdParty = false) {
    std::promise<VSAResultCode> done;
    manager_->setDataProtectionOnDataContainerForContainerIdentity(
        *m->containerIdentity(), c, thirdParty, false,
        [&](VSAResultCode code) { done.set_value(code); });
    return done.get_future().get();
  }

  VSATestTempDir temp_{"vessa-protection"};
  std::string root_;
  std::atomic<bool> locked_{false};
  std::shared_ptr<VSALinuxFileSystem> fileSystem_;
  std::shared_ptr<VSAGlobalConfiguration> config_;
  std::shared_ptr<FakePersonaService> personas_;
  std::shared_ptr<VSAUserIdentityCache> identities_;
  std::shared_ptr<VSATransactions> transactions_ = std::make_shared<VSATransactions>();
  VSAWorkQueue::Ref lockStateQueue_ = VSAWorkQueue::create("test.lockstate");
  VSAWorkQueue::Ref fileQueue_ = VSAWorkQueue::create("test.protection-files");
  std::shared_ptr<VSALocks> locks_ = std::make_shared<VSALocks>();
  std::shared_ptr<VSATestLocks> testLocks_ = std::make_shared<VSATestLocks>(locks_);
  VSAFakeCodeSigningQueries codeSigning_;
  std::map<std::string, VSAValue>& entitlements_ = codeSigning_.entitlements;
  VSAFakeWellknownContainers wellknown_;
  std::shared_ptr<const VSADataProtectionEnvironment> env_;
  std::unique_ptr<VSADataProtectionManager> manager_;
  VSAUserIdentityRef user_;
};

TEST_F(Protection, AnOlderChangeLeavesTheNewerChangesFile) {
  auto m = container("com.app");
  auto first = operation(m, 3, false);
  auto second = operation(m, 4, false);
  ASSERT_TRUE(first->writeToDiskWithError(nullptr));
  ASSERT_TRUE(second->writeToDiskWithError(nullptr));
  bool firstDone = false;
  first->setCompletionBlock([&](bool retry, const VSAErrorRef& e) {
    firstDone = true;
    EXPECT_FALSE(retry);
    EXPECT_FALSE(e);
  });
  first->performChangeOperation();
  ASSERT_TRUE(firstDone);
  EXPECT_EQ(classOf(m->url() + "/Library/file"), 3);
  // The file now names the second change, which is still to run.
  auto read = VSADataProtectionUpdate::_readAndValidateDataProtectionUpdateAtURL(
      updateFile(m), *identities_, nullptr);
  ASSERT_TRUE(read);
  EXPECT_EQ(read->internalID, second->internalChangeID());
  EXPECT_EQ(read->protectionClass, 4);
  second->performChangeOperation();
  EXPECT_FALSE(fs::exists(updateFile(m)));
  EXPECT_EQ(classOf(m->url()), 4);
  EXPECT_EQ(classOf(m->url() + "/Library/Caches"), 4);
}

TEST_F(Protection, ALockedDeviceRetriesAtEachUnlockAndStartsTheRetryOnce) {
  auto m = container("com.app");
  setClassOfTree(m->url(), 1);
  locked_ = true;
  lockStateQueue_->suspend();
  auto op = operation(m, 3, true);
  ASSERT_TRUE(op->writeToDiskWithError(nullptr));
  std::atomic<int> retryStarts{0};
  std::promise<std::pair<bool, VSAErrorRef>> done;
  op->setRetryStartBlock([&] { ++retryStarts; });
  op->setCompletionBlock([&](bool retry, const VSAErrorRef& e) { done.set_value({retry, e}); });
  op->performChangeOperation();
  // Waiting for the unlock: the file stays and the daemon is held busy.
  EXPECT_TRUE(fs::exists(updateFile(m)));
  EXPECT_EQ(transactions_->openCount(), 1);
  EXPECT_EQ(retryStarts, 0);
  // An unlock that ends before the retry gets through: it fails again and
  // waits for the next one (the queued block re-suspends the queue as the
  // lock-state monitor would).
  lockStateQueue_->async([q = lockStateQueue_] { q->suspend(); });
  lockStateQueue_->resume();
  while (lockStateQueue_->suspendCount() == 0) std::this_thread::yield();
  EXPECT_EQ(retryStarts, 1);
  EXPECT_TRUE(op->retried());
  EXPECT_EQ(classOf(m->url() + "/Library/file"), 1);
  locked_ = false;
  lockStateQueue_->resume();
  auto [retry, error] = done.get_future().get();
  EXPECT_FALSE(retry);
  EXPECT_FALSE(error);
  EXPECT_EQ(retryStarts, 1);
  EXPECT_EQ(classOf(m->url() + "/Library/file"), 3);
  EXPECT_FALSE(fs::exists(updateFile(m)));
  lockStateQueue_->sync([] {});
  EXPECT_EQ(transactions_->openCount(), 0);
}

TEST_F(Protection, ALockedDeviceWithoutRetryFailsWith61AndForgetsTheChange) {
  auto m = container("com.app");
  setClassOfTree(m->url(), 1);
  locked_ = true;
  auto op = operation(m, 4, false);
  ASSERT_TRUE(op->writeToDiskWithError(nullptr));
  VSAErrorRef error;
  bool retry = false;
  op->setCompletionBlock([&](bool r, const VSAErrorRef& e) { retry = r, error = e; });
  op->performChangeOperation();
  ASSERT_TRUE(error);
  EXPECT_TRUE(retry);
  EXPECT_EQ(error->resultCode(0), VSAResult::kDeviceLocked);
  EXPECT_FALSE(fs::exists(updateFile(m)));
}

TEST_F(Protection, UpdateFilesAreValidatedWhenRead) {
  auto m = container("com.app");
  auto op = operation(m, 3, true);
  ASSERT_TRUE(op->writeToDiskWithError(nullptr));
  std::string url = updateFile(m);
  EXPECT_EQ(classOf(url), 4);  // readable while locked
  auto dict = *VSA_dictionaryWithContentsOfURL(url, 0, nullptr);
  EXPECT_TRUE(dict.get(kVSADataOperationUserIdentityKey));
  auto back = VSADataProtectionChangeOperation::dataProtectionChangeOperationAtURL(url, fileQueue_,
                                                                                   env_, nullptr);
  ASSERT_TRUE(back);
  EXPECT_EQ(back->internalChangeID(), op->internalChangeID());
  EXPECT_EQ(back->dataContainerMetadata()->url(), m->url());
  for (const char* key : {kVSADataOperationIdentifierKey, kVSADataOperationContainerClassKey,
                          kVSADataOperationProtectionClassKey, kVSADataOperationRetryIfLockedKey,
                          kVSADataOperationChangeTypeKey, kVSADataOperationInternalIDKey}) {
    VSAValue broken = dict;
    broken.set(key, VSAValue(VSAValue::Array{}));
    ASSERT_TRUE(VSA_writeToURL(broken, url, 0, nullptr));
    VSAErrorRef error;
    EXPECT_FALSE(VSADataProtectionChangeOperation::dataProtectionChangeOperationAtURL(
        url, fileQueue_, env_, &error))
        << key;
    ASSERT_TRUE(error) << key;
    EXPECT_EQ(error->resultCode(0), VSAResult::kInvalidUpdateFile) << key;
  }
  // A bad change type is refused before anything is written.
  auto bad = VSADataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
      m, 3, false, 99, fileQueue_, env_);
  VSAErrorRef error;
  EXPECT_FALSE(bad->writeToDiskWithError(&error));
  EXPECT_EQ(error->resultCode(0), VSAResult::kOutOfRange);
  // Classes without a user identity store none.
  auto system = container("com.system", VSAClass::kSystemData);
  ASSERT_TRUE(operation(system, 4, false)->writeToDiskWithError(nullptr));
  auto systemDict = *VSA_dictionaryWithContentsOfURL(updateFile(system), 0, nullptr);
  EXPECT_FALSE(systemDict.get(kVSADataOperationUserIdentityKey));
}

TEST_F(Protection, ManagerRulesForRequestedClasses) {
  auto m = container("com.app");
  // Same as current (none recorded = 0): success, and a stale file goes.
  ASSERT_TRUE(operation(m, 3, false)->writeToDiskWithError(nullptr));
  EXPECT_EQ(setClass(m, 0), VSAResult::kSuccess);
  EXPECT_FALSE(fs::exists(updateFile(m)));
  EXPECT_EQ(setClass(m, 2), VSAResult::kInvalidArgument);
  EXPECT_EQ(setClass(m, 2, true), VSAResult::kInvalidArgument);
  // A third-party app asking for a weak class gets no change.
  EXPECT_EQ(setClass(m, 4, true), VSAResult::kSuccess);
  EXPECT_EQ(classOf(m->url() + "/Library/file"), 0);
  EXPECT_EQ(setClass(m, 3, true), VSAResult::kSuccess);
  EXPECT_EQ(classOf(m->url() + "/Library/file"), 3);
  // The class is recorded in the metadata, so asking again is a no-op.
  auto reread = VSAMetadata::readAndValidateMetadataAtUrl(m->url(), user_, false, *config_,
                                                          *identities_, nullptr);
  ASSERT_TRUE(reread);
  EXPECT_EQ(VSADataProtectionManager::currentProtectionClassOfMetadata(*reread), 3);
  EXPECT_EQ(setClass(m, 3), VSAResult::kSuccess);
  // Not a data class, or no such container.
  auto bundle = container("com.bundle", VSAClass::kBundleApplication);
  EXPECT_EQ(setClass(bundle, 3), VSAResult::kInvalidArgument);
  auto missing = VSAContainerIdentity::containerIdentityWithUserIdentity(
      user_, "com.none", VSAClass::kDataApplication, nullptr);
  std::promise<VSAResultCode> done;
  manager_->setDataProtectionOnDataContainerForContainerIdentity(
      *missing, 3, false, false, [&](VSAResultCode c) { done.set_value(c); });
  EXPECT_EQ(done.get_future().get(), VSAResult::kContainerNotFound);
}

TEST_F(Protection, IntendedClassComesFromTheFirstStringEntitlement) {
  VSAValue e = VSAValue::dictionary();
  e.set("com.tamsk.developer.default-data-protection", VSAValue(1));  // not a string
  e.set("data-protection-class", "VSAFileProtectionCompleteUntilFirstUserAuthentication");
  e.set("DataProtectionClass", "VSAFileProtectionComplete");
  entitlements_["com.a"] = e;
  VSAValue unknown = VSAValue::dictionary();
  unknown.set("DataProtectionClass", "SomethingElse");
  entitlements_["com.b"] = unknown;
  VSAValue writeOnly = VSAValue::dictionary();
  writeOnly.set("DataProtectionClass", "VSAFileProtectionWriteOnly");
  entitlements_["com.c"] = writeOnly;
  EXPECT_EQ(manager_->intendedDataProtectionClassBasedOnEntitlementsForIdentifier("com.a"), 3);
  EXPECT_EQ(manager_->intendedDataProtectionClassBasedOnEntitlementsForIdentifier("com.b"), 0);
  EXPECT_EQ(manager_->intendedDataProtectionClassBasedOnEntitlementsForIdentifier("com.c"), 2);
  EXPECT_EQ(manager_->intendedDataProtectionClassBasedOnEntitlementsForIdentifier("com.none"), 0);
}

TEST_F(Protection, RestartFinishesSurvivingChangesAndSkipsDamagedFiles) {
  auto a = container("com.a");
  auto b = container("com.b");
  // Left by a daemon that stopped before running them.
  ASSERT_TRUE(operation(a, 3, true)->writeToDiskWithError(nullptr));
  ASSERT_TRUE(operation(b, 1, true)->writeToDiskWithError(nullptr));
  std::string damaged = config_->pendingUpdatesDirectory() + "/damaged-2-501.plist";
  std::ofstream(damaged) << "not a property list";
  ASSERT_TRUE(manager_->restartPendingDataProtectionOperationsWithError(nullptr));
  EXPECT_EQ(classOf(a->url() + "/Library/file"), 3);
  EXPECT_EQ(classOf(b->url() + "/Library/file"), 1);
  EXPECT_FALSE(fs::exists(updateFile(a)));
  EXPECT_FALSE(fs::exists(updateFile(b)));
  EXPECT_TRUE(fs::exists(damaged));
  auto reread = VSAMetadata::readAndValidateMetadataAtUrl(a->url(), user_, false, *config_,
                                                          *identities_, nullptr);
  EXPECT_EQ(VSADataProtectionManager::currentProtectionClassOfMetadata(*reread), 3);
}

// Replies seen by one request's completion.
struct Replies {
  std::atomic<int> count{0};
  std::atomic<VSAResultCode> code{0};
  VSADataProtectionManager::Completion completion() {
    return [this](VSAResultCode c) {
      code = c;
      ++count;
    };
  }
};

TEST_F(Protection, RequestsForOneContainerWhileLockedLeaveOneWaitingChange) {
  auto m = container("com.app");
  setClassOfTree(m->url(), 1);
  locked_ = true;
  lockStateQueue_->suspend();
  const int32_t classes[] = {3, 4, 1, 3, 4};
  constexpr size_t n = std::size(classes);
  Replies replies[n];
  for (size_t i = 0; i < n; ++i) {
    manager_->setDataProtectionOnDataContainerForContainerIdentity(
        *m->containerIdentity(), classes[i], false, true, replies[i].completion());
    // The change it replaced is answered at once, and only that one.
    if (i > 0) {
      EXPECT_EQ(replies[i - 1].count, 1) << i;
      EXPECT_EQ(replies[i - 1].code, kVSAProtectionChangeSupersededResult) << i;
    }
    EXPECT_EQ(replies[i].count, 0) << i;
  }
  EXPECT_EQ(manager_->pendingChangeCount(), 1u);
  EXPECT_EQ(manager_->pendingReplyCount(), 1u);
  EXPECT_EQ(transactions_->openCount(), 1);  // one retry queued, not five
  EXPECT_EQ(classOf(m->url() + "/Library/file"), 1);

  locked_ = false;
  lockStateQueue_->resume();
  lockStateQueue_->sync([] {});
  for (size_t i = 0; i < n; ++i) EXPECT_EQ(replies[i].count, 1) << i;
  EXPECT_EQ(replies[n - 1].code, VSAResult::kSuccess);
  EXPECT_EQ(classOf(m->url() + "/Library/file"), 4);
  EXPECT_EQ(classOf(m->url() + "/Library/Caches"), 4);
  EXPECT_FALSE(fs::exists(updateFile(m)));
  auto reread = VSAMetadata::readAndValidateMetadataAtUrl(m->url(), user_, false, *config_,
                                                          *identities_, nullptr);
  ASSERT_TRUE(reread);
  EXPECT_EQ(VSADataProtectionManager::currentProtectionClassOfMetadata(*reread), 4);
  EXPECT_EQ(manager_->pendingChangeCount(), 0u);
  EXPECT_EQ(manager_->pendingReplyCount(), 0u);
  EXPECT_EQ(transactions_->openCount(), 0);
}

TEST_F(Protection, AskingForTheCurrentClassWithdrawsAWaitingChange) {
  auto m = container("com.app");
  setClassOfTree(m->url(), 1);
  locked_ = true;
  lockStateQueue_->suspend();
  Replies waiting;
  manager_->setDataProtectionOnDataContainerForContainerIdentity(*m->containerIdentity(), 3, false,
                                                                 true, waiting.completion());
  ASSERT_EQ(manager_->pendingChangeCount(), 1u);
  // Nothing is recorded yet, so class 0 is the current one.
  EXPECT_EQ(setClass(m, 0), VSAResult::kSuccess);
  EXPECT_EQ(waiting.count, 1);
  EXPECT_EQ(waiting.code, kVSAProtectionChangeSupersededResult);
  EXPECT_EQ(manager_->pendingChangeCount(), 0u);
  locked_ = false;
  lockStateQueue_->resume();
  lockStateQueue_->sync([] {});
  EXPECT_EQ(waiting.count, 1);
  EXPECT_EQ(classOf(m->url() + "/Library/file"), 1);
  EXPECT_FALSE(fs::exists(updateFile(m)));
  EXPECT_EQ(transactions_->openCount(), 0);
}

TEST_F(Protection, RepliesBeyondTheCapAreAnsweredAtOnceAndTheirChangesStillRun) {
  VSADataProtectionManager capped(env_, 2);
  std::vector<VSAMetadataRef> containers;
  for (const char* id : {"com.a", "com.b", "com.c"}) {
    containers.push_back(container(id));
    setClassOfTree(containers.back()->url(), 1);
  }
  locked_ = true;
  lockStateQueue_->suspend();
  Replies replies[3];
  for (size_t i = 0; i < 3; ++i)
    capped.setDataProtectionOnDataContainerForContainerIdentity(
        *containers[i]->containerIdentity(), 3, false, true, replies[i].completion());
  EXPECT_EQ(replies[0].count, 0);
  EXPECT_EQ(replies[1].count, 0);
  EXPECT_EQ(replies[2].count, 1);
  EXPECT_EQ(replies[2].code, kVSAProtectionChangeAnsweredEarlyResult);
  EXPECT_EQ(capped.pendingChangeCount(), 3u);
  EXPECT_EQ(capped.pendingReplyCount(), 2u);
  EXPECT_TRUE(fs::exists(updateFile(containers[2])));

  locked_ = false;
  lockStateQueue_->resume();
  lockStateQueue_->sync([] {});
  for (size_t i = 0; i < 3; ++i) {
    EXPECT_EQ(replies[i].count, 1) << i;
    EXPECT_EQ(classOf(containers[i]->url() + "/Library/file"), 3) << i;
    EXPECT_FALSE(fs::exists(updateFile(containers[i]))) << i;
  }
  EXPECT_EQ(capped.pendingReplyCount(), 0u);
}

TEST_F(Protection, TheClassIsRecordedOnTheMetadataAsItIsAtTheUnlock) {
  auto m = container("com.app");
  setClassOfTree(m->url(), 1);
  locked_ = true;
  lockStateQueue_->suspend();
  std::promise<VSAResultCode> done;
  manager_->setDataProtectionOnDataContainerForContainerIdentity(
      *m->containerIdentity(), 3, false, true, [&](VSAResultCode c) { done.set_value(c); });
  {
    // Meanwhile someone records another info value, the way metadata is written.
    VSAIdentifierLockGuard guard(*locks_, VSAValue(m->uuid().string()), true);
    auto current = VSAMetadata::readAndValidateMetadataAtUrl(m->url(), user_, false, *config_,
                                                             *identities_, nullptr);
    ASSERT_TRUE(current);
    VSAValue info = current->info() ? *current->info() : VSAValue::dictionary();
    info.set("com.example.Other", VSAValue("kept"));
    current->setInfo(info);
    ASSERT_TRUE(current->writeMetadataToDiskWithError(*config_, nullptr));
  }
  locked_ = false;
  lockStateQueue_->resume();
  EXPECT_EQ(done.get_future().get(), VSAResult::kSuccess);
  auto reread = VSAMetadata::readAndValidateMetadataAtUrl(m->url(), user_, false, *config_,
                                                          *identities_, nullptr);
  ASSERT_TRUE(reread);
  ASSERT_TRUE(reread->info());
  const VSAValue* other = reread->info()->get("com.example.Other");
  ASSERT_TRUE(other);
  EXPECT_EQ(*other->stringValue(), "kept");
  EXPECT_EQ(VSADataProtectionManager::currentProtectionClassOfMetadata(*reread), 3);
}

}  // namespace
