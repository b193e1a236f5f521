// Realtime tasks on the service's loop: a watcher per enabled realtime task,
// and its batches pushed by its session within the limits the scheduled runs
// keep too (a share synced by one task at a time, at most max_parallel
// transfers at once).
#include <errno.h>
#include <math.h>
#include <unistd.h>

#include <algorithm>

#include "S2S/logger.h"
#include "service/daemon.h"
#include "service/exit_codes.h"

namespace s2s_service {

namespace {

using S2S::PObject;

bool IsRealtime(const StoredTask& t) {
  return t.task.GetInfo().GetSchedule().GetMode() == S2S::SCHD_REALTIME;
}

bool SameSettings(const StoredTask& a, const StoredTask& b) {
  return a.task == b.task && a.excludes == b.excludes &&
         a.realtime == b.realtime && a.guard == b.guard;
}

bool HasWhole(const std::vector<S2S::Event>& batch) {
  for (const S2S::Event& e : batch) {
    if (KindOf(e) == kEventWhole) return true;
  }
  return false;
}

}  // namespace

void Daemon::SyncWatchers() {
  std::vector<unsigned long long> stale;
  for (const auto& it : realtime_) {
    auto t = tasks_.find(it.first);
    if (stopping_ || t == tasks_.end() || !t->second.stored.enabled ||
        !IsRealtime(t->second.stored) ||
        !SameSettings(t->second.stored, it.second.watcher->task())) {
      stale.push_back(it.first);
    }
  }
  for (unsigned long long id : stale) StopWatching(id);
  if (stopping_) return;
  for (const auto& it : tasks_) {
    if (it.second.stored.enabled && IsRealtime(it.second.stored) &&
        realtime_.count(it.first) == 0) {
      StartWatching(it.first);
    }
  }
}

void Daemon::StartWatching(unsigned long long id) {
  const StoredTask& task = tasks_[id].stored;
  Realtime& rt = realtime_[id];
  WatchLimits limits;
  limits.queue = config_.watch_queue_limit;
  limits.watches = config_.watch_limit;
  limits.check_every = config_.watch_check_ms / 1000.0;
  rt.watcher.reset(new Watcher(id, task, limits));
  rt.watcher->Start(clock_.MonotonicSeconds());
  rt.session.reset(new RealtimeSession(
      id, task, config_.beacon_interval,
      [this](RealtimeSession* session, bool ended) {
        {
          std::lock_guard<std::mutex> lock(mu_);
          sessions_done_.emplace_back(session, ended);
        }
        uint64_t one = 1;
        while (write(ended_fd_, &one, sizeof one) < 0 && errno == EINTR) {
        }
      }));
}

void Daemon::StopWatching(unsigned long long id) {
  auto it = realtime_.find(id);
  if (it == realtime_.end()) return;
  if (it->second.watcher->InFlight()) {
    PObject map = BatchMap(BatchResult(), HasWhole(it->second.batch));
    map["outcome"] = "cancelled";
    map["message"] = "the task stopped watching";
    std::string error;
    if (!history_.Finish(id, map, error)) {
      S2S::Logger::LogMsg(S2S::Logger::Error, "[ERROR] s2sd: %s\n",
                          error.c_str());
    }
  }
  // Its thread ends on its own (the server may be slow to hear of the
  // task's end); the loop joins it when it says so.
  it->second.session->Stop();
  leaving_.push_back(std::move(it->second.session));
  realtime_.erase(it);
  S2S::Logger::LogMsg(S2S::Logger::Note,
                      "[NOTE] s2sd: task %llu: stopped watching\n", id);
}

void Daemon::WatchFds(std::vector<pollfd>& fds) const {
  for (const auto& it : realtime_) {
    int fd = it.second.watcher->Fd();
    if (fd >= 0) fds.push_back(pollfd{fd, POLLIN, 0});
  }
}

int Daemon::WatchTimeout() const {
  double now = clock_.MonotonicSeconds();
  double earliest = 0;
  for (const auto& it : realtime_) {
    const Watcher& w = *it.second.watcher;
    if (w.Busy()) return 0;
    // A batch that is ready but waits for a slot or a share is started
    // when a run or a batch ends, which wakes the loop anyway.
    double due = w.NextDue(!w.Ready(now));
    if (earliest == 0 || due < earliest) earliest = due;
  }
  if (earliest == 0) return -1;
  double ms = ceil((earliest - now) * 1000);
  return static_cast<int>(std::min(std::max(ms, 0.0), 3600e3));
}

void Daemon::OnWatchers(const pollfd* fds, size_t n) {
  double now = clock_.MonotonicSeconds();
  for (size_t i = 0; i < n; ++i) {
    if (fds[i].revents == 0) continue;
    for (auto& it : realtime_) {
      if (it.second.watcher->Fd() == fds[i].fd) it.second.watcher->Read(now);
    }
  }
  for (auto& it : realtime_) {
    Watcher& w = *it.second.watcher;
    if (w.Busy()) w.Pump(now);
    w.Tick(now);
  }
  StartBatches();
}

size_t Daemon::BatchesInFlight() const {
  size_t n = 0;
  for (const auto& it : realtime_) n += it.second.watcher->InFlight() ? 1 : 0;
  return n;
}

bool Daemon::SharesFree(const std::list<std::string>& shares) const {
  auto busy = [&shares](const std::list<std::string>& other) {
    for (const std::string& s : other) {
      if (std::find(shares.begin(), shares.end(), s) != shares.end()) {
        return true;
      }
    }
    return false;
  };
  for (const auto& it : runs_) {
    if (busy(it.second->task.task.GetInfo().GetShareList())) return false;
  }
  for (const auto& it : realtime_) {
    if (it.second.watcher->InFlight() &&
        busy(it.second.watcher->task().task.GetInfo().GetShareList())) {
      return false;
    }
  }
  return true;
}

void Daemon::StartBatches() {
  double now = clock_.MonotonicSeconds();
  for (auto& it : realtime_) {
    Realtime& rt = it.second;
    if (!rt.watcher->Ready(now) || runs_.count(it.first) != 0) continue;
    if (runs_.size() + BatchesInFlight() >= config_.max_parallel) return;
    if (!SharesFree(rt.watcher->task().task.GetInfo().GetShareList())) {
      continue;
    }
    rt.batch = rt.watcher->Take();
    BatchResult starting;
    starting.started = clock_.WallSeconds();
    PObject map = BatchMap(starting, HasWhole(rt.batch));
    map["outcome"] = "running";
    map["message"] = "pushing " + std::to_string(rt.batch.size()) + " paths";
    std::string error;
    if (!history_.Begin(it.first, map, error)) {
      S2S::Logger::LogMsg(S2S::Logger::Error, "[ERROR] s2sd: %s\n",
                          error.c_str());
    }
    bool confirmed = rt.confirm_full && HasWhole(rt.batch);
    if (confirmed) rt.confirm_full = false;
    rt.session->Push(rt.batch, confirmed);
  }
}

void Daemon::OnSessionDone(RealtimeSession* session, bool ended) {
  if (ended) {
    for (auto it = leaving_.begin(); it != leaving_.end(); ++it) {
      if (it->get() != session) continue;
      (*it)->Join();
      leaving_.erase(it);
      return;
    }
    return;
  }
  for (auto& it : realtime_) {
    Realtime& rt = it.second;
    BatchResult r;
    if (rt.session.get() != session || !rt.session->TakeResult(r)) continue;
    bool whole = HasWhole(rt.batch);
    rt.batch.clear();
    rt.watcher->CountRuns(r.runs);
    rt.watcher->Ended(r.ok, r.pushed, r.unpushed, r.error,
                      clock_.MonotonicSeconds(), clock_.WallSeconds());
    PObject map = BatchMap(r, whole);
    S2S::Logger::LogMsg(S2S::Logger::Info, "[INFO] s2sd: task %llu: %s\n",
                        it.first, map["message"].asString().c_str());
    std::string error;
    if (!history_.Finish(it.first, map, error)) {
      S2S::Logger::LogMsg(S2S::Logger::Error, "[ERROR] s2sd: %s\n",
                          error.c_str());
    }
    return;
  }
}

PObject Daemon::BatchMap(const BatchResult& r, bool whole) const {
  PObject map;
  map = PObject::Map();
  map["start"] = static_cast<unsigned long long>(r.started);
  map["end"] = static_cast<unsigned long long>(r.ended);
  map["trigger"] = whole ? "full sync" : "realtime";
  bool held = r.ok && !r.held.empty();
  map["outcome"] = held          ? "held"
                   : r.ok        ? "ok"
                   : r.cancelled ? "cancelled"
                                 : "failed";
  std::string message = std::to_string(r.pushed) + " paths, " +
                        std::to_string(r.runs) + " rsync runs";
  if (held) message += "; " + r.held;
  if (!r.error.empty()) {
    message += "; " + r.error + "; " + std::to_string(r.unpushed.size()) +
               " paths kept for the next try";
  }
  map["message"] = message;
  map["task_status"] = 1;  // a watching task stays busy on the server
  map["task_result"] = held ? kExitDeletions : r.ok ? 0 : 1;
  map["paths"] = static_cast<unsigned long long>(r.pushed);
  map["runs"] = static_cast<unsigned long long>(r.runs);
  PObject::Array shares;
  for (const ShareOutcome& s : r.shares) shares.push_back(ShareMap(s));
  map["shares"] = shares;
  return map;
}

}  // namespace s2s_service
