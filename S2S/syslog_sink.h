// Internal: the one way the library reaches the system log.
//
// The logger (destination Syslog) and the registry functions write through
// VSyslog()/Syslog(). By default that is vsyslog(3); SetSyslogWriter() is a
// seam through which a test observes what would have gone to the system log
// without needing a syslog daemon.
#ifndef S2S_SYSLOG_SINK_H_
#define S2S_SYSLOG_SINK_H_

#include <stdarg.h>

namespace S2S {
namespace detail {

using SyslogWriter = void (*)(int priority, const char* format, va_list ap);

// Installs `writer` (nullptr restores vsyslog) and returns the previous one.
SyslogWriter SetSyslogWriter(SyslogWriter writer);

void VSyslog(int priority, const char* format, va_list ap);
void Syslog(int priority, const char* format, ...)
    __attribute__((format(printf, 2, 3)));

}  // namespace detail
}  // namespace S2S

#endif  // S2S_SYSLOG_SINK_H_
