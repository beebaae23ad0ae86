#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "VSATestTempDir.h"
#include "model/FakePersonaService.h"
#include "model/VSAConcreteContainerIdentity.h"
#include "model/VSAContainerIdentity.h"
#include "model/VSAUserIdentityCache.h"

namespace {

using Kind = VSAPersonaAttributes::Kind;
using namespace std::chrono_literals;

class UserIdentities : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = temp_.path();
    std::filesystem::create_directories(root_ + "/etc");
    std::filesystem::create_directories(root_ + "/private/var/mobile");
    std::filesystem::create_directories(root_ + "/private/var/u502");
    std::ofstream(root_ + "/etc/passwd") << "mobile:x:501:501::/private/var/mobile:/bin/sh\n"
                                            "other:x:502:502::/private/var/u502:/bin/sh\n";
    personas_ = std::make_shared<FakePersonaService>();
    personas_->personas = std::vector<VSAPersonaAttributes>{
        FakePersonaService::persona(Kind::Personal, 1000, "P-1000", {"com.app.personal"}),
        FakePersonaService::persona(Kind::Enterprise, 1001, "E-1001", {"com.app.work"},
                                    root_ + "/private/var/enterprise"),
        FakePersonaService::persona(Kind::Enterprise, 1002, "E-1002", {}),
        FakePersonaService::persona(Kind::Universal, 1003, "U-1003", {"com.app.shared"}),
    };
  }

  std::shared_ptr<VSAUserIdentityCache> makeCache(bool supported = true,
                                                  VSAUserIdentityCache::Options options = {}) {
    return VSAUserIdentityCache::create(
        {personas_, std::make_shared<VSAUserDatabase>(VSASystemRoot(root_)), 501, 501, supported,
         nullptr},
        std::move(options));
  }

  VSATestTempDir temp_{"vessa-users"};
  std::string root_;
  std::shared_ptr<FakePersonaService> personas_;
};

TEST_F(UserIdentities, IdentifiersEqualityAndDescriptions) {
  auto personal = VSAUserIdentity::make(501, 501, "/h", "P", kVSAPersonaTypePersonal, 1000);
  auto unspecific = VSAUserIdentity::make(501, 501, "/h", "P", kVSAPersonaTypeUnspecific, 1000);
  auto enterprise = VSAUserIdentity::make(501, 501, "/e", "E-1", kVSAPersonaTypeEnterprise, 1001);
  EXPECT_EQ(personal->identifier(), "501");
  EXPECT_TRUE(VSAUserIdentityEqual(personal, unspecific));
  EXPECT_EQ(personal->hash(), unspecific->hash());
  EXPECT_EQ(enterprise->identifier(), "E-1");
  EXPECT_FALSE(VSAUserIdentityEqual(personal, enterprise));
  VSAUserIdentitySet set{personal, unspecific, enterprise};
  EXPECT_EQ(set.size(), 2u) << "personal and unspecific collapse in sets";
  EXPECT_EQ(VSAUserIdentity::make(500, 500, "/h", std::nullopt, 0, 500), nullptr);
  EXPECT_NE(personal->description().find("personaType = personal"), std::string::npos);
  EXPECT_NE(unspecific->shortDescription().find("501/501/501/2/1000"), std::string::npos);
  EXPECT_STREQ(VSAUserIdentity::descriptionForPersonaType(9), "unknown");
  // Bundle and system classes are owned by the platform uids, as uid and gid.
  EXPECT_EQ(personal->posixUIDForContainerClass(VSAClass::kBundleApplication),
            CONTAINER_INSTALLATION_UID);
  EXPECT_EQ(personal->posixGIDForContainerClass(VSAClass::kBundleFramework),
            CONTAINER_INSTALLATION_UID);
  EXPECT_EQ(personal->posixGIDForContainerClass(VSAClass::kSystemGroup), CONTAINER_SYSTEM_UID);
  EXPECT_EQ(personal->posixUIDForContainerClass(VSAClass::kDataApplication), 501u);
  // Every per-user class needs a user identity, and so does a number that is no class.
  for (VSAContainerClass c : kVSAPerUserContainerClasses)
    EXPECT_TRUE(VSAUserIdentity::isUserIdentityRequiredForContainerClass(c)) << c;
  for (VSAContainerClass c : {0ull, 14ull, 99ull})
    EXPECT_TRUE(VSAUserIdentity::isUserIdentityRequiredForContainerClass(c)) << c;
  for (VSAContainerClass c : kVSAGlobalContainerClasses)
    EXPECT_FALSE(VSAUserIdentity::isUserIdentityRequiredForContainerClass(c)) << c;
}

