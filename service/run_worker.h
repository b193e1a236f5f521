// One run of a task on a thread of its own: the task's shares locked
// against other runs (LockFactory, one lock file per share, so that other
// processes of the service are kept apart too), the task runner with the
// run's cancel flag bound to the thread, then a report back to the owner.
#ifndef S2S_SERVICE_RUN_WORKER_H_
#define S2S_SERVICE_RUN_WORKER_H_

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "service/cancel.h"
#include "service/session.h"
#include "service/task_map.h"
#include "service/task_runner.h"

namespace s2s_service {

struct ActiveRun {
  unsigned long long id = 0;
  StoredTask task;  // a copy: an update applies from the next run
  std::string trigger;
  RunOptions options;  // dry run, confirmed deletions, the task's guard
  long started = 0;    // wall clock
  unsigned int beacon_interval = 30;
  // Where the task's session is kept between runs; null: none is kept.
  SessionCache* sessions = nullptr;
  CancelFlag cancel;
  TaskOutcome outcome;  // written by the run's thread before it reports

  // Where the run is: the share and the step of the runner's last line, and
  // rsync's last progress figures while a share transfers (zeros else).
  void Progress(std::string& share, std::string& step,
                KARO::Backup::RsyncWrapper::TransferProgress& transfer) const;

  // The shares in progress, in name order, as a run syncs several at once:
  // each from its start to its last line, with its step and, while it
  // transfers, rsync's last progress figures.
  struct ShareProgress {
    std::string name, step;
    KARO::Backup::RsyncWrapper::TransferProgress transfer;
  };
  std::vector<ShareProgress> Shares() const;

  // Logs one line of the runner and follows the run's place by it.
  void Note(const std::string& line);

  std::thread thread;

 private:
  friend void StartRun(std::shared_ptr<ActiveRun>,
                       std::function<void(unsigned long long)>);
  mutable std::mutex mu_;
  std::string share_, step_;
  KARO::Backup::RsyncWrapper::TransferProgress transfer_;
  std::map<std::string, ShareProgress> shares_;
};

// Starts `run` on its thread; `done(id)` is called from that thread when
// the run has ended and `run->outcome` is final. The owner joins
// `run->thread` afterwards.
void StartRun(std::shared_ptr<ActiveRun> run,
              std::function<void(unsigned long long)> done);

}  // namespace s2s_service

#endif  // S2S_SERVICE_RUN_WORKER_H_
