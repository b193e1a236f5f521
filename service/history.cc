#include "service/history.h"

#include <errno.h>
#include <unistd.h>

#include "S2S/logger.h"
#include "service/record.h"

namespace s2s_service {

using S2S::PObject;

std::string History::PathOf(unsigned long long id) const {
  return dir_ + "/" + std::to_string(id);
}

void History::Load(unsigned long long id) {
  if (tasks_.count(id) != 0) return;
  Entry& e = tasks_[id];
  std::string text, error;
  if (!ReadWholeFile(PathOf(id), text, error)) {
    if (errno != ENOENT) {
      S2S::Logger::LogMsg(S2S::Logger::Warning, "[WARNING] history: %s\n",
                          error.c_str());
    }
    return;
  }
  PObject record;
  if (!DecodeRecord(text, record, error)) {
    S2S::Logger::LogMsg(S2S::Logger::Warning,
                        "[WARNING] history of task %llu unreadable: %s\n", id,
                        error.c_str());
    return;
  }
  e.last_due = static_cast<long>(record["last_due"].asInt64());
  for (const PObject& run : record["runs"].asArray()) {
    if (!run.isMap() || e.runs.size() == kMaxRuns) continue;
    e.runs.push_back(run);
    PObject& last = e.runs.back();
    if (last["outcome"].asString() == "running") {
      last["outcome"] = "failed";
      last["message"] = "the service stopped during the run";
    }
  }
}

bool History::Save(unsigned long long id, const Entry& e, std::string& error) {
  PObject record;
  record = PObject::Map();
  record["last_due"] = static_cast<unsigned long long>(e.last_due);
  PObject::Array runs(e.runs.begin(), e.runs.end());
  record["runs"] = runs;
  // Not synced: a run's start and end are written often, and a lost entry
  // after a power cut costs less than a disk wait per run.
  return WriteFileAtomic(PathOf(id), EncodeRecord(record), 0600, error, false);
}

bool History::Begin(unsigned long long id, const PObject& run,
                    std::string& error) {
  Load(id);
  Entry& e = tasks_[id];
  e.runs.push_front(run);
  if (e.runs.size() > kMaxRuns) e.runs.pop_back();
  return Save(id, e, error);
}

bool History::Finish(unsigned long long id, const PObject& run,
                     std::string& error) {
  Load(id);
  Entry& e = tasks_[id];
  if (e.runs.empty()) {
    e.runs.push_front(run);
  } else {
    e.runs.front() = run;
  }
  return Save(id, e, error);
}

PObject::Array History::Runs(unsigned long long id, size_t limit) {
  Load(id);
  const Entry& e = tasks_[id];
  PObject::Array out;
  for (size_t i = 0; i < e.runs.size() && i < limit; ++i) {
    out.push_back(e.runs[i]);
  }
  return out;
}

std::string History::LastResult(unsigned long long id) {
  Load(id);
  for (const PObject& run : tasks_[id].runs) {
    std::string outcome = run["outcome"].asString();
    // A dry run synced nothing.
    if (outcome != "running" && !run["dry_run"].asBool()) return outcome;
  }
  return "";
}

long History::LastDue(unsigned long long id) {
  Load(id);
  return tasks_[id].last_due;
}

bool History::SetLastDue(unsigned long long id, long due, std::string& error) {
  Load(id);
  Entry& e = tasks_[id];
  e.last_due = due;
  return Save(id, e, error);
}

void History::Remove(unsigned long long id) {
  tasks_.erase(id);
  unlink(PathOf(id).c_str());
}

}  // namespace s2s_service
