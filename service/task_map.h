// A task as the service keeps it, and its flat map.
//
// A StoredTask is the library's SyncTask plus the service's own settings
// (enabled, excludes, the mass-delete guard, the realtime settings). It
// crosses the control socket and lies in its file as the flat map of the
// sync-object mapping (SyncTask2PObj's keys) with "enabled", "excludes",
// "delete_guard", "delete_guard_percent", "delete_guard_files" and the
// realtime settings ("realtime_*") beside them. Every key of an incoming map
// is checked against one table (kind and size) before anything is applied,
// so a bad map changes nothing.
#ifndef S2S_SERVICE_TASK_MAP_H_
#define S2S_SERVICE_TASK_MAP_H_

#include <list>
#include <string>

#include "S2S/pobject.h"
#include "S2S/sync_obj_task.h"
#include "service/task_runner.h"

namespace s2s_service {

// How a realtime task (schedule mode realtime) turns changes into syncs.
struct RealtimeSettings {
  unsigned int settle_ms = 2000;       // quiet after the last change
  unsigned int max_delay = 30;         // s: longest wait under constant change
  unsigned int full_sync = 3600;       // s between full syncs of every share
  unsigned int pending_limit = 10000;  // paths per share before a full sync
  std::string source = "auto";         // "auto", "fanotify", "inotify"
  bool operator==(const RealtimeSettings& o) const {
    return settle_ms == o.settle_ms && max_delay == o.max_delay &&
           full_sync == o.full_sync && pending_limit == o.pending_limit &&
           source == o.source;
  }
  bool operator!=(const RealtimeSettings& o) const { return !(*this == o); }
};

struct StoredTask {
  S2S::SyncTask task;
  bool enabled = true;
  std::list<std::string> excludes;
  DeleteGuard guard;
  RealtimeSettings realtime;
};

// Lays the keys of `in` over `task`: only keys present change, "pswd"
// included. Keys that replies carry but requests may not set ("next_run",
// "state", ...) are ignored. Returns true, or false with `error` (a key
// unknown, of the wrong kind or over its size) and `task` unchanged.
bool ApplyTaskMap(const S2S::PObject& in, StoredTask& task, std::string& error);

// The map of `task`; with `with_password` the password too (for the task's
// file), otherwise only "has_password".
S2S::PObject TaskToMap(const StoredTask& task, bool with_password);

// Whether the task may be stored and run: the library's TaskInfo::Validate,
// an id of at least 1 and no ServerSideProblem. False with `error` saying, in
// words, the first rule broken.
bool CheckTask(const StoredTask& task, std::string& error);

// What the server would refuse, or what rsync cannot reach, about a task's
// server and shares: an address that is neither an IPv4 address nor a host
// name, a server name that is no host name, a user name the server's daemon
// does not take, a task or share name the server refuses, a share listed
// twice. Returns "" when all is well, else the first problem in words.
std::string ServerSideProblem(const std::string& task_name,
                              const std::string& server_ip,
                              const std::string& server_name,
                              const std::string& user,
                              const std::list<std::string>& shares);

// An id from the control socket: an integer, or a decimal string. Returns
// true with `id` (at least 1), false for anything else.
bool ReadTaskId(const S2S::PObject& value, unsigned long long& id);

}  // namespace s2s_service

#endif  // S2S_SERVICE_TASK_MAP_H_
