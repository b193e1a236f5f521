// The task store: one file per task, <dir>/<id>.task, holding the task's
// map (service/task_map.h) as a record (service/record.h), password
// included; so every file is mode 0600 and replaced atomically.
//
// Loading reads every file on its own: a file that cannot be read, decoded
// or validated is named in the errors (and logged) and the others load.
#ifndef S2S_SERVICE_TASK_STORE_H_
#define S2S_SERVICE_TASK_STORE_H_

#include <map>
#include <string>
#include <vector>

#include "service/task_map.h"

namespace s2s_service {

class TaskStore {
 public:
  // `dir`: the directory of the task files, e.g. <root>/etc/s2s/tasks.
  explicit TaskStore(const std::string& dir) : dir_(dir) {}

  // Every valid task file, by id, into `tasks` (cleared first); each
  // refused file adds "<file>: <why>" to `errors`. Returns false only when
  // the directory exists but cannot be listed (also in `errors`).
  bool Load(std::map<unsigned long long, StoredTask>& tasks,
            std::vector<std::string>& errors) const;
  // Writes the task's file. True, or false with `error`.
  bool Save(const StoredTask& task, std::string& error) const;
  // Removes the task's file. True (also when there was none), or false with
  // `error`.
  bool Remove(unsigned long long id, std::string& error) const;

  std::string PathOf(unsigned long long id) const;

 private:
  std::string dir_;
};

}  // namespace s2s_service

#endif  // S2S_SERVICE_TASK_STORE_H_
