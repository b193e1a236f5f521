#include "service/realtime_session.h"

#include <errno.h>
#include <sys/stat.h>
#include <time.h>

#include <map>
#include <set>

#include "S2S/logger.h"
#include "S2S/s2s_lock.h"
#include "S2S/s2s_share.h"
#include "service/batcher.h"
#include "service/config.h"
#include "service/share_transfer.h"

namespace s2s_service {

namespace {

// How long a probe and a pairing are trusted.
const double kFresh = 600;
const int kConflictStatus = 214;
// rsync: files vanished while it ran. Their going is an event of its own.
const int kVanished = 24;

double Now() {
  timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<double>(ts.tv_sec) + ts.tv_nsec / 1e9;
}

bool Inside(const std::string& path, const std::string& dir) {
  return dir == "/" || path == dir ||
         (path.size() > dir.size() && path[dir.size()] == '/' &&
          path.compare(0, dir.size(), dir) == 0);
}

// `path`, or the nearest directory above it that is still there.
std::string Existing(const std::string& root, std::string path) {
  struct stat st;
  while (path != "/" && lstat((root + path).c_str(), &st) != 0 &&
         (errno == ENOENT || errno == ENOTDIR)) {
    path = ParentOf(path);
  }
  return path;
}

void AddStats(KARO::Backup::RsyncWrapper::TransferStats& sum,
              const KARO::Backup::RsyncWrapper::TransferStats& s) {
  sum.complete = sum.complete || s.complete;
  sum.files_transferred += s.files_transferred;
  sum.files_deleted += s.files_deleted;
  sum.literal_bytes += s.literal_bytes;
  sum.matched_bytes += s.matched_bytes;
  sum.bytes_sent += s.bytes_sent;
}

}  // namespace

RealtimeSession::RealtimeSession(unsigned long long id, const StoredTask& task,
                                 unsigned int beacon_interval, Done done)
    : id_(id),
      task_(task),
      beacon_interval_(beacon_interval),
      done_(std::move(done)) {
  thread_ = std::thread([this] { Main(); });
}

RealtimeSession::~RealtimeSession() {
  Stop();
  Join();
}

void RealtimeSession::Push(std::vector<S2S::Event> batch, bool confirmed) {
  std::lock_guard<std::mutex> lock(mu_);
  batch_ = std::move(batch);
  confirmed_ = confirmed;
  has_batch_ = true;
  wake_.notify_all();
}

bool RealtimeSession::TakeResult(BatchResult& result) {
  std::lock_guard<std::mutex> lock(mu_);
  if (!has_result_) return false;
  result = std::move(result_);
  has_result_ = false;
  return true;
}

void RealtimeSession::Cancel() {
  std::lock_guard<std::mutex> lock(mu_);
  if (has_batch_) cancel_.Set();
}

void RealtimeSession::Stop() {
  std::lock_guard<std::mutex> lock(mu_);
  stop_ = true;
  cancel_.Set();
  wake_.notify_all();
}

bool RealtimeSession::Ended() const {
  std::lock_guard<std::mutex> lock(mu_);
  return ended_;
}

void RealtimeSession::Join() {
  if (thread_.joinable()) thread_.join();
}

bool RealtimeSession::Connect(std::string& error) {
  if (connected_at_ >= 0 && Now() - connected_at_ < kFresh) return true;
  connected_at_ = -1;
  rsyncer_.reset(new S2S::Rsyncer());
  rsyncer_->SetCancelChecker(CancelChecker);
  const S2S::SyncInfo& info = task_.task.GetInfo().GetSyncInfo();
  int rc = rsyncer_->Initialize(info);
  if (rc != 0 || rsyncer_->GetServerVersionValue() < 0) {
    error = "server unreachable: " + FailureText(rc != 0 ? rc : 251);
    return false;
  }
  std::list<std::string> conflicts;
  int status = 0;
  rc = rsyncer_->DoPairing(false, task_.task.GetInfo().GetShareList(),
                           conflicts, status);
  if (rc == 0 && status == kConflictStatus && !conflicts.empty()) {
    error = "shares fed by another client: " + conflicts.front();
    return false;
  }
  if (rc != 0 || status != 0) {
    error = "pairing refused: " + FailureText(status);
    return false;
  }
  connected_at_ = Now();
  Beacon("watching");
  return true;
}

void RealtimeSession::Beacon(const char* when) {
  int status = 0;
  last_contact_ = Now();
  if (rsyncer_->SendBeacon(task_.task.GetInfo().GetName(), status) != 0 ||
      status != 0) {
    if (CancelRequested()) return;
    S2S::Logger::LogMsg(S2S::Logger::Info,
                        "[INFO] task %llu: beacon (%s) not taken: %s\n", id_,
                        when, FailureText(status).c_str());
    connected_at_ = -1;  // probe again before the next batch
  }
  BeaconSent();
}

bool RealtimeSession::PushPath(const std::string& name, const std::string& path,
                               bool confirmed, ShareOutcome& share,
                               BatchResult& r) {
  using KARO::Backup::RsyncWrapper;
  RsyncWrapper::TransferMode mode;
  mode.max_delete = task_.guard.on && !confirmed ? 0 : -1;
  RsyncWrapper::TransferStats stats;
  for (;;) {
    RsyncWrapper::setThreadProgressHandler(
        [](const RsyncWrapper::TransferProgress&) {});
    RsyncWrapper::setThreadTransferMode(mode);
    int status = 0;
    int rc = rsyncer_->RunSync(id_, name, path, task_.excludes, status);
    // Read before the handler goes: clearing it clears the figures too.
    stats = RsyncWrapper::lastStats();
    RsyncWrapper::setThreadTransferMode(RsyncWrapper::TransferMode());
    RsyncWrapper::setThreadProgressHandler({});
    AddStats(share.stats, stats);
    ++r.runs;
    if (rc != 0 || (status != 0 && status != kVanished)) {
      share.failed_step = "transfer";
      share.status = status != 0 ? status : rc;
      share.cause = FailureText(share.status);
      return false;
    }
    unsigned long long held = stats.deletions_skipped;
    if (mode.max_delete != 0 || held == 0) break;
    unsigned long long entries = EntriesBefore(stats, held);
    if (path != "/") entries = std::max(entries, entries_[name]);
    std::string refusal = GuardRefusal(task_.guard, held, entries);
    if (!refusal.empty()) {
      // The rest went through; the deletions wait for a confirmed run.
      if (share.failed_step.empty()) {
        share.failed_step = "guard";
        share.status = kDeletionsHeld;
        share.cause = path == "/" ? refusal : path + ": " + refusal;
      }
      return true;
    }
    mode.max_delete = -1;
  }
  if (path == "/" && stats.complete) entries_[name] = stats.files;
  return true;
}

void RealtimeSession::PushShare(const std::string& name,
                                const std::vector<S2S::Event>& events,
                                bool confirmed, BatchResult& r) {
  ShareOutcome share;
  share.name = name;
  auto keep = [&](size_t from) {
    r.unpushed.insert(r.unpushed.end(), events.begin() + from, events.end());
  };
  int status = 0;
  int rc = rsyncer_->StartSyncShare(name, status);
  S2S::ShareInfo info;
  if (rc != 0 || status != 0 || rsyncer_->GetShareInfo(name, info) != 0) {
    share.failed_step = "start";
    share.status = status != 0 ? status : rc;
    share.cause = FailureText(share.status);
    r.shares.push_back(share);
    keep(0);
    return;
  }
  double t0 = Now();
  std::vector<std::string> pushed;
  for (size_t i = 0; i < events.size(); ++i) {
    if (CancelRequested()) {
      keep(i);
      break;
    }
    std::string path =
        Existing(info.GetModulePath(), events[i].GetRelativePath());
    bool covered = false;
    for (const std::string& p : pushed) covered = covered || Inside(path, p);
    if (!covered) {
      if (!PushPath(name, path, confirmed, share, r)) {
        keep(i);
        break;
      }
      pushed.push_back(path);
    }
    ++r.pushed;
  }
  share.seconds = Now() - t0;
  bool held = share.failed_step == "guard";
  if ((share.failed_step.empty() || held) && info.IsEncrypted()) {
    rc = rsyncer_->SyncEncryptKey(name);
    if (rc != 0) {
      share.failed_step = "key";
      share.status = rc;
      share.cause = FailureText(rc);
      held = false;
    }
  }
  // The share's end is reported even after a failure, so that the server
  // does not hold its sync as running.
  status = 0;
  rc = rsyncer_->FinishSync("share", name, status);
  if ((share.failed_step.empty() || held) && (rc != 0 || status != 0)) {
    share.failed_step = "finish";
    share.status = status != 0 ? status : rc;
    share.cause = FailureText(share.status);
    held = false;
  }
  if (held) {
    r.held +=
        (r.held.empty() ? "share " : "; share ") + name + ": " + share.cause;
  }
  share.ok = share.failed_step.empty();
  r.shares.push_back(share);
}

BatchResult RealtimeSession::RunBatch(const std::vector<S2S::Event>& batch,
                                      bool confirmed) {
  BatchResult r;
  r.started = static_cast<long>(time(nullptr));
  std::map<std::string, std::vector<S2S::Event>> by_share;
  for (const S2S::Event& e : batch) by_share[e.GetShareName()].push_back(e);
  // Kept apart from other processes' syncs of the same shares; in name
  // order, so that two holders never wait for each other.
  std::vector<S2S::SimpleFileLock> locks;
  for (const auto& it : by_share) {
    locks.push_back(S2S::LockFactory(ShareLockPath(it.first)).GetLock());
    if (locks.back().ExLock() != 0) {
      r.error = "cannot lock share " + it.first;
      r.unpushed = batch;
      r.ended = static_cast<long>(time(nullptr));
      return r;
    }
  }
  if (!Connect(r.error)) {
    r.unpushed = batch;
  } else {
    SetBeaconHook([this] { Beacon("transfer running"); }, beacon_interval_);
    for (const auto& it : by_share) {
      PushShare(it.first, it.second, confirmed, r);
    }
    SetBeaconHook(nullptr, 0);
    last_contact_ = Now();
    for (const ShareOutcome& s : r.shares) {
      if (s.ok || s.failed_step == "guard") continue;
      r.error =
          "share " + s.name + ": " + s.failed_step + " failed: " + s.cause;
      connected_at_ = -1;
      break;
    }
  }
  r.cancelled = CancelRequested();
  if (r.cancelled) r.error = "cancelled";
  r.ok = r.error.empty() && r.unpushed.empty();
  r.ended = static_cast<long>(time(nullptr));
  return r;
}

void RealtimeSession::Main() {
  BindCancelFlag(&cancel_);
  std::unique_lock<std::mutex> lock(mu_);
  while (!stop_) {
    if (has_batch_) {
      std::vector<S2S::Event> batch;
      batch.swap(batch_);
      bool confirmed = confirmed_;
      lock.unlock();
      BatchResult r = RunBatch(batch, confirmed);
      lock.lock();
      result_ = std::move(r);
      has_result_ = true;
      has_batch_ = false;
      if (!stop_) cancel_.Clear();
      lock.unlock();
      done_(this, false);
      lock.lock();
      continue;
    }
    if (connected_at_ < 0) {
      wake_.wait(lock);
      continue;
    }
    double due = last_contact_ + beacon_interval_;
    double now = Now();
    if (now < due) {
      wake_.wait_for(lock, std::chrono::duration<double>(due - now));
      continue;
    }
    lock.unlock();
    Beacon("watching");
    lock.lock();
  }
  lock.unlock();
  if (rsyncer_ != nullptr) {
    // Without the checker: this last command must not be cancelled too.
    rsyncer_->SetCancelChecker(nullptr);
    int status = 0;
    rsyncer_->FinishSync("task", task_.task.GetInfo().GetName(), status);
  }
  BindCancelFlag(nullptr);
  lock.lock();
  ended_ = true;
  lock.unlock();
  done_(this, true);
}

}  // namespace s2s_service
