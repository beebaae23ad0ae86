// vessa-bench: a load generator for a running vessad.
//
// Every figure is printed beside a baseline measured in the same run:
//  - the lookup mode runs the same clients against a floor, vessa-floor: a
//    process of its own that sends every frame back as it came (the least
//    work that could answer), then against the daemon, and prints
//    requests/s and p50/p99 latency as ratios;
//  - the create mode compares container creation through the daemon with a
//    raw loop doing the same directory work (staging directory,
//    sub-directories, metadata file with its fsync, rename) in the same root;
//  - the mixed mode compares its clients' create, look-up, metadata, list and
//    delete requests with one serial loop doing the same file work by hand;
//  - the memory mode reports the daemon's RSS with many containers cached
//    and idle connections open, and before and after a soak of look-ups;
//  - the upcall mode launches one app (data container and two group
//    containers, made by the first launch) over the upcall's seqpacket
//    socket, against vessa-floor sending the same packet and a memfd of
//    the same bytes back.
// The lookup, create and upcall modes run baseline and daemon in ten
// alternating rounds and sum each side, so that both see the same drift in
// the machine's latencies. With --pin CPU the look-up and upcall modes run
// with vessa-bench, the floor and every thread of the daemon on that one CPU
// (the measure's name says "pinned"): the scheduler's cross-CPU wake-ups,
// tens of microseconds on a VM, then no longer hide the work of a request.
// The client must be registered in the root's client registry with the
// "com.tamsk.private.Vessa.allowed" entitlement, and as the kernel bridge for
// the upcall mode (scripts/vessa-bench.sh does both).
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "../bench/VSABenchTable.h"
#include "VSABenchFloor.h"
#include "VSABenchPin.h"
#include "base/VSACommands.h"
#include "base/VSAContainerClasses.h"
#include "base/VSAPlist.h"
#include "base/VSAUUID.h"
#include "platform/VSAIPCClient.h"
#include "platform/VSALinuxFileSystem.h"
#include "platform/VSAUpcallClient.h"
#include "upcall/VSAUpcallMessage.h"
#include "upcall/VSAUpcallPayload.h"

