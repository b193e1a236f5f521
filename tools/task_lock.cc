#include "task_lock.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/file.h>
#include <unistd.h>

#include <filesystem>

#include "karo_root.h"

namespace s2s_tools {

TaskLock::~TaskLock() {
  if (fd_ >= 0) close(fd_);
}

bool TaskLock::Take(unsigned long long id, bool& busy, std::string& error) {
  busy = false;
  std::string dir = KaroRootPath("/run/lock");
  std::error_code ec;
  std::filesystem::create_directories(dir, ec);
  if (ec) {
    error = "cannot create " + dir + ": " + ec.message();
    return false;
  }
  std::string path = dir + "/s2s-task-" + std::to_string(id) + ".lock";
  // Not close-on-exec, on purpose: see the header.
  int fd = open(path.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW, 0600);
  if (fd < 0) {
    error = "cannot open the task lock " + path + ": " + strerror(errno);
    return false;
  }
  int rc;
  while ((rc = flock(fd, LOCK_EX | LOCK_NB)) != 0 && errno == EINTR) {
  }
  if (rc != 0) {
    busy = errno == EWOULDBLOCK;
    error = busy ? "task " + std::to_string(id) +
                       " is running already (another s2s-client, or an "
                       "rsync it started, holds " +
                       path + ")"
                 : "cannot lock " + path + ": " + strerror(errno);
    close(fd);
    return false;
  }
  if (fd_ >= 0) close(fd_);
  fd_ = fd;
  return true;
}

}  // namespace s2s_tools
