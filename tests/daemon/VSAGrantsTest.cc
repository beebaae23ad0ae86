#include <gtest/gtest.h>

#include "base/VSACommands.h"
#include "daemon/VSAEntitlements.h"
#include "daemon/VSAGrants.h"

namespace {

VSAClientIdentityRef identityWith(VSAValue entitlements) {
  return std::make_shared<const VSAClientIdentity>("com.example.client", 501, 501, 42, nullptr,
                                                   std::move(entitlements), false,
                                                   std::array<uint8_t, 32>{}, false);
}

const VSACommandTableEntry& entry(VSACommandNumber n) { return VSACommandTable()[n]; }

TEST(VSACommandTable, HasThirtyThreeEntriesNumberedByIndex) {
  using namespace VSACommands;
  ASSERT_EQ(VSACommandTable().size(), 33u);
  for (VSACommandNumber i = 0; i < 33; ++i) EXPECT_EQ(VSACommandTable()[i].command, i);
  // Only the commands that answer from their completion have the reply flag clear.
  for (VSACommandNumber i = 0; i < 33; ++i)
    EXPECT_EQ(entry(i).replyAfterHandler, i != kDeleteDeathRow && i != kSetDataProtection) << i;
  std::vector<VSACommandNumber> open, lookup;
  for (VSACommandNumber i = 0; i < 33; ++i) {
    if (entry(i).openToUnentitled) open.push_back(i);
    if (entry(i).honoursLookupEntitlement) lookup.push_back(i);
  }
  EXPECT_EQ(open, (std::vector<VSACommandNumber>{
                      kCreateOrLookup, kGroupContainers, kSystemContainerPath, kGroupContainerPaths,
                      kSystemGroupContainerPath, kUserManagedAssetsPath, kPersonaUniqueStrings}));
  EXPECT_EQ(lookup, (std::vector<VSACommandNumber>{
                        kCreateOrLookup, kListContainers, kGroupContainers,
                        kGroupContainerIdentifiers, kSystemContainerPath, kGroupContainerPaths,
                        kSystemGroupContainerPath, kDiskUsage, kPersonaUniqueStrings}));
  EXPECT_STREQ(entry(VSACommands::kDeleteDeathRow).entitlement, kVSAEntitlementUserManagedAssets);
  EXPECT_STREQ(entry(VSACommands::kWipePluginData).entitlement, kVSAEntitlementWipeContainer);
  EXPECT_STREQ(entry(VSACommands::kRetryTest).entitlement, kVSAEntitlementTestability);
  EXPECT_STREQ(entry(VSACommands::kTestLock).entitlement, kVSAEntitlementTestability);
}

TEST(VSAGrants, AllowedClientIsUnrestrictedExceptForTestability) {
  auto full = identityWith(VSAValue::Dictionary{{kVSAEntitlementAllowed, VSAValue(true)}});
  VSAGrants g = VSADeriveGrants(entry(VSACommands::kDeleteContainer), full.get());
  EXPECT_TRUE(g.entitled && g.unrestricted && g.allowOtherIdLookup && g.admitted);
  EXPECT_FALSE(g.lookup);
  // "allowed" does not imply testability: the retry test and test locks are refused.
  for (VSACommandNumber n : {VSACommands::kRetryTest, VSACommands::kTestLock}) {
    g = VSADeriveGrants(entry(n), full.get());
    EXPECT_FALSE(g.unrestricted);
    EXPECT_FALSE(g.entitled);
    EXPECT_FALSE(g.admitted) << n;
  }
  auto tester = identityWith(VSAValue::Dictionary{{kVSAEntitlementAllowed, VSAValue(true)},
                                                  {kVSAEntitlementTestability, VSAValue(true)}});
  g = VSADeriveGrants(entry(VSACommands::kTestLock), tester.get());
  EXPECT_TRUE(g.entitled && g.admitted);
  EXPECT_FALSE(g.unrestricted);
}

TEST(VSAGrants, LookupDictionaryOpensOnlyTheCommandsThatHonourIt) {
  auto looker = identityWith(VSAValue::Dictionary{
      {kVSAEntitlementLookup, VSAValue::Dictionary{{"com.example.other", VSAValue(true)}}}});
  for (VSACommandNumber n = 0; n < 33; ++n) {
    VSAGrants g = VSADeriveGrants(entry(n), looker.get());
    bool expected = entry(n).honoursLookupEntitlement || entry(n).openToUnentitled;
    EXPECT_EQ(g.admitted, expected) << n;
    EXPECT_EQ(g.lookup.has_value(), entry(n).honoursLookupEntitlement) << n;
    EXPECT_FALSE(g.unrestricted);
  }
  // A lookup value that is not a dictionary is ignored.
  auto wrong = identityWith(VSAValue::Dictionary{{kVSAEntitlementLookup, VSAValue("all")}});
  EXPECT_FALSE(VSADeriveGrants(entry(VSACommands::kListContainers), wrong.get()).admitted);
}

TEST(VSAGrants, OnlyNumbersGrantBooleanEntitlements) {
  auto stringYes = identityWith(VSAValue::Dictionary{{kVSAEntitlementAllowed, VSAValue("YES")},
                                                     {kVSAEntitlementOtherIdLookup, VSAValue(1)}});
  VSAGrants g = VSADeriveGrants(entry(VSACommands::kDeleteContainer), stringYes.get());
  EXPECT_FALSE(g.entitled);
  EXPECT_FALSE(g.admitted);
  g = VSADeriveGrants(entry(VSACommands::kCreateOrLookup), stringYes.get());
  EXPECT_TRUE(g.admitted) << "command 0 is open to unentitled clients";
  EXPECT_TRUE(g.allowOtherIdLookup);
  EXPECT_FALSE(g.entitled);
}

TEST(VSAGrants, WipeListComesFromItsEntitlementArray) {
  auto wiper = identityWith(VSAValue::Dictionary{
      {kVSAEntitlementWipeContainer, VSAValue::Array{VSAValue("com.example.a")}}});
  VSAGrants g = VSADeriveGrants(entry(VSACommands::kWipePluginData), wiper.get());
  EXPECT_TRUE(g.entitled && g.admitted);
  ASSERT_TRUE(g.entitledWipeIdentifiers);
  EXPECT_EQ(g.entitledWipeIdentifiers->arrayValue()->size(), 1u);
  auto boolWiper =
      identityWith(VSAValue::Dictionary{{kVSAEntitlementWipeContainer, VSAValue(true)}});
  g = VSADeriveGrants(entry(VSACommands::kWipePluginData), boolWiper.get());
  EXPECT_FALSE(g.entitled);
  EXPECT_FALSE(g.admitted);
  auto full = identityWith(VSAValue::Dictionary{{kVSAEntitlementAllowed, VSAValue(true)}});
  g = VSADeriveGrants(entry(VSACommands::kWipePluginData), full.get());
  EXPECT_TRUE(g.entitled) << "without a list, entitled follows unrestricted";
  EXPECT_FALSE(g.entitledWipeIdentifiers);
}

TEST(VSAGrants, NoIdentityGetsOnlyOpenCommands) {
  for (VSACommandNumber n = 0; n < 33; ++n) {
    VSAGrants g = VSADeriveGrants(entry(n), nullptr);
    EXPECT_EQ(g.admitted, entry(n).openToUnentitled) << n;
    EXPECT_FALSE(g.entitled || g.unrestricted || g.allowOtherIdLookup);
  }
}

}  // namespace
