#include "model/VSAMetadata.h"

#include <fcntl.h>

#include <cerrno>

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAPlist.h"
#include "model/VSAGlobalConfiguration.h"
#include "model/VSAUserIdentityCache.h"

namespace {
constexpr const char* kIdentifierKey = "VSAMetadataIdentifier";
constexpr const char* kUUIDKey = "VSAMetadataUUID";
constexpr const char* kClassKey = "VSAMetadataContentClass";
constexpr const char* kUserIdentityKey = "VSAMetadataUserIdentity";
constexpr const char* kPersonaKey = "VSAMetadataPersona";
constexpr const char* kInfoKey = "VSAMetadataInfo";
constexpr const char* kAssetsKey = "VSAMetadataUserManagedAssetsDirName";
constexpr const char* kVersionKey = "VSAMetadataVersion";

std::string_view parentView(std::string_view path) {
  size_t slash = path.find_last_of('/');
  if (slash == std::string_view::npos) return ".";
  return slash == 0 ? "/" : path.substr(0, slash);
}

std::string parentOf(const std::string& path) { return std::string(parentView(path)); }

// Whether `whole` is VSAPathJoin(base, component); the join is only built
// when a slash at the seam makes the plain comparison unsure.
bool isJoinOf(std::string_view whole, std::string_view base, std::string_view component) {
  if (base.empty() || base.back() == '/' || component.empty() || component.front() == '/')
    return whole == VSAPathJoin(base, component);
  return whole.size() == base.size() + 1 + component.size() && whole.starts_with(base) &&
         whole[base.size()] == '/' && whole.ends_with(component);
}

template <typename... A>
VSAMetadataRef invalid(VSAErrorRef* error, VSAResultCode code, const char* format,
                       const A&... args) {
  auto e =
      VSAError::make(code, nullptr, "readAndValidateMetadataAtFileUrl", __LINE__, format, args...);
  VSALogIn(VSALogCategory::Metadata, kVSALogError, "readAndValidateMetadataAtFileUrl", "%@",
           e->message());
  VSASetError(error, e);
  return nullptr;
}

std::string shown(const VSAValue* v) { return v ? v->description() : std::string("(null)"); }
}  // namespace

VSAMetadata::VSAMetadata(VSAConcreteContainerIdentityRef containerIdentity,
                         std::optional<VSAValue> info, std::string url,
                         std::optional<std::string> userManagedAssetsDirName)
    : identity_(std::move(containerIdentity)),
      info_(std::move(info)),
      url_(std::move(url)),
      assetsDirName_(std::move(userManagedAssetsDirName)) {}

void VSAMetadata::setUserIdentity(const VSAUserIdentityRef& userIdentity) {
  identity_ = std::make_shared<const VSAConcreteContainerIdentity>(
      identity_->uuid(), userIdentity, identity_->identifier(), identity_->containerClass());
}

void VSAMetadata::setUuid(const VSAUUID& uuid) {
  identity_ = std::make_shared<const VSAConcreteContainerIdentity>(
      uuid, identity_->userIdentity(), identity_->identifier(), identity_->containerClass());
}

VSAValue VSAMetadata::plist() const {
  VSAValue d = VSAValue::dictionary();
  if (info_) d.set(kInfoKey, *info_);
  d.set(kClassKey, VSAValue(static_cast<uint64_t>(containerClass())));
  if (VSAUserIdentity::isUserIdentityRequiredForContainerClass(containerClass()) && userIdentity())
    d.set(kUserIdentityKey, userIdentity()->plist());
  d.set(kIdentifierKey, VSAValue(identifier()));
  d.set(kUUIDKey, VSAValue(uuid().string()));
  d.set(kVersionKey, VSAValue("2"));
  if (assetsDirName_) d.set(kAssetsKey, VSAValue(*assetsDirName_));
  return d;
}

bool VSAMetadata::writeMetadataToDiskWithError(VSAGlobalConfiguration& configuration,
                                               VSAErrorRef* error) {
  return writeMetadataToFileURL(VSAPathJoin(url_, kVSAMetadataFileName), configuration, error);
}

