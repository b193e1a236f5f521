// The inotify source: a watch per directory. Each watch is a node that
// knows its parent's watch and its name, so that a renamed directory moves
// its whole subtree by changing one node, and a path is built by walking up.
#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <stdlib.h>
#include <string.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <deque>
#include <functional>
#include <set>
#include <unordered_map>

#include "service/watch_source.h"

namespace s2s_service {

namespace {

const uint32_t kMask = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO |
                       IN_MODIFY | IN_ATTRIB | IN_DELETE_SELF | IN_MOVE_SELF |
                       IN_ONLYDIR | IN_DONT_FOLLOW | IN_EXCL_UNLINK;
// Directories listed per slice of set-up work.
const size_t kScanSlice = 256;
// Reads per wake-up, so that a storm of events cannot hold the loop.
const int kReadsPerWake = 16;

std::string KernelWatchLimit() {
  char buf[32] = "";
  int fd = open("/proc/sys/fs/inotify/max_user_watches", O_RDONLY | O_CLOEXEC);
  if (fd >= 0) {
    ssize_t n = read(fd, buf, sizeof buf - 1);
    buf[n > 0 ? n : 0] = '\0';
    close(fd);
  }
  std::string s(buf);
  while (!s.empty() && (s.back() == '\n' || s.back() == ' ')) s.pop_back();
  return s.empty() ? "unknown" : s;
}

class InotifySource : public ChangeSource {
 public:
  InotifySource(int fd, const WatchLimits& limits) : fd_(fd), limits_(limits) {}
  ~InotifySource() override { close(fd_); }

  const char* Name() const override { return "inotify"; }
  int Fd() const override { return fd_; }
  bool Add(const WatchedShare& share, std::string& error) override;
  void Remove(const std::string& name) override;
  void Read(std::vector<S2S::Event>& out) override;
  bool Busy() const override { return !scan_.empty(); }
  void Pump(std::vector<S2S::Event>& out) override;
  size_t Watches() const override { return nodes_.size(); }

 private:
  struct Node {
    int parent;      // -1 for a share's directory
    unsigned share;  // for a share's directory; the others walk up to one
    unsigned generation;
    std::string name;
  };
  struct Root {
    std::string name, path;
    int wd = -1;
    bool active = false;
    bool whole_pending = false;
  };
  struct MovedAway {
    uint32_t cookie;
    int parent;
    std::string name;
  };

  // The share of a watch and its path inside it ("" for the share's own
  // directory); false for a watch that hangs on no share any more.
  bool Locate(int wd, unsigned& share, std::string& rel) const;
  int Watch(const std::string& path, int parent, unsigned share,
            const std::string& name);
  void Limit(const std::string& why);
  void Handle(const inotify_event& e, std::vector<S2S::Event>& out);
  void Overflow();
  void Lost(unsigned share, std::vector<S2S::Event>& out);
  void Unwatch(const std::function<bool(int, const Node&)>& which);
  void Detach(const MovedAway& gone);