TEST_F(UserIdentities, PlistWritesFourOrFiveKeys) {
  auto plain = VSAUserIdentity::make(501, 501, "/h", std::nullopt, kVSAPersonaTypePersonal, 501);
  EXPECT_EQ(plain->plist().dictionaryValue()->size(), 4u);
  EXPECT_EQ(*plain->plist().get("version")->stringValue(), "2");
  auto withString = VSAUserIdentity::make(501, 501, "/h", "E", kVSAPersonaTypeEnterprise, 1);
  EXPECT_EQ(*withString->plist().get("personaUniqueString")->stringValue(), "E");
}

TEST_F(UserIdentities, RebuildMapsPersonasAndApps) {
  auto cache = makeCache();
  auto personal = cache->userIdentityForPersonalPersona();
  ASSERT_TRUE(personal);
  EXPECT_EQ(personal->personaType(), kVSAPersonaTypePersonal);
  EXPECT_EQ(*personal->personaUniqueString(), "P-1000");
  EXPECT_EQ(personal->homeDirectoryURL(), root_ + "/private/var/mobile");
  auto unspecific = cache->unspecificUserIdentity();
  EXPECT_EQ(unspecific->personaType(), kVSAPersonaTypeUnspecific);
  EXPECT_EQ(*unspecific->personaUniqueString(), "P-1000") << "carries the personal string";
  auto work = cache->userIdentityForPersonaUniqueString(std::string("E-1001"), 501, 501);
  ASSERT_TRUE(work);
  EXPECT_EQ(work->identifier(), "E-1001");
  EXPECT_EQ(work->homeDirectoryURL(), root_ + "/private/var/enterprise");
  EXPECT_EQ(cache->userIdentityWithPersonaID(1003)->personaType(), kVSAPersonaTypeUnspecific)
      << "universal personas share the unspecific identity";
  EXPECT_FALSE(cache->userIdentityForPersonaUniqueString(std::string("nope"), 501, 501));
  // App association.
  auto shared = cache->userIdentitiesForBundleIdentifier("com.app.shared");
  EXPECT_EQ(shared.size(), 3u) << "personal plus both enterprise identities";
  EXPECT_TRUE(cache->isBundleIdentifierAssociatedWithUserIdentity("com.app.work", work));
  EXPECT_FALSE(cache->isBundleIdentifierAssociatedWithUserIdentity("com.app.work", personal));
  auto unknown = cache->userIdentitiesForBundleIdentifier("com.app.unlisted");
  ASSERT_EQ(unknown.size(), 1u);
  EXPECT_TRUE(VSAUserIdentityEqual(*unknown.begin(), personal));
  int visited = 0;
  cache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const auto&) { ++visited; });
  EXPECT_EQ(visited, 3) << "personal (with unspecific and universal), two enterprise";
}

TEST_F(UserIdentities, UidFloorAndRebasing) {
  auto cache = makeCache();
  auto low = cache->userIdentityForPersonalPersonaWithUID(500, 500);
  EXPECT_EQ(low->posixUID(), 501u);
  auto other = cache->userIdentityForPersonalPersonaWithUID(502, 502);
  EXPECT_EQ(other->posixUID(), 502u);
  EXPECT_EQ(other->homeDirectoryURL(), root_ + "/private/var/u502");
  auto work = cache->userIdentityForPersonaUniqueString(std::string("E-1001"), 502, 502);
  EXPECT_EQ(work->homeDirectoryURL(), root_ + "/private/var/enterprise")
      << "enterprise keeps its home";
}

