// s2s-client: runs one sync task against a server appliance.
//
//   s2s-client [--root DIR] [--task-file FILE] [options]   (see --help)
//   s2s-client [--root DIR] init --share NAME[=PATH]...   (client_root.h)
//
// Progress goes to standard output, one line per step, then a summary; the
// library's log goes to standard error. The exit code says what failed
// (service/exit_codes.h).
#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>
#include <time.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "S2S/logger.h"
#include "cancel.h"
#include "client_options.h"
#include "client_root.h"
#include "karo/rsync_wrapper.h"
#include "karo_root.h"
#include "secret.h"
#include "service/exit_codes.h"
#include "service/share_transfer.h"
#include "service/task_runner.h"
#include "task_lock.h"

namespace {

using namespace s2s_tools;
using namespace s2s_service;

int g_verbose = 0;

// The wrapper's lines: warnings always, rsync's own output (debug) only
// when asked for.
void WrapperLog(int priority, const char* message) {
  if (priority <= LOG_WARNING || g_verbose >= 2) {
    fprintf(stderr, "%s\n", message);
  }
}

bool MakeTempDir(std::string& error) {
  std::string dir = KaroRootPath("/tmp/S2S");
  std::string partial;
  for (size_t pos = 1; pos != std::string::npos;) {
    pos = dir.find('/', pos + 1);
    partial = dir.substr(0, pos);
    if (mkdir(partial.c_str(), pos == std::string::npos ? 0700 : 0755) != 0 &&
        errno != EEXIST) {
      error = "cannot create " + partial + ": " + strerror(errno);
      return false;
    }
  }
  return true;
}

bool g_tty = false;        // standard output is a terminal
bool g_live_line = false;  // a progress line is showing, without line break
double g_last_progress = -1;

// A plain progress line every this many seconds when not on a terminal.
const double kProgressEvery = 10;

double Monotonic() {
  timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<double>(ts.tv_sec) + ts.tv_nsec / 1e9;
}

std::string Size(double bytes) {
  const char* units[] = {"B", "KiB", "MiB", "GiB", "TiB"};
  int u = 0;
  for (; bytes >= 1024 && u < 4; ++u) bytes /= 1024;
  char buf[32];
  snprintf(buf, sizeof buf, u == 0 ? "%.0f %s" : "%.1f %s", bytes, units[u]);
  return buf;
}

void Print(const std::string& line) {
  printf("%s%s\n", g_live_line ? "\n" : "", line.c_str());
  g_live_line = false;
  fflush(stdout);
}

// One live line on a terminal, else a plain line now and then.
void ShowProgress(const std::string& share,
                  const KARO::Backup::RsyncWrapper::TransferProgress& p) {
  double now = Monotonic();
  if (!g_tty && g_last_progress >= 0 &&
      now - g_last_progress < kProgressEvery) {
    return;
  }
  g_last_progress = now;
  char line[256];
  snprintf(line, sizeof line,
           "share %s: %s of %s (%u%%), %s/s, %u:%02u:%02u left, %llu/%llu "
           "files checked",
           share.c_str(), Size(p.bytes_done).c_str(),
           Size(p.bytes_total).c_str(), p.percent,
           Size(p.bytes_per_second).c_str(), p.seconds_left / 3600,
           p.seconds_left / 60 % 60, p.seconds_left % 60, p.files_checked,
           p.files_total);
  if (g_tty) {
    printf("\r%s\033[K", line);
    g_live_line = true;
    fflush(stdout);
  } else {
    Print(line);
  }
}

// What a dry run found: "+ path" would be sent, "- path" deleted.
void PrintListing(const char* sign, unsigned long long count,
                  const std::vector<std::string>& paths) {
  for (const std::string& p : paths) printf("    %s %s\n", sign, p.c_str());
  if (count > paths.size()) {
    printf("    %s ... and %llu more\n", sign, count - paths.size());
  }
}

void PrintSummary(const TaskSpec& spec, const TaskOutcome& out) {
  size_t ok = 0;
  for (const ShareOutcome& s : out.shares) ok += s.ok ? 1 : 0;
  printf(
      "summary: task %s, server %s, %zu/%zu shares %s, %d beacons, "
      "%.2f s, exit %d%s%s\n",
      spec.name.c_str(), out.server_ip.empty() ? "-" : out.server_ip.c_str(),
      ok, spec.shares.size(), out.dry_run ? "checked (dry run)" : "synced",
      out.beacons, out.seconds, out.exit_code, out.error.empty() ? "" : ": ",
      out.error.c_str());
  for (const ShareOutcome& s : out.shares) {
    if (s.ok && out.dry_run) {
      printf("  %-20s %s\n", s.name.c_str(),
             DryRunSummary(s, spec.guard).c_str());
      PrintListing("+", s.stats.would_send, s.stats.send_paths);
      PrintListing("-", s.stats.would_delete, s.stats.delete_paths);
    } else if (s.ok) {
      printf(
          "  %-20s ok (%.2f s, %llu files and %s sent, %llu deleted, %s "
          "matched, %s/s)\n",
          s.name.c_str(), s.seconds, s.stats.files_transferred,
          Size(s.stats.literal_bytes).c_str(), s.stats.files_deleted,
          Size(s.stats.matched_bytes).c_str(),
          Size(s.stats.bytes_per_second).c_str());
    } else if (s.failed_step == "guard") {
      printf("  %-20s synced, %s\n", s.name.c_str(), s.cause.c_str());
    } else {
      printf("  %-20s FAILED at %s: %s\n", s.name.c_str(),
             s.failed_step.c_str(), s.cause.c_str());
    }
  }
  fflush(stdout);
}

}  // namespace

