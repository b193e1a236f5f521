// One realtime task's watching, on the service loop's thread: its change
// source, its batcher, and the clocks around them.
//
// Start() picks the source (fanotify where it works and the task allows,
// else inotify) and watches every share's directory. From then on the loop
// feeds it: Read() when the source's descriptor is readable, Pump() while
// the source has set-up work, Tick() at every wake-up. It asks for a full
// sync of every share when each share's watch is complete, every
// `full_sync` seconds after that (at most every 5 minutes while some
// directories cannot be watched), after an overflow, and when a lost share
// is back. A share whose directory goes (deleted, moved, unmounted) stops
// being watched and is looked for again every 2 seconds.
//
// A batch is ready when the batcher's delay has passed, no batch is being
// pushed, the source has no set-up work left (a directory not yet watched
// could otherwise change unseen after its push) and no retry wait runs.
// Ended() puts back what a failed batch did not push and waits 1, 2, 4 ...
// up to 60 seconds before the next try.
//
// Times are the monotonic seconds of the service's clock seam.
// Thread-safety: none; the loop owns it.
#ifndef S2S_SERVICE_WATCHER_H_
#define S2S_SERVICE_WATCHER_H_

#include <sys/types.h>

#include <memory>
#include <string>
#include <vector>

#include "S2S/logger.h"
#include "S2S/pobject.h"
#include "service/batcher.h"
#include "service/task_map.h"
#include "service/watch_source.h"

namespace s2s_service {

class Watcher {
 public:
  Watcher(unsigned long long id, const StoredTask& task,
          const WatchLimits& limits);
  ~Watcher();
  Watcher(const Watcher&) = delete;
  Watcher& operator=(const Watcher&) = delete;

  // Makes the source and watches the shares. False only when no source at
  // all could be made (logged; the status says why).
  bool Start(double now);

  // The source's descriptor (-1 before Start).
  int Fd() const;
  void Read(double now);
  bool Busy() const;
  void Pump(double now);
  // Health checks, retries of lost shares, the full-sync interval.
  void Tick(double now);
  // When Tick or (with `batch`) a batch is due next (monotonic seconds).
  double NextDue(bool batch = true) const;

  // A full sync of every share, as soon as the settle delay allows.
  void FullSync(double now);
  bool Ready(double now) const;
  // The next batch; marks it in flight. REQUIRES: Ready(now).
  std::vector<S2S::Event> Take();
  // The batch in flight ended, having pushed `pushed` paths; `unpushed`
  // is what it could not push (all of it when it failed before the first
  // transfer).
  void Ended(bool ok, size_t pushed, const std::vector<S2S::Event>& unpushed,
             const std::string& error, double now, long wall);
  bool InFlight() const { return in_flight_; }

  // Counted for the status: rsync runs and files pushed by a batch.
  void CountRuns(size_t runs) { rsync_runs_ += runs; }

  // The task's realtime status map (doc/service_protocol.md).
  S2S::PObject StatusMap(double now) const;
  const StoredTask& task() const { return task_; }

 private:
  struct Share {
    std::string name, path;
    bool watching = false;
    std::string message;  // why it is not watched
    dev_t dev = 0;
    ino_t ino = 0;
  };
  bool MakeSource(bool fanotify, std::string& error);
  // False when the source refused an existing directory.
  bool Watch(Share& share);
  void Lose(Share& share, const std::string& why);
  void Feed(const std::vector<S2S::Event>& events, double now);
  double FullInterval() const;
  void Log(S2S::Logger::Level level, const std::string& text) const;

  unsigned long long id_;
  StoredTask task_;
  WatchLimits limits_;
  Batcher batcher_;
  std::unique_ptr<ChangeSource> source_;
  std::string source_note_;  // why not fanotify, when it was wanted
  std::string problem_;      // the source's problem, once logged
  std::vector<Share> shares_;
  double next_check_ = 0, next_full_ = 0, retry_at_ = 0, backoff_ = 0;
  bool in_flight_ = false;
  double batch_first_ = 0;  // the oldest change of the batch in flight
  double oldest_ = 0;       // of the pending changes; 0 none
  // Since start.
  unsigned long long events_ = 0, batches_ = 0, paths_ = 0, full_syncs_ = 0,
                     failures_ = 0, rsync_runs_ = 0;
  long last_batch_ = 0;  // wall clock
  double last_lag_ = 0;  // s from the first change to the end of its push
  std::string last_error_;
};

}  // namespace s2s_service

#endif  // S2S_SERVICE_WATCHER_H_
