// vessactl's verbs against the real daemon: what people type becomes the
// right request, replies read as "Key: value" lines, failures name their
// code and meaning and exit 1, and arguments that do not fit exit 2 with
// the verb's usage.
#include <gtest/gtest.h>

#include <fstream>
#include <sstream>
#include <string>

#include "base/VSAJSON.h"
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
  // People get a table and sizes they can read.
  auto table = d.vessactl("installer", {"ls"});
  EXPECT_TRUE(has(table.output, "IDENTIFIER") && has(table.output, "com.example.app") &&
              has(table.output, "1 container\n"))
      << table.output;
  auto usage = d.vessactl("installer", {"usage", "com.example.app"});
  EXPECT_TRUE(has(usage.output, "DiskUsage:") && has(usage.output, " bytes)")) << usage.output;
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

std::string fileText(const std::string& path) {
  std::ifstream in(path);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

uint64_t number(const VSAValue& v, const char* key) {
  const VSAValue* n = v.get(key);
  return n ? n->uint64Value().value_or(0) : 0;
}

// `vessactl status` signals the daemon and prints the dump it writes: a new
// one each time, with what the daemon holds, in the log as well.
TEST(Vessactl, StatusPrintsAFreshStateDump) {
  VSATestDaemon d;
  d.registerVessactl("installer", "com.example.installer",
                     VSAValue::Dictionary{{"com.tamsk.private.Vessa.allowed", VSAValue(true)}});
  auto none = d.vessactl("", {"status"});
  EXPECT_EQ(none.status, 2);
  EXPECT_TRUE(has(none.output, "vessad is not running")) << none.output;
  ASSERT_TRUE(d.start());
  for (const char* id : {"com.example.one", "com.example.two"})
    ASSERT_EQ(d.vessactl("installer", {"create", id}).status, 0);
  int pid = std::atoi(fileText(d.path("/run/vessad/vessad.pid")).c_str());
  ASSERT_GT(pid, 0);

  auto first = d.vessactl("", {"status", "--json"});
  ASSERT_EQ(first.status, 0) << first.output;
  std::string why;
  auto state = VSAJSON::parse(first.output, &why);
  ASSERT_TRUE(state && state->isDictionary()) << why << first.output;
  EXPECT_EQ(number(*state, "pid"), static_cast<uint64_t>(pid));
  EXPECT_EQ(state->get("serving")->boolValue(), true);
  bool listener = false, dataMap = false;
  for (const auto& q : *state->get("queues")->arrayValue())
    listener |= *q.get("label")->stringValue() == "com.tamsk.vessad.listener";
  for (const auto& c : *state->get("containerCache")->arrayValue())
    dataMap |= c.get("key")->stringValue()->find("appData") != std::string::npos &&
               number(c, "containers") == 2;
  EXPECT_TRUE(listener && dataMap) << first.output;
  EXPECT_GT(number(*state->get("codeSigningDatabase"), "bytes"), 0u);
  ASSERT_NE(state->get("deathRow"), nullptr);
  ASSERT_NE(state->get("migration"), nullptr);

  auto second = d.vessactl("", {"status", "--json"});
  auto later = VSAJSON::parse(second.output, &why);
  ASSERT_TRUE(later) << second.output;
  EXPECT_EQ(number(*later, "generation"), number(*state, "generation") + 1)
      << "each status is a new dump, not the last file";
  auto people = d.vessactl("", {"status"});
  EXPECT_EQ(people.status, 0);
  EXPECT_TRUE(has(people.output, "serving") && has(people.output, "Container cache:") &&
              has(people.output, "Death row:"))
      << people.output;
  EXPECT_EQ(d.stop(), 0);
  EXPECT_TRUE(has(d.daemonOutput(), "State: containerCache")) << "the dump is logged too";
  EXPECT_FALSE(std::ifstream(d.path("/run/vessad/vessad.pid")).good())
      << "a stopped daemon leaves no pid behind";
}

}  // namespace
