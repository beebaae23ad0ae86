// libsystemd, loaded the first time something needs it (journald, readiness
// notification, socket activation) rather than at every process start: with
// its six dependencies it is most of what starting a small tool (vessactl,
// vessa-launch) costs, and those never need it unless they log to the journal.
// Thread-safe; the library stays loaded.
#pragma once

#include <cstddef>

struct VSASystemdLibrary {
  int (*journalSend)(const char* format, ...);
  int (*notify)(int unsetEnvironment, const char* state);
  int (*listenFds)(int unsetEnvironment);
  int (*isSocketUnix)(int fd, int type, int listening, const char* path, size_t length);

  // The loaded library; null when it is not installed or lacks a function.
  static const VSASystemdLibrary* get();
};
