#include "VSACtlStatus.h"

#include <signal.h>

#include <chrono>
#include <cstdio>
#include <ctime>
#include <fstream>
#include <sstream>
#include <thread>

#include "base/VSAJSON.h"
#include "base/VSAPathString.h"
#include "base/VSAProgressLog.h"
#include "daemon/VSAStateDump.h"
#include "platform/VSAIPCClient.h"
#include "platform/VSASystemRoot.h"

namespace {
using Clock = std::chrono::steady_clock;
constexpr auto kPoll = std::chrono::milliseconds(20);

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

std::string text(const VSAValue& v, const char* key) {
  const VSAValue* s = v.get(key);
  return s && s->stringValue() ? *s->stringValue() : "";
}

const VSAValue::Array& list(const VSAValue& v, const char* key) {
  static const VSAValue::Array empty;
  const VSAValue* a = v.get(key);
  return a && a->arrayValue() ? *a->arrayValue() : empty;
}
}  // namespace

// The pid in the run directory when that process is a running vessad; 0 otherwise.
int VSACtlStatus::livePid() {
  std::string run = VSASystemRoot(root_).runDirectory();
  int pid = std::atoi(fileText(VSAPathJoin(run, kVSAPidFileName)).c_str());
  if (pid <= 0 || ::kill(pid, 0) != 0) return 0;
  std::string comm = fileText("/proc/" + std::to_string(pid) + "/comm");
  return comm.rfind("vessad", 0) == 0 ? pid : 0;
}

// A daemon the service manager starts on demand writes its pid once started;
// a connection to its socket is that demand.
int VSACtlStatus::waitForPid() {
  if (int pid = livePid()) return pid;
  VSAIPCClient client;
  if (!client.connect(socketPath_, nullptr)) return 0;
  auto deadline = Clock::now() + std::chrono::seconds(timeout_);
  while (Clock::now() < deadline) {
    if (int pid = livePid()) return pid;
    std::this_thread::sleep_for(kPoll);
  }
  return 0;
}

bool VSACtlStatus::readState(VSAValue* state, std::string* raw) {
  *raw = fileText(VSAPathJoin(VSASystemRoot(root_).runDirectory(), kVSAStateFileName));
  std::string why;
  auto parsed = VSAJSON::parse(*raw, &why);
  if (!parsed || !parsed->isDictionary()) return false;
  *state = *parsed;
  return true;
}

int VSACtlStatus::run(bool json) {
  int pid = waitForPid();
  if (!pid) {
    std::fprintf(stderr, "vessactl status: vessad is not running for %s (no live pid in %s)\n",
                 root_.c_str(), VSASystemRoot(root_).runDirectory().c_str());
    return 2;
  }
  VSAValue state;
  std::string raw;
  uint64_t before = readState(&state, &raw) && number(state, "pid") == uint64_t(pid)
                        ? number(state, "generation")
                        : 0;
  if (::kill(pid, SIGUSR1) != 0) {
    std::perror("vessactl status: cannot signal vessad");
    return 2;
  }
  auto deadline = Clock::now() + std::chrono::seconds(timeout_);
  while (!(readState(&state, &raw) && number(state, "pid") == uint64_t(pid) &&
           number(state, "generation") > before)) {
    if (Clock::now() >= deadline) {
      std::fprintf(stderr, "vessactl status: vessad (pid %d) wrote no state in %d s\n", pid,
                   timeout_);
      return 2;
    }
    std::this_thread::sleep_for(kPoll);
  }
  std::fputs(json ? raw.c_str() : summary(state).c_str(), stdout);
  return 0;
}

std::string VSACtlStatus::summary(const VSAValue& state) {
  std::string out;
  auto line = [&out](const std::string& l) { out += l + "\n"; };
  std::time_t written = static_cast<std::time_t>(number(state, "writtenAt"));
  char when[32] = "";
  std::strftime(when, sizeof when, "%Y-%m-%d %H:%M:%S", std::localtime(&written));
  const VSAValue* serving = state.get("serving");
  bool up = serving && serving->boolValue().value_or(false);
  line(VSAFormat("vessad %llu, %s (state at %s)", number(state, "pid"),
                 up ? "serving" : "starting up", when));
  if (!up) return out;
  line("Queues:");
  line(VSAFormat("  %-36s %7s  %s", "QUEUE", "WAITING", "SUSPENDED"));
  for (const auto& q : list(state, "queues")) {
    const VSAValue* s = q.get("suspended");
    line(VSAFormat("  %-36s %7llu  %s", text(q, "label"), number(q, "depth"),
                   s && s->boolValue().value_or(false) ? "yes" : "no"));
  }
  line(VSAFormat("Open transactions: %llu", number(state, "openTransactions")));
  line("Container cache:");
  line(VSAFormat("  %-48s %10s", "CLASS MAP", "CONTAINERS"));
  for (const auto& c : list(state, "containerCache")) {
    const VSAValue* t = c.get("transient");
    std::string key = text(c, "key") + (t && t->boolValue().value_or(false) ? " (transient)" : "");
    line(VSAFormat("  %-48s %10llu", key, number(c, "containers")));
  }
  const VSAValue* dead = state.get("deathRow");
  line(VSAFormat("Death row: %llu entries, %@", dead ? number(*dead, "entries") : 0,
                 VSAProgressLog::byteCount(dead ? number(*dead, "bytes") : 0)));
  const VSAValue* left = state.get("tmpLeftovers");
  line(VSAFormat("Left in /tmp by death row: %llu entries, %@", left ? number(*left, "entries") : 0,
                 VSAProgressLog::byteCount(left ? number(*left, "bytes") : 0)));
  line(VSAFormat("Pending protection changes: %llu", number(state, "pendingProtectionUpdates")));
  line(VSAFormat("Replace files in progress: %llu", number(state, "replaceFilesInProgress")));
  const VSAValue* locks = state.get("testLocks");
  std::string held;
  for (const auto& l : locks ? list(*locks, "held") : VSAValue::Array{})
    held += VSAFormat(" %llu (x%llu)", number(l, "lock"), number(l, "count"));
  const VSAValue* enabled = locks ? locks->get("enabled") : nullptr;
  line(VSAFormat("Test locks: %s, %s",
                 enabled && enabled->boolValue().value_or(false) ? "on" : "off",
                 held.empty() ? std::string("none held") : "held:" + held));
  const VSAValue* migration = state.get("migration");
  const VSAValue* status = migration ? migration->get("status") : nullptr;
  line(VSAFormat("Migration status: %@%@", migration ? text(*migration, "statusFile") : "",
                 status ? " " + VSAJSON::print(*status, false) : std::string()));
  const auto& work = list(state, "work");
  line(work.empty() ? "Work under way: none" : "Work under way:");
  for (const auto& w : work) {
    std::string bytes =
        number(w, "bytes") ? ", " + VSAProgressLog::byteCount(number(w, "bytes")) : "";
    line(VSAFormat("  %@: %llu/%llu %@%@", text(w, "task"), number(w, "done"), number(w, "total"),
                   text(w, "unit"), bytes));
  }
  const VSAValue* db = state.get("codeSigningDatabase");
  line(VSAFormat("Code-signing database: %@ (%@)",
                 VSAProgressLog::byteCount(db ? number(*db, "bytes") : 0),
                 db ? text(*db, "path") : ""));
  return out;
}
