#include "platform/VSAFaultInjectingFileSystem.h"

VSAFaultInjectingFileSystem::VSAFaultInjectingFileSystem(std::shared_ptr<VSAFileSystem> inner)
    : inner_(std::move(inner)), unsynced_(inner_) {}

std::shared_ptr<VSAFaultInjectingFileSystem> VSAFaultInjectingFileSystem::readOnly(
    std::shared_ptr<VSAFileSystem> inner) {
  auto fs = std::make_shared<VSAFaultInjectingFileSystem>(std::move(inner));
  for (Op op : {Op::Mkdir, Op::Chown, Op::Chmod, Op::Rename, Op::Unlink, Op::Rmdir, Op::SetXattr,
                Op::SetFlags, Op::CopyData, Op::Symlink, Op::WriteFile, Op::Mkdtemp, Op::SetACL,
                Op::SetClass, Op::MaintainStatistics})
    fs->failAll(op, EROFS);
  return fs;
}

void VSAFaultInjectingFileSystem::failNth(Op op, int n, int error) {
  std::lock_guard lock(mutex_);
  rules_.push_back({op, n - 1, error});
}

void VSAFaultInjectingFileSystem::failAll(Op op, int error) {
  std::lock_guard lock(mutex_);
  rules_.push_back({op, -1, error});
}

void VSAFaultInjectingFileSystem::crashAfter(int calls, CrashModel model) {
  std::lock_guard lock(mutex_);
  crashRemaining_ = calls;
  crashModel_ = model;
  powerLost_ = false;
  // From here on every change is durable only once synced.
  if (model == CrashModel::PowerLoss)
    unsynced_.start();
  else
    unsynced_.clear();
}

void VSAFaultInjectingFileSystem::crashNow() {
  bool losePower = false;
  {
    std::lock_guard lock(mutex_);
    if (crashRemaining_ < 0) return;
    crashRemaining_ = 0;
    losePower = crashModel_ == CrashModel::PowerLoss && !powerLost_;
    powerLost_ = true;
  }
  if (losePower) unsynced_.losePower();
}

void VSAFaultInjectingFileSystem::failCall(int n, int error) {
  std::lock_guard lock(mutex_);
  failCallRemaining_ = n - 1;
  failCallError_ = error;
}

void VSAFaultInjectingFileSystem::afterNextLstatOf(const std::string& path,
                                                   std::function<void()> hook) {
  std::lock_guard lock(mutex_);
  lstatHooks_.emplace_back(path, std::move(hook));
}

bool VSAFaultInjectingFileSystem::crashed() const {
  std::lock_guard lock(mutex_);
  return crashRemaining_ == 0;
}

void VSAFaultInjectingFileSystem::reset() {
  std::lock_guard lock(mutex_);
  rules_.clear();
  crashRemaining_ = -1;
  crashModel_ = CrashModel::ProcessDeath;
  powerLost_ = false;
  unsynced_.clear();
  failCallRemaining_ = -1;
  counts_.fill(0);
  lstatHooks_.clear();
}

int VSAFaultInjectingFileSystem::callCount(Op op) const {
  std::lock_guard lock(mutex_);
  return counts_[static_cast<size_t>(op)];
}

int VSAFaultInjectingFileSystem::totalCalls() const {
  std::lock_guard lock(mutex_);
  int total = 0;
  for (int c : counts_) total += c;
  return total;
}

int VSAFaultInjectingFileSystem::injected(Op op) {
  {
    std::lock_guard lock(mutex_);
    ++counts_[static_cast<size_t>(op)];
    if (crashRemaining_ != 0) return injectedLocked(op);
    if (crashModel_ != CrashModel::PowerLoss || powerLost_) return EIO;
    powerLost_ = true;
  }
  // The first call after the crash point: the power fails now. Undone
  // outside the lock: calls under way on other threads report their
  // changes meanwhile, and those are undone as they arrive.
  unsynced_.losePower();
  return EIO;
}

