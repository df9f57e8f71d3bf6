// Counts the heap blocks of one chosen size that are alive, by replacing the
// global operator new and delete of the test process. A test picks the size
// of the object it follows (for example sizeof(StatusReportor)) and compares
// the count before and after the code under test.
#ifndef ZARK_TESTS_MODULE_ALLOC_TRACKER_H
#define ZARK_TESTS_MODULE_ALLOC_TRACKER_H

#include <cstddef>

namespace zark::moduletest {

// Starts counting blocks of exactly `size` bytes from zero.
void TrackAllocationsOfSize(std::size_t size);

// Blocks of the tracked size allocated and not yet freed since tracking
// started, and all that were allocated.
long LiveTrackedBlocks();
long TrackedAllocations();

} // namespace zark::moduletest

#endif
