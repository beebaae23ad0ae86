#include "operations/VSAReplaceFile.h"

#include "base/VSALog.h"
#include "base/VSAPathString.h"
#include "base/VSAPlist.h"

namespace {

std::string orNull(const std::optional<std::string>& s) { return s ? *s : "(null)"; }

VSAErrorRef fail(VSAResultCode code, const char* fn, int line, std::string message,
                 VSAErrorRef underlying = nullptr) {
  VSALog(kVSALogError, fn, "%@", message);
  return VSAError::make(code, std::move(underlying), fn, line, "%@", message);
}

// A path the daemon wrote: absolute, no NUL, no "..".
bool isDirectoryPath(const std::string& path) {
  return path.size() > 1 && path[0] == '/' && path.find('\0') == std::string::npos &&
         !containsDotDotPathComponents(path);
}
}  // namespace

bool VSAReplaceFile::_writeToDiskReplaceAt(VSAFileManager& fm, const std::string& url,
                                           const std::optional<std::string>& old,
                                           const std::optional<std::string>& withNew,
                                           const std::optional<std::string>& usingStaging,
                                           const std::optional<std::string>& toDestination,
                                           VSAErrorRef* error) {
  const char* fn = "_writeToDiskReplaceAt";
  if (!old || !withNew || !usingStaging || !toDestination) {
    VSASetError(error, fail(VSAResult::kInvalidReplaceInfo, fn, __LINE__,
                            VSAFormat("Invalid Replace File Info: old: %@, new: %@, staging: %@, "
                                      "dest: %@",
                                      orNull(old), orNull(withNew), orNull(usingStaging),
                                      orNull(toDestination))));
    return false;
  }
  VSAValue dict = VSAValue::dictionary();
  dict.set(kVSAReplaceOperationOldURL, *old);
  dict.set(kVSAReplaceOperationNewURL, *withNew);
  dict.set(kVSAReplaceOperationStagingURL, *usingStaging);
  dict.set(kVSAReplaceOperationDestURL, *toDestination);
  VSAErrorRef underlying;
  auto bytes = VSAPlist::serialize(dict, VSAPlist::Format::Binary, &underlying);
  if (!bytes || !fm.writeFileAtomicallyAtURL(url, *bytes, 0600, std::nullopt, &underlying)) {
    VSASetError(error,
                fail(VSAResult::kWriteFailed, fn, __LINE__,
                     VSAFormat("Failed to write replace dictionary to URL %@", url), underlying));
    return false;
  }
  return true;
}

std::optional<VSAReplaceFileInfo> VSAReplaceFile::_readAndValidateReplaceFileAtUrl(
    VSAFileManager& fm, const std::string& url, VSAErrorRef* error) {
  const char* fn = "_readAndValidateReplaceFileAtUrl";
  std::vector<uint8_t> bytes;
  VSAErrorRef underlying;
  int rc = fm.fileSystem().readFile(url, &bytes, kVSAReplaceFileMaxSize);
  std::optional<VSAValue> value;
  // Only the daemon writes replace files, always as binary lists; the binary
  // decoder also guarantees UTF-8 strings, which a journal must be able to
  // hold again.
  if (rc == 0) value = VSAPlist::parse(bytes, &underlying, VSAPlist::Accept::BinaryOnly);
  if (!value) {
    if (rc != 0) underlying = VSAError::posix(rc, fn, __LINE__, url);
    VSASetError(error, fail(VSAResult::kInvalidReplaceFile, fn, __LINE__,
                            VSAFormat("Failed to read replace file at URL %@", url), underlying));
    return std::nullopt;
  }
  if (!value->isDictionary()) {
    VSASetError(error, fail(VSAResult::kInvalidReplaceFile, fn, __LINE__,
                            VSAFormat("Bad Data in replace file: %@", *value)));
    return std::nullopt;
  }
  auto text = [&](const char* key) -> std::optional<std::string> {
    const VSAValue* v = value->get(key);
    return v && v->isString() ? std::optional<std::string>(*v->stringValue()) : std::nullopt;
  };
  auto old = text(kVSAReplaceOperationOldURL), fresh = text(kVSAReplaceOperationNewURL),
       staging = text(kVSAReplaceOperationStagingURL), dest = text(kVSAReplaceOperationDestURL);
  if (!old || !fresh || !staging || !dest) {
    VSASetError(error, fail(VSAResult::kInvalidReplaceFile, fn, __LINE__,
                            VSAFormat("Invalid replace data: Old: %@, New: %@, Staging: %@, "
                                      "Dest: %@",
                                      orNull(old), orNull(fresh), orNull(staging), orNull(dest))));
    return std::nullopt;
  }
  for (const std::string* path : {&*old, &*fresh, &*staging, &*dest}) {
    if (isDirectoryPath(*path)) continue;
    VSASetError(error, fail(VSAResult::kInvalidReplaceFile, fn, __LINE__,
                            VSAFormat("Invalid directory path in replace file %@: %@", url,
                                      VSAClientStringForLog(*path))));
    return std::nullopt;
  }
  return VSAReplaceFileInfo{*old, *fresh, *staging, *dest};
}
