// Deleting a container for a client: the container is looked up with the
// client's access test, and its staging into death row is queued on the
// request's command queue, to run when the request completes. One object
// serves one request.
#pragma once

#include "base/VSAError.h"
#include "model/VSAContainerIdentity.h"
#include "operations/VSACommandQueue.h"
#include "operations/VSAOperationGrants.h"
#include "operations/VSAOperationServices.h"

class VSAContainerDeletion {
 public:
  VSAContainerDeletion(const VSAOperationServices& services, const VSAOperationGrants& grants,
                       VSACommandQueue& commandQueue)
      : services_(services), grants_(grants), commandQueue_(commandQueue) {}

  void deleteContainerWithContainerIdentity(const VSAContainerIdentityRef& identity, bool transient,
                                            VSAResultCode* withError);

 private:
  const VSAOperationServices& services_;
  const VSAOperationGrants& grants_;
  VSACommandQueue& commandQueue_;
};
