#include "platform/VSANamedSemaphore.h"

#include <fcntl.h>
#include <semaphore.h>

std::string VSANamedSemaphore::nameForRoot(const std::string& baseName, const VSASystemRoot& root) {
  return root.isHostRoot() ? baseName : baseName + "." + root.hashSuffix();
}

bool VSANamedSemaphore::exists(const std::string& name) {
  sem_t* s = sem_open(("/" + name).c_str(), 0);
  if (s == SEM_FAILED) return false;
  sem_close(s);
  return true;
}

bool VSANamedSemaphore::create(const std::string& name) {
  sem_t* s = sem_open(("/" + name).c_str(), O_CREAT, 0444, 0);
  if (s == SEM_FAILED) return false;
  sem_close(s);
  return true;
}

void VSANamedSemaphore::remove(const std::string& name) { sem_unlink(("/" + name).c_str()); }
