#include "service/task_runner.h"

#include <stdio.h>
#include <time.h>

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

// One task's run: the Rsyncer and the outcome that the steps fill in.
class Run {
 public:
  Run(const S2S::SyncTask& task, const std::list<std::string>& excludes,
      const Reporter& report, const ProgressReporter& progress,
      const RunOptions& options, Session* session)
      : task_(task),
        excludes_(excludes),
        report_(report),
        progress_(progress),
        options_(options),
        session_(session != nullptr ? session : &own_session_) {
    out_.dry_run = options.dry_run;
  }

  void Go(unsigned int beacon_interval);
  TaskOutcome& outcome() { return out_; }

 private:
  bool Connect();
  bool ProbeAndPair();
  bool Probe();
  bool Pair();
  bool Renew(const ShareOutcome& share);
  void Beacon(const char* when);
  void SyncShare(const std::string& share);
  PushResult Push(ShareOutcome& share);
  void DryRun();
  bool ShareStep(ShareOutcome& share, const char* step, int rc, int status);
  void FinishTask();
  // The exit code and error from the shares' outcomes.
  void Outcome();
  bool Stop(int code, const std::string& error);

  const S2S::SyncTask& task_;
  const std::list<std::string>& excludes_;
  const Reporter& report_;
  const ProgressReporter& progress_;
  const RunOptions& options_;
  Session own_session_;
  Session* session_;
  S2S::Rsyncer rsyncer_;
  bool reused_ = false;  // the session came from an earlier run, unproven
  bool lost_ = false;    // probing or pairing again failed
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
  if (!session_->valid) return ProbeAndPair();
  rsyncer_.Resume(session_->probed, session_->server_version);
  reused_ = true;
  out_.server_ip = session_->probed.GetServerIP();
  out_.server_version = session_->server_version;
  report_("session: " + out_.server_ip + ", protocol version " +
          std::to_string(out_.server_version) + ", probed and paired " +
          Format("%.0f s ago", SessionClock() - session_->made));
  return true;
}

bool Run::ProbeAndPair() {
  // A version held would survive a probe whose every address fails.
  rsyncer_.Resume(S2S::SyncInfo(), -1);
  session_->valid = false;
  if (!Probe() || !Pair()) return false;
  session_->valid = true;
  session_->probed = rsyncer_.GetSyncInfo();
  session_->server_version = rsyncer_.GetServerVersionValue();
  session_->made = SessionClock();
  return true;
}

// A share that failed on a session from an earlier run, with an answer that
// session may have caused, gets a new probe and pairing at once; once per
// run. True when the share's steps may be made again.
bool Run::Renew(const ShareOutcome& share) {
  if (share.ok || !Stale(share.status)) return false;
  // Whatever comes of it, the next run starts afresh.
  session_->valid = false;
  if (!reused_ || CancelRequested()) return false;
  reused_ = false;
  report_("session: probing and pairing again after " + share.cause);
  if (ProbeAndPair()) return true;
  lost_ = true;
  return false;
}

bool Run::Probe() {
  const S2S::SyncInfo& info = task_.GetInfo().GetSyncInfo();
  std::string target =
      info.GetServerIP().empty() ? info.GetServerName() : info.GetServerIP();
  report_("probe: " + target);
  int rc = rsyncer_.Initialize(info);
  out_.server_ip = rsyncer_.GetSyncInfo().GetServerIP();
  out_.server_version = rsyncer_.GetServerVersionValue();
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

bool Run::Pair() {
  const std::list<std::string>& shares = task_.GetInfo().GetShareList();
  int status = 0;
  int rc = rsyncer_.DoPairing(options_.dry_run, shares, out_.conflicts, status);
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
          (rsyncer_.SupportMultiSource() ? "" : " (single-client server)") +
          (options_.dry_run ? " (dry run: nothing recorded)" : ""));
  return true;
}

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

PushResult Run::Push(ShareOutcome& share) {
  const std::string& name = share.name;
  return PushShare(
      rsyncer_, task_.GetID(), excludes_, options_,
      [this, &name](const KARO::Backup::RsyncWrapper::TransferProgress& p) {
        if (progress_) progress_(name, p);
      },
      share);
}

