// What a task's run learnt of its server and the next run of the same task
// may reuse: the address that answered the probe, the server's protocol
// version, and the pairing of the task's shares. Probing and pairing cost
// three commands, as many as the rest of a one-share run without changes;
// a task that runs every few minutes need not repeat them each time.
//
// The service keeps one session per task in a SessionCache, which the runs
// on the worker threads share. A session is handed out only to a task whose
// server settings (the whole SyncInfo) and share list are the ones it was
// made for, and only while it is younger than the cache's maximum age, ten
// minutes by default; an edited task therefore probes again at once. The
// task runner drops a session itself when the server answers that it is no
// longer good (service/task_runner.h).
#ifndef S2S_SERVICE_SESSION_H_
#define S2S_SERVICE_SESSION_H_

#include <list>
#include <map>
#include <mutex>
#include <string>

#include "S2S/sync_obj_task.h"

namespace s2s_service {

struct Session {
  bool valid = false;
  S2S::SyncInfo probed;  // the probe's sync info: the address that answered
  int server_version = -1;
  double made = 0;  // when the probe ran, on SessionClock()
};

// The clock of Session::made: monotonic seconds.
double SessionClock();

// Sessions by task id. Thread-safe.
class SessionCache {
 public:
  static constexpr double kMaxAge = 600;
  explicit SessionCache(double max_age = kMaxAge) : max_age_(max_age) {}

  // The session kept for `task` when it was made for the task's SyncInfo
  // and share list and is younger than the maximum age at `now`; an invalid
  // session otherwise.
  Session Get(const S2S::SyncTask& task, double now) const;
  // Keeps `session` for `task` (by its id, with its SyncInfo and share
  // list); an invalid session drops the one kept.
  void Put(const S2S::SyncTask& task, const Session& session);
  // Forgets the session of task `id`.
  void Drop(unsigned long long id);

 private:
  struct Entry {
    S2S::SyncInfo settings;
    std::list<std::string> shares;
    Session session;
  };
  const double max_age_;
  mutable std::mutex mu_;
  std::map<unsigned long long, Entry> entries_;
};

}  // namespace s2s_service

#endif  // S2S_SERVICE_SESSION_H_
