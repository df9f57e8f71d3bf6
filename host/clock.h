// The clock that sessions and login throttling measure time with. A seam:
// tests hand in a clock they move by hand.
#ifndef ZARK_HOST_CLOCK_H
#define ZARK_HOST_CLOCK_H

#include <chrono>

namespace zark::host {

class Clock {
public:
  using TimePoint = std::chrono::steady_clock::time_point;
  virtual ~Clock() = default;
  [[nodiscard]] virtual TimePoint Now() const = 0;
};

// The monotonic clock of the machine: not moved by changes of the wall time.
class SteadyClock final : public Clock {
public:
  [[nodiscard]] TimePoint Now() const override {
    return std::chrono::steady_clock::now();
  }
};

} // namespace zark::host

#endif
