// vessa-bench: a load generator for a running vessad.
//
// Every figure is printed beside a baseline measured in the same run:
//  - request modes (lookup, mixed) first run the same clients against an echo
//    server built from the daemon's own listener, socket and framing, then
//    against the daemon, and print requests/s and p50/p99 latency as ratios;
//  - the create mode compares container creation through the daemon with a
//    raw loop doing the same directory work (staging directory,
//    sub-directories, metadata file, rename) in the same root;
//  - the upcall mode launches one app (data container and two group
//    containers, made by the first launch) over the upcall's seqpacket
//    socket, against an echo server on the daemon's own upcall transport
//    that sends the same packet and a memfd of the same bytes back.
// The client must be registered in the root's client registry with the
// "com.tamsk.private.Vessa.allowed" entitlement, and as the kernel bridge for
// the upcall mode (scripts/vessa-bench.sh does both).
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "../bench/VSABenchTable.h"
#include "base/VSAPlist.h"
#include "base/VSAUUID.h"
#include "base/VSAWorkQueue.h"
#include "platform/VSAIPCClient.h"
#include "platform/VSAIPCListener.h"
#include "platform/VSALinuxFileSystem.h"
#include "platform/VSATransactions.h"
#include "platform/VSAUpcallClient.h"
#include "platform/VSAUpcallListener.h"
#include "upcall/VSAUpcallMessage.h"
#include "upcall/VSAUpcallPayload.h"

