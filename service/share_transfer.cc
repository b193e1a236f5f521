#include "service/share_transfer.h"

#include <fcntl.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>

#include "S2S/logger.h"
#include "karo_root.h"
#include "service/record.h"

namespace s2s_service {

namespace {

using KARO::Backup::RsyncWrapper;

double Now() {
  timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<double>(ts.tv_sec) + ts.tv_nsec / 1e9;
}

std::string ResumeMark(const std::string& share) {
  return KaroRootPath("/var/lib/s2s/partial/" + share);
}

// Without the mark a resumed push sends the whole file again, which costs
// time but nothing else: a failure is only logged.
void SetResumeMark(const std::string& share, bool on) {
  std::string path = ResumeMark(share);
  if (!on) {
    unlink(path.c_str());
    return;
  }
  std::string error;
  int fd = -1;
  if (MakeDirs(path.substr(0, path.rfind('/')), error)) {
    fd = open(path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
  }
  if (fd < 0) {
    S2S::Logger::LogMsg(S2S::Logger::Warning,
                        "[WARNING] cannot mark %s for resuming\n",
                        path.c_str());
    return;
  }
  close(fd);
}

// The most deletions `guard` lets through on a copy of `entries`.
unsigned long long Allowed(const DeleteGuard& guard,
                           unsigned long long entries) {
  return std::min(entries * guard.percent / 100, guard.files);
}

// A guarded push's second run adds its deletions to the first's figures.
void Add(RsyncWrapper::TransferStats& into,
         const RsyncWrapper::TransferStats& more) {
  if (!into.complete) {
    into = more;
    return;
  }
  into.files_transferred += more.files_transferred;
  into.files_deleted += more.files_deleted;
  into.files_created += more.files_created;
  into.literal_bytes += more.literal_bytes;
  into.matched_bytes += more.matched_bytes;
  into.bytes_sent += more.bytes_sent;
  into.bytes_received += more.bytes_received;
  into.deletions_skipped = more.deletions_skipped;
}

bool Push(S2S::Rsyncer& rsyncer, unsigned long long task_id,
          const std::list<std::string>& excludes,
          const RsyncWrapper::TransferMode& mode,
          const RsyncWrapper::ProgressHandler& progress, ShareOutcome& out,
          PushResult& result) {
  // Always a handler, so that rsync prints the --stats the figures and the
  // guard read.
  RsyncWrapper::setThreadProgressHandler(
      [&progress](const RsyncWrapper::TransferProgress& p) {
        if (progress) progress(p);
      });
  RsyncWrapper::setThreadTransferMode(mode);
  double t0 = Now();
  result.status = 0;
  result.rc = rsyncer.RunSync(task_id, out.name, "/", excludes, result.status);
  out.seconds += Now() - t0;
  Add(out.stats, RsyncWrapper::lastStats());
  RsyncWrapper::setThreadTransferMode(RsyncWrapper::TransferMode());
  RsyncWrapper::setThreadProgressHandler({});
  return result.rc == 0 && result.status == 0;
}

}  // namespace

PushResult PushShare(S2S::Rsyncer& rsyncer, unsigned long long task_id,
                     const std::list<std::string>& excludes,
                     const RunOptions& options,
                     const RsyncWrapper::ProgressHandler& progress,
                     ShareOutcome& out) {
  PushResult result;
  RsyncWrapper::TransferMode mode;
  if (options.dry_run) {
    mode.dry_run = true;
    Push(rsyncer, task_id, excludes, mode, progress, out, result);
    return result;
  }
  bool guarded = options.guard.on && !options.confirm_deletions;
  mode.max_delete = guarded ? 0 : -1;
  mode.resume = access(ResumeMark(out.name).c_str(), F_OK) == 0;
  SetResumeMark(out.name, true);
  if (!Push(rsyncer, task_id, excludes, mode, progress, out, result)) {
    return result;
  }
  SetResumeMark(out.name, false);
  unsigned long long held = out.stats.deletions_skipped;
  if (held == 0) return result;
  result.held =
      GuardRefusal(options.guard, held, EntriesBefore(out.stats, held));
  if (!result.held.empty()) {
    result.status = kDeletionsHeld;
    return result;
  }
  mode.max_delete = -1;
  mode.resume = false;
  Push(rsyncer, task_id, excludes, mode, progress, out, result);
  return result;
}

// Those of the client's list that it had already, and those only it has
// (the deletions).
unsigned long long EntriesBefore(const RsyncWrapper::TransferStats& s,
                                 unsigned long long held) {
  return s.files - std::min(s.files_created, s.files) + held;
}

std::string GuardRefusal(const DeleteGuard& guard, unsigned long long held,
                         unsigned long long entries) {
  unsigned long long allowed = Allowed(guard, entries);
  if (held <= allowed) return "";
  return "deletions held back: " + std::to_string(held) + " of " +
         std::to_string(entries) +
         " entries on the server would be deleted, more than the guard "
         "allows (" +
         std::to_string(allowed) + "); confirm the run to delete them";
}

std::string DryRunSummary(const ShareOutcome& share, const DeleteGuard& guard) {
  const RsyncWrapper::TransferStats& s = share.stats;
  std::string line = "would send " + std::to_string(s.would_send) +
                     ", delete " + std::to_string(s.would_delete);
  unsigned long long allowed = Allowed(guard, EntriesBefore(s, s.would_delete));
  if (guard.on && s.would_delete > allowed) {
    line += " (more than the guard allows, " + std::to_string(allowed) +
            ": a run would hold the deletions back unless confirmed)";
  }
  return line;
}

}  // namespace s2s_service
