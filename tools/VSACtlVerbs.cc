#include "VSACtlVerbs.h"

#include <cstdlib>
#include <map>

#include "base/VSACommands.h"
#include "base/VSAContainerClasses.h"
#include "base/VSAError.h"
#include "base/VSAJSON.h"
#include "base/VSAUUID.h"

namespace {

const char* const kClassNames[] = {
    nullptr,           "bundle",      "data",      "plugin",        "plugin-data", "vpn-plugin",
    "vpn-plugin-data", "group",       "framework", "relay-service", "daemon-data", "temp",
    "system",          "system-group"};

// Options every container verb takes, and what remains (the positionals).
struct Parsed {
  std::vector<std::string> positional;
  std::optional<uint64_t> containerClass;
  std::optional<std::string> persona, uuid;
  bool transient = false, retry = false, create = false;
};

std::optional<Parsed> parse(const std::vector<std::string>& args, std::string* error) {
  Parsed p;
  for (size_t i = 0; i < args.size(); ++i) {
    const std::string& a = args[i];
    auto value = [&]() -> std::optional<std::string> {
      if (i + 1 < args.size()) return args[++i];
      *error = a + " needs a value";
      return std::nullopt;
    };
    if (a == "--class") {
      auto v = value();
      if (!v) return std::nullopt;
      p.containerClass = VSACtlVerbs::classNamed(*v);
      if (!p.containerClass) {
        *error = "unknown container class " + *v;
        return std::nullopt;
      }
    } else if (a == "--persona") {
      if (!(p.persona = value())) return std::nullopt;
    } else if (a == "--uuid") {
      if (!(p.uuid = value())) return std::nullopt;
      if (!VSAUUID::parse(*p.uuid)) {
        *error = "not a UUID: " + *p.uuid;
        return std::nullopt;
      }
    } else if (a == "--transient") {
      p.transient = true;
    } else if (a == "--retry") {
      p.retry = true;
    } else if (a == "--create") {
      p.create = true;
    } else if (a.rfind("--", 0) == 0) {
      *error = "unknown option " + a;
      return std::nullopt;
    } else {
      p.positional.push_back(a);
    }
  }
  return p;
}

// Identifier, class (data by default), persona and UUID of a container.
VSAValue container(VSACommandNumber command, const Parsed& p, const std::string& id,
                   VSAContainerClass defaultClass = VSAClass::kDataApplication) {
  VSAValue r =
      VSAValue::Dictionary{{"Command", VSAValue(command)},
                           {"Identifier", VSAValue(id)},
                           {"ContainerClass", VSAValue(p.containerClass.value_or(defaultClass))}};
  if (p.persona) r.set("PersonaUniqueString", *p.persona);
  if (p.uuid) r.set("UUID", *VSAUUID::parse(*p.uuid));
  if (p.transient) r.set("Transient", true);
  return r;
}

// A value typed on the command line: a number, true/false, or text.
VSAValue typed(const std::string& text) {
  if (text == "true" || text == "false") return VSAValue(text == "true");
  char* end = nullptr;
  unsigned long long n = std::strtoull(text.c_str(), &end, 10);
  if (!text.empty() && text[0] != '-' && *end == '\0') return VSAValue(static_cast<uint64_t>(n));
  return VSAValue(text);
}

}  // namespace

const std::vector<VSACtlVerb>& VSACtlVerbs::all() {
  static const std::vector<VSACtlVerb> verbs = {
      {"create", "ID [--class C] [--persona P] [--transient]", "create a container if missing"},
      {"lookup", "ID [--class C] [--persona P] [--uuid U]", "look a container up (never creates)"},
      {"ls", "[--class C] [--transient]", "list the containers of a class"},
      {"show", "ID [--class C] [--persona P] [--uuid U]", "a container's metadata and info"},
      {"rm", "ID [--class C] [--persona P] [--uuid U]", "delete a container (to death row)"},
      {"wipe", "ID [--class C] [--persona P]", "delete a data container's content, keep it"},
      {"replace", "OLD NEW [--class C] [--persona P]", "put container NEW in OLD's place"},
      {"regen-uuid", "ID [--class C] [--persona P]", "give a container's directory a new name"},
      {"restructure", "ID [--class C] [--persona P]", "make the default sub-directories again"},
      {"info", "get|set|unset ID KEY [VALUE] [--class C]", "a metadata info value"},
      {"groups", "OWNER [--class group|system-group]", "the group containers of an owner"},
      {"cs", "get ID | set ID JSON [OPTIONS]",
       "code-signing information of an identifier (OPTIONS: a JSON object of registration "
       "options, e.g. {\"com.tamsk.Vessa.DataContainerClass\": 2})"},
      {"protect", "ID CLASS [--retry]",
       "set a data container's protection class (1-4; --retry: wait for an unlock)"},
      {"usage", "ID [--class C] [--persona P]", "a container's size on disk"},
      {"assets", "ID [--class C] [--create]", "the user-managed assets directory"},
      {"deathrow", "empty", "empty death row now"},
      {"personas", "", "the persona unique strings this client may use"},
      {"test-lock", "N on|off", "set or clear a test lock (internal builds)"},
  };
  return verbs;
}

