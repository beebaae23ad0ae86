// Crash sweeps of every operation that changes the disk, judged by the root
// checker. For each crash point n the operation runs with the file system
// stopped after its n-th call, twice: once as if the process had died there
// (every later call fails and changes nothing; what reached the disk stays),
// and once as if the device had lost power there (the same, and what the
// operation had not yet made durable is undone: unsynced renames go back,
// entries made in directories not synced since vanish). Then a new daemon
// context starts on the same root as the first start after a boot (boot
// setup, replace recovery, pending protection changes, both cleanups), and:
//   - the root checker finds nothing,
//   - every container that existed before and that the operation does not
//     remove is still found, with the same UUID,
//   - the operation's own promise holds (below, per operation).
// CI runs a sample of the crash points of each operation; VESSA_SWEEP=full
// runs every one. The table of operations, crash points and clean restarts
// (a row per crash model) is printed at the end:
//   VESSA_SWEEP=full build/tests/test_reliability --gtest_filter='CrashSweep.*'
#include <gtest/gtest.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <set>

#include "VSAContainerTestRoot.h"
#include "base/VSAPlist.h"
#include "daemon/VSARootChecker.h"
#include "model/VSAPerUserConfiguration.h"
#include "operations/VSADeathRow.h"

namespace fs = std::filesystem;

namespace {

struct SweepRow {
  std::string operation;
  int points = 0, run = 0, clean = 0;
  std::string codes;  // result codes answered under injected failures
};

std::vector<SweepRow>& sweepTable() {
  static std::vector<SweepRow> rows;
  return rows;
}

class SweepTablePrinter : public ::testing::Environment {
 public:
  void TearDown() override {
    if (sweepTable().empty()) return;
    std::printf("\n%-56s %12s %8s %8s  %s\n", "operation", "crash points", "run", "clean", "codes");
    for (const auto& r : sweepTable())
      std::printf("%-56s %12d %8d %8d  %s\n", r.operation.c_str(), r.points, r.run, r.clean,
                  r.codes.c_str());
  }
};
const auto* const kPrinter = ::testing::AddGlobalTestEnvironment(new SweepTablePrinter);

bool fullSweep() {
  const char* v = std::getenv("VESSA_SWEEP");
  return v && std::string(v) == "full";
}

class CrashSweep : public VSAContainerTestRoot {
 protected:
  struct Known {
    VSAContainerClass containerClass;
    std::optional<VSAUUID> uuid;  // none: it must exist, whatever its UUID
  };

  // A container the sweep must never lose.
  VSAMetadataRef made(const std::string& id, VSAContainerClass c = VSAClass::kDataApplication) {
    VSAResultCode code;
    auto m = create(*installer(), id, &code, false, c);
    EXPECT_TRUE(m) << id << ": " << code;
    if (m) known_[id] = {c, m->uuid()};
    return m;
  }
  void drainBackground() {
    context_->backgroundQueue->sync([] {});
  }

  // The first start after a device boot, on a new context (unlocked).
  void restartAfterBoot() {
    drainBackground();
    // A change still waiting for the unlock dies with the process: it runs
    // against a file system that changes nothing any more.
    if (context_->lockStateQueue->suspendCount() > 0) {
      faults_->crashAfter(0);
      context_->lockStateQueue->resume();
      context_->lockStateQueue->sync([] {});
    }
    context_->lockState->setLockState(0);
    context_.reset();
    startContext();
    auto c = installer();
    c->rebootKeeperSetup();
    c->keeperSetup();
    std::promise<void> first, every;
    c->rebootKeeperCleanupWithCompletion([&] { first.set_value(); });
    first.get_future().wait();
    c->keeperCleanupWithCompletion([&] { every.set_value(); });
    every.get_future().wait();
    drainBackground();
  }

  // The root checker's verdict, with every finding in the failure message.
  // A daemon that is still running may have left what its next start
  // finishes (`startWillRepair`); nothing else.
  void expectCheckerClean(bool startWillRepair = false) {
    VSARootChecker checker(root_);
    auto status = checker.check();
    if (startWillRepair && status == VSARootChecker::kFindings) {
      for (const auto& f : checker.findings()) EXPECT_TRUE(f.repairedAtStart) << checker.text();
    } else {
      EXPECT_EQ(status, VSARootChecker::kClean) << checker.text();
    }
  }
  // The start after a crash of the daemon alone (no device boot).
  void restart() {
    drainBackground();
    VSAContainerTestRoot::restart();
    drainBackground();
  }
  void expectNothingLost() {
    for (const auto& [id, k] : known_) {
      auto found = lookup(id, k.containerClass);
      EXPECT_TRUE(found) << id << " was lost";
      if (found && k.uuid) {
        EXPECT_EQ(found->uuid(), *k.uuid) << id;
      }
    }
  }

