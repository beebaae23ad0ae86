// Finding containers for a client: create or look up one container (access
// tests against the client's grants and the whitelist, a read-locked cache
// lookup, then a write-locked second lookup and creation in staging followed
// by one rename into place), list a class, and read a container's metadata.
// One object serves one request; it reads the request's grants and the
// daemon's shared services. Locks are taken and released inside each call.
#pragma once

#include <optional>
#include <vector>

#include "base/VSAError.h"
#include "model/VSAContainerIdentity.h"
#include "model/VSAMetadata.h"
#include "operations/VSAOperationGrants.h"
#include "operations/VSAOperationServices.h"

// What a create-or-lookup call may do. Call sites name what they set
// ({.createIfNecessary = true}); what is not named keeps its default.
struct VSALookupOptions {
  bool createIfNecessary = false;  // make the container when it does not exist
  bool transient = false;          // a transient container (always made fresh)
  bool useLocking = true;          // false: the caller holds the all-identifiers lock
};

class VSAContainerLookup {
 public:
  VSAContainerLookup(const VSAOperationServices& services, const VSAOperationGrants& grants)
      : services_(services), grants_(grants) {}

  // The container named by `identity`, created first when it is missing and
  // `createIfNecessary`. A transient container is always made fresh. Takes
  // the all-identifiers lock unless `useLocking` is false.
  [[nodiscard]] VSAMetadataRef createOrLookupContainerWithContainerIdentity(
      const VSAContainerIdentityRef& identity, VSALookupOptions options, VSAResultCode* withError);
  // The client's containers of one class (its own user identity), filtered
  // to what its grants let it see.
  [[nodiscard]] std::optional<std::vector<VSAConstMetadataRef>> containersWithClass(
      VSAContainerClass containerClass, bool transient, VSAResultCode* withError);
  // A live container's metadata, re-read under its identifier read lock.
  [[nodiscard]] VSAMetadataRef metadataWithContainerIdentity(
      const VSAContainerIdentityRef& identity, VSAResultCode* withError);

  // The bytes a container takes on disk (the client's lookup access test
  // first; 21 when it does not exist): the file system's statistics when
  // fast sizing is on and available, else a walk of the tree on its device.
  [[nodiscard]] std::optional<uint64_t> diskUsageWithContainerIdentity(
      const VSAContainerIdentityRef& identity, VSAResultCode* withError);

  // The cached container an identity names, with its transient flag set: a
  // concrete identity names the live or the transient container whose UUID
  // it carries; a plain one the live container of its identifier. No access
  // test, no lock: for operations that hold the lock they need.
  [[nodiscard]] static VSAMetadataRef containerForIdentity(VSAContainerCache& cache,
                                                           const VSAContainerIdentity& identity);

 private:
  const VSAOperationServices& services_;
  const VSAOperationGrants& grants_;
};
