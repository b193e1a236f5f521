// The control socket's actions: a table from action name to a small
// function that checks its keys, acts and fills the reply. Each runs on the
// loop's thread; an error reply leaves everything as it was.
#include <unistd.h>

#include <set>

#include "S2S/logger.h"
#include "service/daemon.h"
#include "service/wire_reader.h"

#ifndef S2S_VERSION
#error "S2S_VERSION names the service's version"
#endif

namespace s2s_service {

namespace {

using S2S::PObject;

// The request map, the task map and a list in it.
const unsigned int kMaxRequestDepth = 3;
const size_t kMaxName = 200;

std::string Named(unsigned long long id, const std::string& name) {
  return "task " + std::to_string(id) + " (" + name.substr(0, kMaxName) + ")";
}

PObject Ok(const std::string& message) { return MakeReply(kResultOk, message); }

// rsync's progress figures of one transfer, zeros when none runs.
void PutProgress(const KARO::Backup::RsyncWrapper::TransferProgress& p,
                 PObject& to) {
  to["bytes_done"] = p.bytes_done;
  to["bytes_total"] = p.bytes_total;
  to["percent"] = p.percent;
  to["rate"] = static_cast<unsigned long long>(p.bytes_per_second + 0.5);
  to["seconds_left"] = p.seconds_left;
  to["files_checked"] = p.files_checked;
  to["files_total"] = p.files_total;
}

}  // namespace

PObject Daemon::Dispatch(const PObject& request) {
  struct Entry {
    const char* action;
    Action fn;
    std::set<std::string> keys;  // besides "action"
    bool changes;                // refused while the service stops
  };
  static const Entry kActions[] = {
      {"list", &Daemon::DoList, {}, false},
      {"get", &Daemon::DoGet, {"id"}, false},
      {"add", &Daemon::DoAdd, {"task"}, true},
      {"update", &Daemon::DoUpdate, {"id", "task"}, true},
      {"delete", &Daemon::DoDelete, {"id"}, true},
      {"enable", &Daemon::DoEnable, {"id"}, true},
      {"disable", &Daemon::DoDisable, {"id"}, true},
      {"run", &Daemon::DoRun, {"id", "dry_run", "confirm_deletions"}, true},
      {"cancel", &Daemon::DoCancel, {"id"}, false},
      {"status", &Daemon::DoStatus, {}, false},
      {"history", &Daemon::DoHistory, {"id", "limit"}, false},
      {"reload", &Daemon::DoReload, {}, true},
  };
  if (!request.isMap()) {
    return MakeReply(kResultMalformed, "the request is not a map");
  }
  if (NestingDepth(request) > kMaxRequestDepth) {
    return MakeReply(kResultMalformed, "the request is nested too deeply");
  }
  const PObject& action = request["action"];
  if (!action.isString()) {
    return MakeReply(kResultMalformed, "the request has no \"action\" string");
  }
  for (const Entry& e : kActions) {
    if (action.asStringRef() != e.action) continue;
    for (const auto& m : request.asMap()) {
      if (m.first != "action" && e.keys.count(m.first) == 0) {
        return MakeReply(
            kResultMalformed,
            "unknown key \"" + m.first.substr(0, 64) + "\" for " + e.action);
      }
    }
    if (e.changes && stopping_) {
      return MakeReply(kResultBusy, "the service is stopping");
    }
    return (this->*e.fn)(request);
  }
  return MakeReply(
      kResultUnknownAction,
      "unknown action \"" + action.asStringRef().substr(0, 64) + "\"");
}

Daemon::Task* Daemon::FindTask(const PObject& request, PObject& reply) {
  unsigned long long id = 0;
  if (!request.hasMember("id") || !ReadTaskId(request["id"], id)) {
    reply = MakeReply(kResultMalformed, "the request needs a task \"id\"");
    return nullptr;
  }
  auto it = tasks_.find(id);
  if (it == tasks_.end()) {
    reply = MakeReply(kResultUnknownTask, "no task " + std::to_string(id));
    return nullptr;
  }
  return &it->second;
}

PObject Daemon::TaskMap(unsigned long long id, const Task& task) {
  PObject map = TaskToMap(task.stored, false);
  long next = scheduler_.Next(id);
  map["next_run"] = static_cast<unsigned long long>(next > 0 ? next : 0);
  if (next < 0) {
    map["schedule_error"] =
        "the schedule gives no next time (the local time could not be "
        "computed)";
  }
  std::string state = "idle";
  auto watching = realtime_.find(id);
  if (watching != realtime_.end()) {
    state = "watching";
    if (watching->second.watcher->InFlight()) state = "pushing";
  } else if (runs_.count(id) != 0) {
    state = "running";
  } else if (task.queued) {
    state = "queued";
  } else if (scheduler_.RetryPending(id)) {
    state = "retry_wait";
  }
  map["state"] = state;
  map["last_result"] = history_.LastResult(id);
  return map;
}

bool Daemon::Store(const StoredTask& stored, std::string& error) {
  if (!store_.Save(stored, error)) return false;
  unsigned long long id = stored.task.GetID();
  long now = clock_.WallSeconds();
  tasks_[id].stored = stored;
  scheduler_.Set(id, stored.task.GetInfo().GetSchedule(), stored.enabled, now);
  std::string ignored;
  if (!history_.SetLastDue(id, now, ignored)) {
    S2S::Logger::LogMsg(S2S::Logger::Error, "[ERROR] s2sd: %s\n",
                        ignored.c_str());
  }
  SyncWatchers();
  return true;
}

PObject Daemon::DoList(const PObject&) {
  PObject reply = Ok(std::to_string(tasks_.size()) + " tasks");
  // Built in place: a list of many tasks is too large to copy around.
  PObject::Array& list = reply["tasks"].asArray();
  list.reserve(tasks_.size());
  for (const auto& it : tasks_) list.push_back(TaskMap(it.first, it.second));
  return reply;
}

PObject Daemon::DoGet(const PObject& request) {
  PObject reply;
  Task* task = FindTask(request, reply);
  if (task == nullptr) return reply;
  unsigned long long id = task->stored.task.GetID();
  reply = Ok(Named(id, task->stored.task.GetInfo().GetName()));
  reply["task"] = TaskMap(id, *task);
  return reply;
}

PObject Daemon::DoAdd(const PObject& request) {
  const PObject& in = request["task"];
  if (!in.isMap()) {
    return MakeReply(kResultMalformed, "the request needs a \"task\" map");
  }
  PObject map = in;
  if (map.hasMember("id") && map["id"].isInteger() && map["id"].asUInt64() == 0)
    map.asMap().erase("id");
  StoredTask stored;
  std::string error;
  if (!ApplyTaskMap(map, stored, error)) {
    return MakeReply(kResultMalformed, error);
  }
  if (!map.hasMember("pswd")) {
    return MakeReply(kResultInvalidTask, "the task has no password (\"pswd\")");
  }
  unsigned long long id = stored.task.GetID();
  if (!map.hasMember("id")) {
    for (id = 1; tasks_.count(id) != 0; ++id) {
    }
    stored.task.SetID(id);
  } else if (tasks_.count(id) != 0) {
    return MakeReply(kResultInvalidTask,
                     "task id " + std::to_string(id) + " is used already");
  }
  const std::string name = stored.task.GetInfo().GetName();
  for (const auto& it : tasks_) {
    if (it.second.stored.task.GetInfo().GetName() == name) {
      return MakeReply(kResultInvalidTask, "the name \"" + name +
                                               "\" is used by task " +
                                               std::to_string(it.first));
    }
  }
  if (!CheckTask(stored, error)) return MakeReply(kResultInvalidTask, error);
  if (!Store(stored, error)) return MakeReply(kResultInternal, error);
  PObject reply = Ok(Named(id, name) + " added");
  reply["id"] = id;
  return reply;
}

PObject Daemon::DoUpdate(const PObject& request) {
  PObject reply;
  Task* task = FindTask(request, reply);
  if (task == nullptr) return reply;
  unsigned long long id = task->stored.task.GetID();
  const PObject& in = request["task"];
  if (!in.isMap()) {
    return MakeReply(kResultMalformed, "the request needs a \"task\" map");
  }
  unsigned long long inner = 0;
  if (in.hasMember("id") && (!ReadTaskId(in["id"], inner) || inner != id)) {
    return MakeReply(kResultMalformed,
                     "the task map's \"id\" differs from the request's");
  }
  StoredTask stored = task->stored;
  std::string error;
  if (!ApplyTaskMap(in, stored, error)) {
    return MakeReply(kResultMalformed, error);
  }
  const std::string name = stored.task.GetInfo().GetName();
  for (const auto& it : tasks_) {
    if (it.first != id && it.second.stored.task.GetInfo().GetName() == name) {
      return MakeReply(kResultInvalidTask, "the name \"" + name +
                                               "\" is used by task " +
                                               std::to_string(it.first));
    }
  }
  if (!CheckTask(stored, error)) return MakeReply(kResultInvalidTask, error);
  if (!Store(stored, error)) return MakeReply(kResultInternal, error);
  sessions_.Drop(id);
  reply = Ok(Named(id, name) + " updated");
  reply["task"] = TaskMap(id, tasks_[id]);
  return reply;
}

PObject Daemon::DoDelete(const PObject& request) {
  PObject reply;
  Task* task = FindTask(request, reply);
  if (task == nullptr) return reply;
  unsigned long long id = task->stored.task.GetID();
  std::string name = task->stored.task.GetInfo().GetName();
  if (runs_.count(id) != 0) {
    return MakeReply(kResultBusy,
                     Named(id, name) + " is running; cancel it first");
  }
  std::string error;
  if (!store_.Remove(id, error)) return MakeReply(kResultInternal, error);
  queue_.erase(std::remove(queue_.begin(), queue_.end(), id), queue_.end());
  tasks_.erase(id);
  StopWatching(id);
  scheduler_.Remove(id);
  sessions_.Drop(id);
  history_.Remove(id);
  return Ok(Named(id, name) + " deleted");
}

PObject Daemon::SetEnabled(const PObject& request, bool enabled) {
  PObject reply;
  Task* task = FindTask(request, reply);
  if (task == nullptr) return reply;
  unsigned long long id = task->stored.task.GetID();
  std::string name = Named(id, task->stored.task.GetInfo().GetName());
  if (task->stored.enabled != enabled) {
    StoredTask stored = task->stored;
    stored.enabled = enabled;
    std::string error;
    if (!Store(stored, error)) return MakeReply(kResultInternal, error);
  }
  return Ok(name + (enabled ? " enabled" : " disabled"));
}

PObject Daemon::DoEnable(const PObject& request) {
  return SetEnabled(request, true);
}

PObject Daemon::DoDisable(const PObject& request) {
  return SetEnabled(request, false);
}

PObject Daemon::DoRun(const PObject& request) {
  PObject reply;
  Task* task = FindTask(request, reply);
  if (task == nullptr) return reply;
  unsigned long long id = task->stored.task.GetID();
  std::string name = Named(id, task->stored.task.GetInfo().GetName());
  if (runs_.count(id) != 0) {
    return MakeReply(kResultBusy, name + " is running already");
  }
  if (task->queued) return MakeReply(kResultBusy, name + " is queued already");
  RunOptions options;
  for (const char* key : {"dry_run", "confirm_deletions"}) {
    if (request.hasMember(key) && !request[key].isInteger()) {
      return MakeReply(kResultMalformed,
                       std::string("\"") + key + "\" must be 0 or 1");
    }
  }
  options.dry_run = request["dry_run"].asBool();
  options.confirm_deletions = request["confirm_deletions"].asBool();
  auto watching = realtime_.find(id);
  if (watching != realtime_.end()) {
    if (options.dry_run) {
      return MakeReply(kResultBusy,
                       name +
                           " is watching its shares; a dry run needs it "
                           "stopped (disable it first)");
    }
    watching->second.watcher->FullSync(clock_.MonotonicSeconds());
    if (options.confirm_deletions) {
      watching->second.confirm_full = true;
      return Ok(name +
                ": a full sync of every share is queued; it may delete past "
                "the delete guard");
    }
    return Ok(name + ": a full sync of every share is queued");
  }
  // A dry run does not stand in for the retry that a failed run awaits.
  if (!options.dry_run) scheduler_.CancelRetry(id);
  Queue(id, "manual", options);
  return Ok(name + (runs_.count(id) != 0 ? " started" : " queued") +
            (options.dry_run ? " (dry run)" : ""));
}

PObject Daemon::DoCancel(const PObject& request) {
  PObject reply;
  Task* task = FindTask(request, reply);
  if (task == nullptr) return reply;
  unsigned long long id = task->stored.task.GetID();
  std::string name = Named(id, task->stored.task.GetInfo().GetName());
  auto run = runs_.find(id);
  bool was_running = run != runs_.end();
  if (was_running) run->second->cancel.Set();
  auto watching = realtime_.find(id);
  if (watching != realtime_.end() && watching->second.watcher->InFlight()) {
    // The batch's paths stay pending; the task goes on watching.
    watching->second.session->Cancel();
    was_running = true;
  }
  if (task->queued) {
    queue_.erase(std::remove(queue_.begin(), queue_.end(), id), queue_.end());
    task->queued = false;
  }
  scheduler_.CancelRetry(id);
  reply = Ok(name + (was_running ? " cancelled" : " was not running"));
  reply["was_running"] = was_running;
  return reply;
}

PObject Daemon::DoStatus(const PObject&) {
  long now = clock_.WallSeconds();
  PObject reply = Ok("running");
  reply["version"] = S2S_VERSION;
  reply["pid"] = static_cast<unsigned long long>(getpid());
  reply["started"] = static_cast<unsigned long long>(started_);
  reply["uptime"] = static_cast<unsigned long long>(now - started_);
  reply["max_parallel"] = config_.max_parallel;
  reply["tasks"] = static_cast<unsigned long long>(tasks_.size());
  PObject::Array running;
  for (const auto& it : runs_) {
    const ActiveRun& run = *it.second;
    PObject r;
    r = PObject::Map();
    r["id"] = it.first;
    r["name"] = run.task.task.GetInfo().GetName();
    r["trigger"] = run.trigger;
    r["dry_run"] = run.options.dry_run;
    r["started"] = static_cast<unsigned long long>(run.started);
    std::string share, step;
    KARO::Backup::RsyncWrapper::TransferProgress p;
    run.Progress(share, step, p);
    r["share"] = share;
    r["step"] = step;
    PutProgress(p, r);
    PObject::Array shares;
    for (const ActiveRun::ShareProgress& s : run.Shares()) {
      PObject& entry = shares.emplace_back();
      entry = PObject::Map();
      entry["name"] = s.name;
      entry["step"] = s.step;
      PutProgress(s.transfer, entry);
    }
    r["shares"] = shares;
    running.push_back(r);
  }
  reply["running"] = running;
  PObject::Array next;
  for (const auto& due : scheduler_.Upcoming(tasks_.size())) {
    PObject n;
    n = PObject::Map();
    n["id"] = due.second;
    n["name"] = tasks_[due.second].stored.task.GetInfo().GetName();
    n["next"] = static_cast<unsigned long long>(due.first);
    next.push_back(n);
  }
  reply["next_runs"] = next;
  PObject::Array realtime;
  double mono = clock_.MonotonicSeconds();
  for (const auto& it : realtime_) {
    realtime.push_back(it.second.watcher->StatusMap(mono));
  }
  reply["realtime"] = realtime;
  return reply;
}

PObject Daemon::DoHistory(const PObject& request) {
  PObject reply;
  Task* task = FindTask(request, reply);
  if (task == nullptr) return reply;
  size_t limit = History::kMaxRuns;
  if (request.hasMember("limit")) {
    const PObject& l = request["limit"];
    if (!l.isInteger() || l.asUInt64() < 1 ||
        l.asUInt64() > History::kMaxRuns) {
      return MakeReply(kResultMalformed, "\"limit\" must be 1 to 50");
    }
    limit = l.asUInt64();
  }
  unsigned long long id = task->stored.task.GetID();
  PObject::Array runs = history_.Runs(id, limit);
  reply = Ok(std::to_string(runs.size()) + " runs of " +
             Named(id, task->stored.task.GetInfo().GetName()));
  reply["runs"] = runs;
  return reply;
}

PObject Daemon::DoReload(const PObject&) {
  std::vector<std::string> errors;
  Reload(errors);
  PObject reply = Ok(std::to_string(tasks_.size()) + " tasks loaded, " +
                     std::to_string(errors.size()) + " refused");
  reply["tasks"] = static_cast<unsigned long long>(tasks_.size());
  PObject::Array list;
  for (const std::string& e : errors) {
    list.emplace_back(e.substr(0, ControlServer::kMaxMessage));
  }
  reply["errors"] = list;
  return reply;
}

}  // namespace s2s_service
