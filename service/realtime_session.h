// A realtime task's link to the server, on a thread of its own.
//
// The session probes the server and pairs the task's shares before its
// first batch, and again after a failure or when that is ten minutes old.
// Each batch it is handed is pushed share by share as a run does it: the
// sync announced (StartSyncShare), each sub-path pushed (RunSync, with the
// task's excludes; a path gone meanwhile is pushed through the nearest
// directory that is still there), an encrypted share's key file, and the
// share's end (FinishSync). The task's mass-delete guard holds as in a run:
// a push that would delete more than it allows deletes nothing (the rest
// goes through) unless the batch is confirmed, and its paths are not tried
// again; a part of a share counts against the share's entries as the last
// full push of it found them. While the task watches, a beacon goes out
// whenever the beacon interval passes without one, so the server shows the
// task busy; when the session stops it reports the task's end.
//
// The owner (the service's loop) hands over one batch at a time; the
// session calls `done` from its thread when the batch has ended and when
// the session itself has ended after Stop().
#ifndef S2S_SERVICE_REALTIME_SESSION_H_
#define S2S_SERVICE_REALTIME_SESSION_H_

#include <condition_variable>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "S2S/rsyncer.h"
#include "S2S/sync_obj_share.h"
#include "service/cancel.h"
#include "service/task_map.h"
#include "service/task_runner.h"

namespace s2s_service {

struct BatchResult {
  bool ok = false;
  bool cancelled = false;
  std::string error;                 // why it failed, in words
  size_t pushed = 0;                 // paths pushed
  size_t runs = 0;                   // rsync transfers made
  std::vector<S2S::Event> unpushed;  // to be tried again
  std::vector<ShareOutcome> shares;  // figures summed per share
  std::string held;                  // deletions the guard held, in words
  long started = 0, ended = 0;       // wall clock
};

class RealtimeSession {
 public:
  // `done(session, ended)` is called from the session's thread: when a
  // batch has ended, and (ended true) as its last act.
  using Done = std::function<void(RealtimeSession*, bool ended)>;
  RealtimeSession(unsigned long long id, const StoredTask& task,
                  unsigned int beacon_interval, Done done);
  // Stops and waits for the thread.
  ~RealtimeSession();
  RealtimeSession(const RealtimeSession&) = delete;
  RealtimeSession& operator=(const RealtimeSession&) = delete;

  unsigned long long id() const { return id_; }
  // Hands over a batch. REQUIRES: the previous one has ended.
  // `confirmed`: deletions past the guard go ahead.
  void Push(std::vector<S2S::Event> batch, bool confirmed = false);
  // The result of the batch that ended; false when none waits.
  bool TakeResult(BatchResult& result);
  // Stops the batch's transfer; what it did not push comes back unpushed.
  void Cancel();
  // Asks the thread to end (a transfer is cancelled, the task's end is
  // reported to the server); it calls `done` once more when it has.
  void Stop();
  // Whether the thread has ended; Join() then returns at once.
  bool Ended() const;
  void Join();

 private:
  void Main();
  bool Connect(std::string& error);
  void Beacon(const char* when);
  BatchResult RunBatch(const std::vector<S2S::Event>& batch, bool confirmed);
  void PushShare(const std::string& share,
                 const std::vector<S2S::Event>& events, bool confirmed,
                 BatchResult& r);
  // One path of `share` pushed within the guard; false when rsync failed.
  bool PushPath(const std::string& share, const std::string& path,
                bool confirmed, ShareOutcome& out, BatchResult& r);

  const unsigned long long id_;
  const StoredTask task_;
  const unsigned int beacon_interval_;
  Done done_;
  CancelFlag cancel_;
  // The thread's own.
  std::unique_ptr<S2S::Rsyncer> rsyncer_;
  double connected_at_ = -1;  // monotonic; -1 not connected
  double last_contact_ = 0;
  // Entries of each share's copy on the server after its last full push.
  std::map<std::string, unsigned long long> entries_;

  mutable std::mutex mu_;
  std::condition_variable wake_;
  bool stop_ = false, ended_ = false, has_batch_ = false, has_result_ = false;
  bool confirmed_ = false;
  std::vector<S2S::Event> batch_;
  BatchResult result_;
  std::thread thread_;
};

}  // namespace s2s_service

#endif  // S2S_SERVICE_REALTIME_SESSION_H_