namespace {
using Clock = std::chrono::steady_clock;

struct Options {
  std::string root = "/";
  std::string mode = "lookup";
  int clients = 1;
  int requests = 10000;
  int containers = 10000;  // memory mode: containers made and cached
  int idle = 100;          // memory mode: connections left idle
  int pin = -1;            // lookup and upcall: the CPU everything runs on (-1: none)
  std::string floor;       // the vessa-floor program (default: beside vessa-bench)
};

struct Result {
  double seconds = 0;
  std::vector<double> latenciesUs;
  long errors = 0;  // replies whose ReplyError is not 1
  long lost = 0;    // requests without a reply
  double perSecond() const { return latenciesUs.size() / seconds; }
  double percentile(double p) const {
    if (latenciesUs.empty()) return 0;
    std::vector<double> v = latenciesUs;
    size_t k = std::min(v.size() - 1, static_cast<size_t>(p * v.size()));
    std::nth_element(v.begin(), v.begin() + k, v.end());
    return v[k];
  }
};

// Request `i` of client `c`.
using RequestMaker = std::function<VSAValue(int c, int i)>;

// One client's work: request `i`, its outcome added to `r`.
using ClientStep = std::function<void(int i, Result& r)>;

// Runs `o.clients` threads. Each sets itself up (connects) before the clock
// starts, then runs its step `o.requests` times; their results are merged.
Result runThreads(const Options& o, const std::function<ClientStep(int c)>& setUp) {
  std::vector<std::thread> threads;
  std::vector<Result> parts(o.clients);
  std::atomic<int> ready{0};
  std::atomic<bool> go{false};
  for (int c = 0; c < o.clients; ++c)
    threads.emplace_back([&, c] {
      ClientStep step = setUp(c);
      ++ready;
      while (!go) std::this_thread::yield();
      for (int i = 0; i < o.requests; ++i) step(i, parts[c]);
    });
  while (ready < o.clients) std::this_thread::yield();
  auto start = Clock::now();
  go = true;
  for (auto& t : threads) t.join();
  Result all;
  all.seconds = std::chrono::duration<double>(Clock::now() - start).count();
  for (auto& p : parts) {
    all.latenciesUs.insert(all.latenciesUs.end(), p.latenciesUs.begin(), p.latenciesUs.end());
    all.errors += p.errors;
    all.lost += p.lost;
  }
  return all;
}

// Adds `part`'s requests and time to `total`.
void merge(Result& total, const Result& part) {
  total.seconds += part.seconds;
  total.latenciesUs.insert(total.latenciesUs.end(), part.latenciesUs.begin(),
                           part.latenciesUs.end());
  total.errors += part.errors;
  total.lost += part.lost;
}

// A round's share of the run: `o` with o.requests split over kRounds.
using RoundRunner = std::function<Result(const Options& round, int index)>;
constexpr int kRounds = 10;

// Runs the baseline and the daemon in alternating rounds and sums each side.
// This machine's fsync and scheduling latencies drift over seconds: one long
// run of each compared two different machines; alternating rounds give both
// sides the same mix of quiet and busy moments.
std::vector<Result> alternate(const Options& o, const std::vector<RoundRunner>& sides) {
  Options round = o;
  round.requests = std::max(1, o.requests / kRounds);
  std::vector<Result> results(sides.size());
  for (int k = 0; k < kRounds; ++k)
    for (size_t s = 0; s < sides.size(); ++s) merge(results[s], sides[s](round, k));
  return results;
}
std::pair<Result, Result> alternate(const Options& o, const RoundRunner& base,
                                    const RoundRunner& daemon) {
  auto results = alternate(o, std::vector<RoundRunner>{base, daemon});
  return {results[0], results[1]};
}

Result runClients(const std::string& socket, const Options& o, const RequestMaker& make,
                  bool checkReplies) {
  return runThreads(o, [&](int c) -> ClientStep {
    auto client = std::make_shared<VSAIPCClient>();
    VSAErrorRef error;
    bool connected = client->connect(socket, &error);
    return [&, c, client, connected](int i, Result& r) {
      if (!connected) {
        ++r.lost;
        return;
      }
      VSAErrorRef sendError;
      auto start = Clock::now();
      auto reply = client->sendRequest(make(c, i), std::chrono::seconds(60), &sendError);
      r.latenciesUs.push_back(
          std::chrono::duration<double, std::micro>(Clock::now() - start).count());
      if (!reply) {
        ++r.lost;
      } else if (checkReplies) {
        const VSAValue* e = reply->get("ReplyError");
        if (!e || e->uint64Value().value_or(0) != 1) ++r.errors;
      }
    };
  });
}

// Launches of one app over an upcall socket; `served` checks that every
// reply is a served one with the success flag set.
Result runUpcalls(const std::string& socket, const Options& o, bool served) {
  VSAUpcallProcess p;
  p.codeSignatureID = "com.bench.upcall";
  p.uid = 501;
  p.personaID = 1000;
  p.sandboxType = 0;
  p.groups = {"group.bench.one", "group.bench.two"};
  const std::vector<uint8_t> memory = *p.pack();
  VSAUpcallRequest request;
  request.descriptorSize = request.requestSize = static_cast<uint32_t>(memory.size());
  const std::vector<uint8_t> message = request.bytes();
  return runThreads(o, [&](int) -> ClientStep {
    auto client = std::make_shared<VSAUpcallClient>();
    std::string why;
    bool connected = client->connect(socket, &why);
    return [&, client, connected](int, Result& r) {
      std::vector<uint8_t> reply;
      std::optional<std::vector<uint8_t>> replyMemory;
      std::string callWhy;
      auto start = Clock::now();
      bool ok = connected && client->call(message, &memory, &reply, &replyMemory, &callWhy);
      r.latenciesUs.push_back(
          std::chrono::duration<double, std::micro>(Clock::now() - start).count());
      if (!ok) {
        ++r.lost;
        return;
      }
      auto parsed = VSAUpcallReply::parse(reply.data(), reply.size());
      if (!parsed || !replyMemory) {
        ++r.errors;
      } else if (served) {
        auto answer = VSAUpcallAnswer::read(*replyMemory);
        if (parsed->returnCode != 0 || answer.success != 1u || answer.groups.size() != 2)
          ++r.errors;
      }
    };
  });
}

// Prints both runs and their ratios, and records the throughput ratio (and,
// with several clients, the p99 latency ratio) for bench/run-all's table.
void printPair(const char* what, const Result& base, const Result& daemon, const Options& o,
               const char* baseline, double target, const char* measureSuffix = "") {
  std::printf("%-10s %12s %12s %12s\n", what, "requests/s", "p50 (us)", "p99 (us)");
  std::printf("%-10s %12.0f %12.1f %12.1f\n", "baseline", base.perSecond(), base.percentile(0.5),
              base.percentile(0.99));
  std::printf("%-10s %12.0f %12.1f %12.1f\n", "vessad", daemon.perSecond(), daemon.percentile(0.5),
              daemon.percentile(0.99));
  std::printf("ratio: throughput %.2fx, p50 latency %.2fx, p99 latency %.2fx (baseline / vessad)\n",
              daemon.perSecond() / base.perSecond(),
              base.percentile(0.5) / std::max(daemon.percentile(0.5), 1e-9),
              base.percentile(0.99) / std::max(daemon.percentile(0.99), 1e-9));
  std::printf("errors: %ld, lost replies: %ld (of %zu)\n", daemon.errors, daemon.lost,
              daemon.latenciesUs.size() + static_cast<size_t>(daemon.lost));
  std::string measure = std::string(what) + ", " + std::to_string(o.clients) +
                        (o.clients == 1 ? " client" : " clients") + (o.pin >= 0 ? ", pinned" : "") +
                        measureSuffix;
  VSABenchRecord(measure.c_str(), baseline, daemon.perSecond() / base.perSecond(), target);
  if (o.clients > 1 && target > 0)  // p99 within 3x the baseline's
    VSABenchRecord((measure + ", p99").c_str(), baseline,
                   base.percentile(0.99) / std::max(daemon.percentile(0.99), 1e-9), 1.0 / 3);
  if (daemon.errors || daemon.lost)
    VSABenchRecord((measure + ": errors or lost replies").c_str(), "none", 0, 1);
}

VSAValue request(VSACommandNumber command, const std::string& id, bool create = false) {
  return VSAValue::Dictionary{{"Command", VSAValue(command)},
                              {"Identifier", VSAValue(id)},
                              {"ContainerClass", VSAValue(VSAClass::kDataApplication)},
                              {"CreateIfNecessary", VSAValue(create)}};
}

// The name of a container's metadata file.
constexpr const char* kMetadataName = ".com.tamsk.vessa_keeper.metadata.plist";

// The path of an existing data container, asked of the daemon ("" on failure).
std::string containerPath(const std::string& socket, const std::string& id) {
  VSAIPCClient client;
  VSAErrorRef error;
  std::optional<VSAValue> reply;
  if (client.connect(socket, &error))
    reply = client.sendRequest(request(VSACommands::kCreateOrLookup, id), std::chrono::seconds(60),
                               &error);
  const VSAValue* path = reply ? reply->get("ReplyPath") : nullptr;
  if (!path || !path->stringValue()) {
    std::fprintf(stderr, "vessa-bench: no path for %s: %s\n", id.c_str(),
                 error ? error->message().c_str() : "no ReplyPath");
    return "";
  }
  return *path->stringValue();
}

// Container directory work done by hand, in a scratch directory beside the
// daemon's own (so that the file system places both sides' inodes alike):
// what the daemon does on disk for each request, without its cache, IPC or
// checks. It is the baseline of the create and mixed modes.
class RawContainers {
 public:
  explicit RawContainers(const std::string& root)
      : base_(root + "/private/var/mobile/Containers/bench-raw"),
        staging_(base_ + "/Staging"),
        live_(base_ + "/Live"),
        trash_(base_ + "/Trash") {
    for (const auto& d : {staging_, live_, trash_}) std::filesystem::create_directories(d);
  }
  ~RawContainers() { std::filesystem::remove_all(base_); }

