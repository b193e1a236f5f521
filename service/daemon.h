// The client service: runs sync tasks on their schedules and answers the
// control socket.
//
// One thread owns the event loop: a timer (timerfd on the wall clock, armed
// at the scheduler's earliest due time and cancelled by a clock change, so
// that every next time is then recomputed), the signals (signalfd), and two
// queues it waits on through eventfds: runs that ended, and requests from
// the control socket's thread; and an inotify watch on /etc, where the
// local time zone lies, so that a change of zone recomputes the next times
// as a change of the clock does. Runs happen on worker threads (one Rsyncer
// each); the loop never waits on a transfer. All task state belongs to the
// loop's thread.
//
// Life: Run() writes the pid file, loads the task store, makes the runs
// missed while the service was down (once per task), listens, and loops
// until SIGTERM or SIGINT; then it cancels the running transfers (the task
// runner reports their end to the server), waits for them and returns.
// SIGHUP reloads the task store.
#ifndef S2S_SERVICE_DAEMON_H_
#define S2S_SERVICE_DAEMON_H_

#include <poll.h>

#include <condition_variable>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "S2S/pobject.h"
#include "service/clock.h"
#include "service/config.h"
#include "service/control_server.h"
#include "service/history.h"
#include "service/realtime_session.h"
#include "service/run_worker.h"
#include "service/scheduler.h"
#include "service/session.h"
#include "service/task_store.h"
#include "service/watcher.h"

namespace s2s_service {

class Daemon {
 public:
  Daemon(const DaemonConfig& config, const Clock& clock);
  ~Daemon();
  Daemon(const Daemon&) = delete;
  Daemon& operator=(const Daemon&) = delete;

  // Runs the service until it is told to stop. 0 after a clean stop; 1
  // when it could not start (the reason is logged).
  int Run();

 private:
  struct Task {
    StoredTask stored;
    bool queued = false;
    std::string queued_trigger;
    RunOptions queued_options;  // dry run, confirmed deletions
  };
  struct Pending {  // a request handed over by the control thread
    const S2S::PObject* request;
    S2S::PObject reply;
    bool done = false;
  };
  using Action = S2S::PObject (Daemon::*)(const S2S::PObject& request);
  // An enabled realtime task: its watcher on the loop, its session (a
  // thread) toward the server, and the batch it pushes.
  struct Realtime {
    std::unique_ptr<Watcher> watcher;
    std::unique_ptr<RealtimeSession> session;
    std::vector<S2S::Event> batch;  // in flight
    bool confirm_full = false;      // the next full sync may delete past
                                    // the guard
  };

  bool Setup();
  void Teardown();
  void Loop();
  void OnTimer();
  void OnSignal();
  void OnRunsEnded();
  void OnRequests();
  void OnZoneChange();
  void ArmTimer();
  void Reload(std::vector<std::string>& errors);
  void CatchUp();

  // Queues a run of the task (nothing when it runs or waits already) and
  // starts what may start. False when it was running or queued already.
  bool Queue(unsigned long long id, const std::string& trigger,
             const RunOptions& options = RunOptions());
  void StartQueued();
  // Whether no run and no batch holds any of `shares`.
  bool SharesFree(const std::list<std::string>& shares) const;
  void Start(unsigned long long id, const std::string& trigger);
  void Finish(unsigned long long id);
  S2S::PObject RunMap(const ActiveRun& run, bool ended) const;

  // Realtime tasks (daemon_realtime.cc). Watchers follow the tasks: an
  // enabled realtime task watches, anything else does not.
  void SyncWatchers();
  void StartWatching(unsigned long long id);
  void StopWatching(unsigned long long id);
  // Poll entries for the watchers' descriptors, appended to `fds`.
  void WatchFds(std::vector<pollfd>& fds) const;
  // Milliseconds until a watcher is due; 0 when one has set-up work; -1
  // when none is due ever.
  int WatchTimeout() const;
  void OnWatchers(const pollfd* fds, size_t n);
  void StartBatches();
  void OnSessionDone(RealtimeSession* session, bool ended);
  size_t BatchesInFlight() const;
  S2S::PObject BatchMap(const BatchResult& r, bool whole) const;
  // A share's entry of a run map.
  static S2S::PObject ShareMap(const ShareOutcome& share, bool dry_run = false);

  // The control thread's entry: hands the request to the loop and waits.
  S2S::PObject Handle(const S2S::PObject& request);
  S2S::PObject Dispatch(const S2S::PObject& request);
  S2S::PObject DoList(const S2S::PObject& request);
  S2S::PObject DoGet(const S2S::PObject& request);
  S2S::PObject DoAdd(const S2S::PObject& request);
  S2S::PObject DoUpdate(const S2S::PObject& request);
  S2S::PObject DoDelete(const S2S::PObject& request);
  S2S::PObject DoEnable(const S2S::PObject& request);
  S2S::PObject DoDisable(const S2S::PObject& request);
  S2S::PObject DoRun(const S2S::PObject& request);
  S2S::PObject DoCancel(const S2S::PObject& request);
  S2S::PObject DoStatus(const S2S::PObject& request);
  S2S::PObject DoHistory(const S2S::PObject& request);
  S2S::PObject DoReload(const S2S::PObject& request);
  S2S::PObject SetEnabled(const S2S::PObject& request, bool enabled);
  // The task named by the request's "id", or null with `reply` set.
  Task* FindTask(const S2S::PObject& request, S2S::PObject& reply);
  S2S::PObject TaskMap(unsigned long long id, const Task& task);
  // Saves `stored` (a new or changed task) and applies it to the schedule.
  bool Store(const StoredTask& stored, std::string& error);

  DaemonConfig config_;
  const Clock& clock_;
  long started_ = 0;
  TaskStore store_;
  History history_;
  Scheduler scheduler_;
  std::map<unsigned long long, Task> tasks_;
  std::deque<unsigned long long> queue_;  // waiting for a slot or a share
  SessionCache sessions_;  // each task's probe and pairing, for its next run
  std::map<unsigned long long, std::shared_ptr<ActiveRun>> runs_;
  std::map<unsigned long long, Realtime> realtime_;
  // Sessions told to stop; each is joined once it says it has ended.
  std::vector<std::unique_ptr<RealtimeSession>> leaving_;
  bool stopping_ = false;
  ControlServer control_;

  int timer_fd_ = -1;
  int signal_fd_ = -1;
  int ended_fd_ = -1;    // eventfd: a run ended
  int request_fd_ = -1;  // eventfd: a request waits
  int zone_fd_ = -1;     // inotify on /etc: the local time zone changed
  std::mutex mu_;        // guards the members below and each Pending
  std::vector<unsigned long long> ended_;
  std::vector<std::pair<RealtimeSession*, bool>> sessions_done_;
  std::deque<Pending*> requests_;
  bool closed_ = false;  // the loop answers no more requests
  std::condition_variable answered_;
};

}  // namespace s2s_service

#endif  // S2S_SERVICE_DAEMON_H_
