#include "client_options.h"

#include <getopt.h>
#include <string.h>

namespace s2s_tools {

namespace {

enum Option {
  kRoot = 256,
  kTaskFile,
  kServerIP,
  kServerName,
  kPort,
  kUser,
  kPasswordFile,
  kPassword,
  kShare,
  kExclude,
  kTask,
  kTaskId,
  kCompress,
  kDelta,
  kSSH,
  kSSHPort,
  kMaxBandwidth,
  kBeacon,
  kVersion,
  kDryRun,
  kConfirmDeletions,
  kDeleteGuard,
  kGuardPercent,
  kGuardFiles,
};

const struct option kOptions[] = {
    {"root", required_argument, nullptr, kRoot},
    {"task-file", required_argument, nullptr, kTaskFile},
    {"server-ip", required_argument, nullptr, kServerIP},
    {"server-name", required_argument, nullptr, kServerName},
    {"port", required_argument, nullptr, kPort},
    {"user", required_argument, nullptr, kUser},
    {"password-file", required_argument, nullptr, kPasswordFile},
    {"password", required_argument, nullptr, kPassword},
    {"share", required_argument, nullptr, kShare},
    {"exclude", required_argument, nullptr, kExclude},
    {"task", required_argument, nullptr, kTask},
    {"task-id", required_argument, nullptr, kTaskId},
    {"compress", no_argument, nullptr, kCompress},
    {"delta", no_argument, nullptr, kDelta},
    {"ssh", no_argument, nullptr, kSSH},
    {"ssh-port", required_argument, nullptr, kSSHPort},
    {"max-bandwidth", required_argument, nullptr, kMaxBandwidth},
    {"beacon-interval", required_argument, nullptr, kBeacon},
    {"dry-run", no_argument, nullptr, kDryRun},
    {"confirm-deletions", no_argument, nullptr, kConfirmDeletions},
    {"delete-guard", required_argument, nullptr, kDeleteGuard},
    {"delete-guard-percent", required_argument, nullptr, kGuardPercent},
    {"delete-guard-files", required_argument, nullptr, kGuardFiles},
    {"verbose", no_argument, nullptr, 'v'},
    {"help", no_argument, nullptr, 'h'},
    {"version", no_argument, nullptr, kVersion},
    {nullptr, 0, nullptr, 0},
};

const char kUsage[] =
    "usage: s2s-client [options]\n"
    "       s2s-client [--root DIR] init --share NAME[=PATH]... (init --help)\n"
    "\n"
    "Runs one sync task: probes the server, pairs the shares, then starts,\n"
    "transfers and finishes each share, with beacons while it runs.\n"
    "\n"
    "  --root DIR             appliance root (default: $S2S_ROOT, else /)\n"
    "  --task-file FILE       read the task from FILE ([Task] section file);\n"
    "                         the options below override it\n"
    "  --task NAME            task name\n"
    "  --task-id N            task id (default 1)\n"
    "  --server-ip ADDR       server address\n"
    "  --server-name NAME     server name (with an address as well, the\n"
    "                         machine at ADDR is asked for its name first)\n"
    "  --port PORT            port of the server's rsync daemon (default 873)\n"
    "  --user USER            daemon user\n"
    "  --password-file FILE   the password, in a file of mode 0600; without\n"
    "                         it the password comes from $S2S_PASSWORD\n"
    "  --share NAME           a local share to sync (repeatable)\n"
    "  --exclude RULE         an rsync exclude rule (repeatable)\n"
    "  --compress             compress data on the wire\n"
    "  --max-bandwidth KIB    at most KIB KiB/s on the wire (0: no limit)\n"
    "  --delta                block-level (delta) transfer\n"
    "  --ssh                  go through SSH; --ssh-port PORT\n"
    "  --beacon-interval SEC  seconds between beacons during a run (30)\n"
    "  --dry-run              show what would be sent and deleted; the\n"
    "                         server changes nothing, records no sync\n"
    "  --delete-guard yes|no  hold back deletions of more than\n"
    "                         --delete-guard-percent P (50) % of the\n"
    "                         server's copy or --delete-guard-files N\n"
    "                         (10000) entries, whichever is fewer (yes)\n"
    "  --confirm-deletions    this run deletes past the guard\n"
    "  -v, --verbose          log INFO; twice: DEBUG and rsync's output\n"
    "  -h, --help             this text; --version: the version\n"
    "\n"
    "Exit codes:\n"
    "  0  every share synced\n"
    "  1  local failure (temporary directory, signal handling)\n"
    "  2  usage: bad option, task file, incomplete task, unknown local\n"
    "     share, missing or unsafe password file\n"
    "  3  server unreachable: no address answered, or no protocol version\n"
    "  4  pairing refused, or shares fed by another client\n"
    "  5  a share failed to start, transfer or finish\n"
    "  6  cancelled by SIGINT or SIGTERM\n"
    "  7  another run of the task (or an rsync it left) is still running\n"
    "  8  the delete guard held back a share's deletions (the rest was\n"
    "     synced): check, then run again with --confirm-deletions\n";

bool Number(const char* name, const char* text, unsigned long long max,
            unsigned long long& out, std::string& error) {
  if (ParseNumber(text, max, out)) return true;
  error = std::string("bad value for --") + name + ": " + text;
  return false;
}

}  // namespace

const char* ClientUsage() { return kUsage; }

bool ParseClientArgs(int argc, char** argv, ClientOptions& o,
                     std::string& error) {
  for (int i = 1; i < argc; ++i) {
    if (strcmp(argv[i], "--task-file") == 0 && i + 1 < argc) {
      o.task_file = argv[i + 1];
    } else if (strncmp(argv[i], "--task-file=", 12) == 0) {
      o.task_file = argv[i] + 12;
    }
  }
  if (!o.task_file.empty() && !LoadTaskFile(o.task_file, o.spec, error)) {
    return false;
  }
  bool shares_given = false;
  bool excludes_given = false;
  optind = 0;
  opterr = 0;
  int c;
  unsigned long long n = 0;
  while ((c = getopt_long(argc, argv, "+vh", kOptions, nullptr)) != -1) {
    switch (c) {
      case kRoot:
        o.root = optarg;
        break;
      case kTaskFile:
        break;
      case kServerIP:
        o.spec.server_ip = optarg;
        break;
      case kServerName:
        o.spec.server_name = optarg;
        break;
      case kPort:
        if (!Number("port", optarg, 65535, n, error)) return false;
        o.spec.port = static_cast<unsigned int>(n);
        break;
      case kUser:
        o.spec.user = optarg;
        break;
      case kPasswordFile:
        o.spec.password_file = optarg;
        break;
      case kPassword:
        error =
            "a password on the command line is visible to every user; use "
            "--password-file or S2S_PASSWORD";
        return false;
      case kShare:
        if (!shares_given) o.spec.shares.clear();
        shares_given = true;
        o.spec.shares.push_back(optarg);
        break;
      case kExclude:
        if (!excludes_given) o.spec.excludes.clear();
        excludes_given = true;
        o.spec.excludes.push_back(optarg);
        break;
      case kTask:
        o.spec.name = optarg;
        break;
      case kTaskId:
        if (!Number("task-id", optarg, ~0ULL, n, error)) return false;
        o.spec.id = n;
        break;
      case kCompress:
        o.spec.compress = true;
        break;
      case kDelta:
        o.spec.delta = true;
        break;
      case kSSH:
        o.spec.ssh = true;
        break;
      case kSSHPort:
        if (!Number("ssh-port", optarg, 65535, n, error)) return false;
        o.spec.ssh_port = static_cast<unsigned int>(n);
        break;
      case kMaxBandwidth:
        if (!Number("max-bandwidth", optarg, 4294967295ULL, n, error)) {
          return false;
        }
        o.spec.max_bandwidth = static_cast<unsigned int>(n);
        break;
      case kBeacon:
        if (!Number("beacon-interval", optarg, 86400, n, error)) return false;
        o.beacon_interval = static_cast<unsigned int>(n);
        break;
      case kDryRun:
        o.dry_run = true;
        break;
      case kConfirmDeletions:
        o.confirm_deletions = true;
        break;
      case kDeleteGuard:
        if (!ParseFlag(optarg, o.spec.guard.on)) {
          error = std::string("bad value for --delete-guard: ") + optarg;
          return false;
        }
        break;
      case kGuardPercent:
        if (!Number("delete-guard-percent", optarg, 100, n, error)) {
          return false;
        }
        o.spec.guard.percent = static_cast<unsigned int>(n);
        break;
      case kGuardFiles:
        if (!Number("delete-guard-files", optarg, ~0ULL, n, error)) {
          return false;
        }
        o.spec.guard.files = n;
        break;
      case 'v':
        ++o.verbose;
        break;
      case 'h':
        o.help = true;
        break;
      case kVersion:
        o.version = true;
        break;
      default:
        error = std::string("unknown or incomplete option ") +
                (optind > 0 && optind <= argc ? argv[optind - 1] : "");
        return false;
    }
  }
  if (optind < argc) {
    error = std::string("unexpected argument ") + argv[optind];
    return false;
  }
  return true;
}

}  // namespace s2s_tools
