// Cancelling a run, and beacons while rsync runs, per thread.
//
// Several runs share the service's process, each on a thread of its own, so
// the cancel state belongs to the thread: whoever owns a run holds its
// CancelFlag, the thread that runs it binds the flag (BindCancelFlag), and
// CancelChecker, the plain function the Rsyncer polls while rsync runs,
// reads the flag bound to the calling thread. Setting the flag from another
// thread (or a signal handler) stops that run within one poll.
//
// The same poll is where a run sends its periodic beacon: a long transfer is
// one rsync run, and the poll is the only place the run gets control during
// it. The beacon hook is per thread too and never entered twice at once (a
// beacon's own rsync run polls the checker as well).
#ifndef S2S_SERVICE_CANCEL_H_
#define S2S_SERVICE_CANCEL_H_

#include <atomic>
#include <functional>

namespace s2s_service {

// One run's cancel request. Set() is safe from any thread and from a
// signal handler.
class CancelFlag {
 public:
  void Set() { on_.store(true); }
  void Clear() { on_.store(false); }
  bool IsSet() const { return on_.load(); }

 private:
  static_assert(std::atomic<bool>::is_always_lock_free,
                "a signal handler sets the flag");
  std::atomic<bool> on_{false};
};

// Binds `flag` to the calling thread (null: nothing cancels the thread's
// runs). The flag must outlive the binding.
void BindCancelFlag(const CancelFlag* flag);
// The flag bound to the calling thread, or null: for the threads a run
// starts to bind the run's flag too.
const CancelFlag* BoundCancelFlag();
// Whether the flag bound to the calling thread is set.
bool CancelRequested();

// The Rsyncer's cancel checker: true once the thread's flag is set. While
// not cancelled, runs the thread's beacon hook when its interval has passed
// since the last beacon.
bool CancelChecker();

// Installs `hook` (empty to remove) for the calling thread, to run at most
// every `interval_s` seconds from CancelChecker; the clock starts now.
void SetBeaconHook(std::function<void()> hook, unsigned int interval_s);
// Whether the calling thread has a beacon hook whose interval has passed
// since its last beacon: for a beacon between rsync runs.
bool BeaconDue();
// Restarts the calling thread's beacon clock (after a beacon sent outside
// the poll).
void BeaconSent();

}  // namespace s2s_service

#endif  // S2S_SERVICE_CANCEL_H_
