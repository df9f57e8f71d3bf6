// An owned file descriptor, closed when its owner goes away (C++ only).
#ifndef ZARK_PLATFORM_KLIBC_FD_H
#define ZARK_PLATFORM_KLIBC_FD_H

#include <unistd.h>

#include <utility>

namespace zark::klibc {

class UniqueFd {
public:
  UniqueFd() = default;
  explicit UniqueFd(int fd) : mFd(fd) {}
  UniqueFd(const UniqueFd &) = delete;
  UniqueFd &operator=(const UniqueFd &) = delete;
  UniqueFd(UniqueFd &&other) noexcept : mFd(other.Release()) {}
  UniqueFd &operator=(UniqueFd &&other) noexcept {
    if (this != &other) {
      Reset(other.Release());
    }
    return *this;
  }
  ~UniqueFd() { Reset(); }

  [[nodiscard]] int Get() const { return mFd; }
  [[nodiscard]] bool Valid() const { return mFd >= 0; }
  // Gives up ownership: the descriptor, which the caller must close.
  [[nodiscard]] int Release() { return std::exchange(mFd, -1); }
  // Closes the descriptor held (if any, ignoring the result) and owns fd.
  void Reset(int fd = -1) {
    if (mFd >= 0) {
      ::close(mFd);
    }
    mFd = fd;
  }
  // Closes now and tells whether the close succeeded, since it can report a
  // delayed write error (errno then says which). True when nothing was held.
  [[nodiscard]] bool Close() {
    if (mFd < 0) {
      return true;
    }
    return ::close(std::exchange(mFd, -1)) == 0;
  }

private:
  int mFd = -1;
};

} // namespace zark::klibc

#endif
