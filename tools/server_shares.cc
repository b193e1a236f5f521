#include "server_shares.h"

#include <stdio.h>
#include <unistd.h>

#include <fstream>
#include <memory>
#include <sstream>
#include <vector>

#include "S2S/is_syncedshare.h"
#include "daemon_config.h"
#include "karo_root.h"
#include "karo_section.h"
#include "karo_share.h"
#include "root_files.h"
#include "server_root.h"

namespace s2s_tools {

namespace {

// The handler and its --old-server flag, from the hook lines of the
// configuration this program wrote.
bool ReadHook(std::string& handler, bool& old_server) {
  std::ifstream conf(S2S::server::DaemonConfigPath());
  const std::string key = "\tearly exec = ";
  for (std::string line; std::getline(conf, line);) {
    if (line.compare(0, key.size(), key) != 0) continue;
    std::istringstream words(line.substr(key.size()));
    words >> handler;
    if (handler == "exec") words >> handler;
    old_server = false;
    for (std::string w; words >> w;)
      old_server = old_server || w == "--old-server";
    return !handler.empty();
  }
  return false;
}

bool ReadSecret(std::string& user, std::string& password) {
  std::ifstream secrets(S2S::server::DaemonSecretsPath());
  std::string line;
  if (!std::getline(secrets, line)) return false;
  size_t colon = line.find(':');
  if (colon == std::string::npos) return false;
  user = line.substr(0, colon);
  password = line.substr(colon + 1);
  return !user.empty() && !password.empty();
}

std::string Value(const KSZHASH* h, const char* key) {
  const char* v = KLIBCSzHashGetValue(h, key);
  return v != nullptr ? v : "";
}

}  // namespace

int RegenerateServerConfig(std::string& error) {
  if (access(S2S::server::DaemonConfigPath().c_str(), F_OK) != 0) return 0;
  std::string handler, user, password;
  bool old_server = false;
  if (!ReadHook(handler, old_server) || !ReadSecret(user, password)) {
    error = "cannot read the daemon configuration to rewrite it; run config";
    return -1;
  }
  return WriteServerConfig(handler, user, password, old_server, error) ? 1 : -1;
}

bool RemoveServerShare(const std::string& name, std::string& error) {
  std::string file = KaroRootPath(KARO_SHARE_CONF);
  List names(KLIBCSzListAlloc());
  int count = names ? KLIBCFileEnumSection(file.c_str(), names.get()) : -1;
  if (count < 0) {
    error = "cannot read " + file;
    return false;
  }
  std::vector<std::pair<std::string, Pairs>> keep;
  bool found = false;
  for (int i = 0; i < count; ++i) {
    std::string section = KLIBCSzListGet(names.get(), i);
    if (section == name) {
      found = true;
      continue;
    }
    Hash h(KLIBCSzHashAlloc(64));
    if (!h || KLIBCFileGetSection(file.c_str(), section.c_str(), h.get()) < 0) {
      error = "cannot read share " + section + " of " + file;
      return false;
    }
    Pairs kv;
    for (int k = 0; k < KLIBCSzHashCount(h.get()); ++k) {
      kv.emplace_back(KLIBCSzHashKeyAt(h.get(), k),
                      KLIBCSzHashValueAt(h.get(), k));
    }
    keep.emplace_back(section, kv);
  }
  if (!found) {
    error = "no share " + name;
    return false;
  }
  // Written beside the file and renamed over it, so no reader sees half.
  std::string tmp = file + ".new";
  unlink(tmp.c_str());
  FILE* empty = fopen(tmp.c_str(), "we");
  if (empty == nullptr || fclose(empty) != 0) {
    error = "cannot write " + tmp;
    return false;
  }
  for (const auto& s : keep) {
    if (!AddSection(tmp, s.first, s.second, error)) {
      unlink(tmp.c_str());
      return false;
    }
  }
  if (rename(tmp.c_str(), file.c_str()) != 0) {
    unlink(tmp.c_str());
    error = "cannot replace " + file;
    return false;
  }
  return true;
}

int PrintShares(FILE* out) {
  std::string file = KaroRootPath(KARO_SHARE_CONF);
  List names(KLIBCSzListAlloc());
  int count = !names ? -1
              : !KLIBCFileExist(file.c_str())
                  ? 0
                  : KLIBCFileEnumSection(file.c_str(), names.get());
  for (int i = 0; i < count; ++i) {
    std::string name = KLIBCSzListGet(names.get(), i);
    Hash h(KLIBCSzHashAlloc(64));
    if (!h || KLIBCFileGetSection(file.c_str(), name.c_str(), h.get()) < 0) {
      return -1;
    }
    char running[256] = "";
    S2SServerGetShare(name.c_str(), "RunningID", running, sizeof running);
    fprintf(out, "%-16s %s%s%s%s\n", name.c_str(),
            Value(h.get(), "path").c_str(),
            Value(h.get(), "encrypted") == "yes" ? ", encrypted" : "",
            *running != '\0' ? ", sync running from " : "", running);
  }
  return count < 0 ? -1 : 0;
}

bool ReleaseShare(const std::string& name, std::string& was,
                  std::string& error) {
  KARO_SHARE* share = nullptr;
  if (KAROShareGet(name.c_str(), &share) != 0) {
    error = "no share " + name;
    return false;
  }
  KAROShareFree(share);
  Hash h(KLIBCSzHashAlloc(64));
  int rc = h ? S2SGetServerInfo(("SHARE_" + name).c_str(), h.get()) : -1;
  if (rc < 0) {
    error = "cannot read the registry";
    return false;
  }
  was = Value(h.get(), "RunningID");
  if (was.empty()) return true;
  for (const char* key : {"RunningID", "RunningHost", "RunningUser"}) {
    KLIBCSzHashSetValue(h.get(), key, "");
  }
  if (S2SServerUpdateShare(name.c_str(), h.get()) != 0) {
    error = "cannot write the registry";
    return false;
  }
  return true;
}

}  // namespace s2s_tools
