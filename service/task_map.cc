#include "service/task_map.h"

#include <arpa/inet.h>
#include <ctype.h>
#include <stdlib.h>

#include <set>

#include "S2S/s2s_share.h"
#include "S2S/sync_obj_pobject.h"
#include "server/command_file.h"
#include "server/hooks.h"

namespace s2s_service {

namespace {

using S2S::PObject;

enum Kind { kUInt, kInt, kBool, kText, kTextList, kIgnored };

struct Key {
  const char* name;
  Kind kind;
  size_t max;      // bytes of a string, entries of a list; largest number
  size_t min = 0;  // smallest number
};

// Share names and exclude rules are checked one by one below.
const Key kKeys[] = {
    {"id", kUInt, 0},
    {"name", kText, 128},
    {"share_list", kTextList, 256},
    {"user", kText, 4096},
    {"pswd", kText, 1023},
    {"server_ip", kText, 4096},
    {"server_name", kText, 4096},
    {"compress", kBool, 0},
    {"block", kBool, 0},
    {"ssh", kBool, 0},
    {"ssh_port", kUInt, 65535},
    {"max_bandwidth", kUInt, 0xffffffffu},
    {"schedule_mode", kInt, 0},
    {"schedule_begin_year", kInt, 0},
    {"schedule_begin_month", kInt, 0},
    {"schedule_begin_day", kInt, 0},
    {"schedule_begin_hour", kInt, 0},
    {"schedule_begin_min", kInt, 0},
    {"week_schd", kText, 4096},
    {"period_hour", kInt, 0},
    {"period_minute", kInt, 0},
    {"repeat_times_in_day", kInt, 0},
    {"enabled", kBool, 0},
    {"excludes", kTextList, 256},
    {"delete_guard", kBool, 0},
    {"delete_guard_percent", kUInt, 100},
    {"delete_guard_files", kUInt, 0},
    {"realtime_settle_ms", kUInt, 600000},
    {"realtime_max_delay", kUInt, 86400, 1},
    {"realtime_full_sync", kUInt, 30 * 86400, 1},
    {"realtime_pending_limit", kUInt, 10000000, 1},
    {"realtime_source", kText, 16},
    {"has_password", kIgnored, 0},
    {"next_run", kIgnored, 0},
    {"schedule_error", kIgnored, 0},
    {"state", kIgnored, 0},
    {"last_result", kIgnored, 0},
};

const Key* FindKey(const std::string& name) {
  for (const Key& k : kKeys) {
    if (name == k.name) return &k;
  }
  return nullptr;
}

bool HasLineBreak(const std::string& s) {
  return s.find_first_of("\r\n") != std::string::npos;
}

bool Printable(const std::string& s, const char* banned) {
  for (unsigned char c : s) {
    if (c < 0x20 || c == 0x7f) return false;
    for (const char* b = banned; *b != '\0'; ++b) {
      if (c == static_cast<unsigned char>(*b)) return false;
    }
  }
  return true;
}

// One list entry of `key`: a share name or an exclude rule.
bool CheckEntry(const std::string& key, const std::string& s) {
  if (key == "share_list") {
    return !s.empty() && s.size() <= 255 && Printable(s, "/\\[]\"=@:");
  }
  return !s.empty() && s.size() <= 1024 && !HasLineBreak(s);
}

bool CheckValue(const Key& k, const PObject& v) {
  switch (k.kind) {
    case kUInt:
      if (k.max == 0) return v.isInteger();
      return v.isInteger() && v.asUInt64() <= k.max && v.asUInt64() >= k.min;
    case kInt: {
      long long n = v.asInt64();
      return v.isInteger() && n >= INT32_MIN && n <= INT32_MAX;
    }
    case kBool:
      return v.isInteger();
    case kText:
      if (!v.isString() || v.asStringRef().size() > k.max) return false;
      if (std::string(k.name) == "name") {
        return !v.asStringRef().empty() &&
               Printable(v.asStringRef(), "/\\[]\"");
      }
      if (std::string(k.name) == "realtime_source") {
        const std::string& s = v.asStringRef();
        return s == "auto" || s == "fanotify" || s == "inotify";
      }
      return !HasLineBreak(v.asStringRef());
    case kTextList:
      if (!v.isArray() || v.asArray().size() > k.max) return false;
      for (const PObject& e : v.asArray()) {
        if (!e.isString() || !CheckEntry(k.name, e.asStringRef())) return false;
      }
      return true;
    case kIgnored:
      return true;
  }
  return false;
}

// A DNS host name (RFC 1123, '_' tolerated for local names): dot-separated
// labels of 1-63 letters, digits, '-' and '_', none starting or ending with
// '-', 253 bytes at most. Whatever begins with '-' would read as an option.
bool IsHostName(const std::string& s) {
  if (s.empty() || s.size() > 253) return false;
  size_t begin = 0;
  for (;;) {
    size_t end = s.find('.', begin);
    if (end == std::string::npos) end = s.size();
    size_t len = end - begin;
    if (len == 0 || len > 63 || s[begin] == '-' || s[end - 1] == '-') {
      return false;
    }
    for (size_t i = begin; i < end; ++i) {
      unsigned char c = static_cast<unsigned char>(s[i]);
      if (!isalnum(c) && c != '-' && c != '_') return false;
    }
    if (end == s.size()) return true;
    begin = end + 1;
    // One trailing dot names the root: "host.example." is fine.
    if (begin == s.size()) return true;
  }
}

bool IsIPv4(const std::string& s) {
  in_addr a;
  return inet_pton(AF_INET, s.c_str(), &a) == 1;
}

}  // namespace

std::string ServerSideProblem(const std::string& task_name,
                              const std::string& server_ip,
                              const std::string& server_name,
                              const std::string& user,
                              const std::list<std::string>& shares) {
  using namespace S2S::server;
  if (!IsValidTaskName(task_name)) {
    return "task name \"" + task_name + "\" would be refused by the server (" +
           kTaskNameRule + ")";
  }
  if (!server_ip.empty() && !IsIPv4(server_ip) && !IsHostName(server_ip)) {
    return "server address \"" + server_ip +
           "\" is neither an IPv4 address nor a host name";
  }
  if (!server_name.empty() && !IsHostName(server_name)) {
    return "server name \"" + server_name + "\" is not a host name";
  }
  if (!user.empty() && !IsValidDaemonUser(user)) {
    return "user \"" + user + "\" would be refused by the server (" +
           kDaemonUserRule + ")";
  }
  std::set<std::string> seen;
  for (const std::string& share : shares) {
    if (!IsValidShareName(share)) {
      return "share name \"" + share + "\" would be refused by the server (" +
             kShareNameRule + ")";
    }
    if (!seen.insert(share).second) {
      return "share \"" + share + "\" is listed twice";
    }
  }
  return "";
}

bool ReadTaskId(const PObject& value, unsigned long long& id) {
  if (value.isInteger()) {
    id = value.asUInt64();
  } else if (value.isString()) {
    const std::string& s = value.asStringRef();
    if (s.empty() || s.size() > 19 ||
        s.find_first_not_of("0123456789") != std::string::npos) {
      return false;
    }
    id = strtoull(s.c_str(), nullptr, 10);
  } else {
    return false;
  }
  return id >= 1;
}

bool ApplyTaskMap(const PObject& in, StoredTask& task, std::string& error) {
  if (!in.isMap()) {
    error = "the task is not a map";
    return false;
  }
  for (const auto& m : in.asMap()) {
    const Key* k = FindKey(m.first);
    if (k == nullptr) {
      error = "unknown task key \"" + m.first.substr(0, 64) + "\"";
      return false;
    }
    unsigned long long id = 0;
    bool ok =
        m.first == "id" ? ReadTaskId(m.second, id) : CheckValue(*k, m.second);
    if (!ok) {
      error = "task key \"" + m.first + "\" is of the wrong kind or too long";
      return false;
    }
  }
  // Over the task's own map, so that keys absent keep their values.
  PObject merged = TaskToMap(task, true);
  for (const auto& m : in.asMap()) {
    const Key* k = FindKey(m.first);
    if (k->kind == kIgnored) continue;
    if (m.first == "id") {
      unsigned long long id = 0;
      ReadTaskId(m.second, id);
      merged["id"] = id;
    } else {
      merged[m.first] = m.second;
    }
  }
  StoredTask out;
  S2S::PObj2SyncTask(merged, out.task);
  out.enabled = merged["enabled"].asBool();
  for (const PObject& e : merged["excludes"].asArray()) {
    out.excludes.push_back(e.asString());
  }
  out.guard.on = merged["delete_guard"].asBool();
  out.guard.percent =
      static_cast<unsigned int>(merged["delete_guard_percent"].asUInt64());
  out.guard.files = merged["delete_guard_files"].asUInt64();
  RealtimeSettings& rt = out.realtime;
  rt.settle_ms = merged["realtime_settle_ms"].asUInt32();
  rt.max_delay = merged["realtime_max_delay"].asUInt32();
  rt.full_sync = merged["realtime_full_sync"].asUInt32();
  rt.pending_limit = merged["realtime_pending_limit"].asUInt32();
  rt.source = merged["realtime_source"].asString();
  task = out;
  return true;
}

PObject TaskToMap(const StoredTask& task, bool with_password) {
  PObject map;
  map = PObject::Map();
  S2S::SyncTask2PObj(task.task, map);
  bool has_password = !task.task.GetInfo().GetSyncInfo().GetPassword().empty();
  if (!with_password) {
    map.asMap().erase("pswd");
    map["has_password"] = has_password;
  }
  map["enabled"] = task.enabled;
  PObject::Array excludes;
  for (const std::string& e : task.excludes) excludes.emplace_back(e);
  map["excludes"] = excludes;
  map["delete_guard"] = task.guard.on;
  map["delete_guard_percent"] = task.guard.percent;
  map["delete_guard_files"] = task.guard.files;
  map["realtime_settle_ms"] = task.realtime.settle_ms;
  map["realtime_max_delay"] = task.realtime.max_delay;
  map["realtime_full_sync"] = task.realtime.full_sync;
  map["realtime_pending_limit"] = task.realtime.pending_limit;
  map["realtime_source"] = task.realtime.source;
  return map;
}

bool CheckTask(const StoredTask& task, std::string& error) {
  const S2S::TaskInfo& info = task.task.GetInfo();
  const S2S::SyncInfo& sync = info.GetSyncInfo();
  if (task.task.GetID() == 0) {
    error = "the task id must be at least 1";
    return false;
  }
  if (info.Validate()) {
    error = ServerSideProblem(info.GetName(), sync.GetServerIP(),
                              sync.GetServerName(), sync.GetUser(),
                              info.GetShareList());
    return error.empty();
  }
  // Validate logs the rule it found broken; the same rules, in words.
  if (sync.GetServerIP().empty() && sync.GetServerName().empty()) {
    error = "no server address or name";
  } else if (sync.GetUser().empty()) {
    error = "no user for the server";
  } else if (sync.GetSSHPort() > 65535) {
    error = "the SSH port is out of range";
  } else if (!info.GetSchedule().Validate()) {
    error =
        "the schedule is invalid (mode, begin date, start time, or runs "
        "that do not fit in one day)";
  } else if (info.GetName().empty()) {
    error = "no task name";
  } else if (info.GetShareList().empty()) {
    error = "no shares";
  } else {
    error = "a share is not valid";
    for (const std::string& share : info.GetShareList()) {
      bool ok = false;
      if (S2S::IsValidShare(share, ok) < 0 || !ok) {
        error =
            "share \"" + share + "\" is not a local share that may be synced";
        break;
      }
    }
  }
  return false;
}

}  // namespace s2s_service
