#include "service/session.h"

#include "service/clock.h"

namespace s2s_service {

double SessionClock() { return SystemClock().MonotonicSeconds(); }

Session SessionCache::Get(const S2S::SyncTask& task, double now) const {
  std::lock_guard<std::mutex> lock(mu_);
  auto it = entries_.find(task.GetID());
  if (it == entries_.end()) return Session();
  const Entry& e = it->second;
  const S2S::TaskInfo& info = task.GetInfo();
  bool same =
      e.settings == info.GetSyncInfo() && e.shares == info.GetShareList();
  // A clock that went backwards gives no trust either.
  double age = now - e.session.made;
  if (!same || age < 0 || age >= max_age_) return Session();
  return e.session;
}

void SessionCache::Put(const S2S::SyncTask& task, const Session& session) {
  std::lock_guard<std::mutex> lock(mu_);
  if (!session.valid) {
    entries_.erase(task.GetID());
    return;
  }
  Entry& e = entries_[task.GetID()];
  e.settings = task.GetInfo().GetSyncInfo();
  e.shares = task.GetInfo().GetShareList();
  e.session = session;
}

void SessionCache::Drop(unsigned long long id) {
  std::lock_guard<std::mutex> lock(mu_);
  entries_.erase(id);
}

}  // namespace s2s_service
