// Handlers of the commands that name content inside a container by a
// relative path: the user-managed assets directory (28: "IsRelative",
// "CreateIfNecessary" -> "ReplyPath", "ReplyExisted"), deletion of one asset
// (29: "SourcePath") and staging of shared content from the identifier's
// bundle into its data container (26: "SourcePath", "DestPath" -> "ReplyPath").
#include "base/VSALog.h"
#include "daemon/VSAClientConnection.h"
#include "daemon/VSACommandHandlers.h"
#include "daemon/VSARequestArguments.h"

namespace {
// A path argument must be a string; its content is checked by the operation.
const std::string* pathArgument(const VSARequestArguments& args, const char* key,
                                VSAResultCode* result) {
  const VSAValue* v = args.value(key);
  if (v && v->isString()) return v->stringValue();
  VSALog(kVSALogError, "pathArgument", "Missing or invalid %s", key);
  VSASetCode(result, VSAResult::kInvalidArgument);
  return nullptr;
}
}  // namespace

void VSAHandleUserManagedAssetsPath(const VSAValue& request, VSAValue& reply,
                                    VSAClientConnection& connection, VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  auto identity = args.containerIdentity();
  if (!identity) return;
  bool existed = false;
  auto path = connection.userManagedAssetsPathWithContainerIdentity(
      identity, args.boolValue("IsRelative"), args.boolValue("CreateIfNecessary"), &existed,
      result);
  if (!path) return;
  reply.set("ReplyPath", *path);
  reply.set("ReplyExisted", VSAValue(existed));
}

void VSAHandleDeleteUserManagedAsset(const VSAValue& request, VSAValue&,
                                     VSAClientConnection& connection, VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  auto identity = args.containerIdentity();
  if (!identity) return;
  const std::string* path = pathArgument(args, "SourcePath", result);
  if (!path) return;
  connection.deleteUserManagedAssetWithContainerIdentity(identity, *path, result);
}

void VSAHandleStageSharedContent(const VSAValue& request, VSAValue& reply,
                                 VSAClientConnection& connection, VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  const std::string* identifier = args.identifier();
  if (!identifier) return;
  auto user = args.userIdentity(VSAClass::kDataApplication);
  if (!user) return;
  const std::string* source = pathArgument(args, "SourcePath", result);
  const std::string* destination = source ? pathArgument(args, "DestPath", result) : nullptr;
  if (!destination) return;
  auto path =
      connection.stageSharedContentForIdentifier(*identifier, user, *source, *destination, result);
  if (path) reply.set("ReplyPath", *path);
}
