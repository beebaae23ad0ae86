// vessa-floor: the least work that could answer a request, as a process of
// its own, for the benchmarks' floors. It links nothing of vessad.
//
//   vessa-floor stream SOCKET      frames (4-byte big-endian length + body)
//                                  on a Unix stream socket, each sent back
//                                  as it came
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
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
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

// Frames back as they came: the header, then the body, then one write.
void serveStream(int fd) {
  std::vector<uint8_t> frame;
  for (;;) {
    uint8_t header[4];
    if (!readFully(fd, header, 4)) break;
    uint32_t length = (uint32_t{header[0]} << 24) | (uint32_t{header[1]} << 16) |
                      (uint32_t{header[2]} << 8) | header[3];
    if (length > (1u << 24)) break;
    frame.resize(4 + length);
    std::memcpy(frame.data(), header, 4);
    if (!readFully(fd, frame.data() + 4, length) || !writeFully(fd, frame.data(), frame.size()))
      break;
  }
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
  std::fprintf(stderr, "usage: vessa-floor stream|seqpacket SOCKET\n");
  return 2;
}
}  // namespace

int main(int argc, char** argv) {
  if (argc != 3) return usage();
  std::string kind = argv[1];
  bool stream = kind == "stream";
  if (!stream && kind != "seqpacket") return usage();
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (std::strlen(argv[2]) >= sizeof address.sun_path) return usage();
  std::strcpy(address.sun_path, argv[2]);
  int listener = socket(AF_UNIX, (stream ? SOCK_STREAM : SOCK_SEQPACKET) | SOCK_CLOEXEC, 0);
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
    int fd = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0) {
      if (errno == EINTR || errno == ECONNABORTED) continue;
      std::perror("vessa-floor: accept");
      return 1;
    }
    std::thread(stream ? serveStream : serveSeqpacket, fd).detach();
  }
}
