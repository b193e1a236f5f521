#include "S2S/logger.h"

#include <stdarg.h>
#include <stdio.h>
#include <time.h>

#include "S2S/syslog_sink.h"

namespace S2S {

Logger::Type Logger::log_type = Logger::Syslog;
int Logger::log_level = Logger::Error;
std::atomic<FILE*> Logger::log_fp{nullptr};
std::string Logger::log_path;
int Logger::log_size = -1;
int Logger::rotate_cnt = 50;
pthread_mutex_t Logger::log_mutex = PTHREAD_MUTEX_INITIALIZER;

namespace {

constexpr int kSyslogErrorPriority = 3;  // LOG_ERR

// "<path>_<n>", the name of the n-th rotated file.
void RotatedName(char (&out)[1024], const std::string& path, int n) {
  snprintf(out, sizeof out, "%s_%d", path.c_str(), n);
}

}  // namespace

int Logger::Initialize(Type type, int level, const std::string& path,
                       int count) {
  log_type = type;
  log_level = level;
  switch (type) {
    case Syslog:
      log_fp = nullptr;
      log_path.clear();
      log_size = -1;
      return 0;
    case Stdout:
      log_fp = stdout;
      log_path.clear();
      log_size = -1;
      return 0;
    case Stderr:
      log_fp = stderr;
      log_path.clear();
      log_size = -1;
      return 0;
    default:
      break;
  }
  if (path.empty()) return -1;
  FILE* fp = fopen64(path.c_str(), "a");
  if (fp == nullptr) return -1;
  log_type = File;
  log_fp = fp;
  log_size = 0;
  log_path = path;
  rotate_cnt = count;
  return 0;
}

void Logger::Destroy() {
  if (log_type != File) return;
  FILE* fp = log_fp.exchange(nullptr);
  if (fp != nullptr) fclose(fp);
  // Error messages keep going somewhere visible; the type value reads Stderr
  // although the stream is standard output, as the hosts have always seen it.
  log_fp = stdout;
  log_level = Error;
  log_size = -1;
  log_type = Stderr;
  log_path.clear();
  rotate_cnt = 50;
}

int Logger::Rotate() {
  const int n = rotate_cnt;
  char from[1024];
  char to[1024];
  for (int k = n - 2; k >= 0; --k) {
    RotatedName(from, log_path, k);
    RotatedName(to, log_path, k + 1);
    rename(from, to);
  }
  // Removes what the loop just moved to name(n-1): at most n-1 old files are
  // kept. Hosts count on that depth.
  RotatedName(to, log_path, n - 1);
  remove(to);

  // The closed stream stays in log_fp until the new one is open: writers
  // that test log_fp without the lock meanwhile must wait for the lock and
  // find the new file, not drop their message as if the log were silent.
  // Only under the lock is the stream used, and it is replaced before the
  // lock is released.
  FILE* fp = log_fp.load();
  if (fp != nullptr) fclose(fp);
  RotatedName(to, log_path, 0);
  fp = rename(log_path.c_str(), to) == 0 ? fopen64(log_path.c_str(), "a")
                                         : nullptr;
  log_fp = fp;  // null: silent until the next Initialize
  return fp != nullptr ? 0 : -1;
}

void Logger::LogMsg(Level level, const char* format, ...) {
  if (log_type != Syslog && log_fp.load() == nullptr) return;
  pthread_mutex_lock(&log_mutex);
  if (static_cast<int>(level) > log_level) {
    pthread_mutex_unlock(&log_mutex);
    return;
  }
  int written = 0;
  va_list ap;
  va_start(ap, format);
  switch (log_type) {
    case Syslog:
      // The message's own level only decides whether it is written.
      detail::VSyslog(kSyslogErrorPriority, format, ap);
      break;
    case Stdout:
    case Stderr:
    case File: {
      FILE* fp = log_fp.load();
      if (fp == nullptr) break;
      char stamp[512];
      time_t now = time(nullptr);
      struct tm local;
      localtime_r(&now, &local);
      strftime(stamp, sizeof stamp, "%b %d %H:%M:%S ", &local);
      int a = fprintf(fp, "%s", stamp);
      int b = vfprintf(fp, format, ap);
      fflush(fp);
      written = a + b;
      break;
    }
    default:
      vfprintf(stderr, format, ap);
      break;
  }
  va_end(ap);
  if (log_type == File && log_size >= 0 && written >= 0) {
    log_size += written;
    if (log_size > kRotateSize) {
      Rotate();
      log_size = 0;
    }
  }
  pthread_mutex_unlock(&log_mutex);
}

}  // namespace S2S
