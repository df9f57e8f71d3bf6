#include "alloc_tracker.h"

#include <atomic>
#include <cstdlib>
#include <new>

namespace zark::moduletest {
namespace {

// Every block carries its size in a header in front of it, so that delete
// knows the size whatever form of delete is used.
constexpr std::size_t kHeader = alignof(std::max_align_t);

std::atomic<std::size_t> gTrackedSize{0};
std::atomic<long> gLive{0};
std::atomic<long> gAllocated{0};

} // namespace

void TrackAllocationsOfSize(std::size_t size) {
  gTrackedSize = size;
  gLive = 0;
  gAllocated = 0;
}

long LiveTrackedBlocks() {
  return gLive.load();
}
long TrackedAllocations() {
  return gAllocated.load();
}

} // namespace zark::moduletest

using zark::moduletest::gAllocated;
using zark::moduletest::gLive;
using zark::moduletest::gTrackedSize;
using zark::moduletest::kHeader;

void *operator new(std::size_t size) {
  void *base = std::malloc(size + kHeader);
  if (!base) {
    throw std::bad_alloc();
  }
  *static_cast<std::size_t *>(base) = size;
  if (size != 0 && size == gTrackedSize.load()) {
    ++gLive;
    ++gAllocated;
  }
  return static_cast<char *>(base) + kHeader;
}

void *operator new[](std::size_t size) {
  return operator new(size);
}

void *operator new(std::size_t size, const std::nothrow_t &) noexcept {
  try {
    return operator new(size);
  } catch (...) {
    return nullptr;
  }
}

void *operator new[](std::size_t size, const std::nothrow_t &) noexcept {
  return operator new(size, std::nothrow);
}

void operator delete(void *block) noexcept {
  if (!block) {
    return;
  }
  char *base = static_cast<char *>(block) - kHeader;
  std::size_t size = *reinterpret_cast<std::size_t *>(base);
  if (size != 0 && size == gTrackedSize.load()) {
    --gLive;
  }
  std::free(base);
}

void operator delete[](void *block) noexcept {
  operator delete(block);
}
void operator delete(void *block, std::size_t) noexcept {
  operator delete(block);
}
void operator delete[](void *block, std::size_t) noexcept {
  operator delete(block);
}
void operator delete(void *block, const std::nothrow_t &) noexcept {
  operator delete(block);
}
void operator delete[](void *block, const std::nothrow_t &) noexcept {
  operator delete(block);
}
