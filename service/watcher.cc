#include "service/watcher.h"

#include <sys/stat.h>

#include <algorithm>

#include "S2S/logger.h"
#include "S2S/s2s_share.h"

namespace s2s_service {

namespace {

using S2S::PObject;

// Full syncs while some directories are not watched.
const double kDegradedFull = 300;
const double kMaxBackoff = 60;

BatcherSettings SettingsOf(const RealtimeSettings& rt) {
  BatcherSettings s;
  s.settle = rt.settle_ms / 1000.0;
  s.max_delay = rt.max_delay;
  s.pending_limit = rt.pending_limit;
  return s;
}

unsigned long long Ms(double seconds) {
  return static_cast<unsigned long long>(std::max(0.0, seconds) * 1000 + 0.5);
}

}  // namespace

Watcher::Watcher(unsigned long long id, const StoredTask& task,
                 const WatchLimits& limits)
    : id_(id),
      task_(task),
      limits_(limits),
      batcher_(SettingsOf(task.realtime)) {}

Watcher::~Watcher() = default;

void Watcher::Log(S2S::Logger::Level level, const std::string& text) const {
  const char* tag = level <= S2S::Logger::Warning ? "WARNING" : "NOTE";
  S2S::Logger::LogMsg(level, "[%s] s2sd: task %llu: %s\n", tag, id_,
                      text.c_str());
}

bool Watcher::MakeSource(bool fanotify, std::string& error) {
  source_ = fanotify ? MakeFanotifySource(limits_, error)
                     : MakeInotifySource(limits_, error);
  return source_ != nullptr;
}

void Watcher::Lose(Share& share, const std::string& why) {
  if (share.watching) source_->Remove(share.name);
  share.watching = false;
  if (share.message == why) return;
  share.message = why;
  Log(S2S::Logger::Warning,
      "share " + share.name + ": " + why + "; watching again when it is back");
}

bool Watcher::Watch(Share& share) {
  S2S::ShareInfo info;
  if (S2S::GetShareInfo(share.name, info) != 0) {
    Lose(share, "not a share of this appliance");
    return true;
  }
  share.path = info.GetModulePath();
  struct stat st;
  if (stat(share.path.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
    Lose(share, "its directory " + share.path +
                    " is not there (deleted, moved or unmounted)");
    return true;
  }
  std::string error;
  if (!source_->Add(WatchedShare{share.name, share.path}, error)) {
    Lose(share, error);
    return false;
  }
  if (!share.message.empty()) {
    Log(S2S::Logger::Note, "share " + share.name + ": watched again");
  }
  share.watching = true;
  share.message.clear();
  share.dev = st.st_dev;
  share.ino = st.st_ino;
  return true;
}

bool Watcher::Start(double now) {
  for (const std::string& name : task_.task.GetInfo().GetShareList()) {
    shares_.push_back(Share{name, "", false, "", 0, 0});
  }
  std::string why;
  if (task_.realtime.source != "inotify" && MakeSource(true, why)) {
    for (Share& share : shares_) {
      if (Watch(share)) continue;
      // A file system that cannot be marked: the task watches by
      // directories, all of its shares alike.
      why = share.message;
      source_.reset();
      break;
    }
  }
  if (source_ == nullptr) {
    if (task_.realtime.source != "inotify") source_note_ = why;
    std::string error;
    if (!MakeSource(false, error)) {
      source_note_ = error;
      Log(S2S::Logger::Warning, "cannot watch: " + error);
      return false;
    }
    for (Share& share : shares_) {
      share.message.clear();
      Watch(share);
    }
  }
  Log(S2S::Logger::Note,
      std::string("watching ") + std::to_string(shares_.size()) +
          " shares with " + source_->Name() +
          (source_note_.empty() ? "" : " (fanotify: " + source_note_ + ")"));
  next_check_ = now + limits_.check_every;
  next_full_ = now + FullInterval();
  return true;
}

int Watcher::Fd() const { return source_ ? source_->Fd() : -1; }

bool Watcher::Busy() const { return source_ && source_->Busy(); }

void Watcher::Feed(const std::vector<S2S::Event>& events, double now) {
  for (const S2S::Event& e : events) {
    if (KindOf(e) == kEventLost) {
      for (Share& share : shares_) {
        if (share.name == e.GetShareName()) {
          Lose(share, "its directory " + share.path +
                          " went away (deleted, moved or unmounted)");
        }
      }
      continue;
    }
    if (oldest_ == 0) oldest_ = now;
    batcher_.Add(e, now);
    ++events_;
  }
}

void Watcher::Read(double now) {
  std::vector<S2S::Event> events;
  source_->Read(events);
  Feed(events, now);
}

void Watcher::Pump(double now) {
  std::vector<S2S::Event> events;
  source_->Pump(events);
  Feed(events, now);
}

double Watcher::FullInterval() const {
  double every = task_.realtime.full_sync;
  return problem_.empty() ? every : std::min(every, kDegradedFull);
}

void Watcher::FullSync(double now) {
  std::vector<S2S::Event> whole;
  for (const Share& share : shares_) {
    if (share.watching)
      whole.push_back(MakeEvent(share.name, "/", kEventWhole));
  }
  Feed(whole, now);
  next_full_ = now + FullInterval();
}

void Watcher::Tick(double now) {
  if (source_ == nullptr) return;
  if (now >= next_check_) {
    next_check_ = now + limits_.check_every;
    for (Share& share : shares_) {
      struct stat st;
      if (!share.watching) {
        Watch(share);
      } else if (stat(share.path.c_str(), &st) != 0 || st.st_dev != share.dev ||
                 st.st_ino != share.ino) {
        Lose(share, "its directory " + share.path +
                        " went away (deleted, moved or unmounted)");
      }
    }
  }
  if (source_->problem() != problem_) {
    problem_ = source_->problem();
    Log(S2S::Logger::Warning,
        problem_ + "; a full sync every " +
            std::to_string(static_cast<long>(FullInterval())) +
            " s covers what is not watched");
    next_full_ = std::min(next_full_, now + FullInterval());
  }
  if (now >= next_full_) FullSync(now);
}

double Watcher::NextDue(bool batch) const {
  double due = std::min(next_check_, next_full_);
  if (batch && !in_flight_ && !batcher_.Empty()) {
    due = std::min(due, std::max(batcher_.Due(), retry_at_));
  }
  return due;
}

bool Watcher::Ready(double now) const {
  return !in_flight_ && !batcher_.Empty() && !Busy() && now >= batcher_.Due() &&
         now >= retry_at_;
}

std::vector<S2S::Event> Watcher::Take() {
  std::vector<S2S::Event> batch = batcher_.Take();
  for (const S2S::Event& e : batch) {
    if (KindOf(e) == kEventWhole) ++full_syncs_;
  }
  in_flight_ = true;
  batch_first_ = oldest_;
  oldest_ = 0;
  return batch;
}

void Watcher::Ended(bool ok, size_t pushed,
                    const std::vector<S2S::Event>& unpushed,
                    const std::string& error, double now, long wall) {
  in_flight_ = false;
  paths_ += pushed;
  if (ok) {
    ++batches_;
    last_batch_ = wall;
    last_lag_ = now - batch_first_;
    backoff_ = 0;
    retry_at_ = 0;
    last_error_.clear();
    return;
  }
  ++failures_;
  last_error_ = error;
  if (!unpushed.empty()) {
    batcher_.Restore(unpushed, now);
    if (oldest_ == 0 || batch_first_ < oldest_) oldest_ = batch_first_;
  }
  backoff_ = backoff_ == 0 ? 1 : std::min(backoff_ * 2, kMaxBackoff);
  retry_at_ = now + backoff_;
  Log(S2S::Logger::Warning,
      "batch not pushed: " + error + "; " + std::to_string(batcher_.Pending()) +
          " paths kept, next try in " +
          std::to_string(static_cast<long>(backoff_)) + " s");
}

PObject Watcher::StatusMap(double now) const {
  PObject m;
  m = PObject::Map();
  m["id"] = id_;
  m["name"] = task_.task.GetInfo().GetName();
  m["source"] = source_ ? source_->Name() : "none";
  m["source_note"] = source_note_;
  m["watches"] =
      static_cast<unsigned long long>(source_ ? source_->Watches() : 0);
  m["problem"] = problem_;
  std::string state = in_flight_          ? "pushing"
                      : Busy()            ? "setting up"
                      : retry_at_ > now   ? "retry_wait"
                      : !batcher_.Empty() ? "pending"
                                          : "watching";
  m["state"] = state;
  m["pending"] = static_cast<unsigned long long>(batcher_.Pending());
  m["oldest_pending_ms"] = oldest_ == 0 ? 0ull : Ms(now - oldest_);
  m["last_batch"] = static_cast<unsigned long long>(last_batch_);
  m["last_lag_ms"] = Ms(last_lag_);
  m["events"] = events_;
  m["batches"] = batches_;
  m["paths"] = paths_;
  m["full_syncs"] = full_syncs_;
  m["rsync_runs"] = rsync_runs_;
  m["failures"] = failures_;
  m["overflows"] =
      static_cast<unsigned long long>(source_ ? source_->overflows() : 0);
  m["last_error"] = last_error_;
  PObject::Array shares;
  for (const Share& share : shares_) {
    PObject s;
    s = PObject::Map();
    s["name"] = share.name;
    s["watching"] = share.watching;
    s["message"] = share.message;
    shares.push_back(s);
  }
  m["shares"] = shares;
  return m;
}

}  // namespace s2s_service
