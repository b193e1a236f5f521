// s2s-server: sets up and runs the server appliance.
//
//   s2s-server [--root DIR] init [--share NAME[=PATH]]... [--hostname NAME]
//              [--serial SERIAL] [--user USER [--password-file FILE]]
//   s2s-server [--root DIR] config --user USER [--password-file FILE]
//   s2s-server [--root DIR] start [--port PORT] [--address ADDR]
//   s2s-server [--root DIR] stop | status | pairings
//
// Exit codes: 0 done, 1 failed, 2 usage.
#include <getopt.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <string>

#include "S2S/logger.h"
#include "karo_root.h"
#include "secret.h"
#include "server_daemon.h"
#include "server_report.h"
#include "server_root.h"

namespace {

using namespace s2s_tools;

const char kUsage[] =
    "usage: s2s-server [--root DIR] COMMAND [options]\n"
    "\n"
    "  init     create the root: --share NAME[=PATH] (repeatable; default\n"
    "           path <root>/volume1/NAME), --hostname NAME, --serial SERIAL;\n"
    "           with --user also writes the daemon configuration\n"
    "  config   write the daemon configuration: --user USER, the password\n"
    "           from --password-file FILE (mode 0600) or $S2S_PASSWORD,\n"
    "           [--handler PROGRAM] [--old-server]\n"
    "  start    start the rsync daemon: [--port PORT] (default: a free one)\n"
    "           [--address ADDR] (default 127.0.0.1); prints pid and port\n"
    "  stop     stop the daemon of this root (by its pid file)\n"
    "  status   service status, daemon, shares and tasks\n"
    "  pairings the pairing registry, section by section\n"
    "\n"
    "The root comes from --root or $S2S_ROOT.\n"
    "Exit codes: 0 done, 1 failed, 2 usage.\n";

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
    {nullptr, 0, nullptr, 0},
};

struct Args {
  std::string command;
  std::string root;
  RootSpec spec;
  std::string user;
  std::string password_file;
  std::string handler;
  bool old_server = false;
  int port = 0;
  std::string address = "127.0.0.1";
};

int Usage(const std::string& error) {
  fprintf(stderr, "s2s-server: %s\n(try --help)\n", error.c_str());
  return 2;
}

int Fail(const std::string& error) {
  fprintf(stderr, "s2s-server: %s\n", error.c_str());
  return 1;
}

int Config(const Args& a) {
  std::string handler = a.handler.empty() ? DefaultHandler() : a.handler;
  if (handler.empty()) return Fail("no s2s-cmd-handler beside this program");
  std::string password, error;
  if (!ReadPassword(a.password_file, password, error)) return Fail(error);
  if (!WriteServerConfig(handler, a.user, password, a.old_server, error)) {
    return Fail(error);
  }
  printf("config: daemon user %s, hooks run %s\n", a.user.c_str(),
         handler.c_str());
  return 0;
}

int Run(const Args& a) {
  std::string error;
  if (a.command == "init") {
    if (!InitServerRoot(a.spec, error)) return Fail(error);
    for (const ShareSpec& s : a.spec.shares) {
      printf("init: share %s\n", s.name.c_str());
    }
    printf("init: root %s ready\n", KaroRootPrefix());
    return a.user.empty() ? 0 : Config(a);
  }
  if (a.command == "config") return Config(a);
  if (a.command == "start") {
    pid_t pid = -1;
    int port = 0;
    if (!StartServerDaemon(a.address, a.port, pid, port, error)) {
      return Fail(error);
    }
    printf("daemon: pid %ld, port %d\n", static_cast<long>(pid), port);
    return 0;
  }
  if (a.command == "stop") {
    int rc = StopServerDaemon(error);
    if (rc < 0) return Fail(error);
    printf("daemon: %s\n", rc == 1 ? "stopped" : "was not running");
    return 0;
  }
  if (a.command == "status") return PrintStatus(stdout) == 0 ? 0 : 1;
  if (a.command == "pairings") {
    return PrintPairings(stdout) == 0 ? 0 : Fail("cannot read the registry");
  }
  return Usage("unknown command " + a.command);
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
          return Usage(std::string("bad share ") + optarg);
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
      default:
        return Usage(std::string("unknown or incomplete option ") +
                     argv[optind - 1]);
    }
  }
  if (optind + 1 != argc) return Usage("give exactly one command");
  a.command = argv[optind];
  if (!a.root.empty()) setenv(KARO_ROOT_ENV, a.root.c_str(), 1);
  const char* root = getenv(KARO_ROOT_ENV);
  if (root == nullptr || *root == '\0') {
    return Usage(
        "no root: give --root DIR or set S2S_ROOT (--root / for "
        "the real one)");
  }
  if (a.command == "config" && a.user.empty()) return Usage("config: --user");
  S2S::Logger::Initialize(S2S::Logger::Stderr, S2S::Logger::Warning, "", 0);
  return Run(a);
}