  // A new container as creation makes it: staging directory, metadata file
  // (written, fsynced, renamed), sub-directories with owner, mode and class,
  // the staged directories that hold entries synced (so that the tree
  // survives a power loss once committed), and the rename into place.
  void create(const std::string& name) {
    std::string dir = staging_ + "/" + name;
    fs_.mkdir(dir, 0755);
    fs_.lchown(dir, 501, 501);
    VSAValue metadata = VSAValue::Dictionary{{"VSAMetadataIdentifier", VSAValue(name)},
                                             {"VSAMetadataUUID", VSAValue(name)}};
    auto bytes = VSAPlist::serialize(metadata, VSAPlist::Format::Binary, nullptr);
    fs_.writeFile(dir + "/.tmp-metadata", *bytes, 0644);
    fs_.rename(dir + "/.tmp-metadata", dir + "/" + kMetadataName);
    for (const char* s :
         {"Documents", "Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"}) {
      std::string sub = dir + "/" + s;
      fs_.mkdir(sub, 0755);
      fs_.lchown(sub, 501, 501);
      fs_.chmod(sub, 0755);
      fs_.setProtectionClass(sub, 0);
    }
    for (const std::string& holder : {dir + "/Library", dir}) {
      int fd = -1;
      if (fs_.openDirectory(holder, &fd) == 0) {
        fs_.syncDirectory(fd);
        close(fd);
      }
    }
    fs_.rename(dir, live_ + "/" + name);
  }
  // A look-up finds the container and checks that its metadata file is there.
  bool exists(const std::string& name) {
    struct stat st;
    return fs_.lstat(live_ + "/" + name + "/" + kMetadataName, &st) == 0;
  }
  // Reading a container's metadata: the file, parsed.
  bool readMetadata(const std::string& name) {
    return VSA_dictionaryWithContentsOfURL(live_ + "/" + name + "/" + kMetadataName, 0, nullptr)
        .has_value();
  }
  // Listing a class: every container's metadata in `classDirectory` (the
  // daemon's own class directory, so both list the same containers), read
  // and parsed.
  size_t list(const std::string& classDirectory) {
    size_t n = 0;
    std::error_code ec;
    for (const auto& e : std::filesystem::directory_iterator(classDirectory, ec))
      n += VSA_dictionaryWithContentsOfURL(e.path().string() + "/" + kMetadataName, 0, nullptr)
               .has_value();
    return n;
  }
  // Deleting: the rename out of the class directory, then the removal of the
  // tree (which the daemon does later, off the request).
  void remove(const std::string& name) {
    fs_.rename(live_ + "/" + name, trash_ + "/" + name);
    std::filesystem::remove_all(trash_ + "/" + name);
  }