TEST_F(UserIdentities, PlistReadingRules) {
  auto cache = makeCache();
  VSAResultCode code = 1;
  // "version" as a number is not recognised: the bare identity, no error.
  auto bare = VSAUserIdentity::userIdentityWithPlist(
      VSAValue::Dictionary{{"version", VSAValue(2)}, {"posixUID", VSAValue(501)}}, *cache, &code);
  ASSERT_TRUE(bare);
  EXPECT_EQ(bare->posixUID(), 0u);
  EXPECT_EQ(code, 1u);
  // Type 1 with an unknown string fails with code 1.
  code = 99;
  EXPECT_FALSE(VSAUserIdentity::userIdentityWithPlist(
      VSAValue::Dictionary{{"version", VSAValue("2")},
                           {"posixUID", VSAValue(501)},
                           {"posixGID", VSAValue(501)},
                           {"type", VSAValue(1)},
                           {"personaUniqueString", VSAValue("unknown")}},
      *cache, &code));
  EXPECT_EQ(code, 1u);
  // Type 2 reads back as the personal identity.
  auto unspecific =
      VSAUserIdentity::make(501, 501, "/x", "P-1000", kVSAPersonaTypeUnspecific, 1000);
  auto back = VSAUserIdentity::userIdentityWithPlist(unspecific->plist(), *cache, &code);
  ASSERT_TRUE(back);
  EXPECT_EQ(back->personaType(), kVSAPersonaTypePersonal);
  // Wrong types fail with 75.
  code = 1;
  EXPECT_FALSE(VSAUserIdentity::userIdentityWithPlist(
      VSAValue::Dictionary{{"version", VSAValue("2")}, {"posixUID", VSAValue("501")}}, *cache,
      &code));
  EXPECT_EQ(code, 75u);
  code = 1;
  EXPECT_FALSE(
      VSAUserIdentity::userIdentityWithPlist(VSAValue::Dictionary{{"version", VSAValue("2")},
                                                                  {"posixUID", VSAValue(501)},
                                                                  {"posixGID", VSAValue(501)},
                                                                  {"type", VSAValue(3)}},
                                             *cache, &code));
  EXPECT_EQ(code, 75u);
  // Version 1 with a known persona identifier.
  auto v1 = VSAUserIdentity::userIdentityWithPlist(
      VSAValue::Dictionary{{"version", VSAValue("1")},
                           {"posixUID", VSAValue(501)},
                           {"posixGID", VSAValue(501)},
                           {"personaIdentifier", VSAValue("E-1001")}},
      *cache, &code);
  ASSERT_TRUE(v1);
  EXPECT_EQ(v1->identifier(), "E-1001");
  // An enterprise identity round-trips.
  auto work = cache->userIdentityForPersonaUniqueString(std::string("E-1001"), 501, 501);
  EXPECT_TRUE(VSAUserIdentityEqual(
      VSAUserIdentity::userIdentityWithPlist(work->plist(), *cache, &code), work));
}

TEST_F(UserIdentities, UnsupportedPersonasAnswerThePersonalIdentity) {
  auto cache = makeCache(false);
  auto any = cache->userIdentityForPersonaUniqueString(std::string("E-1001"), 501, 501);
  ASSERT_TRUE(any);
  EXPECT_EQ(any->personaType(), kVSAPersonaTypePersonal);
  EXPECT_TRUE(cache->isBundleIdentifierAssociatedWithUserIdentity("x", nullptr));
  EXPECT_EQ(personas_->listCalls, 0) << "the persona service is never asked";
  int visited = 0;
  cache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const auto&) { ++visited; });
  EXPECT_EQ(visited, 1);
}

