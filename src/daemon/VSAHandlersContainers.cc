// Handlers of the container commands: create or look up (0), list (1),
// stage for deletion (3), empty death row (4), metadata (7), delete (10),
// system container path (15), system group container path (17) and disk
// usage (23, "ReplyDiskUsage").
#include <algorithm>

#include "base/VSALog.h"
#include "codesigning/VSACodeSigningMapping.h"
#include "daemon/VSAClientConnection.h"
#include "daemon/VSACommandHandlers.h"
#include "daemon/VSARequestArguments.h"
#include "operations/VSACommandStageForDelete.h"

namespace {
const char* extensionClassFor(VSAContainerClass c) {
  using namespace VSAClass;
  if (c == kDataApplication || c == kDataPlugin || c == kDataVPNPlugin || c == kDataInternalDaemon)
    return "com.tamsk.sandbox.container";
  if (c == kAppGroup) return "com.tamsk.sandbox.application-group";
  return nullptr;
}

std::optional<std::string> personaString(const VSAMetadata& m) {
  return m.userIdentity() ? m.userIdentity()->personaUniqueString() : std::nullopt;
}
}  // namespace

// A token goes only to a sandboxed client, for a container of an enterprise
// persona, of the classes a sandbox extension exists for.
void VSAAddSandboxToken(VSAClientConnection& connection, const VSAMetadata& m, VSAValue& target,
                        const std::string& key) {
  const auto& client = connection.clientIdentity();
  if (!client || !client->isSandboxed()) return;
  bool enterprise = m.userIdentity() && m.userIdentity()->isEnterprise();
  const char* extensionClass = extensionClassFor(m.containerClass());
  auto type = static_cast<unsigned long long>(m.containerClass());
  if (!enterprise || !extensionClass || !connection.relayMessage()) {
    VSALogIn(VSALogCategory::Sandbox, kVSALogInfo, "VSAAddSandboxToken",
             "%@ is sandboxed and container (type: %llu) is enterprise: %d. NOT issuing token for "
             "path: %s",
             client->bundleIdentifier(), type, enterprise, m.url());
    return;
  }
  VSALogIn(VSALogCategory::Sandbox, kVSALogInfo, "VSAAddSandboxToken",
           "%@ is sandboxed and container (type: %llu) is enterprise: %d. Issuing token for path: "
           "%s",
           client->bundleIdentifier(), type, enterprise, m.url());
  auto token = connection.context().sandboxService->issueFileExtension(
      extensionClass, m.url(), connection.relayMessage()->connection()->auditToken());
  if (!token) {
    VSALogIn(VSALogCategory::Sandbox, kVSALogError, "VSAAddSandboxToken",
             "sandbox_extension_issue_file failed for %@ at path %s: %d",
             client->bundleIdentifier(), m.url(), errno);
    return;
  }
  target.set(key, *token);
}

void VSAHandleCreateOrLookup(const VSAValue& request, VSAValue& reply,
                             VSAClientConnection& connection, VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  auto identity = args.containerIdentity();
  if (!identity) return;
  auto m = connection.createOrLookupContainerWithContainerIdentity(
      identity,
      {.createIfNecessary = args.boolValue("CreateIfNecessary"),
       .transient = args.boolValue("Transient")},
      result);
  if (!m) return;
  reply.set("ReplyPath", m->url());
  reply.set("ReplyUUID", m->uuid());
  reply.set("ReplyExisted", m->existed());
  reply.set("ReplyIdentifier", m->identifier());
  if (auto persona = personaString(*m)) reply.set("ReplyPersonaUniqueString", *persona);
  VSAAddSandboxToken(connection, *m, reply, "ReplySandboxToken");
}

void VSAHandleListContainers(const VSAValue& request, VSAValue& reply,
                             VSAClientConnection& connection, VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  auto c = args.containerClass();
  if (!c) return;
  auto all = connection.containersWithClass(*c, args.boolValue("Transient"), result);
  if (!all) return;
  VSAValue ids = VSAValue::array(), uuids = VSAValue::array(), personas = VSAValue::array();
  for (const auto& m : *all) {
    ids.append(m->identifier());
    uuids.append(m->uuid());
    personas.append(personaString(*m).value_or(""));
  }
  reply.set("ReplyIdsArray", ids);
  reply.set("ReplyUUIDsArray", uuids);
  reply.set("ReplyPersonaUniqueStringsArray", personas);
}

