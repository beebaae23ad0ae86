#include "daemon/VSACommandHandlers.h"

void VSAHandleRetiredCommand(const VSAValue&, VSAValue&, VSAClientConnection&,
                             VSAResultCode* result) {
  VSASetCode(result, VSAResult::kInvalidCommand);
}