int main(int argc, char** argv) {
  if (IsClientInit(argc, argv)) return RunClientInit(argc, argv);
  ClientOptions o;
  std::string error;
  if (!ParseClientArgs(argc, argv, o, error)) {
    fprintf(stderr, "s2s-client: %s\n(try --help)\n", error.c_str());
    return kExitUsage;
  }
  if (o.help) {
    fputs(ClientUsage(), stdout);
    return kExitOk;
  }
  if (o.version) {
    printf("s2s-client %s\n", S2S_VERSION);
    return kExitOk;
  }
  if (!o.root.empty()) setenv(KARO_ROOT_ENV, o.root.c_str(), 1);
  g_verbose = o.verbose;
  S2S::Logger::Initialize(S2S::Logger::Stderr,
                          o.verbose >= 2   ? S2S::Logger::Debug
                          : o.verbose == 1 ? S2S::Logger::Info
                                           : S2S::Logger::Warning,
                          "", 0);
  KARO::Backup::RsyncWrapper::setLogHandler(WrapperLog);
  if (!InstallCancelSignals()) {
    fprintf(stderr, "s2s-client: cannot handle signals\n");
    return kExitLocal;
  }
  if (!CheckTaskSpec(o.spec, error)) {
    fprintf(stderr, "s2s-client: %s\n", error.c_str());
    return kExitUsage;
  }
  std::string password;
  if (!ReadPassword(o.spec.password_file, password, error)) {
    fprintf(stderr, "s2s-client: %s\n", error.c_str());
    return kExitUsage;
  }
  TaskLock lock;
  bool busy = false;
  if (!lock.Take(o.spec.id, busy, error)) {
    fprintf(stderr, "s2s-client: %s\n", error.c_str());
    return busy ? kExitBusy : kExitLocal;
  }
  if (!MakeTempDir(error)) {
    fprintf(stderr, "s2s-client: %s\n", error.c_str());
    return kExitLocal;
  }
  if (o.spec.port != 0) {
    setenv("S2S_RSYNC_PORT", std::to_string(o.spec.port).c_str(), 1);
  }
  S2S::SyncTask task = MakeSyncTask(o.spec, password);
  g_tty = isatty(STDOUT_FILENO) == 1;
  RunOptions options;
  options.dry_run = o.dry_run;
  options.confirm_deletions = o.confirm_deletions;
  options.guard = o.spec.guard;
  TaskOutcome out = RunTask(task, o.spec.excludes, o.beacon_interval, Print,
                            ShowProgress, options);
  if (g_live_line) fputs("\n", stdout);
  PrintSummary(o.spec, out);
  return out.exit_code;
}
