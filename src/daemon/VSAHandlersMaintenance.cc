// Handlers of the per-container commands that neither create nor delete:
// set (5) and read (6) a metadata info value, recreate the default
// structure (8, 22), regenerate the directory UUID (9), replace one
// container by another (2) and wipe a data container's content (11, 12).
// A container is named by the identity keys; with "UUID" (for 2, the
// "Old..."/"New..." keys) it is that very container, without it the live
// container of the identifier.
#include "daemon/VSAClientConnection.h"
#include "daemon/VSACommandHandlers.h"
#include "daemon/VSARequestArguments.h"

void VSAHandleSetInfoValue(const VSAValue& request, VSAValue&, VSAClientConnection& connection,
                           VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  auto identity = args.namedContainerIdentity();
  if (!identity) return;
  connection.setInfoValue(args.value("Value"), args.value("Key"), identity, true, result);
}

void VSAHandleInfoValue(const VSAValue& request, VSAValue& reply, VSAClientConnection& connection,
                        VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  auto identity = args.namedContainerIdentity();
  if (!identity) return;
  auto value = connection.infoValueForKey(args.value("Key"), identity, true, result);
  if (value) reply.set("ReplyInfoValue", *value);
}

void VSAHandleRecreateDefaultStructure(const VSAValue& request, VSAValue&,
                                       VSAClientConnection& connection, VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  auto identity = args.namedContainerIdentity();
  if (!identity) return;
  connection.recreateDefaultStructureWithContainerIdentity(identity, result);
}

void VSAHandleRegenerateDirectoryUUID(const VSAValue& request, VSAValue&,
                                      VSAClientConnection& connection, VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  auto identity = args.namedContainerIdentity();
  if (!identity) return;
  connection.regenerateDirectoryUUIDWithContainerIdentity(identity, result);
}

void VSAHandleReplaceContainer(const VSAValue& request, VSAValue&, VSAClientConnection& connection,
                               VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  auto oldIdentity = args.namedContainerIdentity(
      {"OldIdentifier", "OldContainerClass", "OldContainerUUID", "OldPersonaUniqueString"});
  if (!oldIdentity) return;
  // A new identity without its UUID is the replace's to refuse (code 11).
  auto newIdentity = args.namedContainerIdentity(
      {"NewIdentifier", "NewContainerClass", "NewContainerUUID", "NewPersonaUniqueString"});
  if (!newIdentity) return;
  connection.replaceContainerIdentity(oldIdentity, newIdentity, false, true, result);
}

void VSAHandleWipePluginData(const VSAValue& request, VSAValue&, VSAClientConnection& connection,
                             VSAResultCode* result) {
  VSARequestArguments args(request, connection, result);
  auto identity = args.containerIdentity({}, VSAClass::kDataPlugin);
  if (!identity) return;
  connection.deleteDataContainerContentWithContainerIdentity(identity, result);
}

void VSAHandleDeleteContainerContent(const VSAValue& request, VSAValue&,
                                     VSAClientConnection& connection, VSAResultCode* result) {
  connection.setUnrestricted(true);
  VSARequestArguments args(request, connection, result);
  auto identity = args.containerIdentity();
  if (!identity) return;
  connection.deleteDataContainerContentWithContainerIdentity(identity, result);
}
