// Putting a listening unix socket at its path in one step, or taking over
// the one a service manager holds for that path.
#pragma once

#include <sys/types.h>

#include <string>

// Binds `fd`, a fresh unix socket, under a temporary name beside `path`,
// gives the file `mode`, starts listening and only then renames it to
// `path`. A client that finds the socket file can connect at once: waiting
// for the path to appear is enough (a plain bind makes the file before
// listen, and a connect in between is refused). The file is never
// connectable with another mode than `mode`, and the process's umask is
// left alone (other threads may be creating files meanwhile). Returns 0 or
// an errno; on failure no file is left behind and `path` is untouched.
int VSABindListeningSocket(int fd, const std::string& path, mode_t mode, int backlog);

// The listening unix socket of `type` (SOCK_STREAM, SOCK_SEQPACKET) at `path`
// among those passed by socket activation (systemd's LISTEN_FDS), or -1. The
// service manager owns the file; several listeners may each find theirs.
int VSAActivatedListeningSocket(int type, const std::string& path);