int VSAFaultInjectingFileSystem::injectedLocked(Op op) {
  if (crashRemaining_ > 0) --crashRemaining_;
  if (failCallRemaining_ >= 0 && failCallRemaining_-- == 0) return failCallError_;
  for (auto it = rules_.begin(); it != rules_.end(); ++it) {
    if (it->op != op) continue;
    if (it->remaining < 0) return it->error;
    if (it->remaining-- == 0) {
      int error = it->error;
      rules_.erase(it);
      return error;
    }
  }
  return 0;
}

int VSAFaultInjectingFileSystem::lstat(const std::string& path, struct stat* st) {
  int rc = injected(Op::Lstat);
  if (rc == 0) rc = inner_->lstat(path, st);
  std::function<void()> hook;
  {
    std::lock_guard lock(mutex_);
    for (auto it = lstatHooks_.begin(); it != lstatHooks_.end(); ++it) {
      if (it->first != path) continue;
      hook = std::move(it->second);
      lstatHooks_.erase(it);
      break;
    }
  }
  if (hook) hook();  // outside the mutex: it may call this file system
  return rc;
}

int VSAFaultInjectingFileSystem::mkdir(const std::string& path, mode_t mode) {
  if (int e = injected(Op::Mkdir)) return e;
  int rc = inner_->mkdir(path, mode);
  if (rc == 0) unsynced_.created(path);
  return rc;
}

int VSAFaultInjectingFileSystem::lchown(const std::string& path, uid_t uid, gid_t gid) {
  if (int e = injected(Op::Chown)) return e;
  return inner_->lchown(path, uid, gid);
}

int VSAFaultInjectingFileSystem::chmod(const std::string& path, mode_t mode) {
  if (int e = injected(Op::Chmod)) return e;
  return inner_->chmod(path, mode);
}

int VSAFaultInjectingFileSystem::rename(const std::string& from, const std::string& to) {
  if (int e = injected(Op::Rename)) return e;
  int rc = inner_->rename(from, to);
  if (rc == 0) {
    unsynced_.renamed(from, to);
    unsynced_.syncedParentOf(to);
  }
  return rc;
}

int VSAFaultInjectingFileSystem::renameWithoutSync(const std::string& from, const std::string& to) {
  if (int e = injected(Op::Rename)) return e;
  int rc = inner_->renameWithoutSync(from, to);
  if (rc == 0) unsynced_.renamed(from, to);
  return rc;
}

int VSAFaultInjectingFileSystem::exchange(const std::string& a, const std::string& b) {
  if (int e = injected(Op::Rename)) return e;
  int rc = inner_->exchange(a, b);
  if (rc == 0) {
    unsynced_.exchanged(a, b);
    unsynced_.syncedParentOf(a);
    unsynced_.syncedParentOf(b);
  }
  return rc;
}

int VSAFaultInjectingFileSystem::readlink(const std::string& path, std::string* target) {
  if (int e = injected(Op::Readlink)) return e;
  return inner_->readlink(path, target);
}

int VSAFaultInjectingFileSystem::realpath(const std::string& path, std::string* resolved) {
  if (int e = injected(Op::Realpath)) return e;
  return inner_->realpath(path, resolved);
}

int VSAFaultInjectingFileSystem::unlink(const std::string& path) {
  if (int e = injected(Op::Unlink)) return e;
  return inner_->unlink(path);
}

int VSAFaultInjectingFileSystem::rmdir(const std::string& path) {
  if (int e = injected(Op::Rmdir)) return e;
  return inner_->rmdir(path);
}

int VSAFaultInjectingFileSystem::readDirectory(const std::string& path,
                                               std::vector<VSADirectoryEntry>* entries) {
  if (int e = injected(Op::ReadDirectory)) return e;
  return inner_->readDirectory(path, entries);
}

int VSAFaultInjectingFileSystem::getxattr(const std::string& path, const std::string& name,
                                          std::string* value) {
  if (int e = injected(Op::GetXattr)) return e;
  return inner_->getxattr(path, name, value);
}

int VSAFaultInjectingFileSystem::getFlags(const std::string& path, int* flags) {
  if (int e = injected(Op::GetFlags)) return e;
  return inner_->getFlags(path, flags);
}

int VSAFaultInjectingFileSystem::setFlags(const std::string& path, int flags) {
  if (int e = injected(Op::SetFlags)) return e;
  return inner_->setFlags(path, flags);
}

