#include "S2S/s2s_lock.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/file.h>
#include <unistd.h>

#include <string>
#include <utility>

#define S2S_LOG_AREA "s2s"
#include "S2S/log.h"

namespace S2S {

SimpleFileLock::SimpleFileLock(const std::string& path)
    : locked_(false),
      fd_(open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600)) {
  if (fd_ < 0) {
    LOG_ERROR("Fail to open lock file at '%s', error:'%s'", path.c_str(),
              strerror(errno));
  }
}

SimpleFileLock::~SimpleFileLock() {
  if (fd_ >= 0) close(fd_);
}

SimpleFileLock::SimpleFileLock(SimpleFileLock&& other) noexcept
    : locked_(std::exchange(other.locked_, false)),
      fd_(std::exchange(other.fd_, -1)) {}

SimpleFileLock& SimpleFileLock::operator=(SimpleFileLock&& other) noexcept {
  if (this != &other) {
    if (fd_ >= 0) close(fd_);
    locked_ = std::exchange(other.locked_, false);
    fd_ = std::exchange(other.fd_, -1);
  }
  return *this;
}

int SimpleFileLock::ExLock() {
  if (locked_) return 0;
  if (fd_ < 0) return -1;
  int rc;
  while ((rc = flock(fd_, LOCK_EX)) != 0 && errno == EINTR) {
  }
  if (rc != 0) {
    LOG_ERROR("Fail to lock, error:'%s'", strerror(errno));
    return -1;
  }
  locked_ = true;
  return 0;
}

// The descriptor is checked first so that a lock whose file never opened
// reports its failure here too, not a harmless "not locked".
int SimpleFileLock::UnLock() {
  if (fd_ < 0) return -1;
  if (!locked_) return 0;
  if (flock(fd_, LOCK_UN) != 0) {
    LOG_ERROR("Fail to unlock, error:'%s'", strerror(errno));
    return -1;
  }
  locked_ = false;
  return 0;
}

LockFactory::LockFactory(const std::string& path) : path_(path) {}

SimpleFileLock LockFactory::GetLock() const { return SimpleFileLock(path_); }

}  // namespace S2S
