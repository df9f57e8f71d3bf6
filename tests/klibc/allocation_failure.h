// Makes operator new fail on demand, to check that the library turns
// std::bad_alloc into an error result instead of letting it cross its C
// functions. The test executable replaces the global operator new (and so
// the library's, since the executable exports it).
#ifndef ZARK_TESTS_KLIBC_ALLOCATION_FAILURE_H
#define ZARK_TESTS_KLIBC_ALLOCATION_FAILURE_H

namespace zark::test {

// While alive, lets `allowed` allocations succeed and fails every one
// after them with std::bad_alloc. Not for tests with threads.
class ScopedAllocationFailure {
public:
  explicit ScopedAllocationFailure(long allowed);
  ~ScopedAllocationFailure();
  ScopedAllocationFailure(const ScopedAllocationFailure &) = delete;
  ScopedAllocationFailure &operator=(const ScopedAllocationFailure &) = delete;

  // True once an allocation was refused.
  [[nodiscard]] bool Triggered() const;
};

} // namespace zark::test

#endif
