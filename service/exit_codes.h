// How a task run ended: each code says which stage failed. s2s-client exits
// with it; the service keeps it in the run's history.
#ifndef S2S_SERVICE_EXIT_CODES_H_
#define S2S_SERVICE_EXIT_CODES_H_

namespace s2s_service {

enum ExitCode : int {
  kExitOk = 0,
  kExitLocal = 1,        // a local failure (temporary directory, signals)
  kExitUsage = 2,        // bad arguments, task file, task or password source
  kExitUnreachable = 3,  // no address of the server answered, or no version
  kExitPairing = 4,      // pairing refused, or shares fed by another client
  kExitShare = 5,        // a share failed to start, transfer or finish
  kExitCancelled = 6,    // cancelled (a signal, or the service)
  kExitBusy = 7,         // another run of the task holds its lock
  kExitDeletions = 8,    // the mass-delete guard held a share's deletions
};

}  // namespace s2s_service

#endif  // S2S_SERVICE_EXIT_CODES_H_
