// A clock that tests move by hand.
#ifndef ZARK_TESTS_HOST_FAKE_CLOCK_H
#define ZARK_TESTS_HOST_FAKE_CLOCK_H

#include "clock.h"

#include <atomic>

namespace zark::host::test {

class FakeClock final : public Clock {
public:
  [[nodiscard]] TimePoint Now() const override {
    return TimePoint(TimePoint::duration(mTicks.load()));
  }
  void Advance(TimePoint::duration by) { mTicks += by.count(); }

private:
  // Starts well after the epoch, so that "long ago" is representable.
  std::atomic<TimePoint::rep> mTicks{
      std::chrono::duration_cast<TimePoint::duration>(std::chrono::hours(1000))
          .count()};
};

} // namespace zark::host::test

#endif
