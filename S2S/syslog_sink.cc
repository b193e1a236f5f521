#include "S2S/syslog_sink.h"

#include <syslog.h>

#include <atomic>

namespace S2S {
namespace detail {
namespace {
std::atomic<SyslogWriter> writer{nullptr};
}  // namespace

SyslogWriter SetSyslogWriter(SyslogWriter w) { return writer.exchange(w); }

void VSyslog(int priority, const char* format, va_list ap) {
  SyslogWriter w = writer.load();
  if (w != nullptr) {
    w(priority, format, ap);
  } else {
    vsyslog(priority, format, ap);
  }
}

void Syslog(int priority, const char* format, ...) {
  va_list ap;
  va_start(ap, format);
  VSyslog(priority, format, ap);
  va_end(ap);
}

}  // namespace detail
}  // namespace S2S
