// The command line of s2s-client: a task file, overridden by options.
#ifndef S2S_TOOLS_CLIENT_OPTIONS_H_
#define S2S_TOOLS_CLIENT_OPTIONS_H_

#include <string>

#include "task_file.h"

namespace s2s_tools {

struct ClientOptions {
  TaskSpec spec;
  std::string root;       // --root: the appliance root (S2S_ROOT)
  std::string task_file;  // --task-file
  int verbose = 0;        // -v: library INFO; -vv: DEBUG and rsync's output
  bool help = false;
  bool version = false;               // --version
  unsigned int beacon_interval = 30;  // seconds between beacons during a run
  bool dry_run = false;               // --dry-run
  bool confirm_deletions = false;     // --confirm-deletions
};

// Parses `argv` into `options`: first the task file (--task-file), then
// every other option on top of it, in order; a --share or --exclude on the
// command line replaces the task file's list. Returns true, or false with
// `error`. A password given as an option is refused.
bool ParseClientArgs(int argc, char** argv, ClientOptions& options,
                     std::string& error);

// The --help text, with the exit codes.
const char* ClientUsage();

}  // namespace s2s_tools

#endif  // S2S_TOOLS_CLIENT_OPTIONS_H_
