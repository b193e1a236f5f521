#include "service/task_runner.h"

#include <stdio.h>
#include <sys/stat.h>
#include <time.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <thread>

#include "S2S/rsyncer.h"
#include "S2S/s2s_share.h"
#include "karo/rsync_wrapper.h"
#include "service/cancel.h"
#include "service/exit_codes.h"
#include "service/share_transfer.h"

namespace s2s_service {

namespace {

const int kAlreadyPaired = 207;
const int kConflictStatus = 214;
const int kServiceDisabled = 244;
const int kPairedElsewhere = 245;
const int kNotSyncing = 246;
const int kNotPaired = 247;

// Answers that a session from an earlier run may have caused: the service
// switched off, the server bound to another client or to none, the share's
// running sync gone; or the address the probe found refusing or not
// answering.
bool Stale(int status) {
  switch (status) {
    case 5:
    case 10:
    case 30:
    case 35:
    case kServiceDisabled:
    case kPairedElsewhere:
    case kNotSyncing:
    case kNotPaired:
      return true;
    default:
      return false;
  }
}

double Now() {
  timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<double>(ts.tv_sec) + ts.tv_nsec / 1e9;
}

std::string Join(const std::list<std::string>& items) {
  std::string out;
  for (const std::string& s : items) out += (out.empty() ? "" : ", ") + s;
  return out;
}

std::string Format(const char* format, double value) {
  char buf[64];
  snprintf(buf, sizeof buf, format, value);
  return buf;
}

// One task's run: the Rsyncers and the outcome that the steps fill in.
class Run {
 public:
  Run(const S2S::SyncTask& task, const std::list<std::string>& excludes,
      const Reporter& report, const ProgressReporter& progress,
      const RunOptions& options, Session* session)
      : task_(task),
        excludes_(excludes),
        // The shares' threads report through one lock.
        report_([this, &report](const std::string& line) {
          std::lock_guard<std::mutex> lock(report_mu_);
          report(line);
        }),
        progress_(progress),
        options_(options),
        session_(session != nullptr ? session : &own_session_) {
    out_.dry_run = options.dry_run;
  }

  void Go(unsigned int beacon_interval);
  TaskOutcome& outcome() { return out_; }

 private:
  // A thread's Rsyncer and the session generation it was resumed from.
  struct Worker {
    S2S::Rsyncer rsyncer;
    int generation = -1;
  };

  bool Connect();
  bool ProbeAndPair(S2S::Rsyncer& r);
  bool Probe(S2S::Rsyncer& r);
  bool Pair(S2S::Rsyncer& r);
  bool Renew(const ShareOutcome& share, Worker& w);
  void Refresh(Worker& w);
  void Beacon(const char* when);
  void SyncShares();
  void Work(Worker& w, bool beacons);
  ShareOutcome SyncShare(const std::string& share, S2S::Rsyncer& r);
  PushResult Push(S2S::Rsyncer& r, ShareOutcome& share);
  void DryRun();
  bool ShareStep(ShareOutcome& share, const char* step, int rc, int status);
  // False, with the share failed at "start", when its directory is gone.
  bool ShareThere(ShareOutcome& share, S2S::Rsyncer& r);
  void FinishTask();
  // The exit code and error from the shares' outcomes.
  void Outcome();
  bool Stop(int code, const std::string& error);