bool VSAMetadata::writeMetadataToFileURL(const std::string& fileURL,
                                         VSAGlobalConfiguration& configuration,
                                         VSAErrorRef* error) {
  const char* fn = "writeMetadataToFileURL";
  VSAValue dict = plist();
  std::string staging =
      configuration.stagingDirectoryURLForUserIdentity(userIdentity(), containerClass());
  std::string temp = VSAPathJoin(staging, VSAFormat("temp_metadata-%@.plist", uuid()));
  VSALogIn(VSALogCategory::Metadata, kVSALogDebug, fn, "[%s] Writing metadata to [%@]: %@ => %@",
           fn, fileURL, *this, dict);
  VSAFileManager& fm = configuration.fileManager();
  VSAErrorRef underlying;
  auto bytes = VSAPlist::serialize(dict, VSAPlist::Format::Binary, &underlying);
  int rc = bytes ? fm.fileSystem().writeFile(temp, *bytes, 0644) : EINVAL;
  if (rc != 0) {
    if (!underlying) underlying = VSAError::posix(rc, fn, __LINE__);
    fm.fileSystem().unlink(temp);
    auto e = VSAError::make(VSAResult::kWriteFailed, underlying, fn, __LINE__,
                            "Failed to write metadata dictionary to URL %@ : %@:%ld", temp,
                            underlying->domain(), underlying->code());
    VSALogIn(VSALogCategory::Metadata, kVSALogError, fn, "%@", e->message());
    VSASetError(error, e);
    return false;
  }
  if (!fm.moveItemAtURL(temp, fileURL, &underlying)) {
    fm.fileSystem().unlink(temp);
    auto e = VSAError::make(VSAResult::kWriteFailed, underlying, fn, __LINE__,
                            "Failed to move metadata from staging: %@ to final: %@", temp, fileURL);
    VSALogIn(VSALogCategory::Metadata, kVSALogError, fn, "%@", e->message());
    VSASetError(error, e);
    return false;
  }
  return true;
}

bool VSAMetadata::isTransientReadFailure(int rc) {
  return rc == EIO || rc == ENOSPC || rc == ENOMEM || rc == EAGAIN || rc == EINTR || rc == EMFILE ||
         rc == ENFILE;
}

bool VSAMetadata::isTransientReadFailure(const VSAErrorRef& error) {
  const VSAErrorRef& under = error ? error->underlyingError() : error;
  return under && under->domain() == kVSAPOSIXErrorDomain &&
         isTransientReadFailure(static_cast<int>(under->code()));
}

VSAMetadataRef VSAMetadata::readAndValidateMetadataAtUrl(
    std::string containerURL, const VSAUserIdentityRef& forUserIdentity, bool checkClassPath,
    VSAGlobalConfiguration& configuration, VSAUserIdentityCache& cache, VSAErrorRef* error) {
  std::string file = VSAPathJoin(containerURL, kVSAMetadataFileName);
  // The container is the file's parent; only a path ending in a slash (or
  // none) spells it differently from the parent of the joined file.
  std::string container =
      containerURL.empty() || containerURL.back() == '/' ? parentOf(file) : std::move(containerURL);
  return readAndValidate({AT_FDCWD, file}, file, std::move(container), forUserIdentity,
                         checkClassPath, configuration, cache, error);
}

VSAMetadataRef VSAMetadata::readAndValidateMetadataOfEntry(
    int classDirectory, std::string containerURL, const VSAUserIdentityRef& forUserIdentity,
    bool checkClassPath, VSAGlobalConfiguration& configuration, VSAUserIdentityCache& cache,
    VSAErrorRef* error) {
  std::string file = VSAPathJoin(containerURL, kVSAMetadataFileName);
  std::string relative = VSAPathJoin(VSALastPathComponentView(containerURL), kVSAMetadataFileName);
  return readAndValidate({classDirectory, relative}, file, std::move(containerURL), forUserIdentity,
                         checkClassPath, configuration, cache, error);
}

VSAMetadataRef VSAMetadata::readAndValidateMetadataAtFileUrl(
    const std::string& file, const VSAUserIdentityRef& expected, bool checkClassPath,
    VSAGlobalConfiguration& configuration, VSAUserIdentityCache& cache, VSAErrorRef* error) {
  return readAndValidate({AT_FDCWD, file}, file, parentOf(file), expected, checkClassPath,
                         configuration, cache, error);
}

