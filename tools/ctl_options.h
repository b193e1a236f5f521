// The command line of s2sctl, the front end of the client service.
//
//   s2sctl [--root DIR] [--socket PATH] [--json] COMMAND [TASK] [options]
//
// Options may stand anywhere after the program name. Task options (for
// "task add" and "task edit") are collected as the task map keys they set
// (doc/service_protocol.md), in the order given, so that "edit" sends only
// what was asked to change.
#ifndef S2S_TOOLS_CTL_OPTIONS_H_
#define S2S_TOOLS_CTL_OPTIONS_H_

#include <string>

#include "S2S/pobject.h"

namespace s2s_tools {

// Exit codes of s2sctl: each says what failed.
enum CtlExit : int {
  kCtlOk = 0,
  kCtlFailed = 1,        // the daemon failed (storage), or answered oddly
  kCtlUsage = 2,         // bad arguments, task file or password source
  kCtlUnreachable = 3,   // no daemon listens on the socket
  kCtlUnknownTask = 4,   // no such task
  kCtlInvalidTask = 5,   // the task was refused (validation, id or name used)
  kCtlBusy = 6,          // the task is running (run, delete) or s2sd stops
  kCtlNotPermitted = 7,  // the socket or the daemon refused this user
  kCtlDryRunFailed = 8,  // run --dry-run: the dry run itself failed
};

struct CtlOptions {
  std::string root;    // --root: the appliance root (S2S_ROOT)
  std::string socket;  // --socket: the control socket, else under the root
  bool json = false;   // --json: the reply as JSON
  int verbose = 0;     // -v: the library's log on standard error
  bool help = false;
  bool version = false;  // --version

  std::string command;  // "task add", "task list", "run", "status", ...
  std::string target;   // TASK: an id or a name
  unsigned long long limit = 0;    // history --limit; 0: the daemon's default
  bool dry_run = false;            // run --dry-run
  bool confirm_deletions = false;  // run --confirm-deletions

  // Task options.
  std::string task_file;      // --task-file: s2s-client's [Task] file
  std::string password_file;  // --password-file
  S2S::PObject changes;       // task map keys set by options (a map)
  bool has_task_options = false;
};

// Parses `argv` into `options`. Returns true, or false with `error` in
// words: an unknown option or command, a value that does not parse, an
// option the command does not take, a missing or extra TASK. A password
// given as an option is refused.
bool ParseCtlArgs(int argc, char** argv, CtlOptions& options,
                  std::string& error);

// The --help text, with the exit codes.
const char* CtlUsage();

}  // namespace s2s_tools

#endif  // S2S_TOOLS_CTL_OPTIONS_H_
