// A container's identity as recorded in its metadata file,
// ".com.tamsk.vessa_keeper.metadata.plist" directly inside the container.
//
// The file is a binary property list, always written through a temporary
// file in the staging directory for the container's owner and class and then
// moved over the old one: it is never written in place, so a failure at any
// step leaves the previous file intact. The container belongs to an app, so
// whatever sits at that name is untrusted: it is read through the file
// system's bounded, non-blocking readFile (at most kVSAMetadataFileMaxSize
// bytes), only a binary property list is accepted, and a FIFO, link,
// directory, oversized or XML file is just "unreadable" (code 12) like a
// missing one. Reading validates every field in a
// fixed order (codes 12 and 29 with the exact messages) and optionally that
// the container sits in the directory of its class. Not synchronised: one
// object belongs to one request.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "base/VSAError.h"
#include "base/VSAValue.h"
#include "model/VSAConcreteContainerIdentity.h"

// The largest metadata file read. The daemon writes a few hundred bytes (an
// info dictionary adds a little); anything larger was not written by it.
inline constexpr size_t kVSAMetadataFileMaxSize = 64u << 10;

// The info dictionary key under which a data container's protection class is kept.
inline constexpr const char* kVSAContentProtectionClassInfoKey =
    "com.tamsk.Ferrox.ContentProtectionClass";

class VSAGlobalConfiguration;
class VSAUserIdentityCache;
class VSAMetadata;
using VSAMetadataRef = std::shared_ptr<VSAMetadata>;
// An entry shared with the cache's maps: read-only, so handing it out needs no copy.
using VSAConstMetadataRef = std::shared_ptr<const VSAMetadata>;

class VSAMetadata {
 public:
  // initWithContainerIdentity:info:url:userManagedAssetsDirName:
  VSAMetadata(VSAConcreteContainerIdentityRef containerIdentity, std::optional<VSAValue> info,
              std::string url, std::optional<std::string> userManagedAssetsDirName);

  const VSAConcreteContainerIdentityRef& containerIdentity() const { return identity_; }
  const VSAUserIdentityRef& userIdentity() const { return identity_->userIdentity(); }
  const std::string& identifier() const { return identity_->identifier(); }
  VSAContainerClass containerClass() const { return identity_->containerClass(); }
  const VSAUUID& uuid() const { return identity_->uuid(); }
  const std::optional<VSAValue>& info() const { return info_; }
  const std::string& url() const { return url_; }
  const std::optional<std::string>& userManagedAssetsDirName() const { return assetsDirName_; }
  bool existed() const { return existed_; }
  bool transient() const { return transient_; }

  void setUserIdentity(const VSAUserIdentityRef& userIdentity);
  void setUuid(const VSAUUID& uuid);
  void setInfo(std::optional<VSAValue> info) { info_ = std::move(info); }
  void setUrl(std::string url) { url_ = std::move(url); }
  void setUserManagedAssetsDirName(std::optional<std::string> name) {
    assetsDirName_ = std::move(name);
  }
  void setExisted(bool v) { existed_ = v; }
  void setTransient(bool v) { transient_ = v; }

  // The dictionary written to the file.
  VSAValue plist() const;
  bool writeMetadataToDiskWithError(VSAGlobalConfiguration& configuration, VSAErrorRef* error);
  bool writeMetadataToFileURL(const std::string& fileURL, VSAGlobalConfiguration& configuration,
                              VSAErrorRef* error);

  // `containerURL` is taken by value: the new metadata keeps it as its path.
  static VSAMetadataRef readAndValidateMetadataAtUrl(
      std::string containerURL, const VSAUserIdentityRef& forUserIdentity, bool checkClassPath,
      VSAGlobalConfiguration& configuration, VSAUserIdentityCache& cache, VSAErrorRef* error);
  static VSAMetadataRef readAndValidateMetadataAtFileUrl(
      const std::string& fileURL, const VSAUserIdentityRef& forUserIdentity, bool checkClassPath,
      VSAGlobalConfiguration& configuration, VSAUserIdentityCache& cache, VSAErrorRef* error);
  // readAndValidateMetadataAtUrl for the container `containerURL`, an entry
  // of the class directory open at `classDirectory`: its metadata file is
  // opened relative to that descriptor, beneath it, no link followed (a
  // class map's build reads thousands and the kernel walks two names each).
  static VSAMetadataRef readAndValidateMetadataOfEntry(int classDirectory, std::string containerURL,
                                                       const VSAUserIdentityRef& forUserIdentity,
                                                       bool checkClassPath,
                                                       VSAGlobalConfiguration& configuration,
                                                       VSAUserIdentityCache& cache,
                                                       VSAErrorRef* error);

  // Reads the metadata file of `cached` (a container the cache holds) again,
  // for an operation that puts what it reads into the cache or answers it.
  // The file lies inside the container, which its app owns and may rewrite:
  // it counts only while it describes that same container (identifier,
  // class, UUID, user) and the container still sits directly in its class
  // directory (the live or transient one, as cached). A file that disagrees
  // is this container's "unreadable" failure (code 12), logged; it never
  // says anything about another container.
  static VSAMetadataRef rereadMetadataOfCachedContainer(const VSAMetadata& cached,
                                                        VSAGlobalConfiguration& configuration,
                                                        VSAUserIdentityCache& cache,
                                                        VSAErrorRef* error);

  // Whether a read failed for the system's own reasons (I/O error, no
  // memory or descriptors) rather than because of the file: the container
  // may be whole, so nothing may be decided from the failure.
  static bool isTransientReadFailure(int rc);
  static bool isTransientReadFailure(const VSAErrorRef& error);

  std::string description() const;

 private:
  // Where a reader opens the metadata file: by its path, or by a path
  // relative to an open directory.
  struct Source {
    int dir;                  // AT_FDCWD, or the open directory
    const std::string& path;  // the path opened (relative to `dir`)
  };
  // Every reader ends here: `file` is the metadata file (as logs name it),
  // `container` the directory holding it (known to the caller, not derived
  // again).
  static VSAMetadataRef readAndValidate(Source source, const std::string& file,
                                        std::string container, const VSAUserIdentityRef& expected,
                                        bool checkClassPath, VSAGlobalConfiguration& configuration,
                                        VSAUserIdentityCache& cache, VSAErrorRef* error);

  VSAConcreteContainerIdentityRef identity_;
  std::optional<VSAValue> info_;
  std::string url_;
  std::optional<std::string> assetsDirName_;
  bool existed_ = false;
  bool transient_ = false;
};
