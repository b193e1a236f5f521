// s2s-server: sets up and runs the server appliance.
//
//   s2s-server [--root DIR] init [--share NAME[=PATH]]... [--hostname NAME]
//              [--serial SERIAL] [--user USER [--password-file FILE]]
//   s2s-server [--root DIR] config --user USER [--password-file FILE]
//   s2s-server [--root DIR] start [--port PORT] [--address ADDR]
//   s2s-server [--root DIR] stop | status [--json] | pairings [--json]
//   s2s-server [--root DIR] share add NAME[=PATH] [--encrypted]
//   s2s-server [--root DIR] share remove NAME | share list
//   s2s-server [--root DIR] release SHARE | reset-pairing
//   s2s-server [--root DIR] ssh-setup --user USER --key-file FILE
//              [--authorized-keys FILE]
//
// Exit codes: 0 done, 1 failed, 2 usage, 3 the daemon is not running
// (status, pairings).
#include <fcntl.h>
#include <getopt.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/file.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "S2S/is_syncedshare.h"
#include "S2S/logger.h"
#include "karo_root.h"
#include "root_files.h"
#include "secret.h"
#include "server/command_file.h"
#include "server/hooks.h"
#include "server_daemon.h"
#include "server_report.h"
#include "server_root.h"
#include "server_shares.h"
#include "server_ssh.h"

