#include "server_root.h"

#include <unistd.h>

#include <filesystem>
#include <memory>

#include "S2S/is_syncedshare.h"
#include "command_handler.h"
#include "daemon_config.h"
#include "karo_host.h"
#include "karo_programs.h"
#include "karo_root.h"
#include "karo_section.h"
#include "karo_share.h"
#include "root_files.h"
#include "server_ssh.h"

namespace s2s_tools {

namespace {

const char kVolume[] = "/volume1";
const char kPlatformConf[] = "/etc/s2s/platform.conf";

}  // namespace

bool ParseShareSpec(const std::string& text, ShareSpec& out) {
  size_t eq = text.find('=');
  out.name = text.substr(0, eq);
  out.path = eq == std::string::npos ? "" : text.substr(eq + 1);
  while (out.path.size() > 1 && out.path.back() == '/') out.path.pop_back();
  if (KaroShareNameValid(out.name.c_str()) != 1 ||
      out.name.find(':') != std::string::npos) {
    return false;
  }
  return eq == std::string::npos || (!out.path.empty() && out.path[0] == '/');
}

bool InitServerRoot(const RootSpec& spec, std::string& error) {
  std::string volume = KaroRootPath(kVolume);
  for (const char* dir : {"/etc/s2s", "/usr/karo/etc", "/var/run",
                          "/var/log/s2s", "/tmp/S2S", kVolume}) {
    if (!MakeDirs(KaroRootPath(dir), error)) return false;
  }
  std::string shares_conf = KaroRootPath(KARO_SHARE_CONF);
  for (const ShareSpec& s : spec.shares) {
    std::string path = s.path.empty() ? volume + "/" + s.name : s.path;
    if (!MakeDirs(path, error)) return false;
    Pairs kv = {{"path", path}};
    if (s.encrypted) {
      std::string lower = path.substr(0, path.rfind('/') + 1) + "@" +
                          path.substr(path.rfind('/') + 1) + "@";
      if (!MakeDirs(lower, error)) return false;
      kv.emplace_back("encrypted", "yes");
      kv.emplace_back("enc_path", lower);
    }
    // Shares under the root's volume directory count as internal.
    if (path.compare(0, volume.size() + 1, volume + "/") == 0) {
      kv.emplace_back("volume", volume);
    }
    if (!AddSection(shares_conf, s.name, kv, error)) return false;
  }
  Pairs platform = {{"lookup", "hosts"}};
  if (!spec.hostname.empty()) platform.emplace_back("hostname", spec.hostname);
  if (!spec.serial.empty()) platform.emplace_back("serial", spec.serial);
  if (!MergeSection(KaroRootPath(kPlatformConf), "Platform", platform, error)) {
    return false;
  }
  if (S2SCheckServerInfo() != 0 || KAROUISetS2S(1, nullptr, nullptr) != 0 ||
      S2S::server::MarkRegistryInitialised() != 0) {
    error = "cannot create the pairing registry";
    return false;
  }
  return true;
}

bool WriteServerConfig(const std::string& handler, const std::string& user,
                       const std::string& password, bool old_server,
                       std::string& error) {
  S2S::server::DaemonConfig c;
  c.handler = handler;
  c.user = user;
  c.password = password;
  c.uid = geteuid();
  c.gid = getegid();
  c.old_server = old_server;
  if (S2S::server::WriteDaemonConfig(c) != 0) {
    error = "cannot write the daemon configuration";
    return false;
  }
  return RefreshSshConfig(error);
}

std::string DefaultHandler() { return KaroProgramPath("s2s-cmd-handler"); }

}  // namespace s2s_tools
