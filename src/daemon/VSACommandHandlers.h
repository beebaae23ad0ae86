// Request handlers, one family per file. Each takes the request, a fresh
// reply dictionary, the request's client connection and the result cell
// (1 on entry); on failure it stores the operation's code and writes no
// reply keys of its own.
#pragma once

#include "base/VSACommands.h"
#include "base/VSAError.h"
#include "base/VSAValue.h"
#include "model/VSAMetadata.h"
#include "platform/VSAIPCMessage.h"

class VSAClientConnection;

// Sends the reply of a command that replies from its completion (4, 21): a
// reply with "ReplyError" set to `code`, exactly once; failures are logged.
// Such handlers keep the request's reply context, not its message, so the
// request dictionary is freed as soon as it has been dispatched.
void VSASendLateReply(const VSAIPCReplyContextRef& context, VSAResultCode code,
                      VSACommandNumber command);

using VSACommandHandler = void (*)(const VSAValue& request, VSAValue& reply,
                                   VSAClientConnection& connection, VSAResultCode* result);

// Content named by relative paths; see VSAHandlersContent.cc for the keys.
void VSAHandleUserManagedAssetsPath(const VSAValue& request, VSAValue& reply,
                                    VSAClientConnection& connection, VSAResultCode* result);
void VSAHandleDeleteUserManagedAsset(const VSAValue& request, VSAValue& reply,
                                     VSAClientConnection& connection, VSAResultCode* result);
void VSAHandleStageSharedContent(const VSAValue& request, VSAValue& reply,
                                 VSAClientConnection& connection, VSAResultCode* result);
// Commands 24 and 30: the system-wide and the per-user data migration.
void VSAHandleDataMigration(const VSAValue& request, VSAValue& reply,
                            VSAClientConnection& connection, VSAResultCode* result);
void VSAHandlePerUserDataMigration(const VSAValue& request, VSAValue& reply,
                                   VSAClientConnection& connection, VSAResultCode* result);
// Command 25: starts the crash-retry test ("NumRetryCrashes"); internal builds only.
void VSAHandleRetryTest(const VSAValue& request, VSAValue& reply, VSAClientConnection& connection,
                        VSAResultCode* result);
// Command 31: acquires or releases a test lock ("TestLock", "Enable");
// on other builds it logs and succeeds without doing anything.
void VSAHandleTestLock(const VSAValue& request, VSAValue& reply, VSAClientConnection& connection,
                       VSAResultCode* result);
// Command 27: retired; always fails with 49.
void VSAHandleRetiredCommand(const VSAValue& request, VSAValue& reply,
                             VSAClientConnection& connection, VSAResultCode* result);

// Command 32: the persona unique strings of the user identities the client
// may use ("ReplyPersonaUniqueStringsArray").
void VSAHandlePersonaUniqueStrings(const VSAValue& request, VSAValue& reply,
                                   VSAClientConnection& connection, VSAResultCode* result);

// Command 18: records "CodeSigningInfo" (dict) for "Identifier" with
// "OptionsDictionary"; deletions it decides run when the request completes.
void VSAHandleRecordCodeSigningInfo(const VSAValue& request, VSAValue& reply,
                                    VSAClientConnection& connection, VSAResultCode* result);
// Command 19: "ReplyInfoDictionary" with the identifier's code-signing info
// (absent for unknown, placeholder, advance-copy and invalid entries).
void VSAHandleReadCodeSigningInfo(const VSAValue& request, VSAValue& reply,
                                  VSAClientConnection& connection, VSAResultCode* result);

// Command 20: invalidates the code-signing records of apps without a bundle container.
void VSAHandleInvalidateAppsWithoutBundle(const VSAValue& request, VSAValue& reply,
                                          VSAClientConnection& connection, VSAResultCode* result);

// Command 21: sets the protection class of a data container ("DataProtectionClass",
// "IsThirdParty", "RetryIfLocked"); the reply comes from the change's completion.
void VSAHandleSetDataProtection(const VSAValue& request, VSAValue& reply,
                                VSAClientConnection& connection, VSAResultCode* result);

// Container commands; see VSAHandlersContainers.cc for the keys.
void VSAHandleCreateOrLookup(const VSAValue& request, VSAValue& reply,
                             VSAClientConnection& connection, VSAResultCode* result);
void VSAHandleListContainers(const VSAValue& request, VSAValue& reply,
                             VSAClientConnection& connection, VSAResultCode* result);
void VSAHandleStageForDelete(const VSAValue& request, VSAValue& reply,
                             VSAClientConnection& connection, VSAResultCode* result);
void VSAHandleDeleteDeathRow(const VSAValue& request, VSAValue& reply,
                             VSAClientConnection& connection, VSAResultCode* result);
void VSAHandleContainerMetadata(const VSAValue& request, VSAValue& reply,
                                VSAClientConnection& connection, VSAResultCode* result);
void VSAHandleDiskUsage(const VSAValue& request, VSAValue& reply, VSAClientConnection& connection,
                        VSAResultCode* result);
void VSAHandleDeleteContainer(const VSAValue& request, VSAValue& reply,
                              VSAClientConnection& connection, VSAResultCode* result);
void VSAHandleSystemContainerPath(const VSAValue& request, VSAValue& reply,
                                  VSAClientConnection& connection, VSAResultCode* result);
void VSAHandleSystemGroupContainerPath(const VSAValue& request, VSAValue& reply,
                                       VSAClientConnection& connection, VSAResultCode* result);

// Per-container maintenance, replace and wipe; see VSAHandlersMaintenance.cc.
void VSAHandleSetInfoValue(const VSAValue& request, VSAValue& reply,
                           VSAClientConnection& connection, VSAResultCode* result);
void VSAHandleInfoValue(const VSAValue& request, VSAValue& reply, VSAClientConnection& connection,
                        VSAResultCode* result);
void VSAHandleRecreateDefaultStructure(const VSAValue& request, VSAValue& reply,
                                       VSAClientConnection& connection, VSAResultCode* result);
void VSAHandleRegenerateDirectoryUUID(const VSAValue& request, VSAValue& reply,
                                      VSAClientConnection& connection, VSAResultCode* result);
void VSAHandleReplaceContainer(const VSAValue& request, VSAValue& reply,
                               VSAClientConnection& connection, VSAResultCode* result);
void VSAHandleWipePluginData(const VSAValue& request, VSAValue& reply,
                             VSAClientConnection& connection, VSAResultCode* result);
void VSAHandleDeleteContainerContent(const VSAValue& request, VSAValue& reply,
                                     VSAClientConnection& connection, VSAResultCode* result);

// Group commands; see VSAHandlersGroups.cc.
void VSAHandleGroupContainers(const VSAValue& request, VSAValue& reply,
                              VSAClientConnection& connection, VSAResultCode* result);
void VSAHandleGroupContainerIdentifiers(const VSAValue& request, VSAValue& reply,
                                        VSAClientConnection& connection, VSAResultCode* result);
void VSAHandleGroupContainerPaths(const VSAValue& request, VSAValue& reply,
                                  VSAClientConnection& connection, VSAResultCode* result);

// Adds a sandbox token for the container to `target` under `key` when the
// client is sandboxed and the container belongs to an enterprise persona
// and is of a class with a sandbox extension (2, 4, 6, 10; 7).
void VSAAddSandboxToken(VSAClientConnection& connection, const VSAMetadata& m, VSAValue& target,
                        const std::string& key);