  // Sweeps `operation` over its crash points, under each crash model.
  // `prepare(k)` makes what the operation works on (fresh names for each run
  // k: 0 uninterrupted, then one number per crash point and model);
  // `operation(k)` answers its result code (it must succeed when nothing
  // stops it); `after(k)` checks the operation's own promise once the root
  // has been brought into order; it finds the code the run answered in
  // `answered_`: a result the operation reported done must outlive the crash.
  void sweep(const std::string& name, const std::function<void(int)>& prepare,
             const std::function<VSAResultCode(int)>& operation,
             const std::function<void(int)>& after) {
    prepare(0);
    faults_->reset();
    answered_ = operation(0);
    ASSERT_EQ(answered_, VSAResult::kSuccess) << name << " does not succeed uninterrupted";
    int total = faults_->totalCalls();
    restartAfterBoot();
    after(0);
    ASSERT_GT(total, 0);
    using CrashModel = VSAFaultInjectingFileSystem::CrashModel;
    for (CrashModel model : {CrashModel::ProcessDeath, CrashModel::PowerLoss}) {
      bool powerLoss = model == CrashModel::PowerLoss;
      SweepRow row{name + (powerLoss ? " (power loss)" : ""), total, 0, 0, ""};
      for (int n : crashPoints(total)) {
        SCOPED_TRACE(row.operation + ": crash after call " + std::to_string(n) + " of " +
                     std::to_string(total));
        int k = powerLoss ? total + n : n;
        prepare(k);
        faults_->reset();
        faults_->crashAfter(n, model);
        answered_ = operation(k);
        // Background work the operation started (emptying death row) dies
        // with the process too: it must not run on once the file system
        // works again, moving half-removed trees aside as no crash would.
        drainBackground();
        // An operation that made fewer calls than the crash point (the last
        // point: all of them) returned first; the power fails after it.
        faults_->crashNow();
        faults_->reset();
        restartAfterBoot();
        ++row.run;
        expectCheckerClean();
        expectNothingLost();
        after(k);
        if (HasFailure()) break;
        ++row.clean;
      }
      sweepTable().push_back(row);
      std::printf("%s: %d crash points, %d run, %d clean\n", row.operation.c_str(), total, row.run,
                  row.clean);
      if (HasFailure()) return;
    }
  }

  // Every call of the run, or a dozen spread over it (always the last).
  static std::vector<int> crashPoints(int total) {
    const int stride = fullSweep() ? 1 : std::max(1, total / 12);
    std::vector<int> points;
    for (int n = 1; n <= total; n += stride) points.push_back(n);
    if (points.back() != total) points.push_back(total);
    return points;
  }

  // Fails the n-th file-system call of `operation` with `error` (the disk
  // full, a bad sector) for each n. The daemon goes on: the operation
  // answers a failure code (or copes), every container is still found, and
  // the root checker finds nothing but what the next start finishes; after
  // that start it finds nothing at all.
  void failureSweep(const std::string& name, int error, const std::function<void(int)>& prepare,
                    const std::function<VSAResultCode(int)>& operation) {
    prepare(0);
    faults_->reset();
    ASSERT_EQ(operation(0), VSAResult::kSuccess) << name << " does not succeed uninterrupted";
    int total = faults_->totalCalls();
    drainBackground();
    SweepRow row{name + (error == ENOSPC ? " (ENOSPC)" : " (EIO)"), total, 0, 0, ""};
    std::set<VSAResultCode> codes;
    for (int n : crashPoints(total)) {
      SCOPED_TRACE(row.operation + ": call " + std::to_string(n) + " of " + std::to_string(total));
      prepare(n);
      faults_->reset();
      faults_->failCall(n, error);
      codes.insert(operation(n));
      faults_->reset();
      drainBackground();
      ++row.run;
      expectCheckerClean(true);
      expectNothingLost();
      restart();
      expectCheckerClean();
      expectNothingLost();
      if (HasFailure()) break;
      ++row.clean;
    }
    for (VSAResultCode c : codes) row.codes += (row.codes.empty() ? "" : ",") + std::to_string(c);
    sweepTable().push_back(row);
    std::printf("%s: %d calls, %d run, %d clean, codes %s\n", row.operation.c_str(), total, row.run,
                row.clean, row.codes.c_str());
  }

