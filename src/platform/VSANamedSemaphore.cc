#include "platform/VSANamedSemaphore.h"

#include <fcntl.h>
#include <semaphore.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {
// Where the C library keeps named semaphores, as "sem.<name>".
constexpr const char* kSemaphoreDirectory = "/dev/shm/sem.";
}  // namespace

std::string VSANamedSemaphore::nameForRoot(const std::string& baseName, const VSASystemRoot& root) {
  return root.isHostRoot() ? baseName : baseName + "." + root.hashSuffix();
}

std::string VSANamedSemaphore::backingPath(const std::string& name) {
  return kSemaphoreDirectory + name;
}

VSANamedSemaphore::State VSANamedSemaphore::stateOf(const std::string& name) {
  int fd = ::open(backingPath(name).c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
  if (fd < 0) {
    // A link (ELOOP) or anything else that is there but cannot be opened is not ours.
    struct stat st;
    return ::lstat(backingPath(name).c_str(), &st) == 0 ? State::Forged : State::Absent;
  }
  struct stat st;
  bool ours = ::fstat(fd, &st) == 0 && S_ISREG(st.st_mode) && st.st_uid == ::geteuid() &&
              (st.st_mode & 07777) == 0600;
  ::close(fd);
  return ours ? State::Present : State::Forged;
}

bool VSANamedSemaphore::exists(const std::string& name) { return stateOf(name) == State::Present; }

bool VSANamedSemaphore::create(const std::string& name) {
  // O_EXCL: whatever else took the name in the meantime is not adopted.
  sem_t* s = sem_open(("/" + name).c_str(), O_CREAT | O_EXCL, 0600, 0);
  if (s == SEM_FAILED) return false;
  sem_close(s);
  return true;
}

void VSANamedSemaphore::remove(const std::string& name) { sem_unlink(("/" + name).c_str()); }
