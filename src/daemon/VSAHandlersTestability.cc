// Handlers of the testability commands, which only internal builds honour:
// the crash-retry test (25, "NumRetryCrashes") and the test locks (31,
// "TestLock", "Enable"). Command 31 runs on its own queue (see VSADaemon).
#include "base/VSALog.h"
#include "base/VSATestLocks.h"
#include "daemon/VSAClientConnection.h"
#include "daemon/VSACommandHandlers.h"
#include "daemon/VSARequestArguments.h"

namespace {
bool isInternal(VSAClientConnection& connection) {
  return connection.context().globalConfiguration->isInternalImage();
}

std::optional<uint64_t> unsignedArgument(const VSARequestArguments& args, const char* key) {
  const VSAValue* v = args.value(key);
  return v && v->isInteger() ? v->uint64Value() : std::nullopt;
}
}  // namespace

void VSAHandleRetryTest(const VSAValue& request, VSAValue&, VSAClientConnection& connection,
                        VSAResultCode* result) {
  if (!isInternal(connection)) {
    VSALog(kVSALogError, "VSAHandleRetryTest",
           "People really shouldn't be calling this on non-internal installs!");
    VSASetCode(result, VSAResult::kNotEntitled);
    return;
  }
  VSARequestArguments args(request, connection, result);
  auto crashes = unsignedArgument(args, "NumRetryCrashes");
  if (!crashes) {
    VSALog(kVSALogError, "VSAHandleRetryTest", "Missing or invalid NumRetryCrashes");
    VSASetCode(result, VSAResult::kInvalidArgument);
    return;
  }
  connection.retryTestWithNumCrashes(*crashes, result);
}

void VSAHandleTestLock(const VSAValue& request, VSAValue&, VSAClientConnection& connection,
                       VSAResultCode* result) {
  if (!isInternal(connection)) {
    VSALogIn(VSALogCategory::Test, kVSALogError, "VSAHandleTestLock",
             "Unsupported call to set lock!");
    return;
  }
  VSARequestArguments args(request, connection, result);
  auto lock = unsignedArgument(args, "TestLock");
  if (!lock) {
    VSALogIn(VSALogCategory::Test, kVSALogError, "VSAHandleTestLock",
             "Missing or invalid TestLock");
    VSASetCode(result, VSAResult::kOutOfRange);
    return;
  }
  VSAResultCode code =
      connection.context().testLocks->setLockFromCommand(*lock, args.boolValue("Enable"));
  if (code != VSAResult::kSuccess) VSASetCode(result, code);
}
