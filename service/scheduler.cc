#include "service/scheduler.h"

#include <algorithm>

namespace s2s_service {

long Scheduler::DueOf(const Entry& e) {
  long next = e.enabled && e.next > 0 ? e.next : 0;
  if (e.retry > 0 && (next == 0 || e.retry < next)) return e.retry;
  return next;
}

void Scheduler::Push(unsigned long long id, Entry& e) {
  ++e.generation;
  long due = DueOf(e);
  if (due > 0) heap_.push(Item{due, id, e.generation});
}

void Scheduler::Compute(Entry& e, long now) {
  // A realtime schedule is "due" every second; it is run when asked.
  bool timed = e.enabled && e.schedule.GetMode() != S2S::SCHD_REALTIME;
  e.next = timed ? e.schedule.GetNextScheduledSeconds(now) : 0;
}

void Scheduler::Set(unsigned long long id, const S2S::Schedule& schedule,
                    bool enabled, long now) {
  Entry& e = entries_[id];
  e.schedule = schedule;
  e.enabled = enabled;
  e.retry = 0;
  e.delay = 0;
  Compute(e, now);
  Push(id, e);
}

void Scheduler::Remove(unsigned long long id) { entries_.erase(id); }

void Scheduler::RecomputeAll(long now) {
  heap_ = decltype(heap_)();
  for (auto& it : entries_) {
    Compute(it.second, now);
    Push(it.first, it.second);
  }
}

long Scheduler::Next(unsigned long long id) const {
  auto it = entries_.find(id);
  return it == entries_.end() ? 0 : it->second.next;
}

long Scheduler::NextDue(unsigned long long id) const {
  auto it = entries_.find(id);
  return it == entries_.end() ? 0 : DueOf(it->second);
}

long Scheduler::Earliest() {
  while (!heap_.empty()) {
    const Item& top = heap_.top();
    auto it = entries_.find(top.id);
    if (it != entries_.end() && it->second.generation == top.generation) {
      return top.due;
    }
    heap_.pop();
  }
  return 0;
}

std::vector<Scheduler::Due> Scheduler::TakeDue(long now) {
  std::vector<Due> due;
  for (long at = Earliest(); at > 0 && at <= now; at = Earliest()) {
    Item top = heap_.top();
    heap_.pop();
    Entry& e = entries_[top.id];
    bool retry = e.retry > 0 && e.retry == top.due;
    due.push_back(Due{top.id, top.due, retry});
    if (retry) {
      e.retry = 0;
    } else {
      Compute(e, now);
    }
    Push(top.id, e);
  }
  return due;
}

long Scheduler::ScheduleRetry(unsigned long long id, long now) {
  auto it = entries_.find(id);
  if (it == entries_.end()) return 0;
  Entry& e = it->second;
  e.delay = e.delay == 0 ? kFirstRetry : std::min(e.delay * 2, kMaxRetry);
  long at = now + e.delay;
  if (!e.enabled || e.next <= 0 || at >= e.next) {
    e.retry = 0;
    e.delay = 0;
    Push(id, e);
    return 0;
  }
  e.retry = at;
  Push(id, e);
  return at;
}

void Scheduler::ResetRetry(unsigned long long id) {
  auto it = entries_.find(id);
  if (it != entries_.end()) it->second.delay = 0;
}

void Scheduler::CancelRetry(unsigned long long id) {
  auto it = entries_.find(id);
  if (it == entries_.end() || it->second.retry == 0) return;
  it->second.retry = 0;
  it->second.delay = 0;
  Push(id, it->second);
}

bool Scheduler::RetryPending(unsigned long long id) const {
  auto it = entries_.find(id);
  return it != entries_.end() && it->second.retry > 0;
}

std::vector<std::pair<long, unsigned long long>> Scheduler::Upcoming(
    size_t limit) const {
  std::vector<std::pair<long, unsigned long long>> out;
  for (const auto& it : entries_) {
    long due = DueOf(it.second);
    if (due > 0) out.emplace_back(due, it.first);
  }
  size_t n = std::min(limit, out.size());
  std::partial_sort(out.begin(), out.begin() + n, out.end());
  out.resize(n);
  return out;
}

}  // namespace s2s_service
