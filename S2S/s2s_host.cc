#include "S2S/s2s_host.h"

#include <errno.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <string>

#include "karo_err.h"
#include "karo_host.h"
#include "karo_net.h"
#include "karo_root.h"
#include "karo_service.h"

#define S2S_LOG_AREA "s2s"
#include "S2S/log.h"

namespace S2S {

namespace {
const char kDaemonService[] = "s2s_daemon";
const char kTempTemplate[] = "/tmp/S2S/temp.XXXXXX";
}  // namespace

std::string GetHostName(unsigned int maxlen) {
  char buffer[64] = {0};
  // The platform may fill all `maxlen` bytes without a NUL; never let it
  // reach past the buffer whatever the caller asks.
  maxlen = std::min(maxlen, static_cast<unsigned int>(sizeof buffer - 1));
  if (KAROLnxGetHostname(buffer, static_cast<int>(maxlen)) < 0) {
    LOG_ERROR("Fail to call KAROLnxGetHostname");
    return std::string();
  }
  std::string name(buffer, strnlen(buffer, sizeof buffer));
  if (name.size() > maxlen) name.resize(maxlen);
  return name;
}

std::string GetClientID() {
  char buffer[1024] = {0};
  if (KAROHAIsRunning()) {
    KLIBGetSerialNumber(buffer, sizeof buffer);
    if (buffer[0] == '\0') KAROHAGetMac(0, buffer, sizeof buffer);
    if (buffer[0] == '\0') {
      LOG_ERROR("Fail to get ha sn and mac");
      return std::string();
    }
    return buffer;
  }
  KLIBGetSerialNumber(buffer, 36);
  if (buffer[0] != '\0') return buffer;
  KARO_NETIF info[1];
  if (KLIBNetGetInterfaceInfo(info, 1, KARO_NETIF_SKIP_LOOPBACK) < 1) {
    return std::string();
  }
  const unsigned char* m = info[0].mac;
  snprintf(buffer, sizeof buffer, "%02x:%02x:%02x:%02x:%02x:%02x", m[0], m[1],
           m[2], m[3], m[4], m[5]);
  return buffer;
}

bool IsDaemonRunning() { return KLIBServiceIsRunning(kDaemonService) != 0; }

int StartDaemon() {
  if (KLIBServiceStart(kDaemonService, 0) == 0) return 0;
  int err = KLIBCErrGet();
  if (err == KERR_SERVICE_RUNNING) return 0;
  LOG_ERROR("Fail to start daemon, karoerr=[0x%04X]", err);
  return -1;
}

int StopDaemon() {
  if (KLIBServicePause(kDaemonService) == 0) return 0;
  LOG_ERROR("Fail to stop daemon, karoerr=[0x%04X]", KLIBCErrGet());
  return -1;
}

std::string GetTempFile() {
  std::string path = KaroRootPath(kTempTemplate);
  int fd = mkstemp(&path[0]);
  if (fd < 0) return std::string();
  close(fd);
  return path;
}

void PutTempFile(const std::string& path) {
  if (path.empty()) return;
  if (unlink(path.c_str()) != 0) {
    LOG_ERROR("Fail to unlink temp file '%s' [%d]", path.c_str(), errno);
  }
}

bool IsPathExist(const std::string& path) {
  return access(path.c_str(), F_OK) == 0;
}

}  // namespace S2S
