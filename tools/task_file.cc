#include "task_file.h"

#include <strings.h>

#include <memory>

#include "S2S/s2s_share.h"
#include "karo_section.h"
#include "service/task_map.h"

namespace s2s_tools {

namespace {

struct HashFree {
  void operator()(KSZHASH* h) const { KLIBCSzHashFree(h); }
};

const char kSection[] = "Task";
const unsigned int kMaxPort = 65535;

}  // namespace

bool ParseFlag(const std::string& text, bool& out) {
  for (const char* yes : {"yes", "true", "1", "on"}) {
    if (strcasecmp(text.c_str(), yes) == 0) return out = true, true;
  }
  for (const char* no : {"no", "false", "0", "off"}) {
    if (strcasecmp(text.c_str(), no) == 0) return out = false, true;
  }
  return false;
}

bool ParseNumber(const std::string& text, unsigned long long max,
                 unsigned long long& out) {
  if (text.empty() || text.size() > 20 ||
      text.find_first_not_of("0123456789") != std::string::npos) {
    return false;
  }
  unsigned long long v = 0;
  for (char c : text) {
    unsigned long long d = static_cast<unsigned long long>(c - '0');
    if (v > (max - d) / 10) return false;
    v = v * 10 + d;
  }
  out = v;
  return true;
}

std::list<std::string> SplitList(const std::string& text) {
  std::list<std::string> out;
  size_t start = 0;
  while (start <= text.size()) {
    size_t colon = text.find(':', start);
    if (colon == std::string::npos) colon = text.size();
    if (colon > start) out.push_back(text.substr(start, colon - start));
    start = colon + 1;
  }
  return out;
}

bool LoadTaskFile(const std::string& path, TaskSpec& spec, std::string& error) {
  std::unique_ptr<KSZHASH, HashFree> h(KLIBCSzHashAlloc(64));
  int found = h ? KLIBCFileGetSection(path.c_str(), kSection, h.get()) : -1;
  if (found < 0) {
    error = "cannot read task file " + path;
    return false;
  }
  if (found == 0) {
    error = "task file " + path + " has no [Task] section";
    return false;
  }
  for (int i = 0; i < KLIBCSzHashCount(h.get()); ++i) {
    std::string key = KLIBCSzHashKeyAt(h.get(), i);
    std::string value = KLIBCSzHashValueAt(h.get(), i);
    unsigned long long n = 0;
    bool ok = true;
    if (key == "name") {
      spec.name = value;
    } else if (key == "id") {
      ok = ParseNumber(value, ~0ULL, n);
      if (ok) spec.id = n;
    } else if (key == "server_ip") {
      spec.server_ip = value;
    } else if (key == "server_name") {
      spec.server_name = value;
    } else if (key == "port") {
      ok = ParseNumber(value, kMaxPort, n);
      if (ok) spec.port = static_cast<unsigned int>(n);
    } else if (key == "user") {
      spec.user = value;
    } else if (key == "password_file") {
      spec.password_file = value;
    } else if (key == "shares") {
      spec.shares = SplitList(value);
    } else if (key == "excludes") {
      spec.excludes = SplitList(value);
    } else if (key == "compress") {
      ok = ParseFlag(value, spec.compress);
    } else if (key == "delta") {
      ok = ParseFlag(value, spec.delta);
    } else if (key == "ssh") {
      ok = ParseFlag(value, spec.ssh);
    } else if (key == "ssh_port") {
      ok = ParseNumber(value, kMaxPort, n);
      if (ok) spec.ssh_port = static_cast<unsigned int>(n);
    } else if (key == "delete_guard") {
      ok = ParseFlag(value, spec.guard.on);
    } else if (key == "delete_guard_percent") {
      ok = ParseNumber(value, 100, n);
      if (ok) spec.guard.percent = static_cast<unsigned int>(n);
    } else if (key == "delete_guard_files") {
      ok = ParseNumber(value, ~0ULL, n);
      if (ok) spec.guard.files = n;
    } else if (key == "password") {
      error = "task file " + path +
              ": passwords do not go in task files; use password_file";
      return false;
    } else {
      error = "task file " + path + ": unknown key '" + key + "'";
      return false;
    }
    if (!ok) {
      error = "task file " + path + ": bad value of '" + key + "'";
      return false;
    }
  }
  return true;
}

bool CheckTaskSpec(const TaskSpec& spec, std::string& error) {
  if (spec.name.empty()) {
    error = "no task name (--task)";
  } else if (spec.shares.empty()) {
    error = "no share to sync (--share)";
  } else if (spec.server_ip.empty() && spec.server_name.empty()) {
    error = "no server (--server-ip or --server-name)";
  } else if (spec.user.empty()) {
    error = "no daemon user (--user)";
  } else {
    error = s2s_service::ServerSideProblem(
        spec.name, spec.server_ip, spec.server_name, spec.user, spec.shares);
    if (!error.empty()) return false;
    for (const std::string& share : spec.shares) {
      S2S::ShareInfo info;
      bool valid = false;
      if (S2S::GetShareInfo(share, info) != 0) {
        error = "no local share '" + share + "'";
      } else if (S2S::IsValidShare(share, valid) != 0 || !valid) {
        error = "share '" + share +
                "' cannot be synced (not on an internal "
                "volume)";
      }
      if (!error.empty()) return false;
    }
    return true;
  }
  return false;
}

S2S::SyncTask MakeSyncTask(const TaskSpec& spec, const std::string& password) {
  S2S::SyncInfo info;
  info.SetServerIP(spec.server_ip);
  info.SetServerName(spec.server_name);
  info.SetUser(spec.user);
  info.SetPassword(password);
  info.SetCompression(spec.compress);
  info.SetMaxBandwidth(spec.max_bandwidth);
  info.SetBlockLevelSync(spec.delta);
  info.SetSSH(spec.ssh);
  info.SetSSHPort(spec.ssh_port);
  S2S::TaskInfo task_info;
  task_info.SetName(spec.name);
  task_info.SetShareList(spec.shares);
  task_info.SetSyncInfo(info);
  S2S::SyncTask task;
  task.SetID(spec.id);
  task.SetInfo(task_info);
  return task;
}

}  // namespace s2s_tools
