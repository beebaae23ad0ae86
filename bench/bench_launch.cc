// What starting an app through vessa-launch adds to starting the program
// directly: both timed as whole processes (fork, exec, wait), interleaved so
// that both see the same machine, in the same run.
//   bench_launch ROOT LAUNCHER RUNS
// The launch includes the upcall (containers looked up), the bundle look-up,
// the persona and signing-identifier records, the Landlock ruleset and the
// drop to the app's user. A launcher that waits for its app costs one more
// process start and a fork whatever else it does; `timeout` (which forks,
// execs, waits and passes signals on, as vessa-launch must) is that floor,
// measured in the same run. The
// first table row is reported: the launch against the program alone. The
// second is judged: against the floor, the launch's own work (upcall,
// records, ruleset, its larger program) may add 2 ms at the median.
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <functional>
#include <string>
#include <vector>

#include "VSABenchTable.h"

namespace {
constexpr double kBudgetMs = 2.0;

// Starts every command at once; the wall time of each, in milliseconds
// (negative for one that failed).
std::vector<double> timedTogether(const std::vector<std::vector<std::string>>& commands) {
  std::vector<double> times(commands.size(), -1);
  std::vector<std::pair<pid_t, std::chrono::steady_clock::time_point>> started;
  for (const auto& args : commands) {
    std::vector<char*> argv;
    for (const auto& a : args) argv.push_back(const_cast<char*>(a.c_str()));
    argv.push_back(nullptr);
    auto begin = std::chrono::steady_clock::now();
    pid_t pid = fork();
    if (pid == 0) {
      execv(argv[0], argv.data());
      _exit(127);
    }
    started.emplace_back(pid, begin);
  }
  for (size_t done = 0; done < started.size(); ++done) {
    int status = 0;
    pid_t pid = waitpid(-1, &status, 0);
    auto end = std::chrono::steady_clock::now();
    for (size_t i = 0; i < started.size(); ++i)
      if (started[i].first == pid && WIFEXITED(status) && WEXITSTATUS(status) == 0)
        times[i] = std::chrono::duration<double, std::milli>(end - started[i].second).count();
  }
  return times;
}

// Wall time of one run of argv, in milliseconds; negative when it failed.
double timed(const std::vector<std::string>& args) { return timedTogether({args})[0]; }

double percentile(std::vector<double> v, double p) {
  std::sort(v.begin(), v.end());
  return v[std::min(v.size() - 1, static_cast<size_t>(p * (v.size() - 1) + 0.5))];
}
}  // namespace

// Sixteen apps launched at once against sixteen wrappers at once, `rounds`
// times: what each launch takes while the others compete for the CPUs
// (reported, not judged: with two CPUs, sixteen launches' own work queues up).
void launchTogether(const std::function<std::vector<std::string>(const std::string&)>& launchOf,
                    const std::vector<std::string>& wrapped, int rounds) {
  constexpr int kApps = 16;
  std::vector<std::vector<std::string>> apps, wrappers(kApps, wrapped);
  for (int i = 0; i < kApps; ++i)
    apps.push_back(launchOf("com.example.bench-launch." + std::to_string(i)));
  timedTogether(apps);  // makes their containers
  std::vector<double> l, w;
  for (int r = 0; r < rounds; ++r) {
    for (double t : timedTogether(wrappers)) w.push_back(t);
    for (double t : timedTogether(apps)) l.push_back(t);
  }
  if (*std::min_element(l.begin(), l.end()) < 0) {
    VSABenchRecord("16 app launches at once: a launch failed", "none", 0, 1);
    return;
  }
  double dl = percentile(l, 0.5), dw = percentile(w, 0.5);
  std::printf(
      "16 at once, %d rounds: wrappers median %.3f ms p99 %.3f ms; launches median %.3f ms "
      "p99 %.3f ms; added %+.3f ms at the median\n",
      rounds, dw, percentile(w, 0.99), dl, percentile(l, 0.99), dl - dw);
  char measure[96];
  std::snprintf(measure, sizeof measure, "16 app launches at once (%+.2f ms median)", dl - dw);
  VSABenchRecord(measure, "16 wrappers at once", dw / dl, 0);
}

int main(int argc, char** argv) {
  if (argc != 4) {
    std::fprintf(stderr, "usage: bench_launch ROOT LAUNCHER RUNS\n");
    return 2;
  }
  std::string root = argv[1], launcher = argv[2];
  int runs = std::max(1, std::atoi(argv[3]));
  std::vector<std::string> direct = {"/bin/true"};
  auto launchOf = [&](const std::string& app) {
    return std::vector<std::string>{
        launcher, "--root",   root, "--signing-id", app, "--group", "group.example.bench-launch",
        "--",     "/bin/true"};
  };
  std::vector<std::string> launched = launchOf("com.example.bench-launch");
  if (timed(launched) < 0) {  // makes the containers; says why it fails
    std::fprintf(stderr, "bench_launch: %s fails on %s\n", launcher.c_str(), root.c_str());
    VSABenchRecord("app launch: vessa-launch fails", "none", 0, 1);
    return 1;
  }
  std::vector<std::string> wrapped = {"/usr/bin/timeout", "600", "/bin/true"};
  std::vector<double> a, b, w;
  for (int i = 0; i < runs; ++i) {
    a.push_back(timed(direct));
    w.push_back(timed(wrapped));
    b.push_back(timed(launched));
  }
  if (*std::min_element(b.begin(), b.end()) < 0) {
    VSABenchRecord("app launch: vessa-launch failed in the loop", "none", 0, 1);
    return 1;
  }
  // Each launch is paired with the wrapper run just before it: the median of
  // those differences is what the launch adds, and does not move with the
  // machine's speed drifting over the run the way two separate medians do.
  std::vector<double> added, addedOverProgram;
  for (int i = 0; i < runs; ++i) {
    added.push_back(b[i] - w[i]);
    addedOverProgram.push_back(b[i] - a[i]);
  }
  double da = percentile(a, 0.5), db = percentile(b, 0.5), dw = percentile(w, 0.5);
  double overProgram = percentile(addedOverProgram, 0.5), overFloor = percentile(added, 0.5);
  std::printf("runs: %d each, interleaved\n", runs);
  std::printf("/bin/true directly:        median %.3f ms  p99 %.3f ms\n", da, percentile(a, 0.99));
  std::printf("timeout 600 /bin/true:      median %.3f ms  p99 %.3f ms\n", dw, percentile(w, 0.99));
  std::printf("vessa-launch -- /bin/true: median %.3f ms  p99 %.3f ms\n", db, percentile(b, 0.99));
  std::printf(
      "added by the launch (median of paired differences): %+.3f ms over the program, "
      "%+.3f ms over the floor, p99 %+.3f ms (budget %.1f ms at the median)\n",
      overProgram, overFloor, percentile(added, 0.99), kBudgetMs);
  char measure[96];
  std::snprintf(measure, sizeof measure, "app launch (%+.2f ms median)", overProgram);
  VSABenchRecord(measure, "the program started directly", da / (da + overProgram), 0);
  std::snprintf(measure, sizeof measure, "app launch over a wrapper (%+.2f ms)", overFloor);
  VSABenchRecord(measure, "timeout: fork, exec, wait, signals", dw / (dw + overFloor),
                 dw / (dw + kBudgetMs));
  launchTogether(launchOf, wrapped, std::max(1, runs / 10));
  return 0;
}
