#include "base/VSALog.h"
#include "codesigning/VSACodeSigningMapping.h"
#include "daemon/VSAClientConnection.h"
#include "daemon/VSACommandHandlers.h"
#include "daemon/VSARequestArguments.h"

void VSAHandleRecordCodeSigningInfo(const VSAValue& request, VSAValue&,
                                    VSAClientConnection& connection, VSAResultCode* result) {
  const std::string* identifier = VSARequestArguments(request, connection, result).identifier();
  if (!identifier) return;
  const VSAValue* info = request.get("CodeSigningInfo");
  if (info && !info->isDictionary()) {
    VSALog(kVSALogError, "VSAHandleRecordCodeSigningInfo",
           "CodeSigningInfo for %@ is not a dictionary", *identifier);
    VSASetCode(result, VSAResult::kInvalidArgument);
    return;
  }
  const VSAValue* options = request.get("OptionsDictionary");
  VSAValue opts = options && options->isDictionary() ? *options : VSAValue::dictionary();
  VSAResultCode code = connection.context().codeSigningMapping->processCodeSigningInfo(
      info ? std::optional<VSAValue>(*info) : std::nullopt, identifier, opts,
      connection.commandQueue().get());
  if (code != VSAResult::kSuccess) VSASetCode(result, code);
}

void VSAHandleReadCodeSigningInfo(const VSAValue& request, VSAValue& reply,
                                  VSAClientConnection& connection, VSAResultCode* result) {
  const std::string* identifier = VSARequestArguments(request, connection, result).identifier();
  if (!identifier) return;
  if (auto info =
          connection.context().codeSigningMapping->getCodeSigningInfoForIdentifier(*identifier))
    reply.set("ReplyInfoDictionary", *info);
}

void VSAHandleInvalidateAppsWithoutBundle(const VSAValue&, VSAValue&,
                                          VSAClientConnection& connection, VSAResultCode* result) {
  VSAResultCode code =
      connection.context()
          .codeSigningMapping->invalidateCodeSigningInfoForAppsWithoutBundleContainer();
  if (code != VSAResult::kSuccess) VSASetCode(result, code);
}
