#include "VSALaunchOptions.h"

#include <cstdlib>
#include <functional>
#include <map>

namespace {
std::optional<uint32_t> number(const std::string& text) {
  if (text.empty() || text.find_first_not_of("0123456789") != std::string::npos || text.size() > 10)
    return std::nullopt;
  unsigned long long v = std::strtoull(text.c_str(), nullptr, 10);
  if (v > UINT32_MAX) return std::nullopt;
  return static_cast<uint32_t>(v);
}
}  // namespace

const char* VSALaunchOptions::usage() {
  return "usage: vessa-launch [--root DIR] --signing-id ID [--uid UID] [--persona ID] [--plugin]\n"
         "                    [--group G]... [--system-container ID] [--system-group G]...\n"
         "                    [--allow-read PATH]... [--allow-write PATH]... [--unconfined]\n"
         "                    [--verbose] -- PROGRAM [ARG...]\n"
         "       vessa-launch [--root DIR] --signing-id ID [...] --print-rules\n"
         "\n"
         "Starts PROGRAM as the app ID, confined to its own containers: asks vessad\n"
         "(through the upcall, as the kernel bridge) for the app's containers, records\n"
         "the process's persona and signing identifier for the daemon, and runs\n"
         "PROGRAM as the app's user with HOME its data container and one Landlock\n"
         "ruleset: read-write beneath its data, group and system containers,\n"
         "read-only beneath the system's directories and its bundle, nothing else.\n"
         "\n"
         "  --root DIR              the device's system root (default /)\n"
         "  --signing-id ID         the app's code-signing identifier\n"
         "  --uid UID               the app's user (default: the device's mobile user)\n"
         "  --persona ID            the persona it runs in (default: the personal one)\n"
         "  --plugin                it is a plug-in (its plug-in data container)\n"
         "  --group G               an application group it may use (repeatable)\n"
         "  --system-container ID   its system container\n"
         "  --system-group G        a system group container (repeatable)\n"
         "  --allow-read PATH       also readable (repeatable)\n"
         "  --allow-write PATH      also readable and writable (repeatable)\n"
         "  --unconfined            start it even when Landlock is missing (said so)\n"
         "  --print-rules           print the containers and rules as JSON; start nothing\n"
         "  --verbose               say the Landlock ABI used and each rule\n"
         "\n"
         "Exit status: PROGRAM's; 125 when vessa-launch itself fails (the failing step\n"
         "is named), 126 when PROGRAM cannot be run, 127 when it is not found; 128+N\n"
         "when PROGRAM was killed by signal N. SIGINT, SIGTERM and SIGHUP are passed on.\n";
}

std::optional<VSALaunchOptions> VSALaunchOptions::parse(int argc, char** argv, std::string* why,
                                                        bool* help) {
  VSALaunchOptions o;
  *help = false;
  using Setter = std::function<bool(const std::string&)>;
  auto text = [](std::string& field) -> Setter {
    return [&field](const std::string& v) { return field = v, !v.empty(); };
  };
  auto list = [](std::vector<std::string>& field) -> Setter {
    return [&field](const std::string& v) { return field.push_back(v), !v.empty(); };
  };
  std::map<std::string, Setter> valued = {
      {"--root", text(o.root)},
      {"--signing-id", text(o.signingIdentifier)},
      {"--uid", [&](const std::string& v) { return (o.uid = number(v)).has_value(); }},
      {"--persona", [&](const std::string& v) { return (o.personaID = number(v)).has_value(); }},
      {"--group", list(o.groups)},
      {"--system-container",
       [&](const std::string& v) { return o.systemContainer = v, !v.empty(); }},
      {"--system-group", list(o.systemGroups)},
      {"--allow-read", list(o.allowRead)},
      {"--allow-write", list(o.allowWrite)},
  };
  std::map<std::string, bool*> flags = {{"--plugin", &o.plugin},
                                        {"--unconfined", &o.unconfined},
                                        {"--print-rules", &o.printRules},
                                        {"--verbose", &o.verbose}};
  int i = 1;
  for (; i < argc; ++i) {
    std::string a = argv[i];
    if (a == "--") {
      ++i;
      break;
    }
    if (a == "-h" || a == "--help") {
      *help = true;
      return std::nullopt;
    }
    if (auto f = flags.find(a); f != flags.end()) {
      *f->second = true;
    } else if (auto v = valued.find(a); v != valued.end()) {
      if (i + 1 >= argc) return *why = a + " needs a value", std::nullopt;
      if (!v->second(argv[++i])) return *why = "bad value for " + a + ": " + argv[i], std::nullopt;
    } else if (a.rfind("-", 0) == 0) {
      return *why = "unknown option " + a, std::nullopt;
    } else {
      break;  // the program, without "--"
    }
  }
  for (; i < argc; ++i) o.program.push_back(argv[i]);
  if (o.signingIdentifier.empty()) return *why = "--signing-id is required", std::nullopt;
  if (o.program.empty() && !o.printRules) return *why = "no program to run", std::nullopt;
  for (const auto* paths : {&o.allowRead, &o.allowWrite})
    for (const auto& p : *paths)
      if (p.front() != '/') return *why = "not an absolute path: " + p, std::nullopt;
  return o;
}
