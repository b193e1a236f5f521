#include "server_root.h"

#include <strings.h>
#include <unistd.h>

#include <algorithm>
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
#include "protocol.h"
#include "root_files.h"
#include "server_ssh.h"

namespace s2s_tools {

namespace {

const char kVolume[] = "/volume1";
const char kPlatformConf[] = "/etc/s2s/platform.conf";

namespace fs = std::filesystem;

std::string DirOf(const ShareSpec& s) {
  return s.path.empty() ? KaroRootPath(kVolume) + "/" + s.name : s.path;
}

// `path` with its symbolic links resolved as far as it exists.
fs::path Resolved(const std::string& path) {
  std::error_code ec;
  fs::path p = fs::weakly_canonical(path, ec);
  return ec ? fs::path(path).lexically_normal() : p;
}

bool Within(const fs::path& inner, const fs::path& outer) {
  auto i = inner.begin();
  for (auto o = outer.begin(); o != outer.end(); ++o, ++i) {
    if (o->empty()) continue;  // the end of "dir/"
    if (i == inner.end() || *i != *o) return false;
  }
  return true;
}

// The shares in /etc/s2s/shares.conf: name and directory.
std::vector<std::pair<std::string, std::string>> KnownShares() {
  std::vector<std::pair<std::string, std::string>> out;
  std::string file = KaroRootPath(KARO_SHARE_CONF);
  KSZLIST* names = KLIBCSzListAlloc();
  int count = names == nullptr || !KLIBCFileExist(file.c_str())
                  ? 0
                  : KLIBCFileEnumSection(file.c_str(), names);
  for (int i = 0; i < count; ++i) {
    const char* name = KLIBCSzListGet(names, i);
    char path[4096] = "";
    KLIBCFileGetSectionValue(file.c_str(), name, "path", path, sizeof path);
    out.emplace_back(name, path);
  }
  KLIBCSzListFree(names);
  return out;
}

}  // namespace

std::string ServerShareProblem(
    const ShareSpec& s,
    const std::vector<std::pair<std::string, std::string>>& others) {
  using S2S::server::kCommandModule;
  using S2S::server::kKeyModule;
  using S2S::server::kSpoolModule;
  const std::string& name = s.name;
  std::string dir = DirOf(s);
  // The daemon reads %NAME% in a path as a variable, drops blanks at the
  // end of a value and folds runs of blanks in a module's name.
  if (name.find('%') != std::string::npos ||
      dir.find('%') != std::string::npos) {
    return "share " + name + ": no '%' in a share's name or directory";
  }
  if (name.find("  ") != std::string::npos) {
    return "share " + name + ": no two blanks in a row in a share's name";
  }
  for (unsigned char c : dir) {
    if (c < 0x20 || c == 0x7f) {
      return "share " + name + ": a control character in its directory";
    }
  }
  if (dir.back() == ' ') {
    return "share " + name + ": its directory may not end with a blank";
  }
  for (const char* own : {kCommandModule, kSpoolModule, kKeyModule, "global"}) {
    if (strcasecmp(name.c_str(), own) == 0) {
      return "share " + name + ": the name is the daemon's own";
    }
  }
  fs::path mine = Resolved(dir);
  for (const char* system :
       {"/", "/etc", "/usr", "/bin", "/sbin", "/lib", "/lib64", "/boot",
        "/proc", "/sys", "/dev", "/run"}) {
    if (mine == fs::path(system) ||
        (std::string(system) != "/" && Within(mine, system))) {
      return "share " + name + ": " + dir + " is a system directory";
    }
  }
  for (const char* state : {"/etc/s2s", "/usr/karo", "/var/spool/s2s",
                            "/var/run", "/var/log/s2s", "/tmp/S2S"}) {
    fs::path own = Resolved(KaroRootPath(state));
    if (Within(own, mine) || Within(mine, own)) {
      return "share " + name + ": " + dir + " holds or lies in " +
             own.string() + ", the server's own";
    }
  }
  for (const auto& other : others) {
    if (other.first == name) continue;
    if (strcasecmp(other.first.c_str(), name.c_str()) == 0) {
      return "share " + name + ": differs from share " + other.first +
             " only in case, which the daemon's module names ignore";
    }
    fs::path theirs = Resolved(other.second);
    if (Within(mine, theirs) || Within(theirs, mine)) {
      return "share " + name + ": " + dir + " and share " + other.first +
             "'s " + other.second + " would hold each other's data";
    }
  }
  return "";
}

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
  // Every share checked before anything is made.
  std::vector<std::pair<std::string, std::string>> known = KnownShares();
  for (const ShareSpec& s : spec.shares) {
    auto same = std::find_if(known.begin(), known.end(),
                             [&s](const auto& k) { return k.first == s.name; });
    if (spec.add_only && same != known.end()) {
      error = "share " + s.name + " is there already, in " + same->second +
              " (remove it first to change it)";
      return false;
    }
    error = ServerShareProblem(s, known);
    if (!error.empty()) return false;
    if (same != known.end()) known.erase(same);
    known.emplace_back(s.name, DirOf(s));
  }
  for (const ShareSpec& s : spec.shares) {
    std::string path = DirOf(s);
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
