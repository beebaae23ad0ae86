#include <gtest/gtest.h>

#include <memory>
#include <stdexcept>
#include <thread>

#include "base/VSACrash.h"
#include "base/VSAError.h"
#include "base/VSAFormat.h"
#include "base/VSAJSON.h"
#include "base/VSAValue.h"
#include "base/VSAWorkQueue.h"

namespace {

struct Described {
  std::string description() const { return "<Described>"; }
};

TEST(VSAFormat, ObjectsNumbersAndAnnotations) {
  Described d;
  auto shared = std::make_shared<Described>();
  std::shared_ptr<Described> none;
  EXPECT_EQ(VSAFormat("%@ %@ %@", d, shared, none), "<Described> <Described> (null)");
  EXPECT_EQ(VSAFormat("%d %u %lld %llu", -3, 7u, int64_t(-9), uint64_t(18446744073709551615ull)),
            "-3 7 -9 18446744073709551615");
  EXPECT_EQ(VSAFormat("[%s] %@", "fn", std::string("str")), "[fn] str");
  EXPECT_EQ(VSAFormat(" command=%{public, signpost.description:attribute}llu ", uint64_t(4)),
            " command=4 ");
  EXPECT_EQ(VSAFormat("100%% %5s|%-4d|", "ab", 7), "100%    ab|7   |");
  EXPECT_EQ(VSAFormat("%@ and %d"), "(missing) and (missing)");
  EXPECT_EQ(VSAFormat("%@", VSAValue(VSAValue::Dictionary{{"a", VSAValue(1)}})),
            "{\n    a = 1;\n}");
}

TEST(VSAError, DescriptionWithAndWithoutUnderlyingError) {
  auto posix = VSA_POSIX_ERROR(ENOENT);
  auto plain = VSA_ERROR(34, "Failed to move metadata from staging: %@ to final: %@", "/a", "/b");
  EXPECT_EQ(plain->localizedDescription(),
            "34: Failed to move metadata from staging: /a to final: /b");
  auto wrapped = VSA_ERROR_UNDERLYING(34, posix, "Failed to write %s", "x");
  EXPECT_EQ(wrapped->localizedDescription(),
            "34: Failed to write x (" + posix->description() + ")");
  EXPECT_EQ(wrapped->functionName(), "TestBody");
  EXPECT_GT(wrapped->sourceFileLine(), 0u);
  EXPECT_EQ(wrapped->underlyingError(), posix);
  EXPECT_EQ(wrapped->resultCode(1), 34u);
  EXPECT_EQ(posix->resultCode(41), 41u);
}

TEST(VSAError, OptionalOutParametersMayBeNull) {
  VSASetError(nullptr, VSA_ERROR(1, "x"));
  VSASetCode(nullptr, 5);
  VSAResultCode cell = 1;
  VSASetCode(&cell, 20);
  EXPECT_EQ(cell, 20u);
}

TEST(VSACrash, UncaughtExceptionText) {
  EXPECT_EQ(
      VSAUncaughtExceptionText("com.tamsk.vessad.listener", "std::runtime_error", "boom", "f1\n"),
      "** INTERNAL ERROR: Uncaught Exception **\nException: <com.tamsk.vessad.listener> "
      "std::runtime_error: boom\nStack:\nf1\n");
  EXPECT_EQ(VSAUncaughtExceptionText("", "", "why", ""),
            "** INTERNAL ERROR: Uncaught Exception **\nException: why\nStack:\n");
}

TEST(VSACrashDeathTest, UncaughtExceptionEndsTheProcessWithTheText) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  // A thread that runs no queue has no name: the text has no "<...>" part.
  EXPECT_DEATH(
      {
        VSAInstallUncaughtExceptionHandler();
        std::thread([] { throw std::runtime_error("kaboom"); }).join();
      },
      "\\*\\* INTERNAL ERROR: Uncaught Exception \\*\\*\nException: std::runtime_error: "
      "kaboom\nStack:");
  // On a work queue the queue's label names the thread.
  EXPECT_DEATH(
      {
        VSAInstallUncaughtExceptionHandler();
        VSAWorkQueue::create("test.crash.queue")->sync([] { throw std::logic_error("bad"); });
      },
      "Exception: <test.crash.queue> std::logic_error: bad\nStack:");
}

TEST(VSAValue, LenientAccessorsAndNumericEquality) {
  EXPECT_EQ(VSAValue(int64_t(5)), VSAValue(uint64_t(5)));
  EXPECT_NE(VSAValue(int64_t(-1)), VSAValue(uint64_t(UINT64_MAX)));
  EXPECT_FALSE(VSAValue(int64_t(-1)).uint64Value());
  EXPECT_EQ(VSAValue(uint64_t(3)).int64Value(), 3);
  EXPECT_EQ(VSAValue("YES").boolValue(), std::nullopt);
  EXPECT_EQ(VSAValue(2).boolValue(), true);
  auto u = VSAUUID::random();
  EXPECT_EQ(VSAValue(u.string()).uuidValue(), u);
  EXPECT_EQ(VSAValue("not-a-uuid").uuidValue(), std::nullopt);
  VSAValue d;
  d.set("a", VSAValue(1));
  EXPECT_TRUE(d.isDictionary());
  EXPECT_EQ(d.get("missing"), nullptr);
  EXPECT_EQ(VSAValue(1).get("a"), nullptr);
}

TEST(VSAJSON, ParsesAndPrints) {
  std::string why;
  auto v = VSAJSON::parse(R"({"Command": 0, "Neg": -2, "Real": 1.5, "S": "a\u00e9\ud83d\ude00",
                               "L": [true, null], "D": {}})",
                          &why);
  ASSERT_TRUE(v) << why;
  EXPECT_EQ(v->get("Command")->uint64Value(), 0u);
  EXPECT_EQ(v->get("Neg")->int64Value(), -2);
  EXPECT_EQ(*v->get("S")->stringValue(), "a\xC3\xA9\xF0\x9F\x98\x80");
  auto again = VSAJSON::parse(VSAJSON::print(*v), &why);
  ASSERT_TRUE(again) << why;
  EXPECT_EQ(*again, *v);
  for (const char* bad : {"{", "[1,]", "{\"a\" 1}", "\"\\ud800\"", "01x", "", "[[[["})
    EXPECT_FALSE(VSAJSON::parse(bad, &why)) << bad;
}

}  // namespace
