// Re-reading the metadata file of a container the cache already holds.
#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "model/VSAGlobalConfiguration.h"
#include "model/VSAMetadata.h"
#include "model/VSAUserIdentityCache.h"

namespace {
constexpr const char* kOrigin = "rereadMetadataOfCachedContainer";

// What in `fresh` disagrees with the cached entry, or nothing.
const char* disagreement(const VSAMetadata& cached, const VSAMetadata& fresh) {
  if (fresh.identifier() != cached.identifier()) return "identifier";
  if (fresh.containerClass() != cached.containerClass()) return "class";
  if (fresh.uuid() != cached.uuid()) return "UUID";
  if (!VSAUserIdentityEqual(fresh.userIdentity(), cached.userIdentity())) return "user";
  return nullptr;
}

// Whether the cached container's directory lies directly in the directory of
// its class (live or transient as cached).
bool inClassDirectory(const VSAMetadata& cached, VSAGlobalConfiguration& configuration) {
  auto directory = configuration.containerDirectoryURLForUserIdentity(
      cached.userIdentity(), cached.containerClass(), cached.transient());
  std::string_view name = VSALastPathComponentView(cached.url());
  return directory && !name.empty() && VSAPathJoin(*directory, name) == cached.url();
}
}  // namespace

VSAMetadataRef VSAMetadata::rereadMetadataOfCachedContainer(const VSAMetadata& cached,
                                                            VSAGlobalConfiguration& configuration,
                                                            VSAUserIdentityCache& cache,
                                                            VSAErrorRef* error) {
  auto fresh = readAndValidateMetadataAtUrl(cached.url(), cached.userIdentity(), false,
                                            configuration, cache, error);
  if (!fresh) return nullptr;
  fresh->setTransient(cached.transient());
  const char* differs = disagreement(cached, *fresh);
  if (!differs && !inClassDirectory(cached, configuration)) differs = "class directory";
  if (!differs) return fresh;
  auto e = VSAError::make(VSAResult::kMetadataUnreadable, nullptr, kOrigin, __LINE__,
                          "Metadata at %@ disagrees with the cached container in its %s: "
                          "%@ class %llu, cached %@ class %llu",
                          cached.url(), differs, VSAClientStringForLog(fresh->identifier()),
                          fresh->containerClass(), cached.identifier(), cached.containerClass());
  VSALogIn(VSALogCategory::Metadata, kVSALogError, kOrigin, "%@", e->message());
  VSASetError(error, e);
  return nullptr;
}