namespace {
using Clock = std::chrono::steady_clock;

struct Options {
  std::string root = "/";
  std::string mode = "lookup";
  int clients = 1;
  int requests = 10000;
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

// The daemon's listener, socket and framing, answering every request at once.
Result runEcho(const Options& o, const RequestMaker& make) {
  std::string dir = "/tmp/vessa-bench-echo-XXXXXX";
  if (!mkdtemp(dir.data())) return {};
  auto transactions = std::make_shared<VSATransactions>();
  VSAIPCListener listener(dir + "/echo", VSAWorkQueue::create("vessa-bench.echo"), transactions);
  VSAErrorRef error;
  if (!listener.listen(&error)) return {};
  listener.setHandler([](const VSAIPCMessageRef& m) {
    auto reply = m->createReply();
    if (!reply) return;
    reply->set("ReplyError", VSAValue(1u));
    m->sendReply(*reply);
  });
  listener.resume();
  Result r = runClients(dir + "/echo", o, make, true);
  listener.stop();
  std::filesystem::remove_all(dir);
  return r;
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

// The daemon's upcall transport, sending every packet and its memory back.
Result runUpcallEcho(const Options& o) {
  std::string dir = "/tmp/vessa-bench-upcall-XXXXXX";
  if (!mkdtemp(dir.data())) return {};
  VSAUpcallListener echo(dir + "/echo", nullptr, 1u << 20);
  VSAErrorRef error;
  if (!echo.start([](VSAUpcallPacket packet,
                     VSAUpcallListener::Reply reply) { reply(packet.message, &packet.memory); },
                  &error))
    return {};
  Result r = runUpcalls(dir + "/echo", o, false);
  echo.stop();
  std::filesystem::remove_all(dir);
  return r;
}

// Prints both runs and their ratios, and records the throughput ratio (and,
// with several clients, the p99 latency ratio) for bench/run-all's table.
void printPair(const char* what, const Result& base, const Result& daemon, const Options& o,
               const char* baseline, double target) {
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
                        (o.clients == 1 ? " client" : " clients");
  VSABenchRecord(measure.c_str(), baseline, daemon.perSecond() / base.perSecond(), target);
  if (o.clients > 1 && target > 0)  // p99 within 3x the baseline's
    VSABenchRecord((measure + ", p99").c_str(), baseline,
                   base.percentile(0.99) / std::max(daemon.percentile(0.99), 1e-9), 1.0 / 3);
  if (daemon.errors || daemon.lost)
    VSABenchRecord((measure + ": errors or lost replies").c_str(), "none", 0, 1);
}

VSAValue request(uint64_t command, const std::string& id, bool create = false) {
  return VSAValue::Dictionary{{"Command", VSAValue(command)},
                              {"Identifier", VSAValue(id)},
                              {"ContainerClass", VSAValue(2u)},
                              {"CreateIfNecessary", VSAValue(create)}};
}

// One container's directory work done by hand, as creation does it.
double rawCreateLoop(const std::string& root, int count) {
  VSALinuxFileSystem fs;
  std::string base = root + "/private/var/mobile/bench-raw";
  std::string staging = base + "/Staging", live = base + "/Live";
  std::filesystem::create_directories(staging);
  std::filesystem::create_directories(live);
  const char* subdirs[] = {"Documents",           "Library",    "Library/Caches",
                           "Library/Preferences", "SystemData", "tmp"};
  auto start = Clock::now();
  for (int i = 0; i < count; ++i) {
    std::string name = VSAUUID::random().string();
    std::string dir = staging + "/" + name;
    fs.mkdir(dir, 0755);
    fs.lchown(dir, 501, 501);
    VSAValue metadata = VSAValue::Dictionary{{"VSAMetadataIdentifier", VSAValue("com.raw")},
                                             {"VSAMetadataUUID", VSAValue(name)}};
    auto bytes = VSAPlist::serialize(metadata, VSAPlist::Format::Binary, nullptr);
    fs.writeFile(dir + "/.tmp-metadata", *bytes, 0644);
    fs.rename(dir + "/.tmp-metadata", dir + "/.metadata.plist");
    for (const char* s : subdirs) {
      std::string sub = dir + "/" + s;
      fs.mkdir(sub, 0755);
      fs.lchown(sub, 501, 501);
      fs.chmod(sub, 0755);
      fs.setProtectionClass(sub, 0);
    }
    fs.rename(dir, live + "/" + name);
  }
  double seconds = std::chrono::duration<double>(Clock::now() - start).count();
  std::filesystem::remove_all(base);
  return count / seconds;
}

int usage() {
  std::fprintf(stderr,
               "usage: vessa-bench --root DIR [--mode lookup|create|mixed|upcall] [--clients N] "
               "[--requests N]\n"
               "  lookup: command 0 on one existing container (baseline: echo server)\n"
               "  create: command 0 creating a new container per request (baseline: raw\n"
               "          directory work in the same root)\n"
               "  mixed:  look up, create, read metadata, list, delete (baseline: echo)\n"
               "  upcall: the kernel's upcall for an app with a data and two group\n"
               "          containers (baseline: echo on the same seqpacket transport)\n"
               "  --requests counts requests per client (default 10000)\n");
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
    else
      return usage();
  }
  if (o.clients < 1 || o.requests < 1) return usage();
  std::string socket = o.root + "/run/vessad/com.tamsk.vessad";
  std::string pid = std::to_string(getpid());
  std::printf("vessa-bench: mode %s, %d client(s) x %d request(s)\n", o.mode.c_str(), o.clients,
              o.requests);
  if (o.mode == "lookup") {
    Options one = o;
    one.clients = 1;
    one.requests = 1;
    runClients(
        socket, one, [&](int, int) { return request(0, "com.bench.lookup", true); }, true);
    RequestMaker make = [](int, int) { return request(0, "com.bench.lookup"); };
    Result base = runEcho(o, make);
    printPair("look-up", base, runClients(socket, o, make, true), o, "socket echo, same framing",
              o.clients == 1 ? 0.8 : 0.5);
    return 0;
  }
  if (o.mode == "create") {
    double raw = rawCreateLoop(o.root, o.requests * o.clients);
    Result daemon = runClients(
        socket, o,
        [&](int c, int i) {
          return request(
              0, "com.bench.create." + pid + "." + std::to_string(c) + "." + std::to_string(i),
              true);
        },
        true);
    std::printf(
        "create     raw loop %.0f containers/s, vessad %.0f containers/s (p50 %.1f us, p99 "
        "%.1f us)\nratio: %.2fx\nerrors: %ld, lost replies: %ld\n",
        raw, daemon.perSecond(), daemon.percentile(0.5), daemon.percentile(0.99),
        daemon.perSecond() / raw, daemon.errors, daemon.lost);
    VSABenchRecord("creation, 1 client", "raw loop, same work and fsyncs", daemon.perSecond() / raw,
                   0.8);
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
              {"Command", VSAValue(18u)},
              {"Identifier", VSAValue("com.bench.upcall")},
              {"CodeSigningInfo",
               VSAValue::Dictionary{{"com.tamsk.Vessa.Entitlements", VSAValue::dictionary()}}},
              {"OptionsDictionary",
               VSAValue::Dictionary{{"com.tamsk.Vessa.DataContainerClass", VSAValue(2u)}}}});
        },
        true);
    Result warm = runUpcalls(upcallSocket, one, true);  // makes the containers
    if (warm.errors || warm.lost) {
      std::fprintf(stderr, "vessa-bench: the first upcall failed (is this a kernel bridge?)\n");
      return 1;
    }
    Result base = runUpcallEcho(o);
    printPair("upcall", base, runUpcalls(upcallSocket, o, true), o, "seqpacket+memfd echo", 0.7);
    return 0;
  }
  if (o.mode == "mixed") {
    // Each client cycles over its own containers: create, look up, metadata, list, delete.
    RequestMaker make = [&](int c, int i) {
      std::string id =
          "com.bench.mixed." + pid + "." + std::to_string(c) + "." + std::to_string(i / 5);
      switch (i % 5) {
        case 0:
          return request(0, id, true);
        case 1:
          return request(0, id);
        case 2:
          return request(7, id);
        case 3:
          return VSAValue(
              VSAValue::Dictionary{{"Command", VSAValue(1u)}, {"ContainerClass", VSAValue(2u)}});
        default:
          return request(10, id);
      }
    };
    Result base = runEcho(o, make);
    // Reported against the echo server only: a raw loop doing the same file
    // work is the fair baseline, and it is not built yet.
    printPair("mixed", base, runClients(socket, o, make, true), o, "socket echo (report only)", 0);
    return 0;
  }
  return usage();
}
