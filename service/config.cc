#include "service/config.h"

#include <grp.h>
#include <stdlib.h>

#include "karo_root.h"
#include "karo_section.h"

namespace s2s_service {

namespace {

const char kSection[] = "Service";

// The value of `key`: 1 read, 0 absent, -1 unreadable.
int Get(const std::string& file, const char* key, std::string& value) {
  char buf[256];
  int n =
      KLIBCFileGetSectionValue(file.c_str(), kSection, key, buf, sizeof buf);
  if (n < 0) return 0;
  value.assign(buf, static_cast<size_t>(n));
  return 1;
}

bool Number(const std::string& text, unsigned long lo, unsigned long hi,
            unsigned int& out) {
  if (text.empty() || text.size() > 9 ||
      text.find_first_not_of("0123456789") != std::string::npos) {
    return false;
  }
  unsigned long v = strtoul(text.c_str(), nullptr, 10);
  if (v < lo || v > hi) return false;
  out = static_cast<unsigned int>(v);
  return true;
}

}  // namespace

bool LoadDaemonConfig(DaemonConfig& config, std::string& error) {
  std::string file = ConfigPath();
  std::string value;
  if (Get(file, "max_parallel", value) == 1 &&
      !Number(value, 1, 64, config.max_parallel)) {
    error = file + ": max_parallel must be 1 to 64";
    return false;
  }
  if (Get(file, "share_parallel", value) == 1 &&
      !Number(value, 1, 16, config.share_parallel)) {
    error = file + ": share_parallel must be 1 to 16";
    return false;
  }
  if (Get(file, "beacon_interval", value) == 1 &&
      !Number(value, 0, 86400, config.beacon_interval)) {
    error = file + ": beacon_interval must be 0 to 86400 seconds";
    return false;
  }
  if (Get(file, "admin_group", value) == 1 && !value.empty()) {
    group g;
    group* found = nullptr;
    char buf[4096];
    if (getgrnam_r(value.c_str(), &g, buf, sizeof buf, &found) != 0 ||
        found == nullptr) {
      error = file + ": admin_group \"" + value + "\" is no group";
      return false;
    }
    config.has_admin_group = true;
    config.admin_gid = found->gr_gid;
  }
  return true;
}

std::string TaskDir() { return KaroRootPath("/etc/s2s/tasks"); }
std::string HistoryDir() { return KaroRootPath("/var/lib/s2s/history"); }
std::string RunDir() { return KaroRootPath("/run/s2s"); }
std::string SocketPath() { return RunDir() + "/s2sd.sock"; }
std::string PidFilePath() { return RunDir() + "/s2sd.pid"; }
std::string ConfigPath() { return KaroRootPath("/etc/s2s/s2sd.conf"); }
std::string ShareLockPath(const std::string& share) {
  return RunDir() + "/locks/" + share + ".lock";
}

}  // namespace s2s_service
