#include "rsync_log.h"

#include <stdarg.h>
#include <stdio.h>

#include <atomic>

#include "karo/rsync_wrapper.h"

namespace KARO {
namespace Backup {
namespace detail {

namespace {

void SyslogHandler(int priority, const char* message) {
  syslog(priority, "%s", message);
}

std::atomic<RsyncWrapper::LogHandler> handler{&SyslogHandler};

}  // namespace

void Log(int priority, const char* format, ...) {
  char line[2048];
  int n = snprintf(line, sizeof line, "karorsync: ");
  va_list ap;
  va_start(ap, format);
  vsnprintf(line + n, sizeof line - n, format, ap);
  va_end(ap);
  handler.load()(priority, line);
}

}  // namespace detail

void RsyncWrapper::setLogHandler(LogHandler h) {
  detail::handler.store(h != nullptr ? h : &detail::SyslogHandler);
}

}  // namespace Backup
}  // namespace KARO
