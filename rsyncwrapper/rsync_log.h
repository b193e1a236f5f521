// Internal: the wrapper's own log. One handler for the whole process
// (RsyncWrapper::setLogHandler); by default syslog(3).
#ifndef KARO_RSYNC_LOG_H_
#define KARO_RSYNC_LOG_H_

#include <syslog.h>

namespace KARO {
namespace Backup {
namespace detail {

// Formats one line ("karorsync: " is prepended) and hands it to the handler.
void Log(int priority, const char* format, ...)
    __attribute__((format(printf, 2, 3)));

}  // namespace detail
}  // namespace Backup
}  // namespace KARO

#endif  // KARO_RSYNC_LOG_H_
