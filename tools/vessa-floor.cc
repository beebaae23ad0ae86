// vessa-floor: the least work that could answer a request, as a process of
// its own, for the benchmarks' floors. It links nothing of vessad.
//
//   vessa-floor stream SOCKET [PATH]
//                                  frames (4-byte big-endian length + body)
//                                  on a Unix stream socket, each sent back
//                                  as it came; with PATH, each frame first
//                                  gets the checks every request of the
//                                  daemon needs: a look for a connection
//                                  waiting to be accepted, a look at the
//                                  peer's executable (it must not have
//                                  exec'd since it connected) and a look,
//                                  without following links, at PATH (the
//                                  container's metadata file is still there)
//   vessa-floor seqpacket SOCKET   packets on a Unix seqpacket socket, each
//                                  with one descriptor of memory (a memfd):
//                                  the packet goes back with a new memfd
//                                  holding the same bytes, as an upcall's
//                                  reply carries its answer
//
// One thread per connection, blocking reads and writes: no queue, no poll.
// It writes "ready" on standard output once it listens, and runs until it is
// killed or its standard input closes.
#include <fcntl.h>
#include <linux/openat2.h>
#include <poll.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

namespace {

int gListener = -1;
const char* gCheckPath = nullptr;  // stream with checks: the path looked at per frame

void serveStream(int fd);

bool readFully(int fd, void* buffer, size_t size) {
  auto* p = static_cast<uint8_t*>(buffer);
  while (size > 0) {
    ssize_t n = read(fd, p, size);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    p += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

bool writeFully(int fd, const void* buffer, size_t size) {
  const auto* p = static_cast<const uint8_t*>(buffer);
  while (size > 0) {
    ssize_t n = write(fd, p, size);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    p += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

// The per-request checks of the daemon, by the same system calls.
bool checkRequest(int processDirectory) {
  int waiting = accept4(gListener, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
  if (waiting >= 0) std::thread(serveStream, waiting).detach();
  struct stat st {};
  if (processDirectory >= 0 && fstatat(processDirectory, "exe", &st, 0) != 0) return false;
  open_how how{};
  how.flags = O_PATH | O_NOFOLLOW | O_CLOEXEC;
  how.resolve = RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;
  long found = syscall(SYS_openat2, AT_FDCWD, gCheckPath, &how, sizeof how);
  if (found < 0) return false;
  close(static_cast<int>(found));
  return true;
}

// The peer's /proc directory, opened once per connection as the daemon does.
int processDirectoryOf(int fd) {
  ucred peer{};
  socklen_t length = sizeof peer;
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &peer, &length) != 0) return -1;
  std::string dir = "/proc/" + std::to_string(peer.pid);
  return open(dir.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
}

// Frames back as they came: the header, then the body, then one write.
void serveStream(int fd) {
  if (gCheckPath) {
    int flags = fcntl(fd, F_GETFL);
    fcntl(fd, F_SETFL, flags & ~O_NONBLOCK);
  }
  int processDirectory = gCheckPath ? processDirectoryOf(fd) : -1;
  std::vector<uint8_t> frame;
  for (;;) {
    uint8_t header[4];
    if (!readFully(fd, header, 4)) break;
    uint32_t length = (uint32_t{header[0]} << 24) | (uint32_t{header[1]} << 16) |
                      (uint32_t{header[2]} << 8) | header[3];
    if (length > (1u << 24)) break;
    frame.resize(4 + length);
    std::memcpy(frame.data(), header, 4);
    if (!readFully(fd, frame.data() + 4, length)) break;
    if (gCheckPath && !checkRequest(processDirectory)) break;
    if (!writeFully(fd, frame.data(), frame.size())) break;
  }
  if (processDirectory >= 0) close(processDirectory);
  close(fd);
}

// A packet and its memory back: the packet's bytes, and a new memfd with the
// bytes of the one that came.
void serveSeqpacket(int fd) {
  std::vector<uint8_t> packet(4096), memory;
  for (;;) {
    iovec iov{packet.data(), packet.size()};
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))];
    msghdr msg{};
    msg.msg_iov = &iov;
    msg.msg_iovlen = 1;
    msg.msg_control = control;
    msg.msg_controllen = sizeof control;
    ssize_t n = recvmsg(fd, &msg, MSG_CMSG_CLOEXEC);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    int in = -1;
    for (cmsghdr* c = CMSG_FIRSTHDR(&msg); c; c = CMSG_NXTHDR(&msg, c))
      if (c->cmsg_level == SOL_SOCKET && c->cmsg_type == SCM_RIGHTS)
        std::memcpy(&in, CMSG_DATA(c), sizeof in);
    struct stat st {};
    int out = -1;
    if (in >= 0 && fstat(in, &st) == 0) {
      memory.resize(static_cast<size_t>(st.st_size));
      bool copied = pread(in, memory.data(), memory.size(), 0) == st.st_size;
      out = memfd_create("vessa-floor", MFD_CLOEXEC);
      if (!copied || out < 0 || !writeFully(out, memory.data(), memory.size())) {
        if (out >= 0) close(out);
        out = -1;
      }
    }
    if (in >= 0) close(in);
    iovec reply{packet.data(), static_cast<size_t>(n)};
    msghdr answer{};
    answer.msg_iov = &reply;
    answer.msg_iovlen = 1;
    alignas(cmsghdr) char outControl[CMSG_SPACE(sizeof(int))];
    if (out >= 0) {
      answer.msg_control = outControl;
      answer.msg_controllen = sizeof outControl;
      cmsghdr* c = CMSG_FIRSTHDR(&answer);
      c->cmsg_level = SOL_SOCKET;
      c->cmsg_type = SCM_RIGHTS;
      c->cmsg_len = CMSG_LEN(sizeof(int));
      std::memcpy(CMSG_DATA(c), &out, sizeof out);
    }
    ssize_t sent;
    do {
      sent = sendmsg(fd, &answer, MSG_NOSIGNAL);
    } while (sent < 0 && errno == EINTR);
    if (out >= 0) close(out);
    if (sent < 0) break;
  }
  close(fd);
}

int usage() {
  std::fprintf(stderr, "usage: vessa-floor stream SOCKET [PATH] | seqpacket SOCKET\n");
  return 2;
}
}  // namespace

int main(int argc, char** argv) {
  if (argc != 3 && argc != 4) return usage();
  std::string kind = argv[1];
  bool stream = kind == "stream";
  if (!stream && kind != "seqpacket") return usage();
  if (argc == 4) {
    if (!stream) return usage();
    gCheckPath = argv[3];
  }
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (std::strlen(argv[2]) >= sizeof address.sun_path) return usage();
  std::strcpy(address.sun_path, argv[2]);
  // Non-blocking, so that a request's look for a waiting connection never waits.
  int listener =
      socket(AF_UNIX, (stream ? SOCK_STREAM : SOCK_SEQPACKET) | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  gListener = listener;
  unlink(argv[2]);
  if (listener < 0 || bind(listener, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
      listen(listener, 64) != 0) {
    std::perror("vessa-floor");
    return 1;
  }
  // Ends with its parent: a closed standard input stops the process.
  std::thread([] {
    char c;
    while (read(STDIN_FILENO, &c, 1) > 0) {
    }
    _exit(0);
  }).detach();
  std::printf("ready\n");
  std::fflush(stdout);
  for (;;) {
    pollfd ready{listener, POLLIN, 0};
    if (poll(&ready, 1, -1) < 0 && errno != EINTR) {
      std::perror("vessa-floor: poll");
      return 1;
    }
    int fd = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0) {
      if (errno == EINTR || errno == ECONNABORTED || errno == EAGAIN) continue;
      std::perror("vessa-floor: accept");
      return 1;
    }
    std::thread(stream ? serveStream : serveSeqpacket, fd).detach();
  }
}
