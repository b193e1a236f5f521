// The fanotify source: one mark per file system, events that name the
// directory by its file handle and the entry by its name. A handle becomes a
// path through open_by_handle_at and the descriptor's link in /proc; the
// paths of directories are cached (bounded), and the cache is dropped when a
// directory moves, since every path below it changed.
//
// A mark covers the whole file system, so most events may concern other
// directories: they are resolved and dropped. No descriptor on a watched
// file system is held between wake-ups, so the watcher never keeps a volume
// from being unmounted.
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <stdlib.h>
#include <string.h>
#include <sys/fanotify.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <unistd.h>

#include <map>
#include <unordered_map>

#include "service/watch_source.h"

namespace s2s_service {

namespace {

const uint64_t kMask = FAN_CREATE | FAN_DELETE | FAN_MOVED_FROM | FAN_MOVED_TO |
                       FAN_MODIFY | FAN_ATTRIB | FAN_ONDIR;
const int kReadsPerWake = 16;
// Directory paths kept; a few MB at most.
const size_t kCacheLimit = 16384;

// The kernel's and the C library's fsid types differ; their bytes do not.
template <typename Fsid>
std::string FsidKey(const Fsid& fsid) {
  static_assert(sizeof(Fsid) == 8, "an fsid is two 32-bit words");
  return std::string(reinterpret_cast<const char*>(&fsid), sizeof fsid);
}

class FanotifySource : public ChangeSource {
 public:
  FanotifySource(int fd, const WatchLimits& limits)
      : fd_(fd), limits_(limits) {}
  ~FanotifySource() override { close(fd_); }

  const char* Name() const override { return "fanotify"; }
  int Fd() const override { return fd_; }
  bool Add(const WatchedShare& share, std::string& error) override;
  void Remove(const std::string& name) override;
  void Read(std::vector<S2S::Event>& out) override;
  bool Busy() const override;
  void Pump(std::vector<S2S::Event>& out) override;
  size_t Watches() const override { return marks_.size(); }

 private:
  struct Root {
    std::string name, path, fsid;
    bool active = false;
    bool whole_pending = false;
  };
  // The path of the directory a handle names; "" when it is gone.
  std::string Resolve(const std::string& fsid, file_handle* handle);
  int MountFd(const std::string& fsid);
  void Report(uint64_t mask, const std::string& fsid, const std::string& path,
              std::vector<S2S::Event>& out);
  void Overflow();