 private:
  VSALinuxFileSystem fs_;
  std::string base_, staging_, live_, trash_;
};

// `raw` lives for the whole run: the daemon's containers stay on disk, so the
// raw loop's stay too, and their removal does not land in the next daemon
// round (freeing a round's inodes made the next allocations scan past them).
Result rawCreateLoop(RawContainers& raw, int count) {
  Result r;
  auto start = Clock::now();
  for (int i = 0; i < count; ++i) {
    auto one = Clock::now();
    raw.create(VSAUUID::random().string());
    r.latenciesUs.push_back(std::chrono::duration<double, std::micro>(Clock::now() - one).count());
  }
  r.seconds = std::chrono::duration<double>(Clock::now() - start).count();
  return r;
}

// The mixed mode's requests, all clients' in turn, done by hand on one thread.
double rawMixedLoop(const std::string& root, const Options& o) {
  RawContainers raw(root);
  long done = 0;
  auto start = Clock::now();
  for (int i = 0; i < o.requests; ++i) {
    for (int c = 0; c < o.clients; ++c, ++done) {
      std::string name = "raw." + std::to_string(c) + "." + std::to_string(i / 5);
      switch (i % 5) {
        case 0:
          raw.create(name);
          break;
        case 1:
          raw.exists(name);
          break;
        case 2:
          raw.readMetadata(name);
          break;
        case 3:
          raw.list(o.root + "/private/var/mobile/Containers/Data/Application");
          break;
        default:
          raw.remove(name);
      }
    }
  }
  return done / std::chrono::duration<double>(Clock::now() - start).count();
}

// The daemon's memory, in KiB: `field` of /proc/<pid>/status (VmRSS, VmHWM),
// the pid taken from the root's pid file; -1 when either cannot be read.
long daemonPid(const std::string& root) {
  std::ifstream pidFile(root + "/run/vessad/vessad.pid");
  long pid = 0;
  return (pidFile >> pid) && pid > 0 ? pid : -1;
}

long daemonMemoryKiB(const std::string& root, const char* field = "VmRSS") {
  long pid = daemonPid(root);
  if (pid <= 0) return -1;
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  std::string line, prefix = std::string(field) + ":";
  while (std::getline(status, line))
    if (line.rfind(prefix, 0) == 0) return std::atol(line.c_str() + prefix.size());
  return -1;
}

// Idle connections from another user (the daemon admits a bounded number per
// user): a child process that switches to `uid`, connects `count` times and
// holds the sockets until the returned descriptor is closed. -1 on failure.
int holdConnectionsAs(uid_t uid, const std::string& socket, int count) {
  int ready[2], release[2];
  if (pipe(ready) != 0 || pipe(release) != 0) return -1;
  pid_t child = fork();
  if (child == 0) {
    close(ready[0]);
    close(release[1]);
    if (setresgid(uid, uid, uid) != 0 || setresuid(uid, uid, uid) != 0) _exit(1);
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::snprintf(addr.sun_path, sizeof addr.sun_path, "%s", socket.c_str());
    for (int i = 0; i < count; ++i) {
      int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
      if (fd < 0 || ::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) _exit(1);
    }
    char c = 1;
    (void)!write(ready[1], &c, 1);
    (void)!read(release[0], &c, 1);  // returns when the parent closes its end
    _exit(0);
  }
  close(ready[1]);
  close(release[0]);
  char c = 0;
  bool ok = child > 0 && read(ready[0], &c, 1) == 1;
  close(ready[0]);
  if (!ok) {
    close(release[1]);
    return -1;
  }
  return release[1];
}

// Memory with `o.containers` containers cached and `o.idle` idle connections,
// then a soak of look-ups (o.clients x o.requests): the daemon's RSS before
// and after it must not grow.
int runMemory(const std::string& socket, const Options& o) {
  Options make = o;
  make.clients = 16;
  make.requests = (o.containers + 15) / 16;
  auto id = [](int n) { return "com.bench.memory." + std::to_string(n); };
  Result made = runClients(
      socket, make,
      [&](int c, int i) {
        return request(VSACommands::kCreateOrLookup, id(c * make.requests + i), true);
      },
      true);
  // One process may hold only so many connections: the rest come from another one.
  const int own = std::min(o.idle, 48);
  std::vector<std::shared_ptr<VSAIPCClient>> idle;
  for (int i = 0; i < own; ++i) {
    auto client = std::make_shared<VSAIPCClient>();
    VSAErrorRef error;
    // One request each, as a client that looked something up and then went quiet.
    if (client->connect(socket, &error) &&
        client->sendRequest(request(VSACommands::kCreateOrLookup, id(i)), std::chrono::seconds(60),
                            &error))
      idle.push_back(client);
  }
  int held = o.idle > own ? holdConnectionsAs(501, socket, o.idle - own) : -1;
  if (o.idle > own && held < 0)
    std::fprintf(stderr, "vessa-bench: uid 501 could not hold %d connections (can it reach %s?)\n",
                 o.idle - own, socket.c_str());
  std::this_thread::sleep_for(std::chrono::milliseconds(500));  // let the daemon accept them
  long cached = daemonMemoryKiB(o.root);
  RequestMaker lookup = [&](int c, int i) {
    return request(VSACommands::kCreateOrLookup, id((c * 7919 + i) % o.containers));
  };
  Options warm = o;
  warm.requests = std::max(1, o.requests / 10);
  runClients(socket, warm, lookup, true);
  long before = daemonMemoryKiB(o.root);
  Result soak = runClients(socket, o, lookup, true);
  long after = daemonMemoryKiB(o.root);
  if (held >= 0) close(held);
  std::printf(
      "memory     %d containers made (%ld errors, %ld lost), %zu + %d idle connections\n"
      "           vessad RSS with them cached: %ld KiB\n"
      "soak       %zu look-ups at %.0f requests/s (%ld errors, %ld lost)\n"
      "           vessad RSS before %ld KiB, after %ld KiB (%+.1f%%)\n",
      o.containers, made.errors, made.lost, idle.size(), held >= 0 ? o.idle - own : 0, cached,
      soak.latenciesUs.size(), soak.perSecond(), soak.errors, soak.lost, before, after,
      before > 0 ? 100.0 * (after - before) / before : 0.0);
  std::string what = "vessad, " + std::to_string(o.containers) + " containers cached, " +
                     std::to_string(o.idle) + " idle connections";
  VSABenchRecordRSS(what.c_str(), cached);
  std::string soakWhat = "vessad after a soak of " + std::to_string(soak.latenciesUs.size()) +
                         " look-ups (before: " + std::to_string(before) + " KiB)";
  VSABenchRecordRSS(soakWhat.c_str(), after);
  // Judged as before/after: 1.0 is no growth; the target allows 5%.
  VSABenchRecord("RSS before / after the look-up soak", "no growth",
                 after > 0 ? static_cast<double>(before) / after : 0, 0.95);
  bool failed = made.lost || soak.errors || soak.lost || (held < 0 && o.idle > own);
  if (failed) VSABenchRecord("memory scenario: errors or lost replies", "none", 0, 1);
  return failed ? 1 : 0;
}

// With --pin: vessa-bench, the floor it starts next and the daemon on one
// CPU for the scope of this object.
class Pinning {
 public:
  explicit Pinning(const Options& o) {
    if (o.pin < 0) return;
    pin_.emplace(static_cast<pid_t>(daemonPid(o.root)), o.pin);
    if (!pin_->pinned())
      std::fprintf(stderr, "vessa-bench: cannot pin the daemon of %s to CPU %d\n", o.root.c_str(),
                   o.pin);
  }
  bool ok() const { return !pin_ || pin_->pinned(); }

