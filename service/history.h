// The history of each task's runs: the last kMaxRuns run maps per task,
// newest first, in one file per task (<dir>/<id>, a record with "runs" and
// "last_due"), rewritten atomically whenever a run starts or ends, so that
// a run in progress shows and the history survives a restart.
//
// A run map holds "start", "end" (0 while running), "trigger", "dry_run",
// "outcome" ("ok", "failed", "cancelled", "held", "running"), "message",
// "task_status", "task_result" and "shares" (per share "name", "step",
// "status", "status_text", "seconds", and rsync's figures "files",
// "bytes", "deleted", "matched", "sent", "speed"; a dry run's listing
// "would_send", "would_delete", "send_paths", "delete_paths").
//
// "last_due" is the schedule slot the task last ran for (or the time it was
// added), so that a slot missed while the service was down is found at
// start-up, and only once.
//
// Thread-safety: none; the service's loop owns it.
#ifndef S2S_SERVICE_HISTORY_H_
#define S2S_SERVICE_HISTORY_H_

#include <deque>
#include <map>
#include <string>

#include "S2S/pobject.h"

namespace s2s_service {

class History {
 public:
  static constexpr size_t kMaxRuns = 50;

  explicit History(const std::string& dir) : dir_(dir) {}

  // Reads the task's file (once; later calls do nothing). A run left
  // "running" by a service that stopped becomes "failed". A file that
  // cannot be decoded is logged and the task starts with an empty history.
  void Load(unsigned long long id);
  // Adds a run in progress (outcome "running") as the newest entry.
  bool Begin(unsigned long long id, const S2S::PObject& run,
             std::string& error);
  // Replaces the newest entry with the finished run.
  bool Finish(unsigned long long id, const S2S::PObject& run,
              std::string& error);
  // The newest `limit` runs, newest first.
  S2S::PObject::Array Runs(unsigned long long id, size_t limit);
  // The outcome of the newest finished run that was not a dry run; ""
  // before the first.
  std::string LastResult(unsigned long long id);

  long LastDue(unsigned long long id);
  bool SetLastDue(unsigned long long id, long due, std::string& error);

  // Forgets the task and removes its file.
  void Remove(unsigned long long id);

 private:
  struct Entry {
    std::deque<S2S::PObject> runs;
    long last_due = 0;
  };
  bool Save(unsigned long long id, const Entry& e, std::string& error);
  std::string PathOf(unsigned long long id) const;

  std::string dir_;
  std::map<unsigned long long, Entry> tasks_;
};

}  // namespace s2s_service

#endif  // S2S_SERVICE_HISTORY_H_
