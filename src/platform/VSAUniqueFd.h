// An owned file descriptor, closed when the owner goes away. Move-only.
#pragma once

#include <unistd.h>

#include <utility>

class VSAUniqueFd {
 public:
  explicit VSAUniqueFd(int fd = -1) : fd_(fd) {}
  ~VSAUniqueFd() { reset(); }
  VSAUniqueFd(VSAUniqueFd&& other) noexcept : fd_(other.release()) {}
  VSAUniqueFd& operator=(VSAUniqueFd&& other) noexcept {
    if (this != &other) reset(other.release());
    return *this;
  }
  VSAUniqueFd(const VSAUniqueFd&) = delete;
  VSAUniqueFd& operator=(const VSAUniqueFd&) = delete;

  int get() const { return fd_; }
  explicit operator bool() const { return fd_ >= 0; }
  int release() { return std::exchange(fd_, -1); }
  void reset(int fd = -1) {
    if (fd_ >= 0) ::close(fd_);
    fd_ = fd;
  }

 private:
  int fd_;
};
