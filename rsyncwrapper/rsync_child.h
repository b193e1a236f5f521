// Internal: runs one rsync process and waits for it, honouring a cancel
// checker.
//
// rsync runs in a session of its own (no controlling terminal, so neither
// rsync nor ssh can prompt) and gets SIGTERM when the process that started
// it dies, with standard input on /dev/null and its output collected
// through a pipe. The death signal follows the thread that forked: the
// caller's thread must outlive the run, which a waiting caller does. The
// password reaches it only as RSYNC_PASSWORD in its environment.
#ifndef KARO_RSYNC_CHILD_H_
#define KARO_RSYNC_CHILD_H_

#include <boost/function.hpp>
#include <string>
#include <vector>

#include "rsync_args.h"
#include "rsync_progress.h"

namespace KARO {
namespace Backup {
namespace detail {

struct ChildOutcome {
  int status = 0;          // rsync's exit code, or an RsyncWrapper::Status
  bool cancelled = false;  // the checker asked to stop
  std::string output;      // what rsync printed (the first 64 KiB)
};

// Runs `args` (args[0] is looked up in PATH). `cancel` may be empty.
// `max_file_size` (0: none) caps every file rsync writes (RLIMIT_FSIZE).
// Returns the outcome; a child that cannot be started gives kStartFailed.
// `progress` (may be null) reads every line of rsync's output as it comes;
// the lines it takes are left out of the outcome's output.
ChildOutcome RunRsync(const std::vector<std::string>& args,
                      const std::string& password,
                      const boost::function<bool()>& cancel,
                      unsigned long long max_file_size = 0,
                      ProgressParser* progress = nullptr);

// RunRsync with the settings' password, logging rsync's output line by line
// at debug level when the debug log is on, and a failure once at error level
// naming `what`. Returns the outcome's status; rsync's output goes to
// `output` when it is not null.
int RunAndLog(const std::vector<std::string>& args, const RsyncSettings& s,
              const boost::function<bool()>& cancel, const char* what,
              std::string* output = nullptr,
              unsigned long long max_file_size = 0,
              ProgressParser* progress = nullptr);

// The line of rsync's `output` that says why it failed, without rsync's
// prefixes: the daemon's "@ERROR:" refusal first, else the first "rsync:"
// complaint, else the "rsync error:" summary. "" when there is none.
std::string ErrorLine(const std::string& output);

// The calling thread's last failure, as RsyncWrapper::lastError() returns
// it.
void SetLastError(const std::string& text);
const std::string& LastError();

// How long a cancelled rsync gets between SIGTERM and SIGKILL.
extern const int kKillGraceMs;

}  // namespace detail
}  // namespace Backup
}  // namespace KARO

#endif  // KARO_RSYNC_CHILD_H_
