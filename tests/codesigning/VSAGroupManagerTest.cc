// Group containers: counted by the code-signing entries that name them,
// removed (through stage-for-delete commands) when the last reference goes
// or at reconciliation, and handed to clients only with a grant.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <future>

#include "VSAContainerTestRoot.h"
#include "base/VSALocks.h"
#include "base/VSAPlist.h"

namespace fs = std::filesystem;

namespace {

class Groups : public VSAContainerTestRoot {
 protected:
  // Two users with base directories: the personal persona (mobile's home)
  // and an enterprise persona with its own layout.
  void SetUp() override {
    VSAContainerTestRoot::SetUp();
    VSAValue personas = VSAValue::Array{
        VSAValue::Dictionary{{"PersonaID", VSAValue(1000u)},
                             {"Kind", VSAValue("personal")},
                             {"UniqueString", VSAValue("PERSONAL-1000")}},
        VSAValue::Dictionary{{"PersonaID", VSAValue(1001u)},
                             {"Kind", VSAValue("enterprise")},
                             {"UniqueString", VSAValue("WORK-1001")},
                             {"LayoutPath", VSAValue("/private/var/enterprise/1001")}}};
    fs::create_directories(root_ + "/private/var/enterprise/1001");
    fs::create_directories(root_ + "/etc/vessad");
    ASSERT_TRUE(VSA_writeToURL(personas, root_ + "/etc/vessad/personas.plist", 0, nullptr));
    startContext();
    work_ = context_->userIdentityCache->userIdentityForPersonaUniqueString("WORK-1001", 501, 501);
    ASSERT_TRUE(work_);
  }
  VSAResultCode reg(const std::string& id, VSAValue entitlements, VSACommandQueue& q) {
    VSAValue info = VSAValue::Dictionary{{kVSAEntitlementsKey, std::move(entitlements)}};
    return context_->codeSigningMapping->processCodeSigningInfo(info, &id, VSAValue::dictionary(),
                                                                &q);
  }
  static VSAValue appGroups(VSAValue list) {
    return VSAValue::Dictionary{{kVSAEntitlementApplicationGroups, std::move(list)}};
  }
  static VSAValue strings(std::initializer_list<const char*> ids) {
    VSAValue::Array a;
    for (const char* id : ids) a.push_back(VSAValue(id));
    return VSAValue(std::move(a));
  }
  // A group container of `user` made through the normal creation path.
  VSAMetadataRef group(const std::string& id, const VSAUserIdentityRef& user,
                       VSAContainerClass c = VSAClass::kAppGroup) {
    VSAResultCode code = VSAResult::kSuccess;
    auto identity = VSAContainerIdentity::containerIdentityWithUserIdentity(user, id, c, &code);
    return installer()->createOrLookupContainerWithContainerIdentity(
        identity, {.createIfNecessary = true}, &code);
  }
  static VSAResultCode run(VSACommandQueue& q) {
    VSAResultCode code = VSAResult::kSuccess;
    bool ok = q.executeAllUntilExhaustedOrError(&code);
    EXPECT_EQ(ok, code == VSAResult::kSuccess) << code;
    return code;
  }
  VSAUserIdentityRef work_;
};

TEST_F(Groups, ASharedGroupGoesWithItsLastReferenceForEveryUser) {
  auto mine = group("group.example.shared", user_);
  auto theirs = group("group.example.shared", work_);
  ASSERT_TRUE(mine && theirs);
  ASSERT_NE(mine->url(), theirs->url());
  VSACommandQueue q;
  ASSERT_EQ(reg("com.example.a", appGroups(strings({"group.example.shared"})), q), 1u);
  // A single string is one group; listed twice it still counts once.
  ASSERT_EQ(reg("com.example.b", appGroups(VSAValue("group.example.shared")), q), 1u);
  ASSERT_EQ(
      reg("com.example.c", appGroups(strings({"group.example.shared", "group.example.shared"})), q),
      1u);
  EXPECT_EQ((*context_->codeSigningMapping->copyReferenceCountSetOfType(
                kVSAGroupTypeApplication))["group.example.shared"],
            3);
  ASSERT_EQ(reg("com.example.a", VSAValue::dictionary(), q), 1u);
  ASSERT_EQ(reg("com.example.c", VSAValue::dictionary(), q), 1u);
  EXPECT_EQ(q.count(), 0u);
  EXPECT_TRUE(fs::exists(mine->url()) && fs::exists(theirs->url()));
  ASSERT_EQ(reg("com.example.b", VSAValue::dictionary(), q), 1u);
  EXPECT_EQ(q.count(), 2u);  // one stage-for-delete per user, nothing done yet
  EXPECT_TRUE(fs::exists(mine->url()) && fs::exists(theirs->url()));
  run(q);
  EXPECT_FALSE(fs::exists(mine->url()));
  EXPECT_FALSE(fs::exists(theirs->url()));
}

TEST_F(Groups, ReconciliationRemovesOnlyUnreferencedGroupsAndAloneRemovesSystemGroups) {
  VSACommandQueue q;
  ASSERT_EQ(reg("com.example.a", appGroups(strings({"group.example.kept"})), q), 1u);
  ASSERT_EQ(reg("com.example.invalid", appGroups(strings({"group.example.held"})), q), 1u);
  ASSERT_TRUE(context_->codeSigningMapping->invalidateCodeSigningInfoForIdentifier(
      "com.example.invalid", nullptr));
  VSAValue system =
      VSAValue::Dictionary{{kVSAEntitlementSystemGroups, strings({"systemgroup.com.example.sys"})}};
  ASSERT_EQ(reg("com.example.sys", system, q), 1u);
  std::map<std::string, VSAMetadataRef> made;
  for (const char* id : {"group.example.kept", "group.example.held", "group.example.orphan"}) {
    made[id] = group(id, user_);
    made[std::string("work:") + id] = group(id, work_);
  }
  for (const char* id : {"systemgroup.com.example.sys", "systemgroup.com.example.orphan"})
    made[id] =
        group(id, context_->userIdentityCache->defaultUserIdentity(), VSAClass::kSystemGroup);
  for (const auto& [id, m] : made) ASSERT_TRUE(m) << id;

  // A registration that drops a system group leaves its container alone.
  ASSERT_EQ(reg("com.example.sys", VSAValue::dictionary(), q), 1u);
  EXPECT_EQ(q.count(), 0u);

  context_->groupManager->reconcileGroupContainersOfType(kVSAGroupTypeApplication, q);
  EXPECT_EQ(q.count(), 2u);  // group.example.orphan, for each user
  run(q);
  for (const auto& [id, m] : made) {
    bool orphanApp = id.find("group.example.orphan") != std::string::npos;
    EXPECT_EQ(fs::exists(m->url()), !orphanApp) << id;
  }
  context_->groupManager->reconcileGroupContainersOfType(kVSAGroupTypeSystem, q);
  run(q);
  EXPECT_FALSE(fs::exists(made["systemgroup.com.example.sys"]->url()));
  EXPECT_FALSE(fs::exists(made["systemgroup.com.example.orphan"]->url()));
  EXPECT_TRUE(fs::exists(made["group.example.kept"]->url()));
  EXPECT_TRUE(fs::exists(made["group.example.held"]->url()));  // an invalid entry holds it
}

TEST_F(Groups, AClientGetsAnOwnersGroupsOnlyWithAGrant) {
  VSACommandQueue q;
  ASSERT_EQ(reg("com.example.a", appGroups(strings({"group.example.a1", "group.example.a2"})), q),
            1u);
  ASSERT_EQ(reg("com.example.b", appGroups(strings({"group.example.b1", "group.example.b2"})), q),
            1u);
  auto appGroupsDir = classDirectory(VSAClass::kAppGroup);
  VSAResultCode code = VSAResult::kSuccess;
  auto self = connection("com.example.a", false, false);
  auto own =
      self->groupContainersForOwnerIdentifier("com.example.a", user_, VSAClass::kAppGroup, &code);
  ASSERT_TRUE(own) << code;
  ASSERT_EQ(own->size(), 2u);
  EXPECT_EQ((*own)[0].first, "group.example.a1");
  EXPECT_TRUE(fs::is_directory((*own)[0].second->url()));
  EXPECT_EQ(entries(appGroupsDir), 2u);
  // Another owner's groups: refused, and nothing is made or revealed.
  code = VSAResult::kSuccess;
  EXPECT_FALSE(
      self->groupContainersForOwnerIdentifier("com.example.b", user_, VSAClass::kAppGroup, &code));
  EXPECT_EQ(code, VSAResult::kNotEntitled);
  EXPECT_FALSE(self->groupContainerIdentifiersForOwnerIdentifier("com.example.b",
                                                                 VSAClass::kAppGroup, &code));
  EXPECT_EQ(entries(appGroupsDir), 2u);
  // A lookup entitlement listing one of them gives that one only.
  VSAValue lookup = VSAValue::Dictionary{{"appGroup", strings({"group.example.b2"})}};
  auto looker = connection("com.example.a", false, false, lookup);
  code = VSAResult::kSuccess;
  auto listed =
      looker->groupContainersForOwnerIdentifier("com.example.b", user_, VSAClass::kAppGroup, &code);
  ASSERT_TRUE(listed) << code;
  ASSERT_EQ(listed->size(), 1u);
  EXPECT_EQ((*listed)[0].first, "group.example.b2");
  // Only the group classes; an owner without entitlements has no groups.
  EXPECT_FALSE(installer()->groupContainerIdentifiersForOwnerIdentifier(
      "com.example.a", VSAClass::kDataApplication, &code));
  EXPECT_EQ(code, VSAResult::kInvalidArgument);
  auto none = installer()->groupContainerIdentifiersForOwnerIdentifier("com.example.none",
                                                                       VSAClass::kAppGroup, &code);
  ASSERT_TRUE(none);
  EXPECT_TRUE(none->empty());
}

TEST_F(Groups, AnOwnersGroupsAreListedUnderTheAllIdentifiersWriteLock) {
  using namespace std::chrono_literals;
  VSACommandQueue q;
  ASSERT_EQ(reg("com.example.a", appGroups(strings({"group.example.a1"})), q), 1u);
  VSAValue owner("com.example.a");
  auto list = [&](bool useLocking) {
    return std::async(std::launch::async, [&, useLocking] {
      VSAResultCode code = VSAResult::kSuccess;
      return context_->groupManager->groupContainerIdentifiersForOwnerIdentifier(
          &owner, VSAClass::kAppGroup, useLocking, &code);
    });
  };
  // A reader of all identifiers (a look-up in progress) holds the listing back.
  context_->locks->lock_all_identifiers_read();
  auto waiting = list(true);
  EXPECT_EQ(waiting.wait_for(300ms), std::future_status::timeout);
  // Without locking the caller's own hold is enough.
  auto unlocked = list(false);
  ASSERT_EQ(unlocked.wait_for(10s), std::future_status::ready);
  EXPECT_EQ(unlocked.get()->size(), 1u);
  context_->locks->unlock_all_identifiers();
  ASSERT_EQ(waiting.wait_for(10s), std::future_status::ready);
  auto ids = waiting.get();
  ASSERT_TRUE(ids);
  EXPECT_EQ(*ids, std::vector<std::string>{"group.example.a1"});
}

}  // namespace