TEST_F(UserIdentities, CurrentContextFollowsTheCurrentPersona) {
  auto cache = makeCache();
  personas_->current = std::nullopt;
  EXPECT_EQ(cache->userIdentityForCurrentContext()->personaType(), kVSAPersonaTypeUnspecific);
  personas_->current = personas_->personas->at(1);
  EXPECT_EQ(cache->userIdentityForCurrentContext()->identifier(), "E-1001");
  personas_->current = personas_->personas->at(0);
  EXPECT_EQ(cache->userIdentityForCurrentContext()->personaType(), kVSAPersonaTypePersonal);
  personas_->current = personas_->personas->at(3);
  EXPECT_EQ(cache->userIdentityForCurrentContext()->personaType(), kVSAPersonaTypeUnspecific);
}

TEST_F(UserIdentities, ResyncRetriesThenGivesUp) {
  personas_->personas = std::vector<VSAPersonaAttributes>{
      FakePersonaService::persona(Kind::Enterprise, 1001, "E-1001")};  // no personal persona
  std::string terminated;
  VSAUserIdentityCache::Options options;
  options.retryDelay = 1ms;
  options.maxTries = 5;
  options.terminate = [&](const std::string& m) { terminated = m; };
  auto cache = makeCache(true, options);
  (void)cache->unspecificUserIdentity();
  EXPECT_EQ(personas_->listCalls, 5);
  EXPECT_EQ(terminated, "Could not obtain persona attributes after exhausting retries.");
}

TEST_F(UserIdentities, ResyncRecoversWhenTheListBecomesUsable) {
  auto good = *personas_->personas;
  personas_->personas = std::vector<VSAPersonaAttributes>{};
  VSAUserIdentityCache::Options options;
  options.retryDelay = 20ms;
  options.terminate = [](const std::string& m) { FAIL() << m; };
  auto cache = makeCache(true, options);
  std::thread fixer([&] {
    std::this_thread::sleep_for(60ms);
    std::lock_guard lock(personas_->mutex_);
    personas_->personas = good;
  });
  auto personal = cache->userIdentityForPersonalPersona();
  fixer.join();
  ASSERT_TRUE(personal);
  EXPECT_EQ(*personal->personaUniqueString(), "P-1000");
  EXPECT_GE(personas_->listCalls, 2);
}

TEST_F(UserIdentities, EnterpriseWithoutUniqueStringIsSkipped) {
  personas_->personas->push_back(FakePersonaService::persona(Kind::Enterprise, 1009, std::nullopt));
  auto cache = makeCache();
  EXPECT_FALSE(cache->userIdentityWithPersonaID(1009));
  EXPECT_TRUE(cache->userIdentityWithPersonaID(1001));
}

struct Recorder : VSAUserIdentityCacheObserver {
  std::vector<std::string> invalidated;
  void userIdentityCacheDidInvalidateUserIdentity(VSAUserIdentityCache&,
                                                  const VSAUserIdentityRef& identity) override {
    invalidated.push_back(identity->identifier());
  }
};

TEST_F(UserIdentities, FlushNotifiesObserversOfEachEnterpriseIdentityAndRebuilds) {
  auto cache = makeCache();
  auto observer = std::make_shared<Recorder>();
  cache->addObserver(observer);
  (void)cache->unspecificUserIdentity();  // build
  int before = personas_->listCalls;
  personas_->personas->pop_back();  // the universal persona goes away
  cache->flush();
  std::sort(observer->invalidated.begin(), observer->invalidated.end());
  EXPECT_EQ(observer->invalidated, (std::vector<std::string>{"E-1001", "E-1002"}));
  EXPECT_EQ(cache->userIdentitiesForBundleIdentifier("com.app.shared").size(), 1u);
  EXPECT_EQ(personas_->listCalls, before + 1);
  cache->removeObserver(observer);
  cache->flush();
  (void)cache->unspecificUserIdentity();
  EXPECT_EQ(observer->invalidated.size(), 2u);
}

