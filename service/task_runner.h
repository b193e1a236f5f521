// One sync task end to end, as the one-shot client and the service run it.
//
// RunTask probes the server (Initialize), pairs the task's shares, then for
// each share announces the sync, pushes the data, carries an encrypted
// share's key file and reports the share's end; beacons keep the task alive
// on the server between shares and, during long transfers, from the cancel
// checker's poll, once their interval has passed; the task's end is
// reported last. Each step is reported as one line through the caller's
// reporter. A share that fails does not stop the others; a failed probe or
// pairing, or a cancel, stops the task.
//
// A caller that runs the task again (the service) may hand in the session
// of its last run (service/session.h): the probe and the pairing are then
// skipped. When a share's step is answered in a way that session may have
// caused (the service off, the server paired with another client or with
// none, the share's sync gone, the address refusing or silent), the run
// probes and pairs again at once and makes the share's steps again, once.
//
// A dry run probes and asks the pairing question without committing the
// server to anything, then runs each share's transfer with rsync's
// --dry-run: no sync is started, no beacon or end is reported, and each
// share's outcome lists what would be sent and deleted.
//
// With RunOptions::share_parallel above 1, that many shares are synced at
// once, on the calling thread and threads the run starts; the outcome lists
// the shares in the task's order all the same, and report lines of
// different shares may interleave.
//
// RunTask runs on the calling thread with its own Rsyncers; a cancel comes
// through the flag bound to that thread (service/cancel.h), which the run's
// own threads bind too, and its beacons are the calling thread's, so
// several tasks may run at once on threads of their own.
#ifndef S2S_SERVICE_TASK_RUNNER_H_
#define S2S_SERVICE_TASK_RUNNER_H_

#include <functional>
#include <list>
#include <string>
#include <vector>

#include "S2S/sync_obj_task.h"
#include "karo/rsync_wrapper.h"
#include "service/session.h"

namespace s2s_service {

// The mass-delete guard of a task: a run that would delete more than
// `percent` % of the entries of the server's copy of a share, or more than
// `files` entries, whichever is fewer, deletes nothing there (the rest of
// the share is synced) unless the run is confirmed.
struct DeleteGuard {
  bool on = true;
  unsigned int percent = 50;
  unsigned long long files = 10000;
  bool operator==(const DeleteGuard& o) const {
    return on == o.on && percent == o.percent && files == o.files;
  }
};

struct RunOptions {
  bool dry_run = false;
  bool confirm_deletions = false;  // this run passes the guard
  DeleteGuard guard;
  // Shares of the run synced at once, each on a thread with an Rsyncer of
  // its own; 1 syncs them one after the other.
  unsigned int share_parallel = 1;
};

struct ShareOutcome {
  std::string name;
  bool ok = false;
  std::string failed_step;  // "start", "transfer", "guard", "key", "finish"
  int status = 0;           // the failed step's status
  std::string cause;        // the status in words, with rsync's or the
                            // server's reason when either gave one
  double seconds = 0;       // time of the transfer
  // rsync's --stats of the transfer (complete false when it printed none);
  // for a dry run also what would be sent and deleted.
  KARO::Backup::RsyncWrapper::TransferStats stats;
};

struct TaskOutcome {
  bool dry_run = false;
  int exit_code = 0;  // an ExitCode
  std::string error;  // why the task stopped or failed; "" when it did not
  std::string server_ip;
  int server_version = -1;
  std::list<std::string> conflicts;
  std::vector<ShareOutcome> shares;
  int beacons = 0;
  double seconds = 0;
};

using Reporter = std::function<void(const std::string& line)>;
// Called with the share's name at each progress line rsync prints while a
// share transfers.
using ProgressReporter = std::function<void(
    const std::string& share,
    const KARO::Backup::RsyncWrapper::TransferProgress& progress)>;

// Runs `task`. `beacon_interval` is the least time between beacons (the
// first once that much time has passed since the shares began). `session`,
// when given, is the task's last session on entry (an invalid one: probe
// and pair) and this run's on return (invalid when the next run has to
// probe again). REQUIRES: the task was checked (CheckTaskSpec).
TaskOutcome RunTask(const S2S::SyncTask& task,
                    const std::list<std::string>& excludes,
                    unsigned int beacon_interval, const Reporter& report,
                    const ProgressReporter& progress = nullptr,
                    const RunOptions& options = RunOptions(),
                    Session* session = nullptr);

// What a status from the rsync wrapper or the server means, for people.
std::string StatusText(int status);
// StatusText(status) followed by the reason rsync or the server gave for the
// calling thread's last failed invocation (RsyncWrapper::lastError), if any.
std::string FailureText(int status);

}  // namespace s2s_service

#endif  // S2S_SERVICE_TASK_RUNNER_H_
