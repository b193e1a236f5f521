// Cancelling the one-shot client's task from a signal.
//
// SIGINT and SIGTERM set the process's cancel flag, which
// InstallCancelSignals binds to the calling thread, the one that runs the
// task (service/cancel.h).
#ifndef S2S_TOOLS_CANCEL_H_
#define S2S_TOOLS_CANCEL_H_

namespace s2s_tools {

// Routes SIGINT and SIGTERM to the flag and binds it to the calling thread.
// Returns false when that fails.
bool InstallCancelSignals();

}  // namespace s2s_tools

#endif  // S2S_TOOLS_CANCEL_H_