TEST_F(UserIdentities, RepopulateReplacesTheContent) {
  auto cache = makeCache();
  auto p = VSAUserIdentity::make(501, 501, "/p", "RP", kVSAPersonaTypePersonal, 7);
  auto e = VSAUserIdentity::make(501, 501, "/e", "RE", kVSAPersonaTypeEnterprise, 8);
  cache->flushAndRepopulateWithUserIdentities({p, e});
  EXPECT_EQ(personas_->listCalls, 0);
  EXPECT_EQ(*cache->userIdentityForPersonalPersona()->personaUniqueString(), "RP");
  EXPECT_EQ(cache->unspecificUserIdentity()->personaType(), kVSAPersonaTypeUnspecific);
  EXPECT_EQ(cache->userIdentityWithPersonaID(8)->identifier(), "RE");
}

TEST_F(UserIdentities, ContainerIdentityValidationOrderAndEquality) {
  auto cache = makeCache();
  auto personal = cache->userIdentityForPersonalPersona();
  auto unspecific = cache->unspecificUserIdentity();
  VSAValue id("com.app");
  VSAResultCode code = 1;
  for (VSAContainerClass bad : {0ull, 14ull, 200ull}) {
    EXPECT_FALSE(
        VSAContainerIdentity::containerIdentityWithUserIdentity(personal, &id, bad, &code));
    EXPECT_EQ(code, 11u);
  }
  VSAValue number(5);
  EXPECT_FALSE(VSAContainerIdentity::containerIdentityWithUserIdentity(
      personal, &number, VSAClass::kDataApplication, &code));
  EXPECT_EQ(code, 11u);
  EXPECT_FALSE(
      VSAContainerIdentity::containerIdentityWithUserIdentity(personal, nullptr, 0, &code));
  EXPECT_EQ(code, 18u) << "a missing identifier is reported before the class";
  EXPECT_FALSE(VSAContainerIdentity::containerIdentityWithUserIdentity(nullptr, nullptr, 0, &code));
  EXPECT_EQ(code, 11u) << "a missing owner wins";
  code = 1;
  EXPECT_FALSE(VSAContainerIdentity::containerIdentityWithIdentifier(
      "com.app", VSAClass::kDataApplication, *cache, &code));
  EXPECT_EQ(code, 11u);
  auto bundle = VSAContainerIdentity::containerIdentityWithIdentifier(
      "com.app", VSAClass::kBundleApplication, *cache, &code);
  ASSERT_TRUE(bundle);
  EXPECT_TRUE(VSAUserIdentityEqual(bundle->userIdentity(), cache->defaultUserIdentity()));

  auto a = VSAContainerIdentity::containerIdentityWithUserIdentity(
      personal, &id, VSAClass::kDataApplication, &code);
  auto b = VSAContainerIdentity::containerIdentityWithUserIdentity(
      unspecific, &id, VSAClass::kDataApplication, &code);
  EXPECT_TRUE(a->isEqual(*b)) << "personal vs unspecific owner of one uid";
  EXPECT_EQ(a->hash(), b->hash());
  VSAUUID u1 = VSAUUID::random(), u2 = VSAUUID::random();
  auto c1 = VSAConcreteContainerIdentity::containerIdentityWithUUID(
      u1, personal, "com.app", VSAClass::kDataApplication, &code);
  auto c2 = VSAConcreteContainerIdentity::containerIdentityWithUUID(
      u2, personal, "com.app", VSAClass::kDataApplication, &code);
  EXPECT_FALSE(c1->isEqual(*c2));
  EXPECT_TRUE(a->isEqual(*c1));
  EXPECT_TRUE(a->isEqual(*c2));
  EXPECT_FALSE(c1->isEqual(*a));
  EXPECT_TRUE(c1->isEqual(*c1));
  VSAValue text(u1.string());
  EXPECT_FALSE(VSAConcreteContainerIdentity::containerIdentityWithUUID(
      &text, personal, &id, VSAClass::kDataApplication, &code));
  EXPECT_EQ(code, 11u) << "a UUID must be a UUID value";
  EXPECT_NE(c1->description().find(u1.string()), std::string::npos);
}

}  // namespace
