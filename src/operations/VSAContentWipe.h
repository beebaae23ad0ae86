// Wiping a data container's content: a fresh transient container of the
// same identity is made and put in the old container's place with the old
// UUID (a replace that preserves it); the old content goes to death row and
// death row starts emptying. The container keeps its path and UUID; its
// files are gone and its default structure is new.
//
// An unrestricted client may wipe any data container (classes 2, 4, 6, 7,
// 9, 10, 11); any other only plug-in data containers (class 4) whose
// identifier its wipe list names. Codes: 18 no identifier, 11 not a data
// class, 55 not allowed, 21 no such container, then those of creation and
// replace. One object serves one request; it widens the request's grants to
// other-identifier lookups, as the wipe needs.
#pragma once

#include "base/VSAError.h"
#include "model/VSAContainerIdentity.h"
#include "operations/VSAOperationGrants.h"
#include "operations/VSAOperationServices.h"

class VSAContentWipe {
 public:
  VSAContentWipe(const VSAOperationServices& services, VSAOperationGrants& grants)
      : services_(services), grants_(grants) {}

  void deleteDataContainerContentWithContainerIdentity(const VSAContainerIdentityRef& identity,
                                                       VSAResultCode* withError);

 private:
  const VSAOperationServices& services_;
  VSAOperationGrants& grants_;
};
