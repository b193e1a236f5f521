// s2sd: the client service. Runs the sync tasks of the appliance on their
// schedules and answers the control socket (doc/service_protocol.md).
//
//   s2sd [--foreground] [--root DIR] [--log syslog|stderr|FILE] [-v]
//
// It always stays in the foreground (a unit or the platform's service
// "s2s_daemon" runs it so); --foreground is accepted for the units' sake.
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <string>

#include "S2S/logger.h"
#include "karo/rsync_wrapper.h"
#include "karo_root.h"
#include "service/clock.h"
#include "service/config.h"
#include "service/daemon.h"

namespace {

const char kUsage[] =
    "usage: s2sd [--foreground] [--root DIR] [--log syslog|stderr|FILE] [-v]\n"
    "\n"
    "Runs the sync tasks of the client appliance on their schedules and\n"
    "answers the control socket <root>/run/s2s/s2sd.sock (s2sctl).\n"
    "\n"
    "  --foreground   stay in the foreground (always so; for units)\n"
    "  --root DIR     the appliance root (default: $S2S_ROOT, else /)\n"
    "  --log WHERE    syslog (default), stderr, or a file to append to\n"
    "  -v             also log each step of every run; -vv: debug\n"
    "  --clock-offset S, --clock-rate R\n"
    "                 schedules see the wall clock as system time * R + S\n"
    "                 (for tests and benchmarks; default 0 and 1)\n"
    "  --watch-queue-limit N, --watch-limit N\n"
    "                 realtime tasks count more than N events per wake-up\n"
    "                 as an overflow, and place at most N inotify watches\n"
    "                 each (for tests; default 0: the kernel's limits)\n"
    "  --watch-check-ms N\n"
    "                 realtime tasks look at their shares' directories\n"
    "                 every N ms (for tests; default 2000)\n"
    "  --help, --version  this text; the version\n"
    "\n"
    "Settings: <root>/etc/s2s/s2sd.conf, section [Service]: max_parallel,\n"
    "share_parallel, admin_group, beacon_interval. SIGHUP reloads the tasks; "
    "SIGTERM\n"
    "cancels the running transfers and stops. Exit: 0 stopped, 1 could not\n"
    "start, 2 usage.\n";

int g_verbose = 0;

// rsync's own lines only at -vv; the wrapper's warnings always.
void WrapperLog(int priority, const char* message) {
  if (priority <= 4 || g_verbose >= 2) {
    S2S::Logger::LogMsg(S2S::Logger::Warning, "[WARNING] rsync: %s\n", message);
  }
}

}  // namespace

int main(int argc, char** argv) {
  std::string root, log = "syslog";
  long clock_offset = 0, clock_rate = 1;
  long queue_limit = 0, watch_limit = 0, check_ms = 2000;
  for (int i = 1; i < argc; ++i) {
    std::string a = argv[i];
    std::string value;
    size_t eq = a.find('=');
    if (a.compare(0, 2, "--") == 0 && eq != std::string::npos) {
      value = a.substr(eq + 1);
      a = a.substr(0, eq);
    } else if (a == "--root" || a == "--log" || a == "--clock-offset" ||
               a == "--clock-rate" || a == "--watch-queue-limit" ||
               a == "--watch-limit" || a == "--watch-check-ms") {
      if (i + 1 == argc) {
        fprintf(stderr, "s2sd: %s needs a value\n", a.c_str());
        return 2;
      }
      value = argv[++i];
    }
    if (a == "--clock-offset" || a == "--clock-rate" ||
        a == "--watch-queue-limit" || a == "--watch-limit" ||
        a == "--watch-check-ms") {
      char* end = nullptr;
      long n = strtol(value.c_str(), &end, 10);
      if (value.empty() || *end != '\0' ||
          (a != "--clock-offset" &&
           n < (a == "--clock-rate" || a == "--watch-check-ms" ? 1 : 0))) {
        fprintf(stderr, "s2sd: %s needs a number\n", a.c_str());
        return 2;
      }
      if (a == "--clock-offset") clock_offset = n;
      if (a == "--clock-rate") clock_rate = n;
      if (a == "--watch-queue-limit") queue_limit = n;
      if (a == "--watch-limit") watch_limit = n;
      if (a == "--watch-check-ms") check_ms = n;
    } else if (a == "--foreground") {
    } else if (a == "--root") {
      root = value;
    } else if (a == "--log") {
      log = value;
    } else if (a == "-v") {
      ++g_verbose;
    } else if (a == "-vv") {
      g_verbose += 2;
    } else if (a == "--help" || a == "-h") {
      fputs(kUsage, stdout);
      return 0;
    } else if (a == "--version") {
      printf("s2sd %s\n", S2S_VERSION);
      return 0;
    } else {
      fprintf(stderr, "s2sd: unknown argument %s\n(try --help)\n", a.c_str());
      return 2;
    }
  }
  if (!root.empty()) setenv(KARO_ROOT_ENV, root.c_str(), 1);
  int level = g_verbose >= 2   ? S2S::Logger::Debug
              : g_verbose == 1 ? S2S::Logger::Info
                               : S2S::Logger::Note;
  int rc = 0;
  if (log == "syslog") {
    rc = S2S::Logger::Initialize(S2S::Logger::Syslog, level, "", 0);
  } else if (log == "stderr") {
    rc = S2S::Logger::Initialize(S2S::Logger::Stderr, level, "", 0);
  } else {
    rc = S2S::Logger::Initialize(S2S::Logger::File, level, log, 5);
  }
  if (rc != 0) {
    fprintf(stderr, "s2sd: cannot log to %s\n", log.c_str());
    return 1;
  }
  KARO::Backup::RsyncWrapper::setLogHandler(WrapperLog);
  s2s_service::DaemonConfig config;
  std::string error;
  if (!s2s_service::LoadDaemonConfig(config, error)) {
    fprintf(stderr, "s2sd: %s\n", error.c_str());
    S2S::Logger::LogMsg(S2S::Logger::Error, "[ERROR] s2sd: %s\n",
                        error.c_str());
    return 1;
  }
  config.watch_queue_limit = static_cast<size_t>(queue_limit);
  config.watch_limit = static_cast<size_t>(watch_limit);
  config.watch_check_ms = static_cast<unsigned int>(check_ms);
  s2s_service::ShiftedClock clock(clock_offset, clock_rate);
  s2s_service::Daemon daemon(config, clock);
  return daemon.Run();
}