int VSAFaultInjectingFileSystem::writeFile(const std::string& path,
                                           const std::vector<uint8_t>& bytes, mode_t mode) {
  if (int e = injected(Op::WriteFile)) return e;
  // The data is synced; a file the call makes is a new entry of its directory.
  bool existed = unsynced_.tracking() && inner_->exists(path) == 0;
  int rc = inner_->writeFile(path, bytes, mode);
  if (rc == 0 && !existed) unsynced_.created(path);
  return rc;
}

int VSAFaultInjectingFileSystem::readFile(const std::string& path, std::vector<uint8_t>* bytes,
                                          size_t maxSize) {
  if (int e = injected(Op::ReadFile)) return e;
  return inner_->readFile(path, bytes, maxSize);
}

int VSAFaultInjectingFileSystem::readFileAt(int dir, const std::string& path,
                                            std::vector<uint8_t>* bytes, size_t maxSize) {
  if (int e = injected(Op::ReadFile)) return e;
  return inner_->readFileAt(dir, path, bytes, maxSize);
}

int VSAFaultInjectingFileSystem::mkdtemp(const std::string& templ, std::string* path) {
  if (int e = injected(Op::Mkdtemp)) return e;
  int rc = inner_->mkdtemp(templ, path);
  if (rc == 0) unsynced_.created(*path);
  return rc;
}

int VSAFaultInjectingFileSystem::setSystemContainerACL(const std::string& path,
                                                       VSASystemContainerACL kind, gid_t gid) {
  if (int e = injected(Op::SetACL)) return e;
  return inner_->setSystemContainerACL(path, kind, gid);
}

int VSAFaultInjectingFileSystem::getProtectionClass(const std::string& path, int* protectionClass) {
  if (int e = injected(Op::GetClass)) return e;
  return inner_->getProtectionClass(path, protectionClass);
}

int VSAFaultInjectingFileSystem::setProtectionClass(const std::string& path, int protectionClass) {
  if (int e = injected(Op::SetClass)) return e;
  return inner_->setProtectionClass(path, protectionClass);
}

int VSAFaultInjectingFileSystem::directoryStatistics(const std::string& path, uint64_t* bytes) {
  if (int e = injected(Op::DirectoryStatistics)) return e;
  return inner_->directoryStatistics(path, bytes);
}

int VSAFaultInjectingFileSystem::maintainDirectoryStatistics(const std::string& path) {
  if (int e = injected(Op::MaintainStatistics)) return e;
  return inner_->maintainDirectoryStatistics(path);
}

int VSAFaultInjectingFileSystem::openDirectory(const std::string& path, int* fd) {
  if (int e = injected(Op::OpenDirectory)) return e;
  return inner_->openDirectory(path, fd);
}

int VSAFaultInjectingFileSystem::openDirectoryAt(int dir, const std::string& name, int* fd) {
  if (int e = injected(Op::OpenDirectory)) return e;
  return inner_->openDirectoryAt(dir, name, fd);
}

int VSAFaultInjectingFileSystem::statAt(int dir, const std::string& name, struct stat* st) {
  if (int e = injected(Op::Lstat)) return e;
  return inner_->statAt(dir, name, st);
}

int VSAFaultInjectingFileSystem::readDirectoryAt(int dir, std::vector<VSADirectoryEntry>* entries) {
  if (int e = injected(Op::ReadDirectory)) return e;
  return inner_->readDirectoryAt(dir, entries);
}

int VSAFaultInjectingFileSystem::mkdirAt(int dir, const std::string& name, mode_t mode) {
  if (int e = injected(Op::Mkdir)) return e;
  int rc = inner_->mkdirAt(dir, name, mode);
  if (rc == 0) unsynced_.created(dir, name);
  return rc;
}

int VSAFaultInjectingFileSystem::unlinkAt(int dir, const std::string& name, bool directory) {
  if (int e = injected(directory ? Op::Rmdir : Op::Unlink)) return e;
  return inner_->unlinkAt(dir, name, directory);
}

