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
  // The system's wall-clock time (seconds since the epoch) at which this
  // clock reads `wall`: where the service arms its timer.
  virtual double SystemSecondsOf(long wall) const {
    return static_cast<double>(wall);
  }
};

// The system's clocks (CLOCK_REALTIME, CLOCK_MONOTONIC).
const Clock& SystemClock();

// The system's clocks with the wall clock moved: it reads
// system time * `rate` + `offset`, so that a test or a benchmark can bring a
// schedule's time near, or let the schedule's minutes pass in seconds,
// without waiting for them.
class ShiftedClock : public Clock {
 public:
  ShiftedClock(long offset, long rate) : offset_(offset), rate_(rate) {}
  long WallSeconds() const override;
  double MonotonicSeconds() const override;
  double SystemSecondsOf(long wall) const override;

 private:
  long offset_;
  long rate_;
};

}  // namespace s2s_service

#endif  // S2S_SERVICE_CLOCK_H_
