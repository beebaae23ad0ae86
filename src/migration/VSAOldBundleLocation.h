// Moves the bundle containers an earlier release kept below the mobile
// user's home ("Containers/Bundle") into the global bundle directory.
//
// That place lies in a directory the user owns, so the user can plant a
// directory there with a metadata file of its own making. Only what the
// installation owns is moved: the walk holds each directory open and acts on
// its entries by name, a level is entered only when it is a directory owned
// by root, the daemon's own uid or the installation uid and writable by its
// owner alone, and a container is moved (one rename, never over an existing
// item) only when it and its metadata file, if it has one, are owned and
// protected so too. Everything else stays where it is, with a log line; a
// level that ends empty is removed.
#pragma once

#include <string>

#include "base/VSAError.h"
#include "platform/VSAFileSystem.h"

// False, with `error`, when the old location or the target cannot be read, or
// a trusted container cannot be moved (an item of its name is at the target
// already). Planted entries left behind are not a failure.
bool VSAMoveOldBundleLocation(VSAFileSystem& fs, const std::string& old, const std::string& target,
                              VSAErrorRef* error);
