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

long OffsetClock::WallSeconds() const {
  return SystemClock().WallSeconds() + offset_;
}

double OffsetClock::MonotonicSeconds() const {
  return SystemClock().MonotonicSeconds();
}

}  // namespace s2s_service
