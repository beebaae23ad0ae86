#include "operations/VSAContainerDeletion.h"

#include "base/VSALog.h"
#include "operations/VSACommandStageForDelete.h"
#include "operations/VSAContainerLookup.h"

void VSAContainerDeletion::deleteContainerWithContainerIdentity(
    const VSAContainerIdentityRef& identity, bool transient, VSAResultCode* withError) {
  VSAResultCode code = VSAResult::kSuccess;
  VSAMetadataRef found =
      VSAContainerLookup(services_, grants_)
          .createOrLookupContainerWithContainerIdentity(identity, {.transient = transient}, &code);
  if (!found) {
    VSALog(kVSALogError, __func__,
           "Failed to lookup existing container to delete-identity: %@, transient: %d",
           identity ? identity->description() : std::string("(null)"), transient);
    VSASetCode(withError, code);
    return;
  }
  commandQueue_.insertCommand(
      VSACommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
          services_.stageEnvironment, {found->containerIdentity()}, true, nullptr));
}