const VSACtlVerb* VSACtlVerbs::find(const std::string& name) {
  for (const auto& v : all())
    if (name == v.name) return &v;
  return nullptr;
}

std::optional<uint64_t> VSACtlVerbs::classNamed(const std::string& text) {
  for (VSAContainerClass c = kVSAContainerClassMin; c <= kVSAContainerClassMax; ++c)
    if (text == kClassNames[c] || text == std::to_string(c)) return c;
  return std::nullopt;
}

const char* VSACtlVerbs::className(uint64_t containerClass) {
  return containerClass >= kVSAContainerClassMin && containerClass <= kVSAContainerClassMax
             ? kClassNames[containerClass]
             : "unknown";
}

const char* VSACtlVerbs::meaningOfCode(uint64_t code) {
  const char* meaning = VSAResult::meaning(code);
  return meaning ? meaning : "unknown result code";
}

std::string VSACtlVerbs::help(const VSACtlVerb& verb) {
  return std::string("usage: vessactl [--root DIR] [--json] ") + verb.name + " " + verb.arguments +
         "\n  " + verb.summary +
         "\n  --class C: a class name (bundle, data, plugin, plugin-data, vpn-plugin,\n"
         "  vpn-plugin-data, group, framework, relay-service, daemon-data, temp, system,\n"
         "  system-group) or number; --persona P: a persona unique string\n";
}

