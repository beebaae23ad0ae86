// Handlers of the group commands: the group containers of an owner with
// sandbox tokens and persona strings (13), their identifiers (14) and their
// paths (16). The owner is "Identifier"; "ContainerClass" is 7 (application
// groups, per user: "PersonaUniqueString" picks the user) or 13 (system
// groups, kept under the default user).
#include "daemon/VSAClientConnection.h"
#include "daemon/VSACommandHandlers.h"
#include "daemon/VSARequestArguments.h"

namespace {
struct GroupRequest {
  std::string owner;
  VSAContainerClass groupClass = VSAClass::kUndefined;
  VSAUserIdentityRef user;
};

std::optional<GroupRequest> readGroupRequest(VSARequestArguments& args,
                                             VSAClientConnection& connection) {
  auto c = args.containerClass();
  if (!c) return std::nullopt;
  const std::string* owner = args.identifier();
  if (!owner) return std::nullopt;
  if (*c != VSAClass::kAppGroup && *c != VSAClass::kSystemGroup) {
    args.fail(VSAResult::kInvalidArgument);
    return std::nullopt;
  }
  VSAUserIdentityRef user = *c == VSAClass::kSystemGroup
                                ? connection.context().userIdentityCache->defaultUserIdentity()
                                : args.userIdentity(*c);
  if (!user) return std::nullopt;
  return GroupRequest{*owner, *c, user};
}

void replyWithGroups(const VSAValue& request, VSAValue& reply, VSAClientConnection& connection,
                     VSAResultCode* result, bool withTokens) {
  VSARequestArguments args(request, connection, result);
  auto r = readGroupRequest(args, connection);
  if (!r) return;
  auto groups =
      connection.groupContainersForOwnerIdentifier(r->owner, r->user, r->groupClass, result);
  if (!groups) return;
  VSAValue paths = VSAValue::dictionary(), tokens = VSAValue::dictionary(),
           personas = VSAValue::dictionary();
  for (const auto& [id, m] : *groups) {
    paths.set(id, m->url());
    if (!withTokens) continue;
    VSAAddSandboxToken(connection, *m, tokens, id);
    if (m->userIdentity() && m->userIdentity()->personaUniqueString())
      personas.set(id, *m->userIdentity()->personaUniqueString());
  }
  reply.set("ReplyGroupContainerDict", paths);
  if (!withTokens) return;
  reply.set("ReplySandboxTokenDict", tokens);
  reply.set("ReplyPersonaUniqueStringDict", personas);
}
}  // namespace

void VSAHandleGroupContainers(const VSAValue& request, VSAValue& reply,
                              VSAClientConnection& connection, VSAResultCode* result) {
  replyWithGroups(request, reply, connection, result, true);
}

void VSAHandleGroupContainerPaths(const VSAValue& request, VSAValue& reply,
                                  VSAClientConnection& connection, VSAResultCode* result) {
  replyWithGroups(request, reply, connection, result, false);
}

void VSAHandleGroupContainerIdentifiers(const VSAValue& request, VSAValue& reply,
                                        VSAClientConnection& connection, VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  auto r = readGroupRequest(args, connection);
  if (!r) return;
  auto ids =
      connection.groupContainerIdentifiersForOwnerIdentifier(r->owner, r->groupClass, result);
  if (!ids) return;
  VSAValue array = VSAValue::array();
  for (const auto& id : *ids) array.append(id);
  reply.set("ReplyGroupIdentifiersArray", array);
}
