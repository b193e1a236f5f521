// Where the service takes the time from: the wall clock for schedules (they
// are calendar times) and a monotonic clock for delays. Tests pass a clock
// of their own to move time without sleeping.
#ifndef S2S_SERVICE_CLOCK_H_
#define S2S_SERVICE_CLOCK_H_

namespace s2s_service {

class Clock {
 public:
  virtual ~Clock() = default;
  // Seconds since the epoch.
  virtual long WallSeconds() const = 0;
  // Seconds on a clock that never jumps.
  virtual double MonotonicSeconds() const = 0;
};

// The system's clocks (CLOCK_REALTIME, CLOCK_MONOTONIC).
const Clock& SystemClock();

// The system's clocks with the wall clock `offset` seconds ahead, so that a
// test or a benchmark can bring a schedule's time near without waiting for
// it.
class OffsetClock : public Clock {
 public:
  explicit OffsetClock(long offset) : offset_(offset) {}
  long WallSeconds() const override;
  double MonotonicSeconds() const override;

 private:
  long offset_;
};

}  // namespace s2s_service

#endif  // S2S_SERVICE_CLOCK_H_
