// The choice of addresses worth trying for a server.
//
// Holds no state; may be called from any thread. A failing name query of the
// machine at the remembered address is logged and the lookup goes on.
#ifndef S2S_S2S_ADDRESS_H_
#define S2S_S2S_ADDRESS_H_

#include <string>
#include <vector>

#include "S2S/export.h"

namespace S2S {

// Appends to `out` (not cleared) the addresses worth trying for server
// `host`, preferring the remembered address `ip` while it still belongs to
// the host. 0, or -1 when nothing usable was found.
S2S_EXPORT int GetUsableIP(const std::string& host, const std::string& ip,
                           std::vector<std::string>& out);

}  // namespace S2S

#endif  // S2S_S2S_ADDRESS_H_
