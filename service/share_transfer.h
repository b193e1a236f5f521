// One share's data transfer within a task run: a resumed file, the
// mass-delete guard, and a dry run's listing around the share's RunSync.
//
// Resume: the server keeps what an interrupted transfer had sent (the
// wrapper's partial directory), but rsync builds on it only with its delta
// transfer. A mark under the root (/var/lib/s2s/partial/<share>), made
// before each push and removed once one succeeded, tells the next push of
// the share after a cancel, a lost connection or a killed client to run
// with the delta transfer, so that only what is missing is sent again.
//
// Guard: a guarded push first runs with deletions held back (rsync's
// --max-delete=0, which counts them); when rsync held some and they stay
// within the guard, or the run is confirmed, a second push deletes them.
// A push with nothing to delete costs one rsync run, as without the guard.
//
// Runs on the calling thread and uses the wrapper's per-thread settings.
#ifndef S2S_SERVICE_SHARE_TRANSFER_H_
#define S2S_SERVICE_SHARE_TRANSFER_H_

#include <functional>
#include <list>
#include <string>

#include "S2S/rsyncer.h"
#include "service/task_runner.h"

namespace s2s_service {

struct PushResult {
  int rc = 0;        // RunSync's result
  int status = 0;    // the wrapper's status; 25 when the guard held deletions
  std::string held;  // the guard's refusal in words, with the counts
};

// Pushes the whole of `out.name` (a dry run when `options` say so). Adds
// rsync's figures to `out.stats` and the time taken to `out.seconds`.
// Returns rc 0 and status 0 when the push was made in full.
PushResult PushShare(
    S2S::Rsyncer& rsyncer, unsigned long long task_id,
    const std::list<std::string>& excludes, const RunOptions& options,
    const KARO::Backup::RsyncWrapper::ProgressHandler& progress,
    ShareOutcome& out);

// The guard's verdict on `held` deletions from a copy of `entries` entries:
// "" when they stay within what it allows, else its refusal in words, with
// the counts.
std::string GuardRefusal(const DeleteGuard& guard, unsigned long long held,
                         unsigned long long entries);

// The entries the server's copy had before a push with figures `s` that
// held back `held` deletions (of the pushed tree only, for a part of it).
unsigned long long EntriesBefore(
    const KARO::Backup::RsyncWrapper::TransferStats& s,
    unsigned long long held);

// rsync's own exit code for deletions that --max-delete stopped; a share's
// status when the guard held its deletions back.
const int kDeletionsHeld = 25;

// A dry run's finding for a share in one line: how much would be sent and
// deleted, and whether the guard would hold the deletions back.
std::string DryRunSummary(const ShareOutcome& share, const DeleteGuard& guard);

}  // namespace s2s_service

#endif  // S2S_SERVICE_SHARE_TRANSFER_H_
