// Files that hold secrets of every app (the code-signing database and its
// journal) are readable and writable by root alone.
#pragma once

#include <string>

// Makes `path` a regular file of mode 0600: created empty when `create` is
// set and it is missing, its mode narrowed when it exists. A missing file
// without `create` is success. No link is followed. 0 or an errno.
int VSAMakeFileOwnerOnly(const std::string& path, bool create);
