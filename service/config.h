// The service's settings and where its files lie under the appliance root.
//
// Settings come from <root>/etc/s2s/s2sd.conf, section [Service]; each key
// is optional:
//
//   [Service]
//   	max_parallel="2"        most runs at once, 1 to 64
//   	share_parallel="3"      most shares of one run synced at once, 1 to 16
//   	admin_group="s2sadmin"  a group whose members may use the socket
//   	beacon_interval="30"    seconds between beacons during a transfer
#ifndef S2S_SERVICE_CONFIG_H_
#define S2S_SERVICE_CONFIG_H_

#include <stddef.h>
#include <sys/types.h>

#include <string>

namespace s2s_service {

struct DaemonConfig {
  unsigned int max_parallel = 2;
  unsigned int share_parallel = 3;
  bool has_admin_group = false;
  gid_t admin_gid = 0;
  unsigned int beacon_interval = 30;
  // Limits below the kernel's for the realtime tasks' change sources, so
  // that tests reach them (s2sd's options, not the settings file); 0 none.
  size_t watch_queue_limit = 0;
  size_t watch_limit = 0;
  // Milliseconds between looks at the realtime shares' directories.
  unsigned int watch_check_ms = 2000;
};

// Reads the settings file (a missing file means the defaults). True, or
// false with `error` naming the bad key.
bool LoadDaemonConfig(DaemonConfig& config, std::string& error);

// Paths under the root (KaroRootPath).
std::string TaskDir();
std::string HistoryDir();
std::string RunDir();  // socket, pid file, share locks
std::string SocketPath();
std::string PidFilePath();
std::string ConfigPath();
// The lock file that keeps syncs of `share` apart.
std::string ShareLockPath(const std::string& share);

}  // namespace s2s_service

#endif  // S2S_SERVICE_CONFIG_H_
