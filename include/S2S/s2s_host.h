// Who this appliance is, control of the service daemon, and temporary files.
//
// Free functions without state, callable from any thread; every answer comes
// fresh from the host platform. Failures are logged once, at ERROR, where
// they are detected.
#ifndef S2S_S2S_HOST_H_
#define S2S_S2S_HOST_H_

#include <string>

#include "S2S/export.h"

namespace S2S {

// The host name cut to at most `maxlen` characters (maxlen < 64); "" on
// failure.
S2S_EXPORT std::string GetHostName(unsigned int maxlen);

// This appliance's identity: the serial number, else (high-availability
// pair) the pair's address or (single appliance) the first interface's
// hardware address in lower-case "aa:bb:cc:dd:ee:ff" form. "" when none.
S2S_EXPORT std::string GetClientID();

// Whether the service "s2s_daemon" runs.
S2S_EXPORT bool IsDaemonRunning();

// Start and pause the service "s2s_daemon". 0 on success (starting a service
// that already runs is success), -1 on failure.
S2S_EXPORT int StartDaemon();
S2S_EXPORT int StopDaemon();

// Creates a new empty file from the template /tmp/S2S/temp.XXXXXX (below the
// root) and returns its path; "" on failure. The directory must exist. The
// caller removes the file with PutTempFile.
S2S_EXPORT std::string GetTempFile();

// Removes `path`; an empty path does nothing.
S2S_EXPORT void PutTempFile(const std::string& path);

// Whether `path` exists.
S2S_EXPORT bool IsPathExist(const std::string& path);

}  // namespace S2S

#endif  // S2S_S2S_HOST_H_
