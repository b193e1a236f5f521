// Exit codes of s2s-client: each says which stage of a task failed.
#ifndef S2S_TOOLS_EXIT_CODES_H_
#define S2S_TOOLS_EXIT_CODES_H_

namespace s2s_tools {

enum ExitCode : int {
  kExitOk = 0,
  kExitLocal = 1,        // a local failure (temporary directory, signals)
  kExitUsage = 2,        // bad arguments, task file, task or password source
  kExitUnreachable = 3,  // no address of the server answered, or no version
  kExitPairing = 4,      // pairing refused, or shares fed by another client
  kExitShare = 5,        // a share failed to start, transfer or finish
  kExitCancelled = 6,    // SIGINT or SIGTERM stopped the task
};

}  // namespace s2s_tools

#endif  // S2S_TOOLS_EXIT_CODES_H_
