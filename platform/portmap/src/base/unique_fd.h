// An owned file descriptor, closed when its owner goes away.
#ifndef ZARK_PORTMAP_UNIQUE_FD_H
#define ZARK_PORTMAP_UNIQUE_FD_H

#include <unistd.h>

#include <utility>

namespace zark::portmap {

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
  [[nodiscard]] int Release() { return std::exchange(mFd, -1); }
  void Reset(int fd = -1) {
    if (mFd >= 0) {
      ::close(mFd);
    }
    mFd = fd;
  }

private:
  int mFd = -1;
};

} // namespace zark::portmap

#endif
