// s2s-cmd-handler: the program the server's rsync daemon runs from its hooks.
//
//   s2s-cmd-handler [--root DIR] [--old-server] MODE
//   s2s-cmd-handler --help | --version
//
// --root sets the appliance root (as S2S_ROOT does) for the registry, the
// share configuration and the spool directories.
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include "S2S/logger.h"
#include "hooks.h"
#include "karo_root.h"

namespace {

const char kHelp[] =
    "usage: s2s-cmd-handler [--root DIR] [--old-server] MODE\n"
    "       s2s-cmd-handler --help | --version\n"
    "\n"
    "Run by the server's rsync daemon from the hooks of its configuration\n"
    "(written by s2s-server), not by hand:\n"
    "  early  spools the early input of a connection to the command module\n"
    "  pre    reads the command, carries it out and writes its reply\n"
    "  post   removes the connection's spool, upload and reply files\n"
    "  data   lets a push into a share through only from the client that\n"
    "         holds the share's running sync\n"
    "  keys   the same for the share's key file in the key module\n"
    "  keys-done    removes what is not a plain file from the key directory\n"
    "  upload       admits one new command file per request id to the spool\n"
    "  upload-done  removes oversized or non-regular files from the spool\n"
    "\n"
    "  --root DIR     appliance root (as $S2S_ROOT) of the registry, shares\n"
    "                 and spool directories\n"
    "  --old-server   answer as a server of protocol version 0\n"
    "\n"
    "Its inputs are the daemon's RSYNC_* variables; it logs to syslog.\n"
    "Exit codes: 0 lets the transfer go on, 2 usage, anything else refuses.\n";

}  // namespace

int main(int argc, char** argv) {
  bool old_server = false;
  const char* mode = nullptr;
  for (int i = 1; i < argc; ++i) {
    if (strcmp(argv[i], "--help") == 0) {
      fputs(kHelp, stdout);
      return 0;
    }
    if (strcmp(argv[i], "--version") == 0) {
      printf("s2s-cmd-handler %s\n", S2S_VERSION);
      return 0;
    }
    if (strcmp(argv[i], "--root") == 0 && i + 1 < argc) {
      setenv(KARO_ROOT_ENV, argv[++i], 1);
    } else if (strcmp(argv[i], "--old-server") == 0) {
      old_server = true;
    } else if (mode == nullptr) {
      mode = argv[i];
    } else {
      mode = nullptr;
      break;
    }
  }
  if (mode == nullptr) {
    fprintf(stderr,
            "usage: %s [--root DIR] [--old-server] "
            "early|pre|post|data|keys|keys-done|upload|upload-done\n",
            argv[0]);
    return 2;
  }
  S2S::Logger::Initialize(S2S::Logger::Syslog, S2S::Logger::Note, "", 0);
  using namespace S2S::server;
  HookEnv env = HookEnv::FromEnvironment();
  if (strcmp(mode, "early") == 0) return EarlyHook(env, stdin);
  if (strcmp(mode, "pre") == 0) {
    int rc = PreHook(env, old_server, stdout);
    fflush(stdout);
    CleanUpAfterConnection(env);
    return rc;
  }
  if (strcmp(mode, "post") == 0) return PostHook(env);
  if (strcmp(mode, "data") == 0) return DataHook(env, stdout);
  if (strcmp(mode, "keys") == 0) return KeyHook(env, stdout);
  if (strcmp(mode, "keys-done") == 0) return KeyDoneHook();
  if (strcmp(mode, "upload") == 0) return UploadHook(env, stdout);
  if (strcmp(mode, "upload-done") == 0) return UploadDoneHook();
  fprintf(stderr, "%s: unknown mode %s\n", argv[0], mode);
  return 2;
}
