// Where a realtime task learns of changes below its shares: the kernel's
// file system notifications, read from one descriptor that the service's
// loop polls.
//
// Two kinds exist. The fanotify source places one mark per file system that
// holds a watched share and is told the directory and the name of every
// change there (no watch per directory; needs root and Linux 5.9). The
// inotify source places a watch on every directory of every share, watches
// new directories as they appear and lists them, so that what was made in
// them before their watch existed is not missed. Both report the same
// events (service/batcher.h): a path changed or gone, a share to be synced
// whole (after an overflow of the kernel's queue, and once its watch is
// complete, so that what happened before is covered), and a share lost (its
// directory deleted or unmounted: the source stops watching it).
//
// Thread-safety: none; the loop's thread owns a source.
#ifndef S2S_SERVICE_WATCH_SOURCE_H_
#define S2S_SERVICE_WATCH_SOURCE_H_

#include <stddef.h>

#include <memory>
#include <string>
#include <vector>

#include "S2S/sync_obj_share.h"
#include "service/batcher.h"

namespace s2s_service {

// Limits below the kernel's own, so that tests reach them with small trees
// and bursts. 0: only the kernel's.
struct WatchLimits {
  // Events taken in one wake-up; past it the rest is dropped and counted
  // as an overflow of the kernel's queue.
  size_t queue = 0;
  // inotify watches of one source.
  size_t watches = 0;
  // Seconds between looks at the shares' directories: an unmount is not
  // reported by a file system mark, and a share that is back is watched
  // again at the next look.
  double check_every = 2;
};

struct WatchedShare {
  std::string name;
  std::string path;  // the directory whose contents the share's syncs push
};

class ChangeSource {
 public:
  virtual ~ChangeSource() = default;

  // "fanotify" or "inotify".
  virtual const char* Name() const = 0;
  // The descriptor to poll for reading.
  virtual int Fd() const = 0;
  // Starts watching `share`. True, or false with `error` in words (the
  // directory is missing, its file system cannot be marked, ...); the share
  // is then not watched. Its whole event comes once its watch is complete.
  virtual bool Add(const WatchedShare& share, std::string& error) = 0;
  // Stops watching the share (nothing when it is not watched).
  virtual void Remove(const std::string& name) = 0;
  // Takes what the kernel has reported, without blocking, into `out`.
  virtual void Read(std::vector<S2S::Event>& out) = 0;
  // Whether set-up work is left (directories still to be listed and
  // watched); Pump() does a slice of it, so the loop stays responsive.
  virtual bool Busy() const { return false; }
  virtual void Pump(std::vector<S2S::Event>& /*out*/) {}
  // Marks or watches in place.
  virtual size_t Watches() const = 0;
  // Why some changes cannot be seen (the watch limit was reached), in
  // words; "" when every directory is watched.
  const std::string& problem() const { return problem_; }
  // Overflows of the kernel's queue since the source was made.
  size_t overflows() const { return overflows_; }

 protected:
  std::string problem_;
  size_t overflows_ = 0;
};

// A fanotify source, or null with `error` saying why this kernel or this
// process cannot have one.
std::unique_ptr<ChangeSource> MakeFanotifySource(const WatchLimits& limits,
                                                 std::string& error);
// An inotify source, or null with `error` (no descriptor could be made).
std::unique_ptr<ChangeSource> MakeInotifySource(const WatchLimits& limits,
                                                std::string& error);

}  // namespace s2s_service

#endif  // S2S_SERVICE_WATCH_SOURCE_H_
