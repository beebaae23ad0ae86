#include <gtest/gtest.h>

#include "daemon/VSAEntitlements.h"
#include "daemon/VSAGrants.h"

namespace {

VSAClientIdentityRef identityWith(VSAValue entitlements) {
  return std::make_shared<const VSAClientIdentity>("com.example.client", 501, 501, 42, nullptr,
                                                   std::move(entitlements), false,
                                                   std::array<uint8_t, 32>{}, false);
}

const VSACommandTableEntry& entry(size_t n) { return VSACommandTable()[n]; }

TEST(VSACommandTable, HasThirtyThreeEntriesNumberedByIndex) {
  ASSERT_EQ(VSACommandTable().size(), 33u);
  for (size_t i = 0; i < 33; ++i) EXPECT_EQ(VSACommandTable()[i].command, i);
  // Only the dispatcher-replied commands have the reply flag clear.
  for (size_t i = 0; i < 33; ++i) EXPECT_EQ(entry(i).replyAfterHandler, i != 4 && i != 21) << i;
  std::vector<size_t> open, lookup;
  for (size_t i = 0; i < 33; ++i) {
    if (entry(i).openToUnentitled) open.push_back(i);
    if (entry(i).honoursLookupEntitlement) lookup.push_back(i);
  }
  EXPECT_EQ(open, (std::vector<size_t>{0, 13, 15, 16, 17, 28, 32}));
  EXPECT_EQ(lookup, (std::vector<size_t>{0, 1, 13, 14, 15, 16, 17, 23, 32}));
  EXPECT_STREQ(entry(4).entitlement, kVSAEntitlementUserManagedAssets);
  EXPECT_STREQ(entry(11).entitlement, kVSAEntitlementWipeContainer);
  EXPECT_STREQ(entry(25).entitlement, kVSAEntitlementTestability);
  EXPECT_STREQ(entry(31).entitlement, kVSAEntitlementTestability);
}

TEST(VSAGrants, AllowedClientIsUnrestrictedExceptForTestability) {
  auto full = identityWith(VSAValue::Dictionary{{kVSAEntitlementAllowed, VSAValue(true)}});
  VSAGrants g = VSADeriveGrants(entry(10), full.get());
  EXPECT_TRUE(g.entitled && g.unrestricted && g.allowOtherIdLookup && g.admitted);
  EXPECT_FALSE(g.lookup);
  // "allowed" does not imply testability: commands 25 and 31 are refused.
  for (size_t n : {25u, 31u}) {
    g = VSADeriveGrants(entry(n), full.get());
    EXPECT_FALSE(g.unrestricted);
    EXPECT_FALSE(g.entitled);
    EXPECT_FALSE(g.admitted) << n;
  }
  auto tester = identityWith(VSAValue::Dictionary{{kVSAEntitlementAllowed, VSAValue(true)},
                                                  {kVSAEntitlementTestability, VSAValue(true)}});
  g = VSADeriveGrants(entry(31), tester.get());
  EXPECT_TRUE(g.entitled && g.admitted);
  EXPECT_FALSE(g.unrestricted);
}

TEST(VSAGrants, LookupDictionaryOpensOnlyTheCommandsThatHonourIt) {
  auto looker = identityWith(VSAValue::Dictionary{
      {kVSAEntitlementLookup, VSAValue::Dictionary{{"com.example.other", VSAValue(true)}}}});
  for (size_t n = 0; n < 33; ++n) {
    VSAGrants g = VSADeriveGrants(entry(n), looker.get());
    bool expected = entry(n).honoursLookupEntitlement || entry(n).openToUnentitled;
    EXPECT_EQ(g.admitted, expected) << n;
    EXPECT_EQ(g.lookup.has_value(), entry(n).honoursLookupEntitlement) << n;
    EXPECT_FALSE(g.unrestricted);
  }
  // A lookup value that is not a dictionary is ignored.
  auto wrong = identityWith(VSAValue::Dictionary{{kVSAEntitlementLookup, VSAValue("all")}});
  EXPECT_FALSE(VSADeriveGrants(entry(1), wrong.get()).admitted);
}

TEST(VSAGrants, OnlyNumbersGrantBooleanEntitlements) {
  auto stringYes = identityWith(VSAValue::Dictionary{{kVSAEntitlementAllowed, VSAValue("YES")},
                                                     {kVSAEntitlementOtherIdLookup, VSAValue(1)}});
  VSAGrants g = VSADeriveGrants(entry(10), stringYes.get());
  EXPECT_FALSE(g.entitled);
  EXPECT_FALSE(g.admitted);
  g = VSADeriveGrants(entry(0), stringYes.get());
  EXPECT_TRUE(g.admitted) << "command 0 is open to unentitled clients";
  EXPECT_TRUE(g.allowOtherIdLookup);
  EXPECT_FALSE(g.entitled);
}

TEST(VSAGrants, WipeListComesFromItsEntitlementArray) {
  auto wiper = identityWith(VSAValue::Dictionary{
      {kVSAEntitlementWipeContainer, VSAValue::Array{VSAValue("com.example.a")}}});
  VSAGrants g = VSADeriveGrants(entry(11), wiper.get());
  EXPECT_TRUE(g.entitled && g.admitted);
  ASSERT_TRUE(g.entitledWipeIdentifiers);
  EXPECT_EQ(g.entitledWipeIdentifiers->arrayValue()->size(), 1u);
  auto boolWiper =
      identityWith(VSAValue::Dictionary{{kVSAEntitlementWipeContainer, VSAValue(true)}});
  g = VSADeriveGrants(entry(11), boolWiper.get());
  EXPECT_FALSE(g.entitled);
  EXPECT_FALSE(g.admitted);
  auto full = identityWith(VSAValue::Dictionary{{kVSAEntitlementAllowed, VSAValue(true)}});
  g = VSADeriveGrants(entry(11), full.get());
  EXPECT_TRUE(g.entitled) << "without a list, entitled follows unrestricted";
  EXPECT_FALSE(g.entitledWipeIdentifiers);
}

TEST(VSAGrants, NoIdentityGetsOnlyOpenCommands) {
  for (size_t n = 0; n < 33; ++n) {
    VSAGrants g = VSADeriveGrants(entry(n), nullptr);
    EXPECT_EQ(g.admitted, entry(n).openToUnentitled) << n;
    EXPECT_FALSE(g.entitled || g.unrestricted || g.allowOtherIdLookup);
  }
}

}  // namespace
