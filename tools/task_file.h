// A sync task as the client program receives it: from a task file and the
// command line, before it becomes a SyncTask.
//
// Task file: a section file (the platform's format) with one section,
// [Task]; every key is optional, the command line overrides it:
//
//   [Task]
//   	name="nightly"            task name (the server records its status)
//   	id="1"                    task id
//   	server_ip="127.0.0.1"     server address
//   	server_name="backup1"     server name, looked up when no address works
//   	port="873"                port of the server's rsync daemon
//   	user="s2s"                daemon user
//   	password_file="/root/.s2s.pass"   mode 0600; never the password itself
//   	shares="docs:photos"      local shares, joined with ':'
//   	excludes="*.tmp:cache/"   rsync exclude rules, joined with ':'
//   	compress="no"             yes/no: compress data on the wire
//   	delta="no"                yes/no: block-level (delta) transfer
//   	ssh="no"                  yes/no: through SSH instead of the daemon
//   	ssh_port="22"
//   	delete_guard="yes"        yes/no: the mass-delete guard
//   	delete_guard_percent="50" it holds back deletions of more than this
//   	delete_guard_files="10000"  share of the server's copy or this many
//
// A "password" key is refused: passwords live in private files only.
#ifndef S2S_TOOLS_TASK_FILE_H_
#define S2S_TOOLS_TASK_FILE_H_

#include <list>
#include <string>

#include "S2S/sync_obj_task.h"
#include "service/task_runner.h"

namespace s2s_tools {

struct TaskSpec {
  std::string name;
  unsigned long long id = 1;
  std::string server_ip;
  std::string server_name;
  unsigned int port = 0;  // 0: the daemon's default port
  std::string user;
  std::string password_file;
  std::list<std::string> shares;
  std::list<std::string> excludes;
  bool compress = false;
  unsigned int max_bandwidth = 0;  // KiB/s; 0: no limit
  bool delta = false;
  bool ssh = false;
  unsigned int ssh_port = 0;
  s2s_service::DeleteGuard guard;
};

// Applies the keys of the [Task] section of `path` to `spec`. Returns true,
// or false with `error` naming the file and the offending key.
bool LoadTaskFile(const std::string& path, TaskSpec& spec, std::string& error);

// "yes"/"no" (also "true"/"false", "1"/"0", any case) into `out`.
bool ParseFlag(const std::string& text, bool& out);
// A decimal number up to `max` into `out`.
bool ParseNumber(const std::string& text, unsigned long long max,
                 unsigned long long& out);
// Splits at ':' dropping empty pieces.
std::list<std::string> SplitList(const std::string& text);

// Checks that the task is complete (name, shares, server, user), that
// nothing in it is what the server would refuse (s2s_service's
// ServerSideProblem), and that every share is known locally and may be
// synced. Returns true, or false with `error`.
bool CheckTaskSpec(const TaskSpec& spec, std::string& error);

// The library's task for `spec` with `password`.
S2S::SyncTask MakeSyncTask(const TaskSpec& spec, const std::string& password);

}  // namespace s2s_tools

#endif  // S2S_TOOLS_TASK_FILE_H_
