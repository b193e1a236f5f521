// The process-wide log of the library.
//
// Logger has no instances: its state is static and every operation is a
// static function. The host program calls Initialize() once to choose the
// destination (system log, standard output, standard error, or a file of its
// own rotated by size) and the most verbose level written; every area of the
// library writes through LogMsg(). Until Initialize() is called, messages of
// level Error go to the system log.
//
// Thread-safety: LogMsg() may be called from any thread; one mutex
// serialises the level test, the writing, the size count and the rotation.
// Initialize() and Destroy() take no lock: call them while no other thread
// logs.
#ifndef S2S_LOGGER_H_
#define S2S_LOGGER_H_

#include <pthread.h>
#include <stdio.h>

#include <atomic>
#include <string>

#include "S2S/export.h"

namespace S2S {

class S2S_EXPORT Logger {
 public:
  // Where messages go.
  enum Type : int {
    Syslog = 0,  // vsyslog, always at the error priority
    Stdout = 1,  // standard output, timestamped
    Stderr = 2,  // standard error, timestamped
    File = 3,    // log_path, timestamped, size-counted and rotated
  };

  // How severe a message is; smaller is more severe. Every message text
  // begins with the tag of its level ("[ERROR]", "[WARNING]", ...).
  enum Level : int {
    Error = 3,
    Warning = 4,
    Note = 5,
    Info = 6,
    Debug = 7,
  };

  // Size of the live log file past which it is rotated.
  static constexpr int kRotateSize = 1048576;

  // Chooses the destination and the most verbose level written. `type` and
  // `level` are stored before anything can fail. Types 0-2 always succeed.
  // Any other type selects a file: `path` is opened for appending and
  // `rotate_cnt` sets the rotation depth. Returns 0 on success; -1 when the
  // path is empty or cannot be opened, in which case the previous stream,
  // path, size and depth are kept (but type and level hold the new values).
  // Nothing is logged about a failure.
  static int Initialize(Type type, int level, const std::string& path,
                        int rotate_cnt);

  // For a file log only: closes the file and leaves error messages going,
  // timestamped, to standard output (with the type reading Stderr). For any
  // other destination nothing happens.
  static void Destroy();

  // Renames the live file to "<path>_0" after shifting older ones up, keeping
  // at most rotate_cnt - 1 of them, and reopens the path. Returns 0, or -1
  // when the rename or the reopen fails; the log is then silent until the
  // next Initialize(). REQUIRES: the caller holds the log mutex (LogMsg does).
  static int Rotate();

  // Writes one message if `level` is at most the selected level. `format`
  // carries the whole text, prefix and newline included (see S2S/log.h).
  static void LogMsg(Level level, const char* format, ...)
      __attribute__((format(printf, 2, 3)));

  // Read-only views of the state, for hosts and tests.
  static Type GetType() { return log_type; }
  static int GetLevel() { return log_level; }
  static FILE* GetStream() { return log_fp.load(std::memory_order_relaxed); }
  static const std::string& GetPath() { return log_path; }
  static int GetSize() { return log_size; }
  static int GetRotateCount() { return rotate_cnt; }

 private:
  static Type log_type;
  static int log_level;
  // Read without the lock by LogMsg's early test, so kept atomic.
  static std::atomic<FILE*> log_fp;
  static std::string log_path;
  static int log_size;
  static int rotate_cnt;
  static pthread_mutex_t log_mutex;
};

}  // namespace S2S

#endif  // S2S_LOGGER_H_