void Run::SyncShare(const std::string& name) {
  ShareOutcome share;
  share.name = name;
  int status = 0;
  int rc = rsyncer_.StartSyncShare(name, status);
  if (ShareStep(share, "start", rc, status)) {
    report_("share " + name + ": started");
    PushResult push = Push(share);
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
      if (rsyncer_.GetShareInfo(name, info) == 0 && info.IsEncrypted()) {
        rc = rsyncer_.SyncEncryptKey(name);
        key_ok = ShareStep(share, "key", rc, 0);
        if (key_ok) report_("share " + name + ": key file copied");
      }
      if (key_ok) {
        status = 0;
        rc = rsyncer_.FinishSync("share", name, status);
        share.ok = ShareStep(share, "finish", rc, status);
        if (share.ok) report_("share " + name + ": finished");
      }
    }
  }
  out_.shares.push_back(share);
}

void Run::DryRun() {
  for (const std::string& name : task_.GetInfo().GetShareList()) {
    if (CancelRequested()) break;
    ShareOutcome share;
    share.name = name;
    PushResult push = Push(share);
    share.ok = ShareStep(share, "transfer", push.rc, push.status);
    if (share.ok) {
      report_("share " + name + ": " + DryRunSummary(share, options_.guard));
    }
    out_.shares.push_back(share);
  }
}

void Run::FinishTask() {
  // A cancelled task still tells the server it is idle again: without the
  // checker, so that this last command is not cancelled as well.
  rsyncer_.SetCancelChecker(nullptr);
  int status = 0;
  const std::string& name = task_.GetInfo().GetName();
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
    if (Probe() && Pair()) {
      DryRun();
      Outcome();
    }
  } else if (Connect()) {
    SetBeaconHook([this] { Beacon("transfer running"); }, beacon_interval);
    const std::list<std::string>& shares = task_.GetInfo().GetShareList();
    for (const std::string& share : shares) {
      if (CancelRequested()) break;
      // Between shares as during a transfer: once the interval has passed.
      if (BeaconDue()) Beacon("next share");
      SyncShare(share);
      if (Renew(out_.shares.back())) {
        out_.shares.pop_back();
        SyncShare(share);
      }
      if (lost_) break;
    }
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

std::string StatusText(int status) {
  std::string text;
  switch (status) {
    case 0:
      text = "ok";
      break;
    case 5:
      text = "refused by the daemon (user, password or module)";
      break;
    case 10:
      text = "no connection";
      break;
    case 20:
      text = "cancelled";
      break;
    case 23:
      text = "partial transfer";
      break;
    case 25:
      text = "deletions held back";
      break;
    case 30:
    case 35:
      text = "time-out";
      break;
    case 42:
      text = "address lookup failed";
      break;
    case 43:
      text = "command unknown to the server";
      break;
    case 202:
      text = "share attributes refused";
      break;
    case 213:
      text = "no address to try";
      break;
    case 214:
      text = "shares fed by another client";
      break;
    case 240:
      text = "command malformed";
      break;
    case 241:
      text = "a name was refused";
      break;
    case 242:
      text = "server registry failure";
      break;
    case 243:
      text = "no such share on the server";
      break;
    case 244:
      text = "service switched off on the server";
      break;
    case 245:
      text = "the server is paired with another client";
      break;
    case 246:
      text = "the server holds no sync of this client";
      break;
    case 247:
      text = "the server is not paired with this client";
      break;
    case 250:
      text = "rsync could not be started";
      break;
    case 251:
      text = "no reply from the server";
      break;
    case 252:
      text = "incomplete settings";
      break;
    case 253:
      text = "reply from the server too large";
      break;
    case 300:
      text = "share record unreadable";
      break;
    case -1:
      text = "request could not be prepared";
      break;
    default:
      text = "failed";
      break;
  }
  return text + " [" + std::to_string(status) + "]";
}

std::string FailureText(int status) {
  std::string why = KARO::Backup::RsyncWrapper::lastError();
  return StatusText(status) + (why.empty() ? "" : ": " + why);
}

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
