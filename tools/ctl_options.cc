#include "ctl_options.h"

#include <getopt.h>
#include <strings.h>

#include <vector>

#include "task_file.h"

namespace s2s_tools {

namespace {

enum Option {
  kRoot = 256,
  kSocket,
  kJson,
  kLimit,
  kTaskFile,
  kPasswordFile,
  kPassword,
  kName,
  kTaskId,
  kServerIP,
  kServerName,
  kUser,
  kShare,
  kExclude,
  kNoExcludes,
  kCompress,
  kDelta,
  kSSH,
  kSSHPort,
  kMaxBandwidth,
  kSchedule,
  kAt,
  kDays,
  kBegin,
  kEvery,
  kRepeat,
  kEnabled,
  kDisabled,
  kDeleteGuard,
  kGuardPercent,
  kGuardFiles,
  kDryRun,
  kConfirmDeletions,
  kSettle,
  kMaxDelay,
  kFullSync,
  kPendingLimit,
  kChangeSource,
};

const struct option kOptions[] = {
    {"root", required_argument, nullptr, kRoot},
    {"socket", required_argument, nullptr, kSocket},
    {"json", no_argument, nullptr, kJson},
    {"limit", required_argument, nullptr, kLimit},
    {"task-file", required_argument, nullptr, kTaskFile},
    {"password-file", required_argument, nullptr, kPasswordFile},
    {"password", required_argument, nullptr, kPassword},
    {"task", required_argument, nullptr, kName},
    {"name", required_argument, nullptr, kName},
    {"task-id", required_argument, nullptr, kTaskId},
    {"server-ip", required_argument, nullptr, kServerIP},
    {"server-name", required_argument, nullptr, kServerName},
    {"user", required_argument, nullptr, kUser},
    {"share", required_argument, nullptr, kShare},
    {"exclude", required_argument, nullptr, kExclude},
    {"no-excludes", no_argument, nullptr, kNoExcludes},
    {"compress", optional_argument, nullptr, kCompress},
    {"delta", optional_argument, nullptr, kDelta},
    {"ssh", optional_argument, nullptr, kSSH},
    {"ssh-port", required_argument, nullptr, kSSHPort},
    {"max-bandwidth", required_argument, nullptr, kMaxBandwidth},
    {"schedule", required_argument, nullptr, kSchedule},
    {"at", required_argument, nullptr, kAt},
    {"days", required_argument, nullptr, kDays},
    {"begin", required_argument, nullptr, kBegin},
    {"every", required_argument, nullptr, kEvery},
    {"repeat", required_argument, nullptr, kRepeat},
    {"enabled", optional_argument, nullptr, kEnabled},
    {"disabled", no_argument, nullptr, kDisabled},
    {"delete-guard", optional_argument, nullptr, kDeleteGuard},
    {"delete-guard-percent", required_argument, nullptr, kGuardPercent},
    {"delete-guard-files", required_argument, nullptr, kGuardFiles},
    {"dry-run", no_argument, nullptr, kDryRun},
    {"confirm-deletions", no_argument, nullptr, kConfirmDeletions},
    {"settle", required_argument, nullptr, kSettle},
    {"max-delay", required_argument, nullptr, kMaxDelay},
    {"full-sync-every", required_argument, nullptr, kFullSync},
    {"pending-limit", required_argument, nullptr, kPendingLimit},
    {"change-source", required_argument, nullptr, kChangeSource},
    {"verbose", no_argument, nullptr, 'v'},
    {"help", no_argument, nullptr, 'h'},
    {"version", no_argument, nullptr, 'V'},
    {nullptr, 0, nullptr, 0},
};

const char kUsage[] =
    "usage: s2sctl [--root DIR] [--socket PATH] [--json] COMMAND ...\n"
    "\n"
    "Talks to the client service s2sd over its control socket.\n"
    "\n"
    "Commands (TASK is a task id or name):\n"
    "  task list                   the tasks, their schedules and states\n"
    "  task show TASK              one task's settings (never its password)\n"
    "  task add [task options]     a new task; prints its id\n"
    "  task edit TASK [task options]   changes only what the options say\n"
    "  task delete TASK            removes a task that is not running\n"
    "  task enable TASK | task disable TASK   schedule on or off\n"
    "  run TASK [--confirm-deletions]   starts the task now; it may delete\n"
    "                              past the task's delete guard\n"
    "  run TASK --dry-run          waits for a dry run and shows what a run\n"
    "                              would send and delete\n"
    "  cancel TASK                 stops its run, queued run or retry\n"
    "  status                      the service: uptime, running, next runs\n"
    "  history TASK [--limit N]    the task's last runs, newest first\n"
    "  reload                      reads the task store again (as SIGHUP)\n"
    "\n"
    "Options:\n"
    "  --root DIR             appliance root (default: $S2S_ROOT, else /)\n"
    "  --socket PATH          control socket (default:\n"
    "                         ROOT/run/s2s/s2sd.sock)\n"
    "  --json                 print the daemon's reply as JSON\n"
    "  -v, --verbose          the library's log on standard error\n"
    "  -h, --help             this text; --version: the version\n"
    "\n"
    "Task options (task add, task edit):\n"
    "  --task-file FILE       the [Task] file of s2s-client; the options\n"
    "                         below override it\n"
    "  --task NAME            task name (also --name)\n"
    "  --task-id N            id of a new task (default: the lowest free)\n"
    "  --server-ip ADDR       server address\n"
    "  --server-name NAME     server name\n"
    "  --user USER            daemon user on the server\n"
    "  --password-file FILE   the password, in a file of mode 0600; without\n"
    "                         it the password comes from $S2S_PASSWORD (add\n"
    "                         needs one; edit keeps the stored one if\n"
    "                         neither is given)\n"
    "  --share NAME           a local share (repeatable; replaces the list)\n"
    "  --exclude RULE         an rsync exclude rule (repeatable; replaces)\n"
    "  --no-excludes          no exclude rules\n"
    "  --compress[=yes|no]    compress data on the wire\n"
    "  --delta[=yes|no]       block-level (delta) transfer\n"
    "  --ssh[=yes|no]         through SSH; --ssh-port PORT\n"
    "  --max-bandwidth KIB    at most KIB KiB/s on the wire (0: no limit)\n"
    "  --schedule MODE        manual, realtime, weekly, monthly, yearly, once\n"
    "  --at HH:MM             time of the first run of a run day\n"
    "  --days DAYS            weekly run days: daily, weekdays, weekends,\n"
    "                         sun,mon,... or seven 0/1 from Sunday\n"
    "  --begin YYYY-MM-DD     the date of a once, monthly (day) or yearly\n"
    "                         (month, day) schedule\n"
    "  --every HH:MM          period of the repeats within a run day\n"
    "  --repeat N             runs after the first of a run day\n"
    "  --enabled[=yes|no], --disabled   whether the schedule starts it\n"
    "  --delete-guard[=yes|no]  hold back a run's deletions of more than\n"
    "                         --delete-guard-percent P (50) % of the\n"
    "                         server's copy or --delete-guard-files N\n"
    "                         (10000) entries, whichever is fewer\n"
    "\n"
    "Realtime tasks (--schedule realtime) watch their shares and push each\n"
    "change:\n"
    "  --settle SEC           quiet after the last change before a push\n"
    "                         (default 2; decimals, e.g. 0.2)\n"
    "  --max-delay SEC        longest wait under constant change (default 30)\n"
    "  --full-sync-every SEC  full sync of every share (default 3600)\n"
    "  --pending-limit N      pending paths per share before a full sync\n"
    "                         instead (default 10000)\n"
    "  --change-source SRC    auto (fanotify where it works, else inotify),\n"
    "                         fanotify or inotify\n"
    "\n"
    "Exit codes:\n"
    "  0  done\n"
    "  1  the daemon failed (storage) or gave an unexpected answer\n"
    "  2  usage: bad option, task file or password source\n"
    "  3  s2sd is not reachable (no socket, nothing listening)\n"
    "  4  no such task\n"
    "  5  the task was refused: invalid, or its id or name is taken\n"
    "  6  busy: the task is running (run, delete), or s2sd is stopping\n"
    "  7  not permitted: the control socket is for root (or the admin "
    "group)\n"
    "  8  run --dry-run: the dry run failed (why on standard error)\n";

struct Command {
  const char* name;
  bool needs_target;
  bool takes_task_options;
};

const Command kCommands[] = {
    {"task list", false, false},   {"task show", true, false},
    {"task add", false, true},     {"task edit", true, true},
    {"task delete", true, false},  {"task enable", true, false},
    {"task disable", true, false}, {"run", true, false},
    {"cancel", true, false},       {"status", false, false},
    {"history", true, false},      {"reload", false, false},
};

bool Fail(std::string& error, const std::string& text) {
  error = text;
  return false;
}

bool Number(const char* option, const char* text, unsigned long long max,
            unsigned long long& out, std::string& error) {
  if (ParseNumber(text, max, out)) return true;
  return Fail(error, std::string("bad value for --") + option + ": " + text);
}

// "HH:MM" into two numbers of at most two digits each.
bool Clock(const char* option, const std::string& text,
           unsigned long long& hours, unsigned long long& minutes,
           std::string& error) {
  size_t colon = text.find(':');
  if (colon == std::string::npos ||
      !ParseNumber(text.substr(0, colon), 99, hours) ||
      !ParseNumber(text.substr(colon + 1), 99, minutes)) {
    return Fail(error, std::string("bad value for --") + option + ": " + text +
                           " (HH:MM)");
  }
  return true;
}

bool Date(const std::string& text, S2S::PObject& changes, std::string& error) {
  unsigned long long y = 0, m = 0, d = 0;
  size_t a = text.find('-');
  size_t b = a == std::string::npos ? a : text.find('-', a + 1);
  if (b == std::string::npos || !ParseNumber(text.substr(0, a), 9999, y) ||
      !ParseNumber(text.substr(a + 1, b - a - 1), 99, m) ||
      !ParseNumber(text.substr(b + 1), 99, d)) {
    return Fail(error, "bad value for --begin: " + text + " (YYYY-MM-DD)");
  }
  changes["schedule_begin_year"] = static_cast<int>(y);
  changes["schedule_begin_month"] = static_cast<int>(m);
  changes["schedule_begin_day"] = static_cast<int>(d);
  return true;
}

// Run days as the schedule's seven characters, Sunday first.
bool Days(const std::string& text, std::string& week, std::string& error) {
  static const char* const kDay[] = {"sun", "mon", "tue", "wed",
                                     "thu", "fri", "sat"};
  if (text == "daily") return week = "1111111", true;
  if (text == "weekdays") return week = "0111110", true;
  if (text == "weekends") return week = "1000001", true;
  if (text.size() == 7 && text.find_first_not_of("01") == std::string::npos &&
      text != "0000000") {
    return week = text, true;
  }
  week = "0000000";
  size_t start = 0;
  while (start <= text.size()) {
    size_t comma = text.find(',', start);
    if (comma == std::string::npos) comma = text.size();
    std::string day = text.substr(start, comma - start);
    int i = 0;
    while (i < 7 && strcasecmp(day.c_str(), kDay[i]) != 0) ++i;
    if (i == 7) {
      return Fail(error, "bad value for --days: " + text +
                             " (daily, weekdays, weekends, sun,mon,... or "
                             "seven 0/1 from Sunday)");
    }
    week[static_cast<size_t>(i)] = '1';
    start = comma + 1;
  }
  return true;
}

// Seconds with up to three decimals, as milliseconds.
bool Millis(const char* option, const std::string& text, unsigned long long max,
            unsigned long long& ms, std::string& error) {
  size_t dot = text.find('.');
  std::string whole = text.substr(0, dot);
  std::string part = dot == std::string::npos ? "" : text.substr(dot + 1);
  unsigned long long s = 0, f = 0;
  if ((whole.empty() && part.empty()) || part.size() > 3 ||
      (!whole.empty() && !ParseNumber(whole, max / 1000, s)) ||
      (!part.empty() && !ParseNumber(part, 999, f))) {
    return Fail(error, std::string("bad value for --") + option + ": " + text +
                           " (seconds, at most three decimals)");
  }
  for (size_t digits = part.size(); digits < 3; ++digits) f *= 10;
  ms = s * 1000 + f;
  if (ms > max) return Fail(error, std::string("--") + option + " too large");
  return true;
}

bool Mode(const std::string& text, int& mode, std::string& error) {
  static const char* const kModes[] = {"manual",  "realtime", "weekly",
                                       "monthly", "yearly",   "once"};
  for (int i = 0; i < 6; ++i) {
    if (text == kModes[i]) return mode = i, true;
  }
  return Fail(error, "bad value for --schedule: " + text +
                         " (manual, realtime, weekly, monthly, yearly, once)");
}

bool Flag(const char* option, const char* text, bool& out, std::string& error) {
  if (text == nullptr) return out = true, true;
  if (ParseFlag(text, out)) return true;
  return Fail(error, std::string("bad value for --") + option + ": " + text);
}

void Append(S2S::PObject& changes, const char* key, bool& replaced,
            const char* value) {
  if (!replaced) changes[key].asArray().clear();
  replaced = true;
  S2S::PObject item(value);
  changes[key].asArray().push_back(item);
}

// One task option into `o.changes`. False with `error` when its value does
// not parse.
bool TaskOption(int c, CtlOptions& o, bool& shares_given, bool& excludes_given,
                std::string& error) {
  S2S::PObject& ch = o.changes;
  unsigned long long n = 0, m = 0;
  bool flag = false;
  int mode = 0;
  std::string week;
  o.has_task_options = true;
  switch (c) {
    case kTaskFile:
      o.task_file = optarg;
      return true;
    case kPasswordFile:
      o.password_file = optarg;
      return true;
    case kName:
      ch["name"] = optarg;
      return true;
    case kTaskId:
      if (!Number("task-id", optarg, ~0ULL, n, error)) return false;
      ch["id"] = n;
      return true;
    case kServerIP:
      ch["server_ip"] = optarg;
      return true;
    case kServerName:
      ch["server_name"] = optarg;
      return true;
    case kUser:
      ch["user"] = optarg;
      return true;
    case kShare:
      Append(ch, "share_list", shares_given, optarg);
      return true;
    case kExclude:
      Append(ch, "excludes", excludes_given, optarg);
      return true;
    case kNoExcludes:
      ch["excludes"].asArray().clear();
      excludes_given = true;
      return true;
    case kCompress:
      if (!Flag("compress", optarg, flag, error)) return false;
      ch["compress"] = flag;
      return true;
    case kDelta:
      if (!Flag("delta", optarg, flag, error)) return false;
      ch["block"] = flag;
      return true;
    case kSSH:
      if (!Flag("ssh", optarg, flag, error)) return false;
      ch["ssh"] = flag;
      return true;
    case kSSHPort:
      if (!Number("ssh-port", optarg, 65535, n, error)) return false;
      ch["ssh_port"] = static_cast<unsigned int>(n);
      return true;
    case kMaxBandwidth:
      if (!Number("max-bandwidth", optarg, 4294967295ULL, n, error)) {
        return false;
      }
      ch["max_bandwidth"] = static_cast<unsigned int>(n);
      return true;
    case kSchedule:
      if (!Mode(optarg, mode, error)) return false;
      ch["schedule_mode"] = mode;
      return true;
    case kAt:
      if (!Clock("at", optarg, n, m, error)) return false;
      ch["schedule_begin_hour"] = static_cast<int>(n);
      ch["schedule_begin_min"] = static_cast<int>(m);
      return true;
    case kDays:
      if (!Days(optarg, week, error)) return false;
      ch["week_schd"] = week;
      return true;
    case kBegin:
      return Date(optarg, ch, error);
    case kEvery:
      if (!Clock("every", optarg, n, m, error)) return false;
      ch["period_hour"] = static_cast<int>(n);
      ch["period_minute"] = static_cast<int>(m);
      return true;
    case kRepeat:
      if (!Number("repeat", optarg, 9999, n, error)) return false;
      ch["repeat_times_in_day"] = static_cast<int>(n);
      return true;
    case kEnabled:
      if (!Flag("enabled", optarg, flag, error)) return false;
      ch["enabled"] = flag;
      return true;
    case kDisabled:
      ch["enabled"] = false;
      return true;
    case kDeleteGuard:
      if (!Flag("delete-guard", optarg, flag, error)) return false;
      ch["delete_guard"] = flag;
      return true;
    case kGuardPercent:
      if (!Number("delete-guard-percent", optarg, 100, n, error)) return false;
      ch["delete_guard_percent"] = static_cast<unsigned int>(n);
      return true;
    case kGuardFiles:
      if (!Number("delete-guard-files", optarg, ~0ULL, n, error)) return false;
      ch["delete_guard_files"] = n;
      return true;
    case kSettle:
      if (!Millis("settle", optarg, 600000, n, error)) return false;
      ch["realtime_settle_ms"] = static_cast<unsigned int>(n);
      return true;
    case kMaxDelay:
      if (!Number("max-delay", optarg, 86400, n, error)) return false;
      ch["realtime_max_delay"] = static_cast<unsigned int>(n);
      return true;
    case kFullSync:
      if (!Number("full-sync-every", optarg, 30 * 86400, n, error)) {
        return false;
      }
      ch["realtime_full_sync"] = static_cast<unsigned int>(n);
      return true;
    case kPendingLimit:
      if (!Number("pending-limit", optarg, 10000000, n, error)) return false;
      ch["realtime_pending_limit"] = static_cast<unsigned int>(n);
      return true;
    case kChangeSource:
      if (std::string(optarg) != "auto" && std::string(optarg) != "fanotify" &&
          std::string(optarg) != "inotify") {
        return Fail(error, std::string("bad value for --change-source: ") +
                               optarg + " (auto, fanotify, inotify)");
      }
      ch["realtime_source"] = optarg;
      return true;
  }
  return Fail(error, "unknown option");
}

}  // namespace

const char* CtlUsage() { return kUsage; }

bool ParseCtlArgs(int argc, char** argv, CtlOptions& o, std::string& error) {
  o.changes.asMap().clear();
  bool shares_given = false;
  bool excludes_given = false;
  bool limit_given = false;
  optind = 0;
  opterr = 0;
  int c;
  while ((c = getopt_long(argc, argv, "vh", kOptions, nullptr)) != -1) {
    switch (c) {
      case kRoot:
        o.root = optarg;
        break;
      case kSocket:
        o.socket = optarg;
        break;
      case kJson:
        o.json = true;
        break;
      case kLimit:
        // The daemon keeps 50 runs a task; 0 would read as "not given".
        if (!Number("limit", optarg, 50, o.limit, error) || o.limit == 0) {
          return Fail(error, std::string("bad value for --limit: ") + optarg +
                                 " (1 to 50)");
        }
        limit_given = true;
        break;
      case kDryRun:
        o.dry_run = true;
        break;
      case kConfirmDeletions:
        o.confirm_deletions = true;
        break;
      case kPassword:
        return Fail(error,
                    "a password on the command line is visible to every "
                    "user; use --password-file or S2S_PASSWORD");
      case 'v':
        ++o.verbose;
        break;
      case 'h':
        o.help = true;
        break;
      case 'V':
        o.version = true;
        break;
      case '?':
      case ':':
        return Fail(error,
                    std::string("unknown or incomplete option ") +
                        (optind > 0 && optind <= argc ? argv[optind - 1] : ""));
      default:
        if (!TaskOption(c, o, shares_given, excludes_given, error)) {
          return false;
        }
    }
  }
  if (o.help || o.version) return true;
  std::vector<std::string> words(argv + optind, argv + argc);
  size_t used = 0;
  if (words.empty()) return Fail(error, "no command");
  o.command = words[used++];
  if (o.command == "task") {
    if (words.size() < 2) return Fail(error, "task: no subcommand");
    o.command += " " + words[used++];
  }
  const Command* command = nullptr;
  for (const Command& k : kCommands) {
    if (o.command == k.name) command = &k;
  }
  if (command == nullptr) return Fail(error, "unknown command " + o.command);
  if (command->needs_target) {
    if (used == words.size()) return Fail(error, o.command + ": no TASK");
    o.target = words[used++];
    if (o.target.empty()) return Fail(error, o.command + ": empty TASK");
  }
  if (used != words.size()) {
    return Fail(error, o.command + ": unexpected argument " + words[used]);
  }
  if (o.has_task_options && !command->takes_task_options) {
    return Fail(error, o.command + " takes no task options");
  }
  if (limit_given && o.command != "history") {
    return Fail(error, "--limit is for history");
  }
  if ((o.dry_run || o.confirm_deletions) && o.command != "run") {
    return Fail(error, "--dry-run and --confirm-deletions are for run");
  }
  if (o.command == "task edit" && o.changes.hasMember("id")) {
    return Fail(error, "task edit: a task's id does not change");
  }
  return true;
}

}  // namespace s2s_tools
