// vessactl: the command-line client of vessad.
//
// Sends one request to the daemon of a system root and prints the reply:
// either a verb people type ("vessactl create com.example.app --class data")
// or the raw keys scripts use ("Command=0 Identifier=..."). Exit status: 0
// when "ReplyError" is 1, 1 when it is another code (named with its meaning
// on stderr), 2 for usage, file or connection errors.
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <string>

#include "VSACtlOutput.h"
#include "VSACtlProvision.h"
#include "VSACtlStatus.h"
#include "VSACtlVerbs.h"
#include "VSACtlWaitIndicator.h"
#include "base/VSACommands.h"
#include "base/VSAJSON.h"
#include "base/VSAPlist.h"
#include "daemon/VSACommandTable.h"
#include "platform/VSAIPCClient.h"
#include "platform/VSAIPCMessage.h"
#include "platform/VSANotificationCenter.h"
#include "platform/VSASystemRoot.h"

namespace {

const char* kCommandNames[kVSACommandCount] = {
    "create or look up a container",
    "list containers of a class",
    "replace a container (Old.../New... identity keys)",
    "stage containers for deletion",
    "empty death row",
    "set a metadata info value (Key, Value; none removes)",
    "read a metadata info value (Key)",
    "read a container's metadata",
    "recreate default structure",
    "regenerate directory UUID",
    "delete a container",
    "wipe plug-in data content (class 4)",
    "wipe a data container's content",
    "group containers with tokens",
    "group container identifiers",
    "path of a system container",
    "group container paths",
    "path of a system group container",
    "record code-signing information",
    "read code-signing information",
    "invalidate apps without bundle container",
    "change data protection class",
    "recreate default structure",
    "disk usage of a container",
    "run the data migration (ACLs, bundle owners, legacy code signing)",
    "crash-retry test (NumRetryCrashes; internal builds; the daemon crashes)",
    "stage shared content (SourcePath in the bundle, DestPath in the data container)",
    "retired",
    "user-managed assets path (IsRelative, CreateIfNecessary)",
    "delete a user-managed asset (SourcePath)",
    "run the per-user data migration (sub-directories, protection classes)",
    "set or clear a test lock (TestLock 0-6, 7 = all; Enable; internal builds)",
    "persona unique strings"};

const char* kStatusHelp =
    "usage: vessactl [--root DIR] [--timeout SEC] status [--json]\n"
    "  the daemon's state: queues, open transactions, cache sizes, death row,\n"
    "  pending protection changes, replace files, test locks, migration status,\n"
    "  work under way, database size. Signals the daemon (SIGUSR1; run as root),\n"
    "  which writes DIR/run/vessad/state.json and its log; --json prints that file\n";

void usage(FILE* out) {
  std::fprintf(out,
               "usage: vessactl [options] VERB ARGUMENTS...\n"
               "       vessactl [options] KEY[:TYPE]=VALUE ...\n"
               "       vessactl [--root DIR] notifications\n"
               "\n"
               "Sends one request to vessad and prints the reply.\n"
               "\n"
               "verbs (vessactl VERB --help for one):\n");
  for (const auto& verb : VSACtlVerbs::all())
    std::fprintf(out, "  %-12s %-42s %s\n", verb.name, verb.arguments, verb.summary);
  std::fprintf(out, "  %-12s %-42s %s\n", "status", "[--json]",
               "the daemon's state (queues, cache, death row, ...)");
  std::fprintf(out, "  %-12s %-42s %s\n", "provision",
               "[--mobile-user NAME] [--mobile-uid N] [--force]",
               "lay out what a root needs before vessad serves (no daemon needed)");
  std::fprintf(out,
               "  container classes by name: data, bundle, plugin, plugin-data, group, system,\n"
               "  system-group, ... or by number (1-13); data when not given\n"
               "\n"
               "options:\n"
               "  --root DIR       system root of the daemon (default /); the socket is\n"
               "                   DIR/run/vessad/com.tamsk.vessad\n"
               "  --socket PATH    talk to this socket instead\n"
               "  --file FILE      read the request from a property list or JSON file;\n"
               "                   KEY=VALUE arguments are added on top\n"
               "  --json           print the reply as JSON\n"
               "  --timeout SEC    how long to wait for the reply (default 30)\n"
               "  -h, --help       this text\n"
               "\n"
               "VALUE types are inferred (123 -> u64, -5 -> i64, true/false -> bool, a UUID\n"
               "-> uuid, anything else -> str) or given as KEY:TYPE=VALUE with TYPE one of\n"
               "u64 i64 bool str uuid real json (a JSON value, for arrays and dictionaries).\n"
               "\n"
               "Exit status: 0 when ReplyError is 1, 1 for any other result code (printed\n"
               "on stderr as CODE: MEANING, except with --json), 2 for usage, file or\n"
               "connection errors.\n"
               "\n"
               "Commands (key Command):\n");
  for (size_t i = 0; i < kVSACommandCount; ++i)
    std::fprintf(out, "  %2zu  %s%s\n", i, kCommandNames[i],
                 VSACommandTable()[i].handler ? "" : "  (not available yet)");
  std::fprintf(out,
               "\nnotifications    print the notifications the daemon posted, oldest first\n"
               "\nA container is named by Identifier, ContainerClass and, optionally,\n"
               "PersonaUniqueString and UUID (that very container; without it the live one).\n"
               "\nexamples: vessactl --root /tmp/demo create com.example.app --class data\n"
               "          vessactl --root /tmp/demo Command=0 Identifier=com.example.app "
               "ContainerClass=2\n"
               "          vessactl --root /tmp/demo Command=12 Identifier=com.example.app "
               "ContainerClass=2\n"
               "\nsee also: vessa-launch (start an app confined to its containers), vessa-upcall\n"
               "(ask for a launching process's containers as the kernel does)\n");
}

bool parseTyped(const std::string& type, const std::string& text, VSAValue& out, std::string& why) {
  char* end = nullptr;
  errno = 0;
  if (type == "u64") {
    unsigned long long v = std::strtoull(text.c_str(), &end, 0);
    if (text.empty() || *end || errno || text[0] == '-')
      return why = "not an unsigned integer", false;
    out = VSAValue(static_cast<uint64_t>(v));
  } else if (type == "i64") {
    long long v = std::strtoll(text.c_str(), &end, 0);
    if (text.empty() || *end || errno) return why = "not an integer", false;
    out = VSAValue(static_cast<int64_t>(v));
  } else if (type == "real") {
    double v = std::strtod(text.c_str(), &end);
    if (text.empty() || *end) return why = "not a number", false;
    out = VSAValue(v);
  } else if (type == "bool") {
    if (text == "true" || text == "yes" || text == "1")
      out = VSAValue(true);
    else if (text == "false" || text == "no" || text == "0")
      out = VSAValue(false);
    else
      return why = "not a boolean", false;
  } else if (type == "uuid") {
    auto u = VSAUUID::parse(text);
    if (!u) return why = "not a UUID", false;
    out = VSAValue(*u);
  } else if (type == "str") {
    out = VSAValue(text);
  } else if (type == "json") {
    auto v = VSAJSON::parse(text, &why);
    if (!v) return false;
    out = *v;
  } else {
    return why = "unknown type " + type, false;
  }
  return true;
}

VSAValue inferValue(const std::string& text) {
  VSAValue v;
  std::string why;
  if (!text.empty() && text.find_first_not_of("0123456789") == std::string::npos &&
      parseTyped("u64", text, v, why))
    return v;
  if (text.size() > 1 && text[0] == '-' &&
      text.find_first_not_of("0123456789", 1) == std::string::npos &&
      parseTyped("i64", text, v, why))
    return v;
  if (text == "true" || text == "false") return VSAValue(text == "true");
  if (auto u = VSAUUID::parse(text)) return VSAValue(*u);
  return VSAValue(text);
}

std::optional<VSAValue> readRequestFile(const std::string& path) {
  VSAErrorRef error;
  auto bytes = VSAReadFile(path, &error);
  if (!bytes) {
    std::fprintf(stderr, "vessactl: cannot read %s: %s\n", path.c_str(),
                 error->localizedDescription().c_str());
    return std::nullopt;
  }
  std::string text(bytes->begin(), bytes->end());
  size_t first = text.find_first_not_of(" \t\r\n");
  std::optional<VSAValue> value;
  std::string why;
  if (first != std::string::npos && text[first] == '{') {
    value = VSAJSON::parse(text, &why);
  } else {
    value = VSAPlist::parse(*bytes, &error);
    if (!value && error) why = error->localizedDescription();
  }
  if (!value || !value->isDictionary()) {
    std::fprintf(stderr, "vessactl: %s is not a dictionary request: %s\n", path.c_str(),
                 why.c_str());
    return std::nullopt;
  }
  return value;
}

int printNotifications(const std::string& root) {
  VSANotificationCenter center{VSASystemRoot(root)};
  for (const std::string& name : center.postedNames()) std::printf("%s\n", name.c_str());
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  std::string root = "/", socketPath, file;
  bool json = false, people = false;
  int timeout = 30;
  VSAValue request = VSAValue::dictionary();
  std::vector<std::string> pairs;
  for (int i = 1; i < argc; ++i) {
    std::string a = argv[i];
    auto next = [&]() -> std::string {
      if (i + 1 >= argc) {
        std::fprintf(stderr, "vessactl: %s needs a value\n", a.c_str());
        std::exit(2);
      }
      return argv[++i];
    };
    if (a == "--root")
      root = next();
    else if (a == "--socket")
      socketPath = next();
    else if (a == "--file")
      file = next();
    else if (a == "--json")
      json = true;
    else if (a == "--timeout")
      timeout = std::atoi(next().c_str());
    else if (a == "-h" || a == "--help")
      return usage(stdout), 0;
    else if (a == "notifications")
      return printNotifications(root);
    else if (a == "provision") {
      std::vector<std::string> rest(argv + i + 1, argv + argc);
      for (const auto& r : rest)
        if (r == "--help" || r == "-h") return std::printf("%s", VSACtlProvision::help()), 0;
      return VSACtlProvision::run(root, rest);
    } else if (a == "status") {
      if (i + 1 < argc &&
          (std::string(argv[i + 1]) == "--help" || std::string(argv[i + 1]) == "-h"))
        return std::printf("%s", kStatusHelp), 0;
      if (i + 1 < argc && std::string(argv[i + 1]) == "--json")
        json = true;
      else if (i + 1 < argc)
        return std::fprintf(stderr, "%s", kStatusHelp), 2;
      return VSACtlStatus(root, socketPath.empty() ? VSASystemRoot(root).socketPath() : socketPath,
                          timeout)
          .run(json);
    } else if (const VSACtlVerb* verb = VSACtlVerbs::find(a)) {
      std::vector<std::string> rest(argv + i + 1, argv + argc);
      for (const auto& r : rest)
        if (r == "--help" || r == "-h")
          return std::printf("%s", VSACtlVerbs::help(*verb).c_str()), 0;
      std::string why;
      auto built = VSACtlVerbs::request(a, rest, &why);
      if (!built) {
        std::fprintf(stderr, "vessactl %s: %s\n%s", a.c_str(), why.c_str(),
                     VSACtlVerbs::help(*verb).c_str());
        return 2;
      }
      request = *built;
      people = !json;
      break;
    } else if (a.find('=') != std::string::npos)
      pairs.push_back(a);
    else
      return usage(stderr), 2;
  }
  if (!file.empty()) {
    auto fromFile = readRequestFile(file);
    if (!fromFile) return 2;
    request = *fromFile;
  }
  for (const std::string& pair : pairs) {
    size_t eq = pair.find('=');
    std::string key = pair.substr(0, eq), text = pair.substr(eq + 1);
    size_t colon = key.find(':');
    VSAValue value;
    if (colon == std::string::npos) {
      value = inferValue(text);
    } else {
      std::string why;
      if (!parseTyped(key.substr(colon + 1), text, value, why)) {
        std::fprintf(stderr, "vessactl: %s: %s\n", pair.c_str(), why.c_str());
        return 2;
      }
      key = key.substr(0, colon);
    }
    request.set(key, value);
  }
  if (request.dictionaryValue()->empty()) return usage(stderr), 2;
  if (socketPath.empty()) socketPath = VSASystemRoot(root).socketPath();

  VSAIPCClient client;
  VSAErrorRef error;
  if (!client.connect(socketPath, &error)) {
    std::fprintf(stderr, "vessactl: %s\n", error->localizedDescription().c_str());
    return 2;
  }
  std::optional<VSAValue> reply;
  {
    // Emptying death row and changing a protection class answer when done.
    const VSAValue* command = request.get("Command");
    VSACommandNumber number = command ? command->uint64Value().value_or(0) : 0;
    std::optional<VSACtlWaitIndicator> waiting;
    if (number == VSACommands::kDeleteDeathRow || number == VSACommands::kSetDataProtection)
      waiting.emplace(number == VSACommands::kDeleteDeathRow ? "emptying death row"
                                                             : "changing the protection class");
    reply = client.sendRequest(request, std::chrono::seconds(timeout), &error);
  }
  if (!reply) {
    std::fprintf(stderr, "vessactl: %s\n", error->localizedDescription().c_str());
    return 2;
  }
  reply->remove(kVSAMessageIDKey);
  const VSAValue* codeValue = reply->get("ReplyError");
  uint64_t code = codeValue ? codeValue->uint64Value().value_or(0) : 0;
  if (people) {
    std::fputs(VSACtlOutput::forPeople(*reply).c_str(), stdout);
  } else {
    std::string text = json ? VSAJSON::print(*reply) : reply->description();
    std::printf("%s\n", text.c_str());
  }
  if (code == 1) return 0;
  // --json output is for programs, which read the code from the reply.
  if (!json)
    std::fprintf(stderr, "vessactl: %llu: %s\n", static_cast<unsigned long long>(code),
                 VSACtlVerbs::meaningOfCode(code));
  return 1;
}
