// What the server admin program shows: the service status and the pairing
// registry, read through the library's registry functions.
#ifndef S2S_TOOLS_SERVER_REPORT_H_
#define S2S_TOOLS_SERVER_REPORT_H_

#include <stdio.h>

namespace s2s_tools {

// The service status (running, busy, paired client), the daemon's pid and
// port, each configured share's running and completed sync, and each
// task's status. Returns 0.
int PrintStatus(FILE* out);

// Every section of the registry with its pairs, in file order. Returns 0,
// or -1 when the registry cannot be read.
int PrintPairings(FILE* out);

}  // namespace s2s_tools

#endif  // S2S_TOOLS_SERVER_REPORT_H_
