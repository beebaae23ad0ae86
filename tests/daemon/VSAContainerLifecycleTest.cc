#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <array>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <future>
#include <thread>

#include "VSAContainerTestRoot.h"
#include "VSAFakeCodeSigning.h"
#include "daemon/VSAClientConnection.h"
#include "operations/VSACommandStageForDelete.h"
#include "platform/VSAFaultInjectingFileSystem.h"
#include "platform/VSALinuxFileSystem.h"

namespace fs = std::filesystem;
using Op = VSAFileSystem::Op;

namespace {

class Lifecycle : public VSAContainerTestRoot {
 protected:
  void sweepCreation(VSAContainerClass cls);
  int injectedFaults_ = 0;  // by sweepCreation
};

TEST_F(Lifecycle, CreatesInPlaceWithMetadataAndSubdirectoriesThenFindsIt) {
  auto c = installer();
  VSAResultCode code;
  auto created = create(*c, "com.example.app", &code);
  ASSERT_TRUE(created) << code;
  EXPECT_FALSE(created->existed());
  EXPECT_EQ(fs::path(created->url()).parent_path(), fs::path(classDirectory()));
  EXPECT_EQ(fs::path(created->url()).filename().string().size(), 36u);  // a UUID name
  EXPECT_TRUE(fs::exists(created->url() + "/" + kVSAMetadataFileName));
  struct stat st;
  ASSERT_EQ(::stat((created->url() + "/Library/Caches").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0755u);
  EXPECT_EQ(st.st_uid, 501u);
  EXPECT_EQ(entries(staging()), 0u);
  auto found = create(*c, "com.example.app", &code);
  ASSERT_TRUE(found);
  EXPECT_TRUE(found->existed());
  EXPECT_EQ(found->url(), created->url());
  EXPECT_EQ(found->uuid(), created->uuid());
  // Looking up without creation finds it too; a missing one is 21 and leaves nothing.
  EXPECT_TRUE(
      c->createOrLookupContainerWithContainerIdentity(identity("com.example.app"), {}, &code));
  EXPECT_FALSE(
      c->createOrLookupContainerWithContainerIdentity(identity("com.example.none"), {}, &code));
  EXPECT_EQ(code, VSAResult::kContainerNotFound);
  EXPECT_EQ(entries(classDirectory()), 1u);
}

TEST_F(Lifecycle, SimultaneousCreatesOfOneIdentityMakeOneDirectory) {
  constexpr int kThreads = 8;
  std::vector<std::thread> threads;
  std::atomic<int> created{0}, existed{0}, failed{0};
  std::promise<void> go;
  auto start = go.get_future().share();
  for (int i = 0; i < kThreads; ++i)
    threads.emplace_back([&] {
      auto c = installer();
      start.wait();
      VSAResultCode code;
      auto m = create(*c, "com.example.race", &code);
      if (!m)
        ++failed;
      else
        ++(m->existed() ? existed : created);
    });
  go.set_value();
  for (auto& t : threads) t.join();
  EXPECT_EQ(failed, 0);
  EXPECT_EQ(created, 1);
  EXPECT_EQ(existed, kThreads - 1);
  EXPECT_EQ(entries(classDirectory()), 1u);
}

TEST_F(Lifecycle, TransientContainersAreAlwaysMadeFresh) {
  auto c = installer();
  VSAResultCode code;
  auto first = create(*c, "com.example.temp", &code, true);
  ASSERT_TRUE(first) << code;
  EXPECT_TRUE(first->transient());
  EXPECT_EQ(fs::path(first->url()).parent_path(),
            fs::path(classDirectory(VSAClass::kDataApplication, true)));
  auto second = create(*c, "com.example.temp", &code, true);
  ASSERT_TRUE(second) << code;
  EXPECT_FALSE(second->existed());
  EXPECT_NE(second->url(), first->url());
  EXPECT_FALSE(fs::exists(first->url()));
  EXPECT_EQ(entries(classDirectory(VSAClass::kDataApplication, true)), 1u);
}

TEST_F(Lifecycle, TransientContainersOfEveryUserGoAtTheFirstStartAfterABoot) {
  auto c = installer();
  VSAResultCode code;
  auto temp = create(*c, "com.example.temp", &code, true);
  ASSERT_TRUE(temp) << code;
  auto kept = create(*c, "com.example.kept", &code);
  ASSERT_TRUE(kept) << code;
  std::promise<void> done;
  c->rebootKeeperCleanupWithCompletion([&] { done.set_value(); });
  done.get_future().wait();
  EXPECT_FALSE(fs::exists(temp->url())) << "a per-user transient container survived a reboot";
  EXPECT_TRUE(fs::exists(kept->url()));
}

TEST_F(Lifecycle, WellKnownSystemGroupsLiveUnderTheirNameWithSystemOwners) {
  auto c = installer();
  VSAResultCode code;
  auto m = create(*c, "systemgroup.com.tamsk.launcher", &code, false, VSAClass::kSystemGroup);
  ASSERT_TRUE(m) << code;
  EXPECT_EQ(fs::path(m->url()).filename(), "systemgroup.com.tamsk.launcher");
  struct stat st;
  ASSERT_EQ(::stat((m->url() + "/Library").c_str(), &st), 0);
  EXPECT_EQ(st.st_uid, kVSANobodyID);
  auto other = create(*c, "systemgroup.com.example.unknown", &code, false, VSAClass::kSystemGroup);
  ASSERT_TRUE(other) << code;
  EXPECT_EQ(fs::path(other->url()).filename().string().size(), 36u);
}

TEST_F(Lifecycle, AccessTestsComeBeforeAnyLookup) {
  VSAResultCode code;
  // Its own identifier: no grant needed.
  auto self = connection("com.example.self", false, false);
  ASSERT_TRUE(create(*self, "com.example.self", &code)) << code;
  // Another identifier without a grant: 55, and nothing created.
  EXPECT_FALSE(create(*self, "com.example.other", &code));
  EXPECT_EQ(code, VSAResult::kNotEntitled);
  auto existing = create(*installer(), "com.example.other", &code);
  ASSERT_TRUE(existing);
  EXPECT_FALSE(
      self->createOrLookupContainerWithContainerIdentity(identity("com.example.other"), {}, &code));
  EXPECT_EQ(code, VSAResult::kNotEntitled);  // the same answer whether it exists or not
  // The lookup entitlement lists identifiers per class.
  VSAValue lookup = VSAValue::dictionary();
  lookup.set("appData", VSAValue(VSAValue::Array{VSAValue("com.example.other")}));
  lookup.set("plugin", VSAValue("not an array"));
  auto looker = connection("com.example.looker", false, false, lookup);
  EXPECT_TRUE(looker->createOrLookupContainerWithContainerIdentity(identity("com.example.other"),
                                                                   {}, &code));
  EXPECT_TRUE(
      looker->isEntitledForLookupWithClass(VSAClass::kDataApplication, "com.example.other"));
  EXPECT_FALSE(looker->isEntitledForLookupWithClass(VSAClass::kBundlePlugin, "com.example.other"));
  EXPECT_EQ(looker->_lookupForContainerClass(VSAClass::kBundlePlugin)->size(), 0u);
  EXPECT_FALSE(looker->_lookupForContainerClass(14));
  // The built-in whitelist lets this client see one app's data.
  auto whitelisted = connection("com.tamsk.mail.composer", false, false);
  ASSERT_TRUE(create(*installer(), "com.tamsk.mail", &code));
  EXPECT_TRUE(whitelisted->createOrLookupContainerWithContainerIdentity(identity("com.tamsk.mail"),
                                                                        {}, &code));
  EXPECT_EQ(entries(classDirectory()), 3u);
}

// Fails, one at a time, every call of every operation type that a clean
// creation makes. A creation that fails leaves no staging directory, no cache
// entry and nothing in the class directory, and the identity can be created
// afterwards; one that succeeds despite the fault (a step whose failure is only
// logged) yields a complete container that a lookup finds. Counts the faults
// injected in injectedFaults_.
void Lifecycle::sweepCreation(VSAContainerClass cls) {
  auto c = installer();
  VSAResultCode code;
  std::string deathrow = context_->globalConfiguration->deathrowDirectory();
  // The first creation also builds the class maps and the directories above
  // the class; the second is the clean run whose calls are counted.
  ASSERT_TRUE(create(*c, "com.example.warmup", &code, false, cls)) << code;
  faults_->reset();
  auto counted = create(*c, "com.example.counted", &code, false, cls);
  ASSERT_TRUE(counted) << code;
  std::array<int, static_cast<size_t>(Op::Count)> calls{};
  int total = 0;
  for (size_t i = 0; i < calls.size(); ++i) total += calls[i] = faults_->callCount(Op(i));
  faults_->reset();
  const auto shape = shapeOf(counted->url());
  ASSERT_GE(shape.size(), 2u);  // the metadata file and sub-directories
  EXPECT_EQ(emptyDeathRow(), VSAResult::kSuccess);

  int injected = 0, failed = 0, survived = 0;
  for (size_t i = 0; i < calls.size(); ++i) {
    Op op = Op(i);
    for (int n = 1; n <= calls[i]; ++n) {
      std::string id = "com.example.fail." + std::to_string(cls) + "." +
                       std::string(VSAFileSystem::opName(op)) + "." + std::to_string(n);
      SCOPED_TRACE(id);
      size_t live = entries(classDirectory(cls));
      faults_->reset();
      faults_->failNth(op, n, EIO);
      auto m = create(*c, id, &code, false, cls);
      bool reached = faults_->callCount(op) >= n;
      faults_->reset();
      ASSERT_TRUE(reached) << "the creation no longer makes this call";
      ++injected;
      EXPECT_EQ(entries(staging(cls)), 0u);
      if (m) {
        ++survived;
        std::printf("  survived: %s\n", id.c_str());
        EXPECT_EQ(shapeOf(m->url()), shape);
        auto found = c->createOrLookupContainerWithContainerIdentity(identity(id, cls), {}, &code);
        ASSERT_TRUE(found) << code;
        EXPECT_EQ(found->url(), m->url());
        EXPECT_EQ(found->uuid(), m->uuid());
        EXPECT_EQ(entries(classDirectory(cls)), live + 1);
      } else {
        ++failed;
        EXPECT_NE(code, VSAResult::kSuccess);
        EXPECT_FALSE(context_->containerCache->containerForContainerIdentity(*identity(id, cls)));
        EXPECT_EQ(entries(classDirectory(cls)), live);  // nothing reached the live directory
        auto again = create(*c, id, &code, false, cls);
        ASSERT_TRUE(again) << code;
        EXPECT_FALSE(again->existed());
        EXPECT_EQ(shapeOf(again->url()), shape);
      }
      EXPECT_EQ(emptyDeathRow(), VSAResult::kSuccess);
      EXPECT_EQ(entries(deathrow), 0u);
    }
  }
  for (size_t i = 0; i < calls.size(); ++i)
    if (calls[i]) std::printf("  %s: %d calls\n", VSAFileSystem::opName(Op(i)), calls[i]);
  EXPECT_EQ(injected, total);
  EXPECT_GT(failed, 10);
  std::printf(
      "creation sweep of class %llu: %d injected faults (%d failed the creation, %d were "
      "survived)\n",
      static_cast<unsigned long long>(cls), injected, failed, survived);
  injectedFaults_ += injected;
}

TEST_F(Lifecycle, AFailureOfAnyCallOfCreationLeavesNothingBehind) {
  sweepCreation(VSAClass::kDataApplication);
  if (HasFatalFailure()) return;
  sweepCreation(VSAClass::kSystemGroup);  // a system class: an ACL and system owners
  std::printf("creation sweeps: %d injected faults\n", injectedFaults_);
  RecordProperty("injected_faults", injectedFaults_);
}

TEST_F(Lifecycle, DeletionStagesOnRequestCompletionAndDeathRowEmpties) {
  auto c = installer();
  VSAResultCode code;
  auto m = create(*c, "com.example.doomed", &code);
  ASSERT_TRUE(m);
  code = VSAResult::kSuccess;
  c->deleteContainerWithContainerIdentity(identity("com.example.doomed"), false, &code);
  EXPECT_EQ(code, VSAResult::kSuccess);
  EXPECT_TRUE(fs::exists(m->url()));  // nothing happens before the request completes
  ASSERT_TRUE(c->completeWithError(&code));
  EXPECT_FALSE(fs::exists(m->url()));
  std::string deathrow = context_->globalConfiguration->deathrowDirectory();
  EXPECT_EQ(entries(deathrow), 1u);
  EXPECT_FALSE(
      c->createOrLookupContainerWithContainerIdentity(identity("com.example.doomed"), {}, &code));
  EXPECT_EQ(code, VSAResult::kContainerNotFound);
  EXPECT_EQ(emptyDeathRow(), VSAResult::kSuccess);
  EXPECT_EQ(entries(deathrow), 0u);
  // Deleting a missing container fails in the lookup and queues nothing.
  auto other = installer();
  code = VSAResult::kSuccess;
  other->deleteContainerWithContainerIdentity(identity("com.example.doomed"), false, &code);
  EXPECT_EQ(code, VSAResult::kContainerNotFound);
  EXPECT_EQ(other->commandQueue()->count(), 0u);
}

// Staging a transient bundle container for deletion takes that container,
// never its permanent twin, drops its entry from the transient class map, and
// keeps the identifier's code-signing records while the permanent one remains.
TEST_F(Lifecycle, ATransientBundleWithAPermanentTwinKeepsTheCodeSigningRecords) {
  auto c = installer();
  VSAResultCode code;
  // The context's stage-for-delete environment records instead of removing,
  // for the stages below and the deletion request at the end.
  VSARecordingCodeSigningChanges recorder;
  struct Restore {
    VSAStageForDeleteEnvironment& environment;
    VSACodeSigningChanges* saved;
    ~Restore() { environment.codeSigning = saved; }
  } restore{*context_->stageEnvironment, context_->stageEnvironment->codeSigning};
  context_->stageEnvironment->codeSigning = &recorder;
  const std::vector<std::string>& forgotten = recorder.removed;
  auto permanent = create(*c, "com.example.twin", &code, false, VSAClass::kBundleApplication);
  ASSERT_TRUE(permanent) << code;
  auto transient = create(*c, "com.example.twin", &code, true, VSAClass::kBundleApplication);
  ASSERT_TRUE(transient) << code;
  // A transient container is named by its concrete identity (its UUID).
  ASSERT_EQ(stage({transient->containerIdentity()}), VSAResult::kSuccess);
  EXPECT_FALSE(fs::exists(transient->url()));
  EXPECT_TRUE(fs::exists(permanent->url() + "/" + kVSAMetadataFileName));
  EXPECT_TRUE(forgotten.empty());
  VSAErrorRef error;
  EXPECT_FALSE(context_->containerCache->containerForContainerIdentity(
      *identity("com.example.twin", VSAClass::kBundleApplication), {.transient = true}, &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), VSAResult::kContainerNotFound);  // dropped, not found stale (44)
  auto still = context_->containerCache->containerForContainerIdentity(
      *identity("com.example.twin", VSAClass::kBundleApplication));
  ASSERT_TRUE(still);
  EXPECT_EQ(still->uuid(), permanent->uuid());

  // A transient bundle container without a permanent twin takes the records along.
  auto lonely = create(*c, "com.example.lonely", &code, true, VSAClass::kBundleApplication);
  ASSERT_TRUE(lonely) << code;
  ASSERT_EQ(stage({lonely->containerIdentity()}), VSAResult::kSuccess);
  EXPECT_FALSE(fs::exists(lonely->url()));
  EXPECT_EQ(forgotten, std::vector<std::string>{"com.example.lonely"});
  error = nullptr;
  EXPECT_FALSE(context_->containerCache->containerForContainerIdentity(
      *identity("com.example.lonely", VSAClass::kBundleApplication), {.transient = true}, &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code(), VSAResult::kContainerNotFound);

  // Deleting the permanent container forgets the records too.
  c->deleteContainerWithContainerIdentity(
      identity("com.example.twin", VSAClass::kBundleApplication), false, &code);
  ASSERT_TRUE(c->completeWithError(&code)) << code;
  EXPECT_FALSE(fs::exists(permanent->url()));
  EXPECT_EQ(forgotten, (std::vector<std::string>{"com.example.lonely", "com.example.twin"}));
}

TEST_F(Lifecycle, AContainerThatCannotBeMovedToDeathRowIsRemovedInPlace) {
  auto c = installer();
  VSAResultCode code;
  auto m = create(*c, "com.example.stuck", &code);
  ASSERT_TRUE(m) << code;
  std::string deathrow = context_->globalConfiguration->deathrowDirectory();
  size_t staged = entries(deathrow);
  c->deleteContainerWithContainerIdentity(identity("com.example.stuck"), false, &code);
  ASSERT_EQ(code, VSAResult::kSuccess);
  faults_->reset();
  faults_->failNth(Op::Rename, 1, EBUSY);
  EXPECT_TRUE(c->completeWithError(&code)) << code;
  EXPECT_EQ(faults_->callCount(Op::Rename), 1);  // the one move, which failed
  faults_->reset();
  EXPECT_FALSE(fs::exists(m->url()));
  EXPECT_EQ(entries(deathrow), staged);  // removed where it was
  EXPECT_FALSE(
      c->createOrLookupContainerWithContainerIdentity(identity("com.example.stuck"), {}, &code));
  EXPECT_EQ(code, VSAResult::kContainerNotFound);
}

// A container that can be neither moved nor removed fails the command with 28
// and keeps its cache entry; the containers after it are still staged.
TEST_F(Lifecycle, AContainerThatCannotBeRemovedKeepsItsEntryAndFailsWith28) {
  auto c = installer();
  VSAResultCode code;
  auto kept = create(*c, "com.example.kept", &code);
  auto gone = create(*c, "com.example.gone", &code);
  ASSERT_TRUE(kept && gone);
  std::vector<VSAResultCode> reported;
  VSACommandQueue queue;
  queue.insertCommand(VSACommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
      context_->stageEnvironment, {identity("com.example.kept"), identity("com.example.gone")},
      true, [&](VSAResultCode failure) { reported.push_back(failure); }));
  faults_->reset();
  faults_->failNth(Op::Rename, 1, EBUSY);
  faults_->failAll(Op::Unlink, EPERM);
  faults_->failAll(Op::Rmdir, EPERM);
  code = VSAResult::kSuccess;
  EXPECT_FALSE(queue.executeAllUntilExhaustedOrError(&code));
  faults_->reset();
  EXPECT_EQ(code, 28u);
  EXPECT_EQ(reported, std::vector<VSAResultCode>{28});
  EXPECT_TRUE(fs::exists(kept->url() + "/" + kVSAMetadataFileName));
  auto entry =
      context_->containerCache->containerForContainerIdentity(*identity("com.example.kept"));
  ASSERT_TRUE(entry);
  EXPECT_EQ(entry->uuid(), kept->uuid());
  EXPECT_FALSE(fs::exists(gone->url()));
  EXPECT_FALSE(
      context_->containerCache->containerForContainerIdentity(*identity("com.example.gone")));
}

// When the cache cannot drop a staged container (its class map is gone and
// cannot be rebuilt), the command fails with 46 and stages nothing more.
TEST_F(Lifecycle, ACacheThatCannotDropAStagedContainerStopsTheCommandWith46) {
  auto c = installer();
  VSAResultCode code;
  auto first = create(*c, "com.example.first", &code, false, VSAClass::kBundleApplication);
  auto second = create(*c, "com.example.second", &code, false, VSAClass::kBundleApplication);
  ASSERT_TRUE(first && second);
  // The class map goes away while the command runs (an identity
  // invalidation), and the class directory cannot be listed any more.
  auto environment = std::make_shared<VSAStageForDeleteEnvironment>(*context_->stageEnvironment);
  VSARecordingCodeSigningChanges recorder;
  recorder.onRemove = [this](const std::string&, VSACommandQueue*) {
    context_->containerCache->invalidateUserIdentity(user_);
    faults_->failAll(Op::ReadDirectory, EIO);
  };
  environment->codeSigning = &recorder;
  std::vector<VSAResultCode> reported;
  VSACommandQueue queue;
  queue.insertCommand(VSACommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
      environment,
      {identity("com.example.first", VSAClass::kBundleApplication),
       identity("com.example.second", VSAClass::kBundleApplication)},
      true, [&](VSAResultCode failure) { reported.push_back(failure); }));
  code = VSAResult::kSuccess;
  EXPECT_FALSE(queue.executeAllUntilExhaustedOrError(&code));
  faults_->reset();
  EXPECT_EQ(code, 46u);
  EXPECT_EQ(reported, std::vector<VSAResultCode>{46});
  EXPECT_FALSE(fs::exists(first->url()));  // staged before the cache refused
  EXPECT_TRUE(fs::exists(second->url() + "/" + kVSAMetadataFileName));  // never reached
}

TEST_F(Lifecycle, DeathRowEntriesThatKeepResistingRemovalEndInTmp) {
  std::string deathrow = context_->globalConfiguration->deathrowDirectory();
  for (const char* name : {"a", "b", "c"}) {
    fs::create_directories(deathrow + "/" + name);
    std::ofstream(deathrow + "/" + name + "/file") << name;
  }
  // One refusal: the entry is removed at the next attempt.
  faults_->failNth(Op::Rmdir, 1, EBUSY);
  EXPECT_EQ(emptyDeathRow(), VSAResult::kSuccess);
  EXPECT_EQ(entries(deathrow), 0u);
  EXPECT_EQ(entries(root_ + "/tmp"), 0u);
  // An entry that keeps resisting is moved aside.
  fs::create_directories(deathrow + "/d");
  std::ofstream(deathrow + "/d/file") << "d";
  faults_->failAll(Op::Rmdir, EBUSY);
  EXPECT_EQ(emptyDeathRow(), VSAResult::kSuccess);
  faults_->reset();
  EXPECT_EQ(entries(deathrow), 0u);
  EXPECT_EQ(entries(root_ + "/tmp"), 1u);
  // Moving something that is not there succeeds and starts nothing.
  VSAErrorRef error;
  EXPECT_TRUE(context_->deathRow->_moveItemAtURLToDeathRow(root_ + "/nothing",
                                                           {.startDeletionThread = true}, &error));
  EXPECT_EQ(entries(deathrow), 0u);
}

}  // namespace