  // Protection class 3 for `m`'s container, through the manager; its code.
  VSAResultCode protect(const VSAMetadataRef& m) {
    auto done = std::make_shared<std::promise<VSAResultCode>>();
    context_->dataProtectionManager->setDataProtectionOnDataContainerForContainerIdentity(
        *m->containerIdentity(), 3, false, true,
        [done](VSAResultCode code) { done->set_value(code); });
    auto reply = done->get_future();
    if (reply.wait_for(std::chrono::seconds(20)) != std::future_status::ready) {
      ADD_FAILURE() << "no reply";
      return VSAResult::kInvalidArgument;
    }
    return reply.get();
  }

  static std::string at(const char* prefix, int n) { return prefix + std::to_string(n); }
  std::map<std::string, Known> known_;
  VSAResultCode answered_ = VSAResult::kSuccess;  // by the sweep's last run of the operation
};

TEST_F(CrashSweep, CreationOfDataAndSystemContainers) {
  for (VSAContainerClass c : {VSAClass::kDataApplication, VSAClass::kSystemData}) {
    std::string prefix =
        c == VSAClass::kDataApplication ? "com.example.new." : "com.example.system.";
    std::map<std::string, std::string> whole;  // what the uninterrupted creation made
    sweep(
        c == VSAClass::kDataApplication ? "create data container" : "create system container",
        [](int) {},
        [&](int n) {
          VSAResultCode code;
          create(*installer(), prefix + std::to_string(n), &code, false, c);
          return code;
        },
        [&](int n) {
          // Made whole or not at all; if made, it must stay. One reported
          // made must have been made.
          auto m = lookup(prefix + std::to_string(n), c);
          if (answered_ == VSAResult::kSuccess) {
            EXPECT_TRUE(m) << "a container reported created was lost";
          }
          if (!m) return;
          known_[prefix + std::to_string(n)] = {c, m->uuid()};
          if (n == 0) whole = shapeOf(m->url());
          EXPECT_EQ(shapeOf(m->url()), whole);
        });
  }
}

TEST_F(CrashSweep, DeletionThroughDeathRow) {
  sweep(
      "delete + empty death row", [&](int n) { made(at("com.example.doomed.", n)); },
      [&](int n) {
        known_.erase(at("com.example.doomed.", n));
        VSAResultCode code = stage({identity(at("com.example.doomed.", n))});
        emptyDeathRow();
        return code;
      },
      [&](int n) {
        // Either still whole (the rename did not happen) or gone for good;
        // gone if the deletion was reported done.
        EXPECT_EQ(entries(context_->globalConfiguration->deathrowDirectory()), 0u) << n;
        if (answered_ == VSAResult::kSuccess) {
          EXPECT_FALSE(lookup(at("com.example.doomed.", n))) << "a deleted container came back";
        }
      });
}

TEST_F(CrashSweep, WipeKeepsPathAndUUID) {
  std::string file;
  std::map<std::string, std::string> fresh;  // what the uninterrupted wipe left
  sweep(
      "wipe data container",
      [&](int n) {
        auto m = made(at("com.example.wiped.", n));
        file = m->url() + "/Documents/precious";
        put(file, "precious");
      },
      [&](int n) {
        VSAResultCode code = VSAResult::kSuccess;
        installer()->deleteDataContainerContentWithContainerIdentity(
            identity(at("com.example.wiped.", n)), &code);
        return code;
      },
      [&](int n) {
        auto m = lookup(at("com.example.wiped.", n));
        ASSERT_TRUE(m);
        // Old content whole, or a fresh structure; fresh if the wipe was
        // reported done.
        if (n == 0) fresh = shapeOf(m->url());
        if (answered_ == VSAResult::kSuccess) {
          EXPECT_NE(read(file), "precious") << "a wiped container's content came back";
        }
        if (read(file) != "precious") {
          EXPECT_EQ(shapeOf(m->url()), fresh);
        }
      });
}

TEST_F(CrashSweep, ReplaceLosesNeitherContainer) {
  VSAMetadataRef oldM, newM;
  sweep(
      "replace",
      [&](int n) {
        oldM = made(at("com.example.old.", n));
        newM = made(at("com.example.new.", n));
      },
      [&](int n) {
        // The old container may go; the new one must stay, with its UUID.
        known_.erase(at("com.example.old.", n));
        VSAResultCode code = VSAResult::kSuccess;
        installer()->replaceContainerIdentity(oldM->containerIdentity(), newM->containerIdentity(),
                                              false, false, &code);
        return code;
      },
      [&](int n) {
        if (answered_ == VSAResult::kSuccess) {
          EXPECT_FALSE(lookup(at("com.example.old.", n))) << "a replaced container came back";
        }
      });
}

TEST_F(CrashSweep, MaintenanceOperations) {
  std::string before;
  sweep(
      "regenerate directory UUID",
      [&](int n) { before = made(at("com.example.renamed.", n))->url(); },
      [&](int n) {
        // The directory's name changes; the container's UUID does not.
        VSAResultCode code = VSAResult::kSuccess;
        installer()->regenerateDirectoryUUIDWithContainerIdentity(
            identity(at("com.example.renamed.", n)), &code);
        return code;
      },
      [&](int n) {
        auto m = lookup(at("com.example.renamed.", n));
        ASSERT_TRUE(m);
        if (answered_ == VSAResult::kSuccess) {
          EXPECT_NE(m->url(), before) << "the directory's new name was lost";
        }
      });
  std::map<std::string, std::string> whole;  // a container with its default structure
  sweep(
      "recreate default structure",
      [&](int n) {
        auto m = made(at("com.example.restructured.", n));
        if (n == 0) whole = shapeOf(m->url());
        fs::remove_all(m->url() + "/Library");
      },
      [&](int n) {
        VSAResultCode code = VSAResult::kSuccess;
        installer()->recreateDefaultStructureWithContainerIdentity(
            identity(at("com.example.restructured.", n)), &code);
        return code;
      },
      [&](int n) {
        auto m = lookup(at("com.example.restructured.", n));
        ASSERT_TRUE(m);
        if (answered_ == VSAResult::kSuccess) {
          EXPECT_EQ(shapeOf(m->url()), whole) << "the recreated structure was lost";
        }
      });
  sweep(
      "set info value", [&](int n) { made(at("com.example.info.", n)); },
      [&](int n) {
        VSAResultCode code = VSAResult::kSuccess;
        VSAValue key("Flavour"), value("mint");
        installer()->setInfoValue(&value, &key, identity(at("com.example.info.", n)), true, &code);
        return code;
      },
      [&](int n) {
        VSAResultCode code = VSAResult::kSuccess;
        VSAValue key("Flavour");
        auto v =
            installer()->infoValueForKey(&key, identity(at("com.example.info.", n)), true, &code);
        if (answered_ == VSAResult::kSuccess) {
          EXPECT_TRUE(v) << "a value reported set was lost";
        }
        if (v) {
          ASSERT_TRUE(v->stringValue());
          EXPECT_EQ(*v->stringValue(), "mint");
        }
      });
}

TEST_F(CrashSweep, ProtectionChangeWhileUnlocked) {
  VSAMetadataRef target;
  sweep(
      "protection change (unlocked)",
      [&](int n) {
        target = made(at("com.example.protected.", n));
        put(target->url() + "/Library/file", "data");
      },
      [&](int) { return protect(target); },
      [&](int) {
        // A change that was written down is finished by the start.
        EXPECT_EQ(entries(context_->globalConfiguration->pendingUpdatesDirectory()), 0u);
      });
}

// While the device is locked a change is written down and waits for the
// unlock; the device reboots instead (the crash), and the first start after
// it, unlocked, finishes what was written down.
TEST_F(CrashSweep, ProtectionChangeWhileLocked) {
  VSAMetadataRef target;
  sweep(
      "protection change (locked, then reboot)",
      [&](int n) {
        context_->lockState->setLockState(0);
        target = made(at("com.example.locked.", n));
        put(target->url() + "/Library/file", "data");
        context_->lockState->setLockState(1);
        context_->lockStateQueue->suspend();  // as the daemon does while locked
      },
      [&](int) {
        auto done = std::make_shared<std::promise<VSAResultCode>>();
        context_->dataProtectionManager->setDataProtectionOnDataContainerForContainerIdentity(
            *target->containerIdentity(), 1, false, true,
            [done](VSAResultCode code) { done->set_value(code); });
        // Written down and waiting (success), or refused at once.
        auto reply = done->get_future();
        if (reply.wait_for(std::chrono::milliseconds(200)) == std::future_status::ready)
          return reply.get();
        return entries(context_->globalConfiguration->pendingUpdatesDirectory()) == 1
                   ? VSAResult::kSuccess
                   : VSAResult::kInvalidArgument;
      },
      [&](int) {
        EXPECT_EQ(entries(context_->globalConfiguration->pendingUpdatesDirectory()), 0u);
      });
}

TEST_F(CrashSweep, GroupRemovalAtItsLastReference) {
  auto reg = [&](const std::string& id, VSAValue entitlements, VSACommandQueue& q) {
    VSAValue info = VSAValue::Dictionary{{kVSAEntitlementsKey, std::move(entitlements)}};
    return context_->codeSigningMapping->processCodeSigningInfo(info, &id, VSAValue::dictionary(),
                                                                &q);
  };
  sweep(
      "group removal (last reference)",
      [&](int n) {
        made(at("group.example.", n), VSAClass::kAppGroup);
        VSACommandQueue q;
        reg(at("com.example.member.", n),
            VSAValue::Dictionary{{kVSAEntitlementApplicationGroups,
                                  VSAValue::Array{VSAValue(at("group.example.", n))}}},
            q);
      },
      [&](int n) {
        known_.erase(at("group.example.", n));
        VSACommandQueue q;
        VSAResultCode code = reg(at("com.example.member.", n), VSAValue::dictionary(), q);
        if (code != VSAResult::kSuccess) return code;
        bool ok = q.executeAllUntilExhaustedOrError(&code);
        return ok ? VSAResult::kSuccess : code;
      },
      [](int) {});
}

TEST_F(CrashSweep, BootSetupRestoresBackedUpSystemContainers) {
  sweep(
      "boot setup: system container restore",
      [&](int n) {
        auto perUser = context_->globalConfiguration->getPerUserConfigurationForUserIdentity(
            installer()->grants().clientUserIdentity);
        std::string backup = perUser->systemContainerBackupDirectory();
        fs::create_directories(backup + "/" + at("com.example.restored.", n) + "/Library");
        put(backup + "/" + at("com.example.restored.", n) + "/Library/prefs", "backed up");
      },
      [&](int) {
        installer()->rebootKeeperSetup();
        return VSAResult::kSuccess;  // it reports nothing; the after-check judges it
      },
      [&](int n) {
        // A restore that a crash interrupted is finished at the next boot.
        auto m = lookup(at("com.example.restored.", n), VSAClass::kSystemData);
        ASSERT_TRUE(m);
        EXPECT_EQ(read(m->url() + "/Library/prefs"), "backed up");
        known_[at("com.example.restored.", n)] = {VSAClass::kSystemData, m->uuid()};
      });
}

TEST_F(CrashSweep, BootCleanupOfOrphansStagingAndTransientContainers) {
  sweep(
      "boot cleanup: orphans, staging, transient",
      [&](int n) {
        made(at("com.example.neighbour.", n));
        fs::create_directories(classDirectory() + "/" + VSAUUID::random().string() + "/Documents");
        fs::create_directories(staging() + "/" + VSAUUID::random().string() + "/Library");
        VSAResultCode code;
        create(*installer(), at("com.example.transient.", n), &code, true);
      },
      [&](int) {
        auto c = installer();
        std::promise<void> first, every;
        c->rebootKeeperCleanupWithCompletion([&] { first.set_value(); });
        first.get_future().wait();
        c->keeperCleanupWithCompletion([&] { every.set_value(); });
        every.get_future().wait();
        return VSAResult::kSuccess;  // it reports nothing; the checker judges it
      },
      [&](int) { EXPECT_EQ(entries(classDirectory(VSAClass::kDataApplication, true)), 0u); });
}

}  // namespace