int VSAFaultInjectingFileSystem::renameAt(int fromDir, const std::string& fromName, int toDir,
                                          const std::string& toName) {
  if (int e = injected(Op::Rename)) return e;
  int rc = inner_->renameAt(fromDir, fromName, toDir, toName);
  if (rc == 0) {
    unsynced_.renamed(fromDir, fromName, toDir, toName);
    unsynced_.synced(toDir);
  }
  return rc;
}

int VSAFaultInjectingFileSystem::chownAt(int dir, const std::string& name, uid_t uid, gid_t gid) {
  if (int e = injected(Op::Chown)) return e;
  return inner_->chownAt(dir, name, uid, gid);
}

int VSAFaultInjectingFileSystem::chmodAt(int dir, const std::string& name, mode_t mode) {
  if (int e = injected(Op::Chmod)) return e;
  return inner_->chmodAt(dir, name, mode);
}

int VSAFaultInjectingFileSystem::getFlagsAt(int dir, const std::string& name, int* flags) {
  if (int e = injected(Op::GetFlags)) return e;
  return inner_->getFlagsAt(dir, name, flags);
}

int VSAFaultInjectingFileSystem::setFlagsAt(int dir, const std::string& name, int flags) {
  if (int e = injected(Op::SetFlags)) return e;
  return inner_->setFlagsAt(dir, name, flags);
}

int VSAFaultInjectingFileSystem::setSystemContainerACLAt(int dir, const std::string& name,
                                                         VSASystemContainerACL kind, gid_t gid) {
  if (int e = injected(Op::SetACL)) return e;
  return inner_->setSystemContainerACLAt(dir, name, kind, gid);
}

int VSAFaultInjectingFileSystem::getProtectionClassAt(int dir, const std::string& name,
                                                      int* protectionClass) {
  if (int e = injected(Op::GetClass)) return e;
  return inner_->getProtectionClassAt(dir, name, protectionClass);
}

int VSAFaultInjectingFileSystem::setProtectionClassAt(int dir, const std::string& name,
                                                      int protectionClass) {
  if (int e = injected(Op::SetClass)) return e;
  return inner_->setProtectionClassAt(dir, name, protectionClass);
}

int VSAFaultInjectingFileSystem::syncDirectory(int dir) {
  if (int e = injected(Op::SyncDirectory)) return e;
  int rc = inner_->syncDirectory(dir);
  if (rc == 0) unsynced_.synced(dir);
  return rc;
}

int VSAFaultInjectingFileSystem::copyDataAt(int fromDir, const std::string& fromName, int toDir,
                                            const std::string& toName, mode_t mode) {
  if (int e = injected(Op::CopyData)) return e;
  int rc = inner_->copyDataAt(fromDir, fromName, toDir, toName, mode);
  if (rc == 0) unsynced_.created(toDir, toName);  // its data is synced
  return rc;
}

int VSAFaultInjectingFileSystem::readlinkAt(int dir, const std::string& name, std::string* target) {
  if (int e = injected(Op::Readlink)) return e;
  return inner_->readlinkAt(dir, name, target);
}

int VSAFaultInjectingFileSystem::symlinkAt(const std::string& target, int dir,
                                           const std::string& name) {
  if (int e = injected(Op::Symlink)) return e;
  int rc = inner_->symlinkAt(target, dir, name);
  if (rc == 0) unsynced_.created(dir, name);
  return rc;
}

int VSAFaultInjectingFileSystem::listxattrAt(int dir, const std::string& name,
                                             std::vector<std::string>* names) {
  if (int e = injected(Op::ListXattr)) return e;
  return inner_->listxattrAt(dir, name, names);
}

int VSAFaultInjectingFileSystem::getxattrAt(int dir, const std::string& name,
                                            const std::string& attribute, std::string* value) {
  if (int e = injected(Op::GetXattr)) return e;
  return inner_->getxattrAt(dir, name, attribute, value);
}

int VSAFaultInjectingFileSystem::setxattrAt(int dir, const std::string& name,
                                            const std::string& attribute,
                                            const std::string& value) {
  if (int e = injected(Op::SetXattr)) return e;
  return inner_->setxattrAt(dir, name, attribute, value);
}