void VSAHandleStageForDelete(const VSAValue& request, VSAValue&, VSAClientConnection& connection,
                             VSAResultCode* result) {
  const VSAValue* classes = request.get("ContainerClassesArray");
  const VSAValue* uuids = request.get("UUIDsArray");
  const VSAValue* ids = request.get("IdentifiersArray");
  const VSAValue* personas = request.get("PersonaUniqueStringsArray");
  auto count = [](const VSAValue* v) -> long {
    return v && v->isArray() ? static_cast<long>(v->arrayValue()->size()) : -1;
  };
  long n = count(ids);
  if (n < 0 || count(classes) != n || count(uuids) != n || count(personas) != n) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, "VSAHandleStageForDelete",
             "Can't act on an invalid input: UUIDString count: %ld, class count: %ld, ID count: "
             "%lu, persona string count: %lu",
             count(uuids), count(classes), static_cast<unsigned long>(std::max(n, 0L)),
             static_cast<unsigned long>(std::max(count(personas), 0L)));
    VSASetCode(result, VSAResult::kInvalidArgument);
    return;
  }
  std::vector<VSAContainerIdentityRef> identities;
  for (long i = 0; i < n; ++i) {
    VSAValue one = VSAValue::dictionary();
    one.set("ContainerClass", (*classes->arrayValue())[i]);
    one.set("UUID", (*uuids->arrayValue())[i]);
    one.set("Identifier", (*ids->arrayValue())[i]);
    const VSAValue& persona = (*personas->arrayValue())[i];
    if (persona.isString() && !persona.stringValue()->empty())
      one.set("PersonaUniqueString", persona);
    VSARequestArguments args(one, connection, result);
    auto identity = args.concreteContainerIdentity();
    if (!identity) return;
    // The caller must be able to reach each container it names.
    VSAResultCode access = VSAResult::kSuccess;
    if (!connection.createOrLookupContainerWithContainerIdentity(identity, {}, &access) &&
        access == VSAResult::kNotEntitled) {
      VSASetCode(result, access);
      return;
    }
    identities.push_back(identity);
  }
  connection.commandQueue()->insertCommand(
      VSACommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
          connection.context().stageEnvironment, std::move(identities), true, nullptr));
}

void VSAHandleDeleteDeathRow(const VSAValue&, VSAValue&, VSAClientConnection& connection,
                             VSAResultCode*) {
  VSAIPCReplyContextRef context =
      connection.relayMessage() ? connection.relayMessage()->replyContext() : nullptr;
  connection.context().deathRow->deleteContainersOnDeathRowWithCompletion(
      [context](VSAResultCode code) {
        VSASendLateReply(context, code, VSACommands::kDeleteDeathRow);
      });
}

void VSAHandleContainerMetadata(const VSAValue& request, VSAValue& reply,
                                VSAClientConnection& connection, VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  auto identity = args.containerIdentity();
  if (!identity) return;
  auto m = connection.metadataWithContainerIdentity(identity, result);
  if (!m) return;
  reply.set("ReplyPath", m->url());
  reply.set("ReplyTransient", m->transient());
  if (args.boolValue("InfoDictRequested"))
    reply.set("ReplyInfoDictionary", m->info() ? *m->info() : VSAValue::dictionary());
  if (auto persona = personaString(*m)) reply.set("ReplyPersonaUniqueString", *persona);
  VSAAddSandboxToken(connection, *m, reply, "ReplySandboxToken");
}

void VSAHandleDiskUsage(const VSAValue& request, VSAValue& reply, VSAClientConnection& connection,
                        VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  auto identity = args.containerIdentity();
  if (!identity) return;
  auto bytes = connection.diskUsageWithContainerIdentity(identity, result);
  if (bytes) reply.set("ReplyDiskUsage", VSAValue(*bytes));
}

void VSAHandleDeleteContainer(const VSAValue& request, VSAValue&, VSAClientConnection& connection,
                              VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  auto identity = args.containerIdentity();
  if (!identity) return;
  connection.deleteContainerWithContainerIdentity(identity, args.boolValue("Transient"), result);
}

void VSAHandleSystemContainerPath(const VSAValue& request, VSAValue& reply,
                                  VSAClientConnection& connection, VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  auto identity = args.containerIdentity({}, VSAClass::kSystemData);
  if (!identity) return;
  if (!connection.allowOtherIdLookup() && !connection.context().whitelist->containerIdIsWellknown(
                                              identity->identifier(), VSAClass::kSystemData)) {
    VSALogIn(VSALogCategory::Relay, kVSALogError, "VSAHandleSystemContainerPath",
             "%@ is not a well-known system container", identity->identifier());
    VSASetCode(result, VSAResult::kNotEntitled);
    return;
  }
  auto m = connection.createOrLookupContainerWithContainerIdentity(
      identity, {.createIfNecessary = true}, result);
  if (m) reply.set("ReplyPath", m->url());
}

void VSAHandleSystemGroupContainerPath(const VSAValue& request, VSAValue& reply,
                                       VSAClientConnection& connection, VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  const std::string* group = args.identifier("GroupIdentifier");
  if (!group) return;
  const auto& client = connection.clientIdentity();
  std::string bundle = client ? client->bundleIdentifier() : std::string();
  auto entitled = client ? VSACodeSigningMapping::systemGroupIdentifiersFromEntitlements(
                               bundle, client->entitlements())
                         : std::nullopt;
  std::vector<std::string> ids = entitled.value_or(std::vector<std::string>{});
  if (std::find(ids.begin(), ids.end(), *group) == ids.end()) {
    std::string list;
    for (const auto& id : ids) list += (list.empty() ? "" : ", ") + id;
    VSALogIn(VSALogCategory::Relay, kVSALogError, "VSAHandleSystemGroupContainerPath",
             "%@ is not entitled for system group identifier: %@.  Only entitled for: %@", bundle,
             *group, "(" + list + ")");
    VSASetCode(result, VSAResult::kNotEntitled);
    return;
  }
  VSAResultCode code = VSAResult::kSuccess;
  auto identity = VSAContainerIdentity::containerIdentityWithIdentifier(
      *group, VSAClass::kSystemGroup, *connection.context().userIdentityCache, &code);
  if (!identity) return VSASetCode(result, code);
  // Entitlement to the group is the access grant here.
  connection.setAllowGroupIdLookup(true);
  auto m = connection.createOrLookupContainerWithContainerIdentity(
      identity, {.createIfNecessary = true}, result);
  if (m) reply.set("ReplyPath", m->url());
}
