#include "ctl_task.h"

#include <stdlib.h>

#include "S2S/sync_obj_pobject.h"
#include "secret.h"
#include "task_file.h"

namespace s2s_tools {

namespace {

const char* const kScheduleKeys[] = {
    "schedule_mode",      "schedule_begin_year", "schedule_begin_month",
    "schedule_begin_day", "schedule_begin_hour", "schedule_begin_min",
    "week_schd",          "period_hour",         "period_minute",
    "repeat_times_in_day"};

// The keys a task file describes, as a task map. For an edit, the keys the
// file leaves empty and the schedule (which the file cannot hold) are left
// out, so they keep their stored values.
S2S::PObject TaskFileMap(const TaskSpec& spec, bool adding) {
  S2S::PObject map;
  S2S::SyncTask2PObj(MakeSyncTask(spec, ""), map);
  auto& m = map.asMap();
  m.erase("pswd");
  if (spec.id == 0) m.erase("id");
  S2S::PObject& excludes = map["excludes"];
  excludes.asArray();
  for (const std::string& rule : spec.excludes) {
    excludes.asArray().push_back(S2S::PObject(rule));
  }
  map["delete_guard"] = spec.guard.on;
  map["delete_guard_percent"] = spec.guard.percent;
  map["delete_guard_files"] = spec.guard.files;
  if (!adding) {
    for (const char* key : kScheduleKeys) m.erase(key);
    m.erase("max_bandwidth");
    for (const char* key : {"name", "server_ip", "server_name", "user",
                            "share_list", "excludes"}) {
      if (map[key].isEmpty()) m.erase(key);
    }
  }
  return map;
}

}  // namespace

bool BuildTaskMap(const CtlOptions& o, bool adding, S2S::PObject& task,
                  std::string& note, std::string& error) {
  TaskSpec spec;
  spec.id = 0;
  task = S2S::PObject();
  task.asMap();
  if (!o.task_file.empty()) {
    if (!LoadTaskFile(o.task_file, spec, error)) return false;
    task = TaskFileMap(spec, adding);
    if (spec.port != 0) {
      note = "the task file's port " + std::to_string(spec.port) +
             " is not a task setting: s2sd uses S2S_RSYNC_PORT of its own "
             "environment";
    }
  } else if (adding) {
    task = TaskFileMap(spec, true);
  }
  for (const auto& change : o.changes.asMap()) {
    task[change.first] = change.second;
  }
  const std::string& password_file =
      o.password_file.empty() ? spec.password_file : o.password_file;
  if (adding || !password_file.empty() || getenv(kPasswordEnv) != nullptr) {
    std::string password;
    if (!ReadPassword(password_file, password, error)) return false;
    task["pswd"] = password;
  }
  if (!adding && task.asMap().empty()) {
    error = "task edit: nothing to change (give task options)";
    return false;
  }
  return true;
}

}  // namespace s2s_tools
