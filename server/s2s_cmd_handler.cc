// s2s-cmd-handler: the program the server's rsync daemon runs from its hooks.
//
//   s2s-cmd-handler [--root DIR] [--old-server] MODE
//   s2s-cmd-handler -c "HOOK LINE"
//   s2s-cmd-handler --help | --version
//
// --root sets the appliance root (as S2S_ROOT does) for the registry, the
// share configuration and the spool directories. "-c" makes it the shell
// the daemon runs its hooks through (RSYNC_SHELL): a hook line of its own
// configuration runs without a shell in between, any other goes to
// /bin/sh.
#include <limits.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <sstream>
#include <string>
#include <vector>

#include "S2S/logger.h"
#include "daemon_config.h"
#include "hooks.h"
#include "karo_root.h"

namespace {

const char kHelp[] =
    "usage: s2s-cmd-handler [--root DIR] [--old-server] MODE\n"
    "       s2s-cmd-handler --help | --version\n"
    "\n"
    "Run by the server's rsync daemon from the hooks of its configuration\n"
    "(written by s2s-server), not by hand:\n"
    "  early  reads the early input of a connection to the command module,\n"
    "         carries the command out, writes its reply and leaves a cleaner\n"
    "         that removes the connection's upload and reply files\n"
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
    "  -c LINE        run a hook line as the daemon's hook shell would\n"
    "\n"
    "Its inputs are the daemon's RSYNC_* variables; it logs to syslog.\n"
    "Exit codes: 0 lets the transfer go on, 2 usage, anything else refuses.\n";

// "-c LINE" from the daemon: the words of LINE when it is a hook line this
// program's configuration wrote, "exec PROGRAM ARGS...", with PROGRAM this
// very program; otherwise the system's shell runs LINE.
std::vector<std::string> HookWords(const char* line) {
  std::vector<std::string> words;
  std::istringstream split(line);
  for (std::string word; std::getline(split, word, ' ');) {
    if (!S2S::server::ShellSafe(word)) return {};
    if (!word.empty()) words.push_back(word);
  }
  if (words.size() < 3 || words[0] != "exec") return {};
  char self[PATH_MAX], named[PATH_MAX];
  ssize_t n = readlink("/proc/self/exe", self, sizeof self - 1);
  if (n <= 0 || realpath(words[1].c_str(), named) == nullptr) return {};
  self[n] = '\0';
  if (strcmp(self, named) != 0) return {};
  words.erase(words.begin());
  return words;
}

}  // namespace

int main(int argc, char** argv) {
  std::vector<std::string> words;
  std::vector<char*> hook_argv;
  if (argc == 3 && strcmp(argv[1], "-c") == 0) {
    words = HookWords(argv[2]);
    if (words.empty()) {
      execl("/bin/sh", "sh", "-c", argv[2], static_cast<char*>(nullptr));
      perror("/bin/sh");
      return 127;
    }
    for (std::string& w : words) hook_argv.push_back(&w[0]);
    hook_argv.push_back(nullptr);
    argc = static_cast<int>(words.size());
    argv = hook_argv.data();
  }
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
            "early|data|keys|keys-done|upload|upload-done\n",
            argv[0]);
    return 2;
  }
  S2S::Logger::Initialize(S2S::Logger::Syslog, S2S::Logger::Note, "", 0);
  using namespace S2S::server;
  HookEnv env = HookEnv::FromEnvironment();
  if (strcmp(mode, "early") == 0) {
    std::string id;
    int rc = CommandHook(env, old_server, stdin, &id);
    if (rc == 0) CleanUpAfterConnection(env, id);
    return rc;
  }
  if (strcmp(mode, "data") == 0) return DataHook(env, stdout);
  if (strcmp(mode, "keys") == 0) return KeyHook(env, stdout);
  if (strcmp(mode, "keys-done") == 0) return KeyDoneHook();
  if (strcmp(mode, "upload") == 0) return UploadHook(env, stdout);
  if (strcmp(mode, "upload-done") == 0) return UploadDoneHook();
  fprintf(stderr, "%s: unknown mode %s\n", argv[0], mode);
  return 2;
}
