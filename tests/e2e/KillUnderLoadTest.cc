// The real daemon under a mixed load from 16 clients, killed with SIGKILL at
// random moments and started again, again and again. What a client was told
// exists must still exist with the same UUID after every restart, and the
// root checker (`vessad --verify`, the command an integrator runs) must find
// the root in order each time the restarted daemon has finished its start.
#include <gtest/gtest.h>

#include <atomic>
#include <cstdio>
#include <map>
#include <mutex>
#include <random>
#include <thread>

#include "base/VSAJSON.h"
#include "e2e/VSATestDaemon.h"

using namespace std::chrono_literals;

namespace {

constexpr int kClients = 16;
constexpr int kKills = 50;
constexpr int kIdsPerClient = 6;

VSAValue request(uint64_t command, const std::string& id) {
  return VSAValue::Dictionary{{"Command", VSAValue(command)},
                              {"Identifier", VSAValue(id)},
                              {"ContainerClass", VSAValue(2u)}};
}

// What clients were told: identifier -> UUID of its container. A request
// that may remove a container takes its identifier out before it is sent.
class Promises {
 public:
  void made(const std::string& id, const VSAUUID& uuid) {
    std::lock_guard lock(mutex_);
    told_[id] = uuid;
  }
  void forget(const std::string& id) {
    std::lock_guard lock(mutex_);
    told_.erase(id);
  }
  std::map<std::string, VSAUUID> all() {
    std::lock_guard lock(mutex_);
    return told_;
  }

 private:
  std::mutex mutex_;
  std::map<std::string, VSAUUID> told_;
};

// One client's mix: create, look up, wipe, info value, directory UUID,
// protection class, delete.
void client(VSATestDaemon& d, int index, std::atomic<bool>& stop, Promises& promises,
            int* answered) {
  std::mt19937 random(1000 + index);
  while (!stop) {
    unsigned which = random() % kIdsPerClient;
    std::string id = "com.example.load." + std::to_string(index) + "." + std::to_string(which);
    VSAValue body;
    // Half of the identifiers are never deleted, so that there is always
    // something a client was told exists.
    switch (random() % 8) {
      case 0:
      case 1:
        body = request(0, id);
        body.set("CreateIfNecessary", VSAValue(true));
        break;
      case 2:
        body = request(12, id);  // wipe
        break;
      case 3:
        body = request(5, id);  // info value
        body.set("Key", VSAValue("Flavour"));
        body.set("Value", VSAValue("mint"));
        break;
      case 4:
        body = request(9, id);  // new directory UUID name
        break;
      case 5:
        body = request(21, id);  // protection class
        body.set("DataProtectionClass", VSAValue(3u));
        break;
      case 6:
        if (which < kIdsPerClient / 2) continue;
        promises.forget(id);
        body = request(10, id);  // delete
        break;
      default:
        body = request(0, id);
        break;
    }
    auto reply = d.request(body, 2s);
    if (!reply) continue;
    ++*answered;
    const VSAValue* uuid = reply->get("ReplyUUID");
    if (VSAReplyError(reply) == 1 && uuid && uuid->uuidValue() &&
        body.get("Command")->uint64Value() == 0u)
      promises.made(id, *uuid->uuidValue());
  }
}

// The root checker as an integrator runs it; its exit status and report.
std::pair<int, std::string> verify(const std::string& root, bool json = false) {
  std::string command =
      std::string(VESSAD_PATH) + " --verify --root " + root + (json ? " --json" : "") + " 2>&1";
  FILE* pipe = ::popen(command.c_str(), "r");
  std::string output;
  char buffer[4096];
  while (size_t n = std::fread(buffer, 1, sizeof(buffer), pipe)) output.append(buffer, n);
  int status = ::pclose(pipe);
  return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, output};
}

size_t cleanups(const VSATestDaemon& d) {
  size_t n = 0;
  for (const auto& name : d.notifications()) n += name == "com.tamsk.vessad.cleanup-complete";
  return n;
}

// Starts the daemon and waits until its start's cleanup has finished.
bool startAndSettle(VSATestDaemon& d) {
  size_t before = cleanups(d);
  if (!d.start()) return false;
  for (int i = 0; i < 400 && cleanups(d) <= before; ++i) std::this_thread::sleep_for(25ms);
  return cleanups(d) > before;
}

TEST(DaemonCrash, KilledAtRandomUnderSixteenClientsLosesNothing) {
  VSATestDaemon d;
  d.registerSelf(
      "com.example.installer",
      VSAValue::Dictionary{{"com.tamsk.private.Vessa.allowed", VSAValue(true)},
                           {"com.tamsk.private.Vessa.deleteContainerContent", VSAValue(true)}});
  ASSERT_TRUE(startAndSettle(d));
  Promises promises;
  std::mt19937 random(7);
  int answered = 0, clean = 0, leftForTheStart = 0;
  std::vector<int> perClient(kClients, 0);
  for (int kill = 1; kill <= kKills; ++kill) {
    SCOPED_TRACE("kill " + std::to_string(kill));
    std::atomic<bool> stop{false};
    std::vector<std::thread> clients;
    for (int i = 0; i < kClients; ++i)
      clients.emplace_back(client, std::ref(d), i, std::ref(stop), std::ref(promises),
                           &perClient[i]);
    std::this_thread::sleep_for(std::chrono::milliseconds(20 + random() % 180));
    d.crash();
    stop = true;
    for (auto& t : clients) t.join();
    // Dead where it stood: whatever it left, its next start finishes.
    auto [deadStatus, deadReport] = verify(d.root(), true);
    ASSERT_NE(deadStatus, 2) << deadReport;
    auto parsed = VSAJSON::parse(deadReport, nullptr);
    ASSERT_TRUE(parsed && parsed->get("findings")) << deadReport;
    for (const VSAValue& f : *parsed->get("findings")->arrayValue())
      EXPECT_TRUE(f.get("repairedAtStart")->boolValue().value_or(false)) << deadReport;
    if (deadStatus == 1) ++leftForTheStart;
    // Restarted, its start finished, then stopped: the root is in order.
    ASSERT_TRUE(startAndSettle(d));
    for (const auto& [id, uuid] : promises.all()) {
      auto reply = d.request(request(0, id));
      ASSERT_EQ(VSAReplyError(reply), 1u) << id << " was lost";
      ASSERT_EQ(*reply->get("ReplyUUID")->uuidValue(), uuid) << id;
    }
    ASSERT_EQ(d.stop(), 0);
    auto [status, report] = verify(d.root());
    EXPECT_EQ(status, 0) << report;
    if (status == 0) ++clean;
    ASSERT_TRUE(startAndSettle(d));
  }
  for (int n : perClient) answered += n;
  std::printf(
      "%d kills under %d clients, %d replies, %zu containers promised; %d kills left work for the "
      "next start; %d clean checks after it\n",
      kKills, kClients, answered, promises.all().size(), leftForTheStart, clean);
  EXPECT_GT(promises.all().size(), 0u);
  EXPECT_EQ(d.stop(), 0);
}

}  // namespace
