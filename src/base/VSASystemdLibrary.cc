#include "base/VSASystemdLibrary.h"

#include <dlfcn.h>

namespace {
template <typename F>
bool resolve(void* handle, const char* name, F* out) {
  *out = reinterpret_cast<F>(dlsym(handle, name));
  return *out != nullptr;
}

const VSASystemdLibrary* load() {
  void* handle = dlopen("libsystemd.so.0", RTLD_NOW | RTLD_LOCAL);
  if (!handle) return nullptr;
  static VSASystemdLibrary library;
  if (!resolve(handle, "sd_journal_send", &library.journalSend) ||
      !resolve(handle, "sd_notify", &library.notify) ||
      !resolve(handle, "sd_listen_fds", &library.listenFds) ||
      !resolve(handle, "sd_is_socket_unix", &library.isSocketUnix))
    return nullptr;
  return &library;
}
}  // namespace

const VSASystemdLibrary* VSASystemdLibrary::get() {
  static const VSASystemdLibrary* library = load();
  return library;
}