  const S2S::SyncTask& task_;
  const std::list<std::string>& excludes_;
  std::mutex report_mu_;
  const Reporter report_;
  const ProgressReporter& progress_;
  const RunOptions& options_;
  Session own_session_;
  Session* session_;
  // The calling thread's: probe and pairing, beacons, the task's end.
  S2S::Rsyncer rsyncer_;
  // Guards the session, the generation, reused_, lost_ and out_'s probe
  // fields while the shares' threads run.
  std::mutex mu_;
  int generation_ = 0;   // bumped by each new probe and pairing
  bool reused_ = false;  // the session came from an earlier run, unproven
  bool lost_ = false;    // probing or pairing again failed
  // The task's shares, the next one to take, and their outcomes by place
  // (an outcome without a name: the share was not taken).
  std::vector<std::string> shares_;
  size_t next_ = 0;
  std::vector<ShareOutcome> done_;
  std::condition_variable idle_;  // a share's thread has ended
  size_t threads_ = 0;
  TaskOutcome out_;
};

bool Run::Stop(int code, const std::string& error) {
  if (CancelRequested()) {
    out_.exit_code = kExitCancelled;
    out_.error = "cancelled";
  } else {
    out_.exit_code = code;
    out_.error = error;
  }
  report_("error: " + out_.error);
  return false;
}

bool Run::Connect() {
  if (!session_->valid) return ProbeAndPair(rsyncer_);
  rsyncer_.Resume(session_->probed, session_->server_version);
  reused_ = true;
  out_.server_ip = session_->probed.GetServerIP();
  out_.server_version = session_->server_version;
  report_("session: " + out_.server_ip + ", protocol version " +
          std::to_string(out_.server_version) + ", probed and paired " +
          Format("%.0f s ago", SessionClock() - session_->made));
  return true;
}

bool Run::ProbeAndPair(S2S::Rsyncer& r) {
  // A version held would survive a probe whose every address fails.
  r.Resume(S2S::SyncInfo(), -1);
  session_->valid = false;
  if (!Probe(r) || !Pair(r)) return false;
  session_->valid = true;
  session_->probed = r.GetSyncInfo();
  session_->server_version = r.GetServerVersionValue();
  session_->made = SessionClock();
  ++generation_;
  return true;
}

// REQUIRES: mu_ held.
void Run::Refresh(Worker& w) {
  if (w.generation == generation_) return;
  w.rsyncer.Resume(session_->probed, session_->server_version);
  w.generation = generation_;
}

// A share that failed on a session from an earlier run, with an answer that
// session may have caused, gets a new probe and pairing at once; once per
// run. A share that failed on a session another share's thread has renewed
// since is made again on the new one. True when the share's steps may be
// made again.
bool Run::Renew(const ShareOutcome& share, Worker& w) {
  if (share.ok || !Stale(share.status)) return false;
  std::lock_guard<std::mutex> lock(mu_);
  if (w.generation != generation_) {
    if (lost_ || !session_->valid) return false;
    Refresh(w);
    return !CancelRequested();
  }
  // Whatever comes of it, the next run starts afresh.
  session_->valid = false;
  if (!reused_ || CancelRequested()) return false;
  reused_ = false;
  report_("session: probing and pairing again after " + share.cause);
  if (ProbeAndPair(w.rsyncer)) {
    w.generation = generation_;
    return true;
  }
  lost_ = true;
  return false;
}

bool Run::Probe(S2S::Rsyncer& r) {
  const S2S::SyncInfo& info = task_.GetInfo().GetSyncInfo();
  std::string target =
      info.GetServerIP().empty() ? info.GetServerName() : info.GetServerIP();
  report_("probe: " + target);
  int rc = r.Initialize(info);
  out_.server_ip = r.GetSyncInfo().GetServerIP();
  out_.server_version = r.GetServerVersionValue();
  if (rc == kServiceDisabled || rc == kPairedElsewhere) {
    return Stop(kExitPairing, "server refused this client: " + FailureText(rc));
  }
  if (rc != 0 || out_.server_version < 0) {
    return Stop(kExitUnreachable, "server " + target + " unreachable: " +
                                      FailureText(rc != 0 ? rc : 251));
  }
  report_("probe: " + out_.server_ip + " answers, protocol version " +
          std::to_string(out_.server_version));
  return true;
}

bool Run::Pair(S2S::Rsyncer& r) {
  const std::list<std::string>& shares = task_.GetInfo().GetShareList();
  int status = 0;
  int rc = r.DoPairing(options_.dry_run, shares, out_.conflicts, status);
  // A dry run's question to an old server: this client is the paired one.
  if (options_.dry_run && status == kAlreadyPaired) status = 0;
  // 214 is the server's answer that some shares conflict; the list says
  // which.
  if (rc == 0 && status == kConflictStatus && !out_.conflicts.empty()) {
    return Stop(kExitPairing,
                "shares fed by another client: " + Join(out_.conflicts));
  }
  if (rc != 0 || status != 0) {
    return Stop(kExitPairing, "pairing refused: " + FailureText(status));
  }
  report_("pair: " + Join(shares) +
          (r.SupportMultiSource() ? "" : " (single-client server)") +
          (options_.dry_run ? " (dry run: nothing recorded)" : ""));
  return true;
}

// Only the calling thread sends beacons, with its own Rsyncer.
void Run::Beacon(const char* when) {
  int status = 0;
  if (rsyncer_.SendBeacon(task_.GetInfo().GetName(), status) == 0 &&
      status == 0) {
    ++out_.beacons;
    report_(std::string("beacon: ") + when);
  } else if (!CancelRequested()) {
    report_("beacon: not taken: " + FailureText(status));
  }
  BeaconSent();
}

bool Run::ShareStep(ShareOutcome& share, const char* step, int rc, int status) {
  if (rc == 0 && status == 0) return true;
  share.failed_step = step;
  share.status = rc != 0 && status == 0 ? rc : status;
  // -1: nothing ran, so no reason of rsync's belongs to it.
  share.cause = rc == -1 && status == 0 ? StatusText(share.status)
                                        : FailureText(share.status);
  report_("share " + share.name + ": " + step + " failed: " + share.cause);
  return false;
}

bool Run::ShareThere(ShareOutcome& share, S2S::Rsyncer& r) {
  // rsync would send nothing from a missing directory and call that done;
  // an unmounted volume is no share synced.
  S2S::ShareInfo info;
  struct stat st;
  if (r.GetShareInfo(share.name, info) != 0 ||
      (stat(info.GetModulePath().c_str(), &st) == 0 && S_ISDIR(st.st_mode))) {
    return true;
  }
  share.failed_step = "start";
  share.status = -1;
  share.cause = "its directory " + info.GetModulePath() +
                " is not there (deleted, moved or unmounted)";
  report_("share " + share.name + ": start failed: " + share.cause);
  return false;
}

PushResult Run::Push(S2S::Rsyncer& r, ShareOutcome& share) {
  const std::string& name = share.name;
  return PushShare(
      r, task_.GetID(), excludes_, options_,
      [this, &name](const KARO::Backup::RsyncWrapper::TransferProgress& p) {
        if (!progress_) return;
        std::lock_guard<std::mutex> lock(report_mu_);
        progress_(name, p);
      },
      share);
}

ShareOutcome Run::SyncShare(const std::string& name, S2S::Rsyncer& r) {
  ShareOutcome share;
  share.name = name;
  if (!ShareThere(share, r)) return share;
  int status = 0;
  int rc = r.StartSyncShare(name, status);
  if (ShareStep(share, "start", rc, status)) {
    report_("share " + name + ": started");
    PushResult push = Push(r, share);
    if (!push.held.empty()) {
      share.failed_step = "guard";
      share.status = push.status;
      share.cause = push.held;
      report_("share " + name + ": " + push.held);
    } else if (ShareStep(share, "transfer", push.rc, push.status)) {
      report_("share " + name + ": transferred in " +
              Format("%.2f s", share.seconds));
      S2S::ShareInfo info;
      bool key_ok = true;
      if (r.GetShareInfo(name, info) == 0 && info.IsEncrypted()) {
        rc = r.SyncEncryptKey(name);
        key_ok = ShareStep(share, "key", rc, 0);
        if (key_ok) report_("share " + name + ": key file copied");
      }
      if (key_ok) {
        status = 0;
        rc = r.FinishSync("share", name, status);
        share.ok = ShareStep(share, "finish", rc, status);
        if (share.ok) report_("share " + name + ": finished");
      }
    }
  }
  return share;
}

void Run::DryRun() {
  for (const std::string& name : task_.GetInfo().GetShareList()) {
    if (CancelRequested()) break;
    ShareOutcome share;
    share.name = name;
    if (!ShareThere(share, rsyncer_)) {
      out_.shares.push_back(share);
      continue;
    }
    PushResult push = Push(rsyncer_, share);
    share.ok = ShareStep(share, "transfer", push.rc, push.status);
    if (share.ok) {
      report_("share " + name + ": " + DryRunSummary(share, options_.guard));
    }
    out_.shares.push_back(share);
  }
}

// Takes the task's shares one by one until none is left, the run is
// cancelled or its session is lost. `beacons`: the calling thread's, which
// sends a beacon between shares once the interval has passed.
void Run::Work(Worker& w, bool beacons) {
  w.rsyncer.SetCancelChecker(CancelChecker);
  for (;;) {
    size_t i;
    {
      std::lock_guard<std::mutex> lock(mu_);
      if (next_ == shares_.size() || lost_ || CancelRequested()) return;
      i = next_++;
      Refresh(w);
    }
    if (beacons && BeaconDue()) Beacon("next share");
    ShareOutcome share = SyncShare(shares_[i], w.rsyncer);
    if (Renew(share, w)) share = SyncShare(shares_[i], w.rsyncer);
    std::lock_guard<std::mutex> lock(mu_);
    done_[i] = share;
  }
}

void Run::SyncShares() {
  const std::list<std::string>& list = task_.GetInfo().GetShareList();
  shares_.assign(list.begin(), list.end());
  done_.assign(shares_.size(), ShareOutcome());
  // Besides the calling thread.
  threads_ = std::min<size_t>(options_.share_parallel, shares_.size());
  threads_ = threads_ > 0 ? threads_ - 1 : 0;
  const CancelFlag* flag = BoundCancelFlag();
  std::vector<Worker> workers(threads_);
  std::vector<std::thread> threads;
  for (Worker& w : workers) {
    threads.emplace_back([this, &w, flag] {
      BindCancelFlag(flag);
      Work(w, false);
      std::lock_guard<std::mutex> lock(mu_);
      --threads_;
      idle_.notify_all();
    });
  }
  Worker mine;
  Work(mine, true);
  // The other threads' last shares: beacons go on while they last.
  {
    std::unique_lock<std::mutex> lock(mu_);
    while (threads_ > 0) {
      idle_.wait_for(lock, std::chrono::seconds(1));
      if (threads_ == 0 || !BeaconDue()) continue;
      lock.unlock();
      Beacon("shares running");
      lock.lock();
    }
  }
  for (std::thread& t : threads) t.join();
  for (size_t i = 0; i < shares_.size(); ++i) {
    if (!done_[i].name.empty()) out_.shares.push_back(done_[i]);
  }
}

void Run::FinishTask() {
  // A cancelled task still tells the server it is idle again: without the
  // checker, so that this last command is not cancelled as well.
  rsyncer_.SetCancelChecker(nullptr);
  int status = 0;
  const std::string& name = task_.GetInfo().GetName();
  if (session_->valid) {
    rsyncer_.Resume(session_->probed, session_->server_version);
  }
  int rc = rsyncer_.FinishSync("task", name, status);
  if (rc == 0 && Stale(status)) session_->valid = false;
  if (rc == 0 && status == 0) {
    report_("task " + name + ": finished");
  } else {
    report_("task " + name +
            ": end not recorded: " + FailureText(status != 0 ? status : rc));
    if (out_.exit_code == kExitOk) {
      out_.exit_code = kExitShare;
      out_.error = "the server did not record the end of the task";
    }
  }
}

void Run::Go(unsigned int beacon_interval) {
  double t0 = Now();
  rsyncer_.SetCancelChecker(CancelChecker);
  if (options_.dry_run) {
    // A dry run asks its own questions and leaves any session alone.
    if (Probe(rsyncer_) && Pair(rsyncer_)) {
      DryRun();
      Outcome();
    }
  } else if (Connect()) {
    SetBeaconHook([this] { Beacon("transfer running"); }, beacon_interval);
    SyncShares();
    SetBeaconHook(nullptr, 0);
    // A run whose second probe or pairing failed has stopped already.
    if (!lost_) {
      Outcome();
      FinishTask();
    }
  }
  out_.seconds = Now() - t0;
}

void Run::Outcome() {
  size_t failed = 0;
  std::string held;
  for (const ShareOutcome& s : out_.shares) {
    if (s.failed_step == "guard") {
      held += (held.empty() ? "share " : "; share ") + s.name + ": " + s.cause;
    } else if (!s.ok) {
      ++failed;
    }
  }
  if (CancelRequested()) {
    out_.exit_code = kExitCancelled;
    out_.error = "cancelled";
    report_("error: cancelled");
  } else if (failed > 0) {
    out_.exit_code = kExitShare;
    out_.error = std::to_string(failed) + " of " +
                 std::to_string(task_.GetInfo().GetShareList().size()) +
                 " shares failed";
  } else if (!held.empty()) {
    out_.exit_code = kExitDeletions;
    out_.error = held;
  }
}

}  // namespace

TaskOutcome RunTask(const S2S::SyncTask& task,
                    const std::list<std::string>& excludes,
                    unsigned int beacon_interval, const Reporter& report,
                    const ProgressReporter& progress, const RunOptions& options,
                    Session* session) {
  Run run(task, excludes, report, progress, options, session);
  run.Go(beacon_interval);
  return run.outcome();
}

}  // namespace s2s_service
