#include "allocation_failure.h"

#include <atomic>
#include <cstdlib>
#include <new>

namespace {

// Allocations still allowed; negative: failure injection is off.
std::atomic<long> gAllowed{-1};
std::atomic<bool> gTriggered{false};

void *Allocate(std::size_t size) {
  long allowed = gAllowed.load();
  if (allowed >= 0) {
    if (allowed == 0) {
      gTriggered = true;
      throw std::bad_alloc();
    }
    gAllowed = allowed - 1;
  }
  if (void *memory = std::malloc(size == 0 ? 1 : size)) {
    return memory;
  }
  throw std::bad_alloc();
}

} // namespace

void *operator new(std::size_t size) {
  return Allocate(size);
}
void *operator new[](std::size_t size) {
  return Allocate(size);
}
void operator delete(void *memory) noexcept {
  std::free(memory);
}
void operator delete[](void *memory) noexcept {
  std::free(memory);
}
void operator delete(void *memory, std::size_t) noexcept {
  std::free(memory);
}
void operator delete[](void *memory, std::size_t) noexcept {
  std::free(memory);
}

namespace zark::test {

ScopedAllocationFailure::ScopedAllocationFailure(long allowed) {
  gTriggered = false;
  gAllowed = allowed;
}

ScopedAllocationFailure::~ScopedAllocationFailure() {
  gAllowed = -1;
}

bool ScopedAllocationFailure::Triggered() const {
  return gTriggered;
}

} // namespace zark::test