namespace {

TEST_F(CrashSweep, FullDiskAndIOErrorsAtEachStepLeaveTheRootInOrder) {
  VSAMetadataRef oldM, newM, target;
  for (int error : {ENOSPC, EIO}) {
    if (HasFailure()) return;
    failureSweep(
        "create data container", error, [](int) {},
        [&](int n) {
          VSAResultCode code;
          std::string id = at(error == EIO ? "com.example.eio." : "com.example.full.", n);
          if (auto m = create(*installer(), id, &code))
            known_[id] = {VSAClass::kDataApplication, m->uuid()};
          return code;
        });
    failureSweep(
        "replace", error,
        [&](int n) {
          oldM = made(at(error == EIO ? "com.example.eio.old." : "com.example.full.old.", n));
          newM = made(at(error == EIO ? "com.example.eio.new." : "com.example.full.new.", n));
        },
        [&](int) {
          VSAResultCode code = VSAResult::kSuccess;
          installer()->replaceContainerIdentity(oldM->containerIdentity(),
                                                newM->containerIdentity(), false, false, &code);
          // Once the new container has moved into its place the old one may
          // go, even if tidying up after the swap failed.
          auto now = lookup(newM->identifier());
          if (code == VSAResult::kSuccess || (now && now->url() != newM->url()))
            known_.erase(oldM->identifier());
          return code;
        });
    failureSweep(
        "protection change", error,
        [&](int n) {
          target = made(at(error == EIO ? "com.example.eio.p." : "com.example.full.p.", n));
          put(target->url() + "/Library/file", "data");
        },
        [&](int) { return protect(target); });
  }
}

}  // namespace

