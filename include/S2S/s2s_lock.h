// A small inter-process lock on a file.
//
// A SimpleFileLock owns the descriptor of its lock file and is used by one
// thread at a time; it excludes other processes and other descriptors of the
// same file. LockFactory is a plain value naming the file.
#ifndef S2S_S2S_LOCK_H_
#define S2S_S2S_LOCK_H_

#include <string>

#include "S2S/export.h"

namespace S2S {

// An exclusive flock() on a file, keeping runs of the service apart across
// processes. The file is created (mode 0600) and never removed. Movable, not
// copyable; the destructor closes the file, which drops a held lock.
class S2S_EXPORT SimpleFileLock {
 public:
  explicit SimpleFileLock(const std::string& path);
  ~SimpleFileLock();
  SimpleFileLock(SimpleFileLock&& other) noexcept;
  SimpleFileLock& operator=(SimpleFileLock&& other) noexcept;
  SimpleFileLock(const SimpleFileLock&) = delete;
  SimpleFileLock& operator=(const SimpleFileLock&) = delete;

  // Takes the lock, waiting as long as another holder keeps it. 0 (also when
  // already held), -1 when the file could not be opened or flock fails.
  int ExLock();
  // Drops the lock. 0 (also when not held), -1 as for ExLock.
  int UnLock();

 private:
  bool locked_;
  int fd_;
};

// Hands out locks on one path.
class S2S_EXPORT LockFactory {
 public:
  explicit LockFactory(const std::string& path);
  // A fresh, unlocked lock on the path.
  SimpleFileLock GetLock() const;

 private:
  std::string path_;
};

}  // namespace S2S

#endif  // S2S_S2S_LOCK_H_
