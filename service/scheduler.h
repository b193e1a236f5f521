// When each task runs next: its schedule's next time, or a retry after a
// failed run, whichever comes first.
//
// Times are wall-clock seconds passed in by the caller (the clock seam): the
// scheduler reads no clock itself. Due times sit in a min-heap; an entry
// that changed leaves a stale heap item behind, which is dropped when it
// reaches the top, so every change is O(log n) and Earliest() is what the
// service arms its one timer with.
//
// A schedule that has no next time gives 0 (manual, a once schedule that
// is over, and realtime, which would be due every second) and is never due; -1
// (the local-time arithmetic failed) is kept as the task's schedule error.
// Retries back off 1, 2, 4 ... minutes up to 30 and are dropped when they would
// come after the next scheduled run.
//
// Thread-safety: none; the service's loop owns it.
#ifndef S2S_SERVICE_SCHEDULER_H_
#define S2S_SERVICE_SCHEDULER_H_

#include <map>
#include <queue>
#include <string>
#include <vector>

#include "S2S/sync_obj_schedule.h"

namespace s2s_service {

class Scheduler {
 public:
  struct Due {
    unsigned long long id;
    long slot;   // the scheduled time that came due (the retry's time)
    bool retry;  // a retry, not a scheduled run
  };

  // Adds or replaces the task's schedule; a disabled task is never due.
  // Its next time is computed from `now`; a pending retry is dropped.
  void Set(unsigned long long id, const S2S::Schedule& schedule, bool enabled,
           long now);
  void Remove(unsigned long long id);
  // Recomputes every next time from `now` (the wall clock jumped).
  void RecomputeAll(long now);

  // The next scheduled time of a task: 0 none, -1 schedule error.
  long Next(unsigned long long id) const;
  // The next time the task is due, retries included; 0 none.
  long NextDue(unsigned long long id) const;
  // The earliest due time of all tasks; 0 when none is due ever.
  long Earliest();
  // Takes every task due at `now`; each one's next time is computed from
  // `now`, so a task is due once however many slots passed.
  std::vector<Due> TakeDue(long now);

  // After a failed run at `now`: schedules a retry with the next delay of
  // the task's backoff unless the next scheduled run comes first. Returns
  // the retry's time, or 0 when none.
  long ScheduleRetry(unsigned long long id, long now);
  // After a run that did not fail: the backoff starts again.
  void ResetRetry(unsigned long long id);
  // Drops a pending retry (the run was cancelled).
  void CancelRetry(unsigned long long id);
  bool RetryPending(unsigned long long id) const;

  // Enabled tasks with a next time, earliest first (at most `limit`).
  std::vector<std::pair<long, unsigned long long>> Upcoming(size_t limit) const;

  static constexpr long kFirstRetry = 60;
  static constexpr long kMaxRetry = 1800;

 private:
  struct Entry {
    S2S::Schedule schedule;
    bool enabled = false;
    long next = 0;   // next scheduled time; 0 none, -1 error
    long retry = 0;  // pending retry's time; 0 none
    long delay = 0;  // the last retry's delay
    unsigned long generation = 0;
  };
  struct Item {
    long due;
    unsigned long long id;
    unsigned long generation;
    bool operator>(const Item& o) const {
      return due != o.due ? due > o.due : id > o.id;
    }
  };
  static long DueOf(const Entry& e);
  void Push(unsigned long long id, Entry& e);
  void Compute(Entry& e, long now);

  std::map<unsigned long long, Entry> entries_;
  std::priority_queue<Item, std::vector<Item>, std::greater<Item>> heap_;
};

}  // namespace s2s_service

#endif  // S2S_SERVICE_SCHEDULER_H_
