// The user database of a system root: accounts by name and uid.
//
// For the root "/" it is the host's (NSS: getpwnam/getpwuid); for any other
// root it is `<root>/etc/passwd` and `<root>/etc/group`, read on each query
// (they are small and rarely read). Home directories are device paths in the
// database and are returned resolved below the root. The files are read
// bounded and never through a symbolic link. Thread-safe.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

#include "platform/VSASystemRoot.h"

struct VSAUserAccount {
  std::string name;
  uid_t uid = 0;
  gid_t gid = 0;
  std::string homeDirectory;  // host path (below the root)
};

class VSAUserDatabase {
 public:
  explicit VSAUserDatabase(VSASystemRoot root);

  std::optional<VSAUserAccount> userNamed(const std::string& name) const;
  std::optional<VSAUserAccount> userWithUID(uid_t uid) const;
  std::optional<gid_t> groupNamed(const std::string& name) const;
  // The real path of the user's home directory; for an unknown user the
  // fixed "/private/var/mobile" (logged).
  std::string homeDirectoryForUID(uid_t uid) const;

 private:
  std::optional<VSAUserAccount> find(const std::string* name, const uid_t* uid) const;
  VSASystemRoot root_;
};