  int fd_;
  WatchLimits limits_;
  std::vector<Root> roots_;
  std::unordered_map<int, Node> nodes_;
  std::deque<int> scan_;
  unsigned generation_ = 1;
  bool prune_ = false;  // a rescan runs: unreached nodes go at its end
  std::vector<MovedAway> moved_away_;
  std::set<uint32_t> moved_in_;
};

bool InotifySource::Locate(int wd, unsigned& share, std::string& rel) const {
  std::vector<const std::string*> names;
  auto it = nodes_.find(wd);
  for (; it != nodes_.end() && it->second.parent >= 0;
       it = nodes_.find(it->second.parent)) {
    names.push_back(&it->second.name);
    if (names.size() > PATH_MAX) return false;  // a cycle; cannot happen
  }
  if (it == nodes_.end()) return false;
  share = it->second.share;
  rel.clear();
  for (auto n = names.rbegin(); n != names.rend(); ++n) rel += "/" + **n;
  return roots_[share].active;
}

void InotifySource::Limit(const std::string& why) {
  if (!problem_.empty()) return;
  problem_ = "inotify watch limit reached at " + std::to_string(nodes_.size()) +
             " watches (" + why + "): directories beyond it are not watched";
}

int InotifySource::Watch(const std::string& path, int parent, unsigned share,
                         const std::string& name) {
  int wd = inotify_add_watch(fd_, path.c_str(), kMask);
  if (wd < 0) {
    if (errno == ENOSPC) {
      Limit("fs.inotify.max_user_watches is " + KernelWatchLimit());
    }
    return -1;  // gone meanwhile, or not a directory any more
  }
  auto it = nodes_.find(wd);
  if (it == nodes_.end()) {
    if (limits_.watches != 0 && nodes_.size() >= limits_.watches) {
      inotify_rm_watch(fd_, wd);
      Limit("the service's limit is " + std::to_string(limits_.watches));
      return -1;
    }
    it = nodes_.emplace(wd, Node{parent, share, 0, name}).first;
  } else {
    // A directory watched already: moved here, or reached again by a rescan.
    it->second.parent = parent;
    it->second.share = share;
    it->second.name = name;
  }
  if (it->second.generation != generation_) {
    it->second.generation = generation_;
    scan_.push_back(wd);
  }
  return wd;
}

bool InotifySource::Add(const WatchedShare& share, std::string& error) {
  char real[PATH_MAX];
  struct stat st;
  if (realpath(share.path.c_str(), real) == nullptr || stat(real, &st) != 0) {
    error = "cannot watch " + share.path + ": " + strerror(errno);
    return false;
  }
  if (!S_ISDIR(st.st_mode)) {
    error = "cannot watch " + share.path + ": not a directory";
    return false;
  }
  unsigned index = 0;
  while (index < roots_.size() && roots_[index].name != share.name) ++index;
  if (index == roots_.size()) roots_.emplace_back();
  Root& root = roots_[index];
  root.name = share.name;
  root.path = real;
  root.active = true;
  root.wd = Watch(real, -1, index, "");
  if (root.wd < 0) {
    error = "cannot watch " + share.path + ": " +
            (problem_.empty() ? strerror(errno) : problem_);
    root.active = false;
    return false;
  }
  root.whole_pending = true;
  return true;
}

void InotifySource::Unwatch(
    const std::function<bool(int, const Node&)>& which) {
  // Chosen first, removed after: the choice may walk up through nodes that
  // go too.
  std::vector<int> gone;
  for (const auto& it : nodes_) {
    if (which(it.first, it.second)) gone.push_back(it.first);
  }
  for (int wd : gone) {
    inotify_rm_watch(fd_, wd);
    nodes_.erase(wd);
  }
}

void InotifySource::Remove(const std::string& name) {
  for (unsigned i = 0; i < roots_.size(); ++i) {
    if (roots_[i].name != name || !roots_[i].active) continue;
    Unwatch([this, i](int wd, const Node&) {
      unsigned share = 0;
      std::string rel;
      return !Locate(wd, share, rel) || share == i;
    });
    roots_[i].active = false;
    roots_[i].wd = -1;
  }
}

void InotifySource::Lost(unsigned share, std::vector<S2S::Event>& out) {
  if (!roots_[share].active) return;
  out.push_back(
      MakeEvent(roots_[share].name, "/", static_cast<EventKind>(kEventLost)));
  Remove(roots_[share].name);
}

void InotifySource::Overflow() {
  // Directories made while events were lost have no watch: every share is
  // listed again, and synced whole once that is done.
  ++overflows_;
  ++generation_;
  prune_ = true;
  for (Root& root : roots_) {
    if (!root.active) continue;
    root.whole_pending = true;
    int wd =
        Watch(root.path, -1, static_cast<unsigned>(&root - &roots_[0]), "");
    if (wd >= 0) root.wd = wd;
  }
}

void InotifySource::Detach(const MovedAway& gone) {
  // A directory moved out of the shares: its watches would report paths it
  // no longer has.
  int top = -1;
  for (const auto& it : nodes_) {
    if (it.second.parent == gone.parent && it.second.name == gone.name) {
      top = it.first;
    }
  }
  if (top < 0) return;
  Unwatch([this, top](int wd, const Node&) {
    for (auto it = nodes_.find(wd); it != nodes_.end();
         it = nodes_.find(it->second.parent)) {
      if (it->first == top) return true;
    }
    return false;
  });
}

void InotifySource::Handle(const inotify_event& e,
                           std::vector<S2S::Event>& out) {
  if (e.mask & IN_Q_OVERFLOW) {
    Overflow();
    return;
  }
  auto it = nodes_.find(e.wd);
  if (it == nodes_.end()) return;  // a watch already forgotten
  unsigned share = 0;
  std::string rel;
  const bool root = it->second.parent < 0;
  if (!Locate(e.wd, share, rel)) {
    if (e.mask & IN_IGNORED) nodes_.erase(e.wd);
    return;
  }
  if (e.mask & (IN_IGNORED | IN_UNMOUNT | IN_DELETE_SELF | IN_MOVE_SELF)) {
    // A directory of the tree going is reported by its parent too; only
    // the share's own directory matters here.
    if (root) Lost(share, out);
    if (e.mask & IN_IGNORED) nodes_.erase(e.wd);
    return;
  }
  if (e.len == 0) return;  // the directory itself; its parent reports it
  const std::string name = e.name;
  std::string path = rel + "/" + name;
  if (e.mask & (IN_DELETE | IN_MOVED_FROM)) {
    out.push_back(MakeEvent(roots_[share].name, path, kEventGone));
    if ((e.mask & IN_MOVED_FROM) && (e.mask & IN_ISDIR)) {
      moved_away_.push_back(MovedAway{e.cookie, e.wd, name});
    }
    return;
  }
  out.push_back(MakeEvent(roots_[share].name, path, kEventChanged));
  if ((e.mask & IN_ISDIR) && (e.mask & (IN_CREATE | IN_MOVED_TO))) {
    if (e.mask & IN_MOVED_TO) moved_in_.insert(e.cookie);
    Watch(roots_[share].path + path, e.wd, share, name);
  }
}

void InotifySource::Read(std::vector<S2S::Event>& out) {
  alignas(inotify_event) char buf[65536];
  size_t taken = 0;
  bool overflow = false;
  for (int reads = 0; reads < kReadsPerWake; ++reads) {
    ssize_t n = read(fd_, buf, sizeof buf);
    if (n <= 0) break;
    for (ssize_t at = 0; at < n;) {
      const inotify_event* e = reinterpret_cast<const inotify_event*>(buf + at);
      at += static_cast<ssize_t>(sizeof(inotify_event) + e->len);
      if (overflow) continue;
      if (limits_.queue != 0 && ++taken > limits_.queue) {
        // What the kernel does past its queue's limit: the rest is lost.
        overflow = true;
        Overflow();
        continue;
      }
      Handle(*e, out);
    }
  }
  for (const MovedAway& gone : moved_away_) {
    if (moved_in_.count(gone.cookie) == 0) Detach(gone);
  }
  moved_away_.clear();
  moved_in_.clear();
}

void InotifySource::Pump(std::vector<S2S::Event>& out) {
  for (size_t done = 0; done < kScanSlice && !scan_.empty(); ++done) {
    int wd = scan_.front();
    scan_.pop_front();
    unsigned share = 0;
    std::string path;
    if (!Locate(wd, share, path)) continue;
    path = roots_[share].path + path;
    int dfd =
        open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    DIR* dir = dfd < 0 ? nullptr : fdopendir(dfd);
    if (dir == nullptr) {
      if (dfd >= 0) close(dfd);
      continue;
    }
    while (dirent* d = readdir(dir)) {
      if (strcmp(d->d_name, ".") == 0 || strcmp(d->d_name, "..") == 0) {
        continue;
      }
      struct stat st;
      bool is_dir = d->d_type == DT_DIR ||
                    (d->d_type == DT_UNKNOWN &&
                     fstatat(dfd, d->d_name, &st, AT_SYMLINK_NOFOLLOW) == 0 &&
                     S_ISDIR(st.st_mode));
      if (is_dir) Watch(path + "/" + d->d_name, wd, share, d->d_name);
    }
    closedir(dir);
  }
  if (!scan_.empty()) return;
  if (prune_) {
    prune_ = false;
    unsigned current = generation_;
    Unwatch([current](int, const Node& n) { return n.generation != current; });
  }
  for (Root& root : roots_) {
    if (!root.active || !root.whole_pending) continue;
    root.whole_pending = false;
    out.push_back(MakeEvent(root.name, "/", kEventWhole));
  }
}

}  // namespace

std::unique_ptr<ChangeSource> MakeInotifySource(const WatchLimits& limits,
                                                std::string& error) {
  int fd = inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
  if (fd < 0) {
    error = std::string("inotify is not available: ") + strerror(errno);
    return nullptr;
  }
  return std::unique_ptr<ChangeSource>(new InotifySource(fd, limits));
}

}  // namespace s2s_service