 private:
  std::optional<VSABenchPin> pin_;
};

int usage() {
  std::fprintf(
      stderr,
      "usage: vessa-bench --root DIR [--mode lookup|create|mixed|upcall|memory] [--clients N] "
      "[--requests N]\n"
      "                   [--containers N] [--idle N] [--pin CPU] [--floor PROGRAM]\n"
      "  lookup: command 0 on one existing container (baseline: vessa-floor, an\n"
      "          echo process sending every frame back)\n"
      "  create: command 0 creating a new container per request (baseline: raw\n"
      "          directory work in the same root)\n"
      "  mixed:  create, look up, read metadata, list, delete (baseline: the same\n"
      "          file work done by hand in one serial loop)\n"
      "  upcall: the kernel's upcall for an app with a data and two group\n"
      "          containers (baseline: vessa-floor echoing packet and memfd)\n"
      "  memory: makes --containers containers (default 10000), leaves --idle\n"
      "          connections idle (default 100), prints the daemon's RSS, then\n"
      "          its RSS before and after a soak of look-ups (the daemon's user:\n"
      "          some idle connections come from uid 501)\n"
      "  --requests counts requests per client (default 10000)\n"
      "  --pin CPU: lookup and upcall with vessa-bench, the floor and the daemon\n"
      "          on that one CPU (the measure says \"pinned\")\n"
      "  --floor: the vessa-floor program (default: beside vessa-bench)\n"
      "lookup, create and upcall alternate baseline and vessad in 10 rounds.\n");
  return 2;
}
}  // namespace