namespace {

using namespace s2s_tools;

const char kUsage[] =
    "usage: s2s-server [--root DIR] COMMAND [options]\n"
    "\n"
    "  init     create the root: --share NAME[=PATH] (repeatable; default\n"
    "           path <root>/volume1/NAME) [--encrypted], --hostname NAME,\n"
    "           --serial SERIAL; with --user also writes the daemon\n"
    "           configuration, without it rewrites an existing one\n"
    "  config   write the daemon configuration: --user USER, the password\n"
    "           from --password-file FILE (mode 0600) or $S2S_PASSWORD,\n"
    "           [--handler PROGRAM] [--old-server]\n"
    "  start    start the rsync daemon: [--port PORT] (default: a free one)\n"
    "           [--address ADDR] (default 127.0.0.1); prints pid and port\n"
    "  stop     stop the daemon of this root (by its pid file)\n"
    "  status   service status, daemon, shares and tasks [--json]\n"
    "  pairings the pairing registry, section by section [--json]\n"
    "  share add NAME[=PATH] [--encrypted] | share remove NAME | share list\n"
    "           change the shares; the daemon configuration follows\n"
    "  release SHARE\n"
    "           clear the share's running sync (a client that stopped\n"
    "           without finishing it)\n"
    "  reset-pairing\n"
    "           forget the client the server is bound to: open to several\n"
    "           clients again\n"
    "  ssh-setup --user USER --key-file FILE [--authorized-keys FILE]\n"
    "           SSH mode: the client's key may log in as the daemon user\n"
    "           only to run the daemon; run as root\n"
    "\n"
    "The root comes from --root or $S2S_ROOT. --help: this text; --version:\n"
    "the version.\n"
    "Exit codes: 0 done, 1 failed, 2 usage, 3 the daemon is not running\n"
    "(status, pairings).\n";

enum Option {
  kRoot = 256,
  kShare,
  kHostname,
  kSerial,
  kUser,
  kPasswordFile,
  kPassword,
  kHandler,
  kOldServer,
  kPort,
  kAddress,
  kVersion,
  kJson,
  kEncrypted,
  kKeyFile,
  kAuthorizedKeys,
};

const struct option kOptions[] = {
    {"root", required_argument, nullptr, kRoot},
    {"share", required_argument, nullptr, kShare},
    {"hostname", required_argument, nullptr, kHostname},
    {"serial", required_argument, nullptr, kSerial},
    {"user", required_argument, nullptr, kUser},
    {"password-file", required_argument, nullptr, kPasswordFile},
    {"password", required_argument, nullptr, kPassword},
    {"handler", required_argument, nullptr, kHandler},
    {"old-server", no_argument, nullptr, kOldServer},
    {"port", required_argument, nullptr, kPort},
    {"address", required_argument, nullptr, kAddress},
    {"help", no_argument, nullptr, 'h'},
    {"version", no_argument, nullptr, kVersion},
    {"json", no_argument, nullptr, kJson},
    {"encrypted", no_argument, nullptr, kEncrypted},
    {"key-file", required_argument, nullptr, kKeyFile},
    {"authorized-keys", required_argument, nullptr, kAuthorizedKeys},
    {nullptr, 0, nullptr, 0},
};

struct Args {
  std::string command;
  std::vector<std::string> words;  // what follows the command
  std::string root;
  RootSpec spec;
  std::string user;
  std::string password_file;
  std::string handler;
  bool old_server = false;
  int port = 0;
  std::string address = "127.0.0.1";
  bool json = false;
  SshSetup ssh;
};

int Usage(const std::string& error) {
  fprintf(stderr, "s2s-server: %s\n(try --help)\n", error.c_str());
  return 2;
}

std::string BadShare(const std::string& spec) {
  return "bad share " + spec + ": NAME[=PATH], NAME of " +
         S2S::server::kShareNameRule + ", PATH absolute";
}

int Fail(const std::string& error) {
  fprintf(stderr, "s2s-server: %s\n", error.c_str());
  return 1;
}

// The handler and the password that config writes, read before anything
// is changed. 0, or the exit code with the reason printed.
int ConfigInputs(const Args& a, std::string& handler, std::string& password) {
  handler = a.handler.empty() ? DefaultHandler() : a.handler;
  if (handler.empty()) return Fail("no s2s-cmd-handler beside this program");
  std::string error;
  if (!ReadPassword(a.password_file, password, error)) return Fail(error);
  return 0;
}

int WriteConfig(const Args& a, const std::string& handler,
                const std::string& password) {
  std::string error;
  if (!WriteServerConfig(handler, a.user, password, a.old_server, error)) {
    return Fail(error);
  }
  printf("config: daemon user %s, hooks run %s\n", a.user.c_str(),
         handler.c_str());
  return 0;
}

int Config(const Args& a) {
  std::string handler, password;
  int rc = ConfigInputs(a, handler, password);
  return rc != 0 ? rc : WriteConfig(a, handler, password);
}

// After a change of the shares: the daemon configuration follows.
int Regenerate() {
  std::string error;
  int rc = RegenerateServerConfig(error);
  if (rc < 0) return Fail(error);
  if (rc > 0) {
    printf(
        "config: daemon configuration rewritten; the daemon serves it "
        "from its next connection\n");
  }
  return 0;
}

int AddShares(const Args& a) {
  std::string error;
  if (!InitServerRoot(a.spec, error)) return Fail(error);
  for (const ShareSpec& s : a.spec.shares) {
    printf("share: %s added%s\n", s.name.c_str(),
           s.encrypted ? " (encrypted)" : "");
  }
  return Regenerate();
}

// The commands that read an existing root refuse a missing one.
bool RootReady() {
  std::string registry = KaroRootPath("/usr/karo/etc/karoS2S.info");
  return access(registry.c_str(), F_OK) == 0;
}

int Share(const Args& a) {
  const std::vector<std::string>& w = a.words;
  std::string error;
  if (w.size() == 2 && w[0] == "add") {
    Args add = a;
    add.spec.shares.clear();
    ShareSpec s;
    if (!ParseShareSpec(w[1], s)) return Usage(BadShare(w[1]));
    s.encrypted = a.spec.encrypted;
    add.spec.shares.push_back(s);
    add.spec.add_only = true;
    return AddShares(add);
  }
  if (w.size() == 2 && w[0] == "remove") {
    if (!RemoveServerShare(w[1], error)) return Fail(error);
    printf("share: %s removed (its data stays)\n", w[1].c_str());
    return Regenerate();
  }
  if (w.size() == 1 && w[0] == "list") {
    return PrintShares(stdout) == 0 ? 0 : Fail("cannot read the shares");
  }
  return Usage("share add NAME[=PATH] | share remove NAME | share list");
}

int Run(const Args& a) {
  std::string error;
  bool has_words = !a.words.empty();
  if (a.command == "init" && !has_words) {
    std::string handler, password;
    if (!a.user.empty()) {
      int rc = ConfigInputs(a, handler, password);
      if (rc != 0) return rc;
    }
    if (!InitServerRoot(a.spec, error)) return Fail(error);
    for (const ShareSpec& s : a.spec.shares) {
      printf("init: share %s\n", s.name.c_str());
    }
    printf("init: root %s ready\n", KaroRootPrefix());
    return a.user.empty() ? Regenerate() : WriteConfig(a, handler, password);
  }
  if (a.command == "config" && !has_words) return Config(a);
  if (a.command == "start" && !has_words) {
    pid_t pid = -1;
    int port = 0;
    if (!StartServerDaemon(a.address, a.port, pid, port, error)) {
      return Fail(error);
    }
    printf("daemon: pid %ld, port %d\n", static_cast<long>(pid), port);
    return 0;
  }
  if (a.command == "ssh-setup" && !has_words) {
    SshSetup ssh = a.ssh;
    ssh.user = a.user;
    std::string done;
    if (!SetUpSsh(ssh, done, error)) return Fail(error);
    printf("%s\n", done.c_str());
    return 0;
  }
  if (a.command == "stop" && !has_words) {
    int rc = StopServerDaemon(error);
    if (rc < 0) return Fail(error);
    printf("daemon: %s\n", rc == 1 ? "stopped" : "was not running");
    return 0;
  }
  bool reads_root = a.command == "status" || a.command == "pairings" ||
                    a.command == "share" || a.command == "release" ||
                    a.command == "reset-pairing";
  if (!reads_root) return Usage("unknown command " + a.command);
  if (!RootReady()) {
    return Fail(std::string("no server root at ") + KaroRootPrefix() +
                " (run s2s-server init)");
  }
  if (a.command == "share") return Share(a);
  if (a.command == "release" && !has_words) {
    return Usage("release: give the share's name");
  }
  if (has_words != (a.command == "release") || a.words.size() > 1) {
    return Usage("unexpected arguments to " + a.command);
  }
  if (a.command == "status") return PrintStatus(stdout, a.json) == 0 ? 0 : 3;
  if (a.command == "pairings") {
    if (PrintPairings(stdout, a.json) != 0) {
      return Fail("cannot read the registry");
    }
    pid_t pid;
    int port;
    return DaemonAlive(pid, port) ? 0 : 3;
  }
  if (a.command == "release") {
    std::string was;
    if (!ReleaseShare(a.words[0], was, error)) return Fail(error);
    if (was.empty()) {
      printf("release: share %s had no running sync\n", a.words[0].c_str());
    } else {
      printf("release: share %s released from the sync of client %s\n",
             a.words[0].c_str(), was.c_str());
    }
    return 0;
  }
  // Only a server bound to one client has a pairing to forget.
  int bound = S2SServerIfOldClientPaired();
  if (bound < 0) return Fail("cannot read the registry");
  if (bound == 0) {
    printf(
        "reset-pairing: not bound to one client; open to several "
        "clients\n");
    return 0;
  }
  S2S_SVR_STATUS st = {};
  s2s_svr_get_status(&st);
  std::string was = st.clientID != nullptr ? st.clientID : "";
  s2s_svr_put_status(&st);
  if (s2s_svr_reset_pair() != 0) return Fail("cannot reset the pairing");
  printf("reset-pairing: client %s forgotten; open to several clients\n",
         was.c_str());
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  Args a;
  opterr = 0;
  int c;
  ShareSpec share;
  while ((c = getopt_long(argc, argv, "h", kOptions, nullptr)) != -1) {
    switch (c) {
      case kRoot:
        a.root = optarg;
        break;
      case kShare:
        if (!ParseShareSpec(optarg, share)) {
          return Usage(BadShare(optarg));
        }
        a.spec.shares.push_back(share);
        break;
      case kHostname:
        a.spec.hostname = optarg;
        break;
      case kSerial:
        a.spec.serial = optarg;
        break;
      case kUser:
        a.user = optarg;
        break;
      case kPasswordFile:
        a.password_file = optarg;
        break;
      case kPassword:
        return Usage(
            "a password on the command line is visible to every "
            "user; use --password-file or S2S_PASSWORD");
      case kHandler:
        a.handler = optarg;
        break;
      case kOldServer:
        a.old_server = true;
        break;
      case kPort:
        a.port = atoi(optarg);
        if (a.port <= 0 || a.port > 65535) {
          return Usage(std::string("bad port ") + optarg);
        }
        break;
      case kAddress:
        a.address = optarg;
        break;
      case 'h':
        fputs(kUsage, stdout);
        return 0;
      case kVersion:
        printf("s2s-server %s\n", S2S_VERSION);
        return 0;
      case kJson:
        a.json = true;
        break;
      case kEncrypted:
        a.spec.encrypted = true;
        break;
      case kKeyFile:
        a.ssh.key_file = optarg;
        break;
      case kAuthorizedKeys:
        a.ssh.authorized_keys = optarg;
        break;
      default:
        return Usage(std::string("unknown or incomplete option ") +
                     argv[optind - 1]);
    }
  }
  if (optind >= argc) return Usage("give a command");
  a.command = argv[optind];
  a.words.assign(argv + optind + 1, argv + argc);
  for (ShareSpec& s : a.spec.shares) s.encrypted = a.spec.encrypted;
  if (!a.root.empty()) setenv(KARO_ROOT_ENV, a.root.c_str(), 1);
  const char* root = getenv(KARO_ROOT_ENV);
  if (root == nullptr || *root == '\0') {
    return Usage(
        "no root: give --root DIR or set S2S_ROOT (--root / for "
        "the real one)");
  }
  if (a.command == "config" && a.user.empty()) {
    return Usage("config needs --user USER");
  }
  if (!a.user.empty() && !S2S::server::IsValidDaemonUser(a.user)) {
    return Usage("bad daemon user " + a.user + " (" +
                 S2S::server::kDaemonUserRule + ")");
  }
  // The daemon's configuration names paths under the root, and the daemon
  // runs elsewhere: a relative root is made absolute here.
  std::error_code ec;
  std::string absolute =
      std::filesystem::absolute(root, ec).lexically_normal().string();
  if (ec) return Usage(std::string("bad root ") + root);
  if (absolute.size() > 1 && absolute.back() == '/') absolute.pop_back();
  setenv(KARO_ROOT_ENV, absolute.c_str(), 1);
  // One change of a root at a time (two shares added at once would each
  // rewrite the configuration from what it read): its directory is the
  // lock, held until this program ends.
  bool reads_only = a.command == "status" || a.command == "pairings" ||
                    (a.command == "share" && a.words.size() == 1);
  if (!reads_only) {
    std::string error;
    if (a.command == "init" && !MakeDirs(absolute, error)) return Fail(error);
    int lock = open(absolute.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (lock >= 0) flock(lock, LOCK_EX);
  }
  if (a.command == "ssh-setup" && (a.user.empty() || a.ssh.key_file.empty())) {
    return Usage("ssh-setup: --user USER --key-file FILE");
  }
  S2S::Logger::Initialize(S2S::Logger::Stderr, S2S::Logger::Warning, "", 0);
  return Run(a);
}
