// The changes of one realtime task, coalesced into batches of sub-paths.
//
// A change is an S2S::Event: the share, the path inside it (beginning with
// "/", no trailing or doubled slashes) and what happened (EventKind, in the
// event's status). Per share the batcher keeps the smallest set of pending
// paths: a path inside a queued directory is dropped, a queued directory
// drops what it holds, and a directory that gathers more than `crowd`
// pending entries is queued itself instead. A path that is gone pushes its
// parent (that is where the deletion or the rename shows). The whole share
// ("/") is queued after an overflow, a lost watch, or more than
// `pending_limit` paths, so memory stays bounded whatever arrives.
//
// A batch is due `settle` seconds after the last change, but never later
// than `max_delay` seconds after the first change since the last batch.
// Take() hands out every pending path, folded up the tree until each share
// has at most `max_paths` of them (each one is an rsync run).
//
// Pure logic: time is passed in (monotonic seconds). Thread-safety: none.
#ifndef S2S_SERVICE_BATCHER_H_
#define S2S_SERVICE_BATCHER_H_

#include <map>
#include <set>
#include <string>
#include <vector>

#include "S2S/sync_obj_share.h"

namespace s2s_service {

// What an event's status means to the batcher.
enum EventKind : int32_t {
  kEventChanged = 0,  // created, written, its attributes changed
  kEventGone = 1,     // deleted or moved away: its parent is pushed
  kEventWhole = 2,    // the whole share (overflow, a watch lost, start-up)
  kEventLost = 3,     // the share's directory was deleted, moved away or
                      // unmounted; its watch ended (never queued: taken as
                      // whole)
};

inline EventKind KindOf(const S2S::Event& e) {
  return static_cast<EventKind>(static_cast<int32_t>(e.GetStatus()));
}

// An event of `kind` for `path` (beginning with "/") of `share`.
S2S::Event MakeEvent(const std::string& share, const std::string& path,
                     EventKind kind = kEventChanged);

struct BatcherSettings {
  double settle = 2;             // seconds of quiet after the last change
  double max_delay = 30;         // longest wait after the first change
  size_t pending_limit = 10000;  // paths per share before it goes whole
  size_t crowd = 8;              // entries of one directory before it is queued
  size_t max_paths = 16;         // sub-paths per share in one batch
};

class Batcher {
 public:
  explicit Batcher(const BatcherSettings& settings) : settings_(settings) {}

  // Records a change seen at `now`.
  void Add(const S2S::Event& change, double now);
  // When the pending changes are due as a batch; 0 when nothing is pending.
  double Due() const;
  // Paths pending over all shares (a whole share counts as one).
  size_t Pending() const;
  bool Empty() const { return shares_.empty(); }
  // Takes every pending change: per share at most max_paths events, none
  // inside another, "/" for a whole share; shares in name order, paths
  // sorted. The batcher is empty afterwards.
  std::vector<S2S::Event> Take();
  // Puts back the events of a batch that could not be pushed, as changes
  // seen at `now`.
  void Restore(const std::vector<S2S::Event>& batch, double now);

  const BatcherSettings& settings() const { return settings_; }
  void set_settings(const BatcherSettings& settings) { settings_ = settings; }

 private:
  struct Share {
    bool whole = false;
    std::set<std::string> paths;            // none inside another
    std::map<std::string, size_t> per_dir;  // pending entries per parent
  };
  void Insert(Share& share, const std::string& path);
  void Fold(Share& share);

  BatcherSettings settings_;
  std::map<std::string, Share> shares_;
  double first_ = 0, last_ = 0;
};

// The directory that holds `path` ("/" for "/x" and for "/").
std::string ParentOf(const std::string& path);

}  // namespace s2s_service

#endif  // S2S_SERVICE_BATCHER_H_
