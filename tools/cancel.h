// Cancelling a running task from a signal, and beacons while rsync runs.
//
// SIGINT and SIGTERM set a flag; CancelChecker, the plain function the
// Rsyncer polls while rsync runs, returns it. The same poll is where the
// client sends its periodic beacon: a long transfer is one rsync run, and
// the poll is the only place the program gets control during it. The beacon
// hook is never entered twice at once (a beacon's own rsync run polls the
// checker too). Everything here belongs to the one thread that runs the
// task.
#ifndef S2S_TOOLS_CANCEL_H_
#define S2S_TOOLS_CANCEL_H_

#include <functional>

namespace s2s_tools {

// Routes SIGINT and SIGTERM to the flag. Returns false when that fails.
bool InstallCancelSignals();
// Whether a signal asked to stop.
bool CancelRequested();
// Sets or clears the flag (tests, and the service's wait).
void SetCancelRequested(bool on);

// The Rsyncer's cancel checker: true once a signal arrived. While not
// cancelled, runs the beacon hook when `interval` seconds have passed
// since the last beacon.
bool CancelChecker();

// Installs `hook` (empty to remove) to run at most every `interval_s`
// seconds from CancelChecker; the clock starts now.
void SetBeaconHook(std::function<void()> hook, unsigned int interval_s);
// Restarts the beacon clock (after a beacon sent outside the poll).
void BeaconSent();

// Blocks until a signal sets the flag.
void WaitForCancel();

}  // namespace s2s_tools

#endif  // S2S_TOOLS_CANCEL_H_
