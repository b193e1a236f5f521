#include "service/clock.h"

#include <time.h>

namespace s2s_service {

namespace {

class System : public Clock {
 public:
  long WallSeconds() const override { return static_cast<long>(time(nullptr)); }
  double MonotonicSeconds() const override {
    timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<double>(ts.tv_sec) + ts.tv_nsec / 1e9;
  }
};

}  // namespace

const Clock& SystemClock() {
  static const System clock;
  return clock;
}

long ShiftedClock::WallSeconds() const {
  timespec ts;
  clock_gettime(CLOCK_REALTIME, &ts);
  return static_cast<long>(ts.tv_sec) * rate_ + offset_ +
         static_cast<long>(ts.tv_nsec * static_cast<double>(rate_) / 1e9);
}

double ShiftedClock::MonotonicSeconds() const {
  return SystemClock().MonotonicSeconds();
}

double ShiftedClock::SystemSecondsOf(long wall) const {
  return static_cast<double>(wall - offset_) / static_cast<double>(rate_);
}

}  // namespace s2s_service