int main(int argc, char** argv) {
  Options o;
  for (int i = 1; i < argc; ++i) {
    std::string a = argv[i];
    auto value = [&]() -> std::string { return i + 1 < argc ? argv[++i] : ""; };
    if (a == "--root")
      o.root = value();
    else if (a == "--mode")
      o.mode = value();
    else if (a == "--clients")
      o.clients = std::atoi(value().c_str());
    else if (a == "--requests")
      o.requests = std::atoi(value().c_str());
    else if (a == "--containers")
      o.containers = std::atoi(value().c_str());
    else if (a == "--idle")
      o.idle = std::atoi(value().c_str());
    else if (a == "--pin")
      o.pin = std::atoi(value().c_str());
    else if (a == "--floor")
      o.floor = value();
    else
      return usage();
  }
  if (o.floor.empty())
    o.floor = (std::filesystem::path(argv[0]).parent_path() / "vessa-floor").string();
  if (o.clients < 1 || o.requests < 1 || o.containers < 1 || o.idle < 0) return usage();
  std::string socket = o.root + "/run/vessad/com.tamsk.vessad";
  std::string pid = std::to_string(getpid());
  std::printf("vessa-bench: mode %s, %d client(s) x %d request(s)\n", o.mode.c_str(), o.clients,
              o.requests);
  if (o.mode == "lookup") {
    Options one = o;
    one.clients = 1;
    one.requests = 1;
    // The first request of a run: on a daemon that has not listed the class
    // yet it builds the class's map (every container's metadata read).
    Result first = runClients(
        socket, one,
        [&](int, int) { return request(VSACommands::kCreateOrLookup, "com.bench.lookup", true); },
        true);
    std::printf("first request: %.1f us\n", first.percentile(0.5));
    RequestMaker make = [](int, int) {
      return request(VSACommands::kCreateOrLookup, "com.bench.lookup");
    };
    std::string path = containerPath(socket, "com.bench.lookup");
    if (path.empty()) return 1;
    Pinning pinning(o);
    if (!pinning.ok()) return 1;
    // Two floors: the echo alone, and the echo with the checks every request
    // needs (a waiting connection, the peer's executable, the metadata file).
    VSABenchFloor floor(o.floor, {"stream"});
    VSABenchFloor checked(o.floor, {"stream", path + "/" + kMetadataName});
    if (!floor.running() || !checked.running()) return 1;
    auto results = alternate(
        o, {[&](const Options& r, int) { return runClients(floor.socket(), r, make, false); },
            [&](const Options& r, int) { return runClients(checked.socket(), r, make, false); },
            [&](const Options& r, int) { return runClients(socket, r, make, true); }});
    const Result &base = results[0], &withChecks = results[1], &daemon = results[2];
    printPair("look-up", base, daemon, o, "echo process, same frames", 0);
    // One client, pinned: judged against the floor of the work a request
    // needs (the echo alone is reported: those checks take a third of it).
    printPair("look-up", withChecks, daemon, o, "echo process + per-request checks",
              o.clients == 1 && o.pin >= 0 ? 0.75 : 0, ", against the checks' floor");
    std::printf("the checks' floor: %.2fx of the echo alone\n",
                withChecks.perSecond() / base.perSecond());
    return 0;
  }
  if (o.mode == "create") {
    RawContainers containers(o.root);
    auto [raw, daemon] = alternate(
        o, [&](const Options& r, int) { return rawCreateLoop(containers, r.requests * r.clients); },
        [&](const Options& r, int k) {
          return runClients(
              socket, r,
              [&, k](int c, int i) {
                return request(VSACommands::kCreateOrLookup,
                               "com.bench.create." + pid + "." + std::to_string(c) + "." +
                                   std::to_string(k * r.requests + i),
                               true);
              },
              true);
        });
    std::printf(
        "create     raw loop %.0f containers/s (p50 %.1f us, p99 %.1f us), vessad %.0f "
        "containers/s (p50 %.1f us, p99 %.1f us)\nratio: %.2fx\nerrors: %ld, lost replies: %ld\n",
        raw.perSecond(), raw.percentile(0.5), raw.percentile(0.99), daemon.perSecond(),
        daemon.percentile(0.5), daemon.percentile(0.99), daemon.perSecond() / raw.perSecond(),
        daemon.errors, daemon.lost);
    VSABenchRecord("creation, 1 client", "raw loop, same work and fsyncs",
                   daemon.perSecond() / raw.perSecond(), 0.8);
    return 0;
  }
  if (o.mode == "upcall") {
    std::string upcallSocket = o.root + "/run/vessad/com.tamsk.vessad.upcall";
    Options one = o;
    one.clients = one.requests = 1;
    // An installed app: its code signing says it has a class-2 data container.
    runClients(
        socket, one,
        [](int, int) {
          return VSAValue(VSAValue::Dictionary{
              {"Command", VSAValue(VSACommands::kRecordCodeSigningInfo)},
              {"Identifier", VSAValue("com.bench.upcall")},
              {"CodeSigningInfo",
               VSAValue::Dictionary{{"com.tamsk.Vessa.Entitlements", VSAValue::dictionary()}}},
              {"OptionsDictionary", VSAValue::Dictionary{{"com.tamsk.Vessa.DataContainerClass",
                                                          VSAValue(VSAClass::kDataApplication)}}}});
        },
        true);
    Result warm = runUpcalls(upcallSocket, one, true);  // makes the containers
    if (warm.errors || warm.lost) {
      std::fprintf(stderr, "vessa-bench: the first upcall failed (is this a kernel bridge?)\n");
      return 1;
    }
    Pinning pinning(o);
    if (!pinning.ok()) return 1;
    VSABenchFloor floor(o.floor, {"seqpacket"});
    if (!floor.running()) return 1;
    auto [base, daemon] = alternate(
        o, [&](const Options& r, int) { return runUpcalls(floor.socket(), r, false); },
        [&](const Options& r, int) { return runUpcalls(upcallSocket, r, true); });
    printPair("upcall", base, daemon, o, "seqpacket+memfd echo process",
              o.clients == 1 && o.pin >= 0 ? 0.6 : 0);
    return 0;
  }
  if (o.mode == "mixed") {
    // Each client cycles over its own containers: create, look up, metadata, list, delete.
    RequestMaker make = [&](int c, int i) {
      std::string id =
          "com.bench.mixed." + pid + "." + std::to_string(c) + "." + std::to_string(i / 5);
      switch (i % 5) {
        case 0:
          return request(VSACommands::kCreateOrLookup, id, true);
        case 1:
          return request(VSACommands::kCreateOrLookup, id);
        case 2:
          return request(VSACommands::kContainerMetadata, id);
        case 3:
          return VSAValue(
              VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kListContainers)},
                                   {"ContainerClass", VSAValue(VSAClass::kDataApplication)}});
        default:
          return request(VSACommands::kDeleteContainer, id);
      }
    };
    double raw = rawMixedLoop(o.root, o);
    Result daemon = runClients(socket, o, make, true);
    std::printf(
        "mixed      raw serial loop %.0f requests/s, vessad %.0f requests/s (p50 %.1f us, p99 "
        "%.1f us)\nratio: %.2fx\nerrors: %ld, lost replies: %ld\n",
        raw, daemon.perSecond(), daemon.percentile(0.5), daemon.percentile(0.99),
        daemon.perSecond() / raw, daemon.errors, daemon.lost);
    std::string measure = "mixed, " + std::to_string(o.clients) + " clients";
    VSABenchRecord(measure.c_str(), "raw serial loop, same mix", daemon.perSecond() / raw, 0.6);
    if (daemon.errors || daemon.lost)
      VSABenchRecord((measure + ": errors or lost replies").c_str(), "none", 0, 1);
    return 0;
  }
  if (o.mode == "memory") return runMemory(socket, o);
  return usage();
}