std::optional<VSAValue> VSACtlVerbs::request(const std::string& verb,
                                             const std::vector<std::string>& arguments,
                                             std::string* error) {
  auto parsed = parse(arguments, error);
  if (!parsed) return std::nullopt;
  const Parsed& p = *parsed;
  const auto& pos = p.positional;
  auto need = [&](size_t n) {
    if (pos.size() == n) return true;
    *error = verb + " takes " + std::to_string(n) + " argument" + (n == 1 ? "" : "s");
    return false;
  };
  if (verb == "create" || verb == "lookup") {
    if (!need(1)) return std::nullopt;
    VSAValue r = container(VSACommands::kCreateOrLookup, p, pos[0]);
    r.set("CreateIfNecessary", verb == "create");
    return r;
  }
  if (verb == "ls") {
    if (!need(0)) return std::nullopt;
    VSAValue r = VSAValue::Dictionary{
        {"Command", VSAValue(VSACommands::kListContainers)},
        {"ContainerClass", VSAValue(p.containerClass.value_or(VSAClass::kDataApplication))}};
    if (p.transient) r.set("Transient", true);
    return r;
  }
  static const std::map<std::string, VSACommandNumber> single = {
      {"rm", VSACommands::kDeleteContainer},
      {"regen-uuid", VSACommands::kRegenerateDirectoryUUID},
      {"restructure", VSACommands::kRecreateDefaultStructure},
      {"usage", VSACommands::kDiskUsage}};
  if (auto it = single.find(verb); it != single.end()) {
    if (!need(1)) return std::nullopt;
    return container(it->second, p, pos[0]);
  }
  if (verb == "show") {
    if (!need(1)) return std::nullopt;
    VSAValue r = container(VSACommands::kContainerMetadata, p, pos[0]);
    r.set("InfoDictRequested", true);
    return r;
  }
  if (verb == "wipe") {
    if (!need(1)) return std::nullopt;
    return container(p.containerClass == VSAClass::kDataPlugin
                         ? VSACommands::kWipePluginData
                         : VSACommands::kDeleteContainerContent,
                     p, pos[0]);
  }
  if (verb == "replace") {
    if (!need(2)) return std::nullopt;
    VSAContainerClass c = p.containerClass.value_or(VSAClass::kDataApplication);
    VSAValue r = VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kReplaceContainer)},
                                      {"OldIdentifier", VSAValue(pos[0])},
                                      {"OldContainerClass", VSAValue(c)},
                                      {"NewIdentifier", VSAValue(pos[1])},
                                      {"NewContainerClass", VSAValue(c)}};
    if (p.persona) {
      r.set("OldPersonaUniqueString", *p.persona);
      r.set("NewPersonaUniqueString", *p.persona);
    }
    return r;
  }
  if (verb == "info") {
    if (pos.empty() || (pos[0] != "get" && pos[0] != "set" && pos[0] != "unset")) {
      *error = "info takes get, set or unset";
      return std::nullopt;
    }
    if (!need(pos[0] == "set" ? 4 : 3)) return std::nullopt;
    VSAValue r = container(pos[0] == "get" ? VSACommands::kInfoValue : VSACommands::kSetInfoValue,
                           p, pos[1]);
    r.set("Key", pos[2]);
    if (pos[0] == "set") r.set("Value", typed(pos[3]));
    return r;
  }
  if (verb == "groups") {
    if (!need(1)) return std::nullopt;
    return container(VSACommands::kGroupContainerIdentifiers, p, pos[0], VSAClass::kAppGroup);
  }
  if (verb == "cs") {
    if (!pos.empty() && pos[0] == "get" && need(2))
      return VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kReadCodeSigningInfo)},
                                  {"Identifier", VSAValue(pos[1])}};
    if (!pos.empty() && pos[0] == "set" && (pos.size() == 4 || need(3))) {
      std::string why;
      auto info = VSAJSON::parse(pos[2], &why);
      if (!info || !info->isDictionary()) {
        *error = "code-signing information must be a JSON object" + (why.empty() ? "" : ": " + why);
        return std::nullopt;
      }
      auto options = pos.size() > 3 ? VSAJSON::parse(pos[3], &why) : VSAValue::dictionary();
      if (!options || !options->isDictionary()) {
        *error = "registration options must be a JSON object" + (why.empty() ? "" : ": " + why);
        return std::nullopt;
      }
      return VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kRecordCodeSigningInfo)},
                                  {"Identifier", VSAValue(pos[1])},
                                  {"CodeSigningInfo", *info},
                                  {"OptionsDictionary", *options}};
    }
    if (error->empty()) *error = "cs takes get ID or set ID JSON";
    return std::nullopt;
  }
  if (verb == "protect") {
    if (!need(2)) return std::nullopt;
    if (pos[1].size() != 1 || pos[1][0] < '1' || pos[1][0] > '4') {
      *error = "protect takes a protection class 1-4";
      return std::nullopt;
    }
    VSAValue r = container(VSACommands::kSetDataProtection, p, pos[0]);
    r.set("DataProtectionClass", static_cast<uint64_t>(pos[1][0] - '0'));
    r.set("RetryIfLocked", p.retry);
    return r;
  }
  if (verb == "assets") {
    if (!need(1)) return std::nullopt;
    VSAValue r = container(VSACommands::kUserManagedAssetsPath, p, pos[0]);
    r.set("CreateIfNecessary", p.create);
    return r;
  }
  if (verb == "deathrow") {
    if (pos.size() != 1 || pos[0] != "empty") {
      *error = "deathrow takes empty";
      return std::nullopt;
    }
    return VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kDeleteDeathRow)}};
  }
  if (verb == "personas") {
    if (!need(0)) return std::nullopt;
    return VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kPersonaUniqueStrings)}};
  }
  if (verb == "test-lock") {
    if (!need(2) || (pos[1] != "on" && pos[1] != "off")) {
      if (error->empty()) *error = "test-lock takes N and on or off";
      return std::nullopt;
    }
    return VSAValue::Dictionary{{"Command", VSAValue(VSACommands::kTestLock)},
                                {"TestLock", typed(pos[0])},
                                {"Enable", VSAValue(pos[1] == "on")}};
  }
  *error = "unknown verb " + verb;
  return std::nullopt;
}