namespace {

// The sweeps start from a root whose directories exist and count as durable.
// On a fresh root the first start makes them (class directories, staging,
// the library directory), and a container committed into a class directory
// lives only as long as that directory's own entry: the power fails right
// after the first creation was reported, and the container must be found.
TEST_F(CrashSweep, AContainerMadeOnAFreshRootOutlivesAPowerLoss) {
  VSATestTempDir fresh{"vessa-fresh"};
  context_.reset();
  root_ = fresh.path();
  VSAWriteMobileUser(root_);
  std::ofstream(root_ + "/etc/group") << "mobile:x:501:\nsystemusers:x:600:\n";
  using CrashModel = VSAFaultInjectingFileSystem::CrashModel;
  // Tracked from the context's first call: nothing the daemon made is durable
  // until it syncs it.
  context_ = std::make_unique<VSADaemonContext>(
      VSASystemRoot(root_), [this](std::shared_ptr<VSAFileSystem> real) {
        faults_ = std::make_shared<VSAFaultInjectingFileSystem>(std::move(real));
        faults_->crashAfter(1 << 30, CrashModel::PowerLoss);
        return faults_;
      });
  user_ = context_->userIdentityCache->userIdentityForPersonalPersona();
  auto c = installer();
  c->rebootKeeperSetup();
  c->keeperSetup();
  for (VSAContainerClass cls : {VSAClass::kDataApplication, VSAClass::kSystemData}) {
    VSAResultCode code;
    std::string id =
        cls == VSAClass::kDataApplication ? "com.example.first" : "com.example.first.system";
    auto m = create(*installer(), id, &code, false, cls);
    ASSERT_TRUE(m) << code;
    known_[id] = {cls, m->uuid()};
  }
  faults_->crashNow();
  faults_->reset();
  restartAfterBoot();
  expectCheckerClean();
  expectNothingLost();
  context_.reset();  // before `fresh` goes
}

// Death row is emptied while other work moves items onto it: an emptying
// can remove the fresh directory an item is about to be moved into. The item
// must then still reach death row (a deletion told "done" must be done),
// not stay where it was.
TEST_F(CrashSweep, AnItemStillReachesDeathRowWhenAnEmptyingTookItsDirectoryFirst) {
  auto m = made("com.example.doomed");
  known_.clear();
  faults_->reset();
  faults_->failNth(VSAFileSystem::Op::Rename, 1, ENOENT);  // the directory vanished
  VSAErrorRef error;
  ASSERT_TRUE(context_->deathRow->_moveItemAtURLToDeathRow(m->url(), {}, &error)) << error;
  EXPECT_FALSE(fs::exists(m->url()));
  EXPECT_EQ(entries(context_->globalConfiguration->deathrowDirectory()), 1u);
  // The batch move of the boot's orphans does the same.
  std::string orphan = classDirectory() + "/" + VSAUUID::random().string();
  fs::create_directories(orphan);
  faults_->reset();
  faults_->failNth(VSAFileSystem::Op::Rename, 1, ENOENT);
  EXPECT_TRUE(context_->deathRow->_moveEntriesToDeathRowWithoutSync({orphan}));
  EXPECT_FALSE(fs::exists(orphan));
}

}  // namespace