VSAMetadataRef VSAMetadata::readAndValidate(Source source, const std::string& file,
                                            std::string container,
                                            const VSAUserIdentityRef& expected, bool checkClassPath,
                                            VSAGlobalConfiguration& configuration,
                                            VSAUserIdentityCache& cache, VSAErrorRef* error) {
  const VSAResultCode bad = VSAResult::kInvalidUpdateFile;  // 29
  std::vector<uint8_t> bytes;
  std::optional<VSAValue> dict;
  VSAFileSystem& fs = configuration.fileManager().fileSystem();
  int rc = source.dir == AT_FDCWD
               ? fs.readFile(source.path, &bytes, kVSAMetadataFileMaxSize)
               : fs.readFileAt(source.dir, source.path, &bytes, kVSAMetadataFileMaxSize);
  if (rc == 0) dict = VSAPlist::parse(bytes, nullptr, VSAPlist::Accept::BinaryOnly);
  if (!dict || !dict->isDictionary()) {
    invalid(error, VSAResult::kMetadataUnreadable, "Failed to read metadata at URL %@", file);
    // The system's own trouble, not the file's: the caller must not take
    // the container for a broken one.
    if (error && *error && isTransientReadFailure(rc))
      *error =
          VSAError::make(VSAResult::kMetadataUnreadable, VSAError::posix(rc, "readFile", __LINE__),
                         "readAndValidateMetadataAtFileUrl", __LINE__, "%@", (*error)->message());
    return nullptr;
  }
  const VSAValue* identifier = dict->get(kIdentifierKey);
  if (!identifier || !identifier->isString())
    return invalid(error, bad, "Invalid metadata Identifier: %@ at %@", shown(identifier), file);
  const VSAValue* uuidText = dict->get(kUUIDKey);
  if (!uuidText || !uuidText->isString())
    return invalid(error, bad, "Invalid metadata UUID String: %@ at %@", shown(uuidText), file);
  auto uuid = VSAUUID::parse(*uuidText->stringValue());
  if (!uuid) return invalid(error, bad, "Invalid metadata UUID: %@ at %@", shown(uuidText), file);
  const VSAValue* cls = dict->get(kClassKey);
  if (!cls || !cls->isNumber())
    return invalid(error, bad, "Invalid metadata Class: %@ at %@", shown(cls), file);
  int64_t classValue = cls->int64Value().value_or(-1);
  // A negative number becomes a huge one, out of range as well.
  VSAContainerClass c = static_cast<VSAContainerClass>(classValue);
  if (!VSAContainerClassIsValid(c))
    return invalid(error, bad, "Invalid metadata Content Class: %ld at %@", classValue, file);

  VSAUserIdentityRef owner;
  if (!VSAUserIdentity::isUserIdentityRequiredForContainerClass(c)) {
    owner = cache.defaultUserIdentity();
  } else {
    uid_t expectedUID = expected ? expected->posixUIDForContainerClass(c) : 0;
    // A per-user file without a persona number is taken to carry the
    // expected user's; one with another number is refused.
    const VSAValue* persona = dict->get(kPersonaKey);
    if (persona && VSAContainerClassIsPerUser(c) &&
        persona->uint64Value() != static_cast<uint64_t>(expectedUID))
      return invalid(error, bad, "Incorrect UserId: %@, expecting: %u for %@ at %@", shown(persona),
                     expectedUID, *identifier->stringValue(), file);
    const VSAValue* stored = dict->get(kUserIdentityKey);
    if (!stored) {
      uint64_t n = persona ? persona->uint64Value().value_or(0) : expectedUID;
      if (n == 499) n = 0;
      owner =
          cache.userIdentityForPersonalPersonaWithUID(static_cast<uid_t>(n), static_cast<gid_t>(n));
    } else {
      VSAResultCode code = VSAResult::kSuccess;
      owner = VSAUserIdentity::userIdentityWithPlist(*stored, cache, &code);
      if (!owner)
        return invalid(error, bad, "Invalid metadata User Identity: %@ for %@ at %@: %llu", *stored,
                       *identifier->stringValue(), file, code);
      if (!VSAUserIdentityEqual(owner, expected))
        return invalid(error, bad, "Incorrect User Identity: %@, expecting: %@ for %@ at %@: %llu",
                       owner, expected, *identifier->stringValue(), file, code);
    }
  }
  const VSAValue* info = dict->get(kInfoKey);
  if (info && !info->isDictionary())
    return invalid(error, bad, "Invalid metadata Info: %@ at %@", *info, file);
  const VSAValue* assets = dict->get(kAssetsKey);
  if (assets && !assets->isString())
    return invalid(error, bad, "Invalid metadata User Managed Dir Name String: %@ at %@", *assets,
                   file);
  if (checkClassPath) {
    std::string_view classDir = parentView(container);
    std::string_view root = parentView(parentView(classDir));
    if (!isJoinOf(classDir, root, VSAContainerClassPathComponent(c)))
      return invalid(error, bad, "Invalid metadata-URLs should match: %@ : %@", file,
                     VSAPathJoin(root, VSAContainerClassPathComponent(c)));
  }
  VSAResultCode code = VSAResult::kSuccess;
  const VSAValue uuidValue(*uuid);
  auto identity = VSAConcreteContainerIdentity::containerIdentityWithUUID(&uuidValue, owner,
                                                                          identifier, c, &code);
  if (!identity)
    return invalid(error, bad, "Could not create user identity from %@: %llu", file, code);
  auto metadata = std::make_shared<VSAMetadata>(
      identity, info ? std::optional<VSAValue>(*info) : std::nullopt, std::move(container),
      assets ? std::optional<std::string>(*assets->stringValue()) : std::nullopt);
  VSALogIn(VSALogCategory::Metadata, kVSALogDebug, "readAndValidateMetadataAtFileUrl",
           "[%s] Read metadata from [%@]: %@ <= %@", "readAndValidateMetadataAtFileUrl", file,
           *metadata, *dict);
  return metadata;
}

std::string VSAMetadata::description() const {
  return VSAFormat(
      "<%@: %p; userIdentity = %@, uuid = %@, containerClass = %llu, identifier = %@, info = %@, "
      "url = %@, userManagedAssetsDirName = %@>",
      "VSAMetadata", static_cast<const void*>(this),
      userIdentity() ? userIdentity()->shortDescription() : std::string("(null)"), uuid(),
      containerClass(), identifier(), info_ ? info_->description() : std::string("(null)"), url_,
      assetsDirName_ ? *assetsDirName_ : std::string("(null)"));
}
