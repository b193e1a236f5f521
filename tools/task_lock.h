// One run per task at a time, across processes.
//
// A run holds an exclusive flock on <root>/run/lock/s2s-task-<id>.lock. The
// descriptor is inherited by the programs the run starts (rsync above all),
// so the lock stays held until the last of them is gone: a rerun is refused
// while a killed client's rsync still writes into the server's shares.
#ifndef S2S_TOOLS_TASK_LOCK_H_
#define S2S_TOOLS_TASK_LOCK_H_

#include <string>

namespace s2s_tools {

class TaskLock {
 public:
  TaskLock() = default;
  ~TaskLock();
  TaskLock(const TaskLock&) = delete;
  TaskLock& operator=(const TaskLock&) = delete;

  // Takes the lock of task `id` without waiting. Returns true, or false with
  // `error` saying why; `busy` is then true when another run holds it.
  bool Take(unsigned long long id, bool& busy, std::string& error);

 private:
  int fd_ = -1;
};

}  // namespace s2s_tools

#endif  // S2S_TOOLS_TASK_LOCK_H_
