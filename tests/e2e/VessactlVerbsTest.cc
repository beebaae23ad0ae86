// vessactl's verbs against the real daemon: what people type becomes the
// right request, replies read as "Key: value" lines, failures name their
// code and meaning and exit 1, and arguments that do not fit exit 2 with
// the verb's usage.
#include <gtest/gtest.h>

#include <string>

#include "e2e/VSATestDaemon.h"

namespace {

bool has(const std::string& text, const std::string& part) {
  return text.find(part) != std::string::npos;
}

TEST(Vessactl, VerbsPeopleTypeReachTheDaemon) {
  VSATestDaemon d;
  d.registerVessactl("installer", "com.example.installer",
                     VSAValue::Dictionary{{"com.tamsk.private.Vessa.allowed", VSAValue(true)}});
  ASSERT_TRUE(d.start());
  auto made = d.vessactl("installer", {"create", "com.example.app", "--class", "data"});
  ASSERT_EQ(made.status, 0) << made.output;
  EXPECT_TRUE(has(made.output, "Path:") && has(made.output, "UUID:")) << made.output;
  EXPECT_TRUE(has(made.output, "/Containers/Data/Application/")) << made.output;
  // lookup never creates: a missing container is code 21, named.
  auto missing = d.vessactl("installer", {"lookup", "com.example.none"});
  EXPECT_EQ(missing.status, 1);
  EXPECT_TRUE(has(missing.output, "21: container not found")) << missing.output;
  EXPECT_EQ(d.vessactl("installer", {"info", "set", "com.example.app", "Flavour", "mint"}).status,
            0);
  auto info = d.vessactl("installer", {"info", "get", "com.example.app", "Flavour"});
  EXPECT_TRUE(has(info.output, "InfoValue:") && has(info.output, "mint")) << info.output;
  auto listed = d.vessactl("installer", {"--json", "ls", "--class", "2"});
  EXPECT_TRUE(has(listed.output, "com.example.app")) << listed.output;
  EXPECT_EQ(d.vessactl("installer", {"rm", "com.example.app"}).status, 0);
  EXPECT_EQ(d.vessactl("installer", {"lookup", "com.example.app"}).status, 1);
  // Arguments that do not fit: exit 2 and the verb's usage, nothing sent.
  auto bad = d.vessactl("installer", {"create", "com.example.app", "--class", "nonsense"});
  EXPECT_EQ(bad.status, 2);
  EXPECT_TRUE(has(bad.output, "unknown container class nonsense")) << bad.output;
  EXPECT_EQ(d.vessactl("installer", {"protect", "com.example.app", "9"}).status, 2);
  auto help = d.vessactl("installer", {"wipe", "--help"});
  EXPECT_EQ(help.status, 0);
  EXPECT_TRUE(has(help.output, "usage: vessactl") && has(help.output, "wipe ID")) << help.output;
  EXPECT_EQ(d.stop(), 0);
}

}  // namespace