  int fd_;
  WatchLimits limits_;
  std::vector<Root> roots_;
  std::map<std::string, std::string> marks_;  // fsid -> a path on it
  std::unordered_map<std::string, std::string> dirs_;
  std::map<std::string, int> mount_fds_;  // this wake-up's only
};

bool FanotifySource::Add(const WatchedShare& share, std::string& error) {
  char real[PATH_MAX];
  struct statfs fs;
  if (realpath(share.path.c_str(), real) == nullptr || statfs(real, &fs) != 0) {
    error = "cannot watch " + share.path + ": " + strerror(errno);
    return false;
  }
  // Marking a file system twice only widens the same mark; after an
  // unmount the kernel dropped it, so it is always placed again.
  if (fanotify_mark(fd_, FAN_MARK_ADD | FAN_MARK_FILESYSTEM, kMask, AT_FDCWD,
                    real) != 0) {
    int e = errno;
    error = "cannot mark the file system of " + share.path + ": " +
            (e == ENODEV || e == EOPNOTSUPP || e == EXDEV
                 ? "it cannot name files by handle"
                 : strerror(e));
    return false;
  }
  std::string fsid = FsidKey(fs.f_fsid);
  marks_[fsid] = real;
  size_t i = 0;
  while (i < roots_.size() && roots_[i].name != share.name) ++i;
  if (i == roots_.size()) roots_.emplace_back();
  roots_[i] = Root{share.name, real, fsid, true, true};
  return true;
}

void FanotifySource::Remove(const std::string& name) {
  std::string fsid;
  for (Root& root : roots_) {
    if (root.name != name || !root.active) continue;
    root.active = false;
    fsid = root.fsid;
  }
  if (fsid.empty()) return;
  for (const Root& root : roots_) {
    if (root.active && root.fsid == fsid) return;  // the mark serves others
  }
  // May fail when the file system is gone: the kernel dropped the mark then.
  fanotify_mark(fd_, FAN_MARK_REMOVE | FAN_MARK_FILESYSTEM, kMask, AT_FDCWD,
                marks_[fsid].c_str());
  marks_.erase(fsid);
}

bool FanotifySource::Busy() const {
  for (const Root& root : roots_) {
    if (root.active && root.whole_pending) return true;
  }
  return false;
}

void FanotifySource::Pump(std::vector<S2S::Event>& out) {
  // A mark sees everything from the moment it is placed.
  for (Root& root : roots_) {
    if (!root.active || !root.whole_pending) continue;
    root.whole_pending = false;
    out.push_back(MakeEvent(root.name, "/", kEventWhole));
  }
}

void FanotifySource::Overflow() {
  ++overflows_;
  for (Root& root : roots_) root.whole_pending = root.active;
}

int FanotifySource::MountFd(const std::string& fsid) {
  auto it = mount_fds_.find(fsid);
  if (it != mount_fds_.end()) return it->second;
  // Any directory of the file system will do; the share's own may just
  // have gone, so its parents are tried too.
  int fd = -1;
  auto mark = marks_.find(fsid);
  std::string path = mark == marks_.end() ? "" : mark->second;
  while (fd < 0 && !path.empty()) {
    fd = open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    struct statfs fs;
    if (fd >= 0 && (fstatfs(fd, &fs) != 0 || FsidKey(fs.f_fsid) != fsid)) {
      close(fd);
      fd = -1;
    }
    size_t slash = path.rfind('/');
    path = path == "/" || slash == std::string::npos ? ""
           : slash == 0                              ? "/"
                                                     : path.substr(0, slash);
  }
  mount_fds_[fsid] = fd;
  return fd;
}

std::string FanotifySource::Resolve(const std::string& fsid,
                                    file_handle* handle) {
  std::string key = fsid;
  key.append(reinterpret_cast<const char*>(&handle->handle_type),
             sizeof handle->handle_type);
  key.append(reinterpret_cast<const char*>(handle->f_handle),
             handle->handle_bytes);
  auto it = dirs_.find(key);
  if (it != dirs_.end()) return it->second;
  int mount_fd = MountFd(fsid);
  if (mount_fd < 0) return "";
  std::string path;
  int fd = open_by_handle_at(mount_fd, handle, O_PATH | O_CLOEXEC);
  if (fd >= 0) {
    char link[64], buf[PATH_MAX];
    snprintf(link, sizeof link, "/proc/self/fd/%d", fd);
    ssize_t n = readlink(link, buf, sizeof buf);
    struct stat st;
    if (n > 0 && n < static_cast<ssize_t>(sizeof buf) && buf[0] == '/' &&
        fstat(fd, &st) == 0 && st.st_nlink > 0) {
      path.assign(buf, static_cast<size_t>(n));
    }
    close(fd);
  }
  if (dirs_.size() >= kCacheLimit) dirs_.clear();
  dirs_.emplace(key, path);
  return path;
}

void FanotifySource::Report(uint64_t mask, const std::string& fsid,
                            const std::string& path,
                            std::vector<S2S::Event>& out) {
  const bool gone = (mask & (FAN_DELETE | FAN_MOVED_FROM)) != 0;
  for (Root& root : roots_) {
    if (!root.active || root.fsid != fsid) continue;
    if (path == root.path) {
      if (gone && (mask & FAN_ONDIR)) {
        out.push_back(MakeEvent(root.name, "/", kEventLost));
        Remove(root.name);
      }
      return;
    }
    if (path.size() > root.path.size() && path[root.path.size()] == '/' &&
        path.compare(0, root.path.size(), root.path) == 0) {
      out.push_back(MakeEvent(root.name, path.substr(root.path.size()),
                              gone ? kEventGone : kEventChanged));
      return;
    }
  }
}

void FanotifySource::Read(std::vector<S2S::Event>& out) {
  alignas(fanotify_event_metadata) char buf[65536];
  size_t taken = 0;
  bool overflow = false;
  for (int reads = 0; reads < kReadsPerWake; ++reads) {
    ssize_t len = read(fd_, buf, sizeof buf);
    if (len <= 0) break;
    const char* next = buf;
    size_t left = static_cast<size_t>(len);
    while (left >= sizeof(fanotify_event_metadata)) {
      // Records follow each other at 4-byte alignment: the metadata, which
      // holds a 64-bit mask, is copied out rather than read in place.
      fanotify_event_metadata md;
      memcpy(&md, next, sizeof md);
      if (md.event_len < sizeof md || md.event_len > left) break;
      const char* event = next;
      next += md.event_len;
      left -= md.event_len;
      if (overflow || md.vers != FANOTIFY_METADATA_VERSION) continue;
      if ((md.mask & FAN_Q_OVERFLOW) ||
          (limits_.queue != 0 && ++taken > limits_.queue)) {
        // Past the queue's limit the rest is lost, as the kernel does.
        overflow = true;
        Overflow();
        continue;
      }
      const char* at = event + md.metadata_len;
      const char* end = event + md.event_len;
      while (at + sizeof(fanotify_event_info_header) <= end) {
        const fanotify_event_info_header* hdr =
            reinterpret_cast<const fanotify_event_info_header*>(at);
        if (hdr->len == 0 || at + hdr->len > end) break;
        if (hdr->info_type == FAN_EVENT_INFO_TYPE_DFID_NAME ||
            hdr->info_type == FAN_EVENT_INFO_TYPE_DFID) {
          const fanotify_event_info_fid* fid =
              reinterpret_cast<const fanotify_event_info_fid*>(at);
          file_handle* handle = reinterpret_cast<file_handle*>(
              const_cast<unsigned char*>(fid->handle));
          std::string fsid = FsidKey(fid->fsid);
          std::string dir = Resolve(fsid, handle);
          const char* name = hdr->info_type == FAN_EVENT_INFO_TYPE_DFID_NAME
                                 ? reinterpret_cast<const char*>(
                                       handle->f_handle + handle->handle_bytes)
                                 : "";
          if (!dir.empty()) {
            bool self = name[0] == '\0' || strcmp(name, ".") == 0;
            Report(md.mask, fsid,
                   self ? dir : (dir == "/" ? "" : dir) + "/" + name, out);
          }
          // Every path below a moved directory changed.
          if ((md.mask & FAN_ONDIR) &&
              (md.mask & (FAN_MOVED_FROM | FAN_MOVED_TO))) {
            dirs_.clear();
          }
          break;
        }
        at += hdr->len;
      }
    }
  }
  for (auto& it : mount_fds_) {
    if (it.second >= 0) close(it.second);
  }
  mount_fds_.clear();
}

}  // namespace

std::unique_ptr<ChangeSource> MakeFanotifySource(const WatchLimits& limits,
                                                 std::string& error) {
  int fd = fanotify_init(
      FAN_CLASS_NOTIF | FAN_CLOEXEC | FAN_NONBLOCK | FAN_REPORT_DFID_NAME,
      O_RDONLY | O_LARGEFILE | O_CLOEXEC);
  if (fd >= 0)
    return std::unique_ptr<ChangeSource>(new FanotifySource(fd, limits));
  int e = errno;
  if (e == EPERM) {
    error = "fanotify needs root (CAP_SYS_ADMIN)";
  } else if (e == EINVAL) {
    error =
        "this kernel's fanotify cannot name directories and entries "
        "(Linux 5.9 or later)";
  } else if (e == ENOSYS) {
    error = "this kernel has no fanotify";
  } else {
    error = std::string("fanotify: ") + strerror(e);
  }
  return nullptr;
}

}  // namespace s2s_service
