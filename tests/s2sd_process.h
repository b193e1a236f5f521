// s2sd as a process of the service tests: started on the test's client
// root with a directory of the test's own ahead in PATH (where a test puts
// an rsync that records its runs), asked through its control socket, and
// stopped by its own pid.
#ifndef S2S_TESTS_S2SD_PROCESS_H_
#define S2S_TESTS_S2SD_PROCESS_H_

#include <signal.h>
#include <stdlib.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "S2S/ipc.h"
#include "appliances.h"
#include "gtest/gtest.h"
#include "service/config.h"
#include "testutil.h"

namespace s2s_test {

class S2sdProcess {
 public:
  ~S2sdProcess() { Stop(); }

  // Starts s2sd in the foreground, verbose, logging to `log`, with `bin`
  // first in PATH and `args` added; true once it answers on its socket.
  bool Start(const std::string& dir, const std::string& bin,
             const std::string& log, const std::vector<std::string>& args) {
    unlink(s2s_service::SocketPath().c_str());
    std::vector<std::string> argv = {S2SD_PROGRAM, "--foreground", "--log", log,
                                     "-v"};
    argv.insert(argv.end(), args.begin(), args.end());
    child_ = Spawn(dir, argv, {"PATH=" + bin + ":" + getenv("PATH")});
    S2S::PObject status;
    status = S2S::PObject::Map();
    status["action"] = "status";
    return WaitUntil([&] { return Request(status)["result"].isInteger(); }, 10);
  }

  // SIGTERM, and its exit code (-1 when it was not running).
  int Stop() {
    if (child_.pid <= 0) return -1;
    kill(child_.pid, SIGTERM);
    int code = child_.Wait();
    child_.pid = -1;
    return code;
  }

  pid_t pid() const { return child_.pid; }

  // The reply to `request`; a null object when s2sd did not answer.
  static S2S::PObject Request(const S2S::PObject& request) {
    S2S::IPCSender sender;
    S2S::PObject reply;
    if (sender.connect(s2s_service::SocketPath()) == 0) {
      sender.send(request, true, reply);
    }
    sender.close();
    return reply;
  }

 private:
  Child child_;
};

// A running server appliance with `shares`, and s2sd's client root beside
// it: s2sd finds an rsync first in PATH that notes each run in rsync_log_
// ("start <ns> <pid> <arguments>", "end <ns> <pid>") and reaches no server
// while the file unreachable_ exists.
class S2sdTest : public ::testing::Test {
 protected:
  S2sdTest() : app_(S2S_CMD_HANDLER) {}

  void SetUpServer(const std::vector<std::string>& shares,
                   const std::string& config) {
    for (const std::string& share : shares) ASSERT_TRUE(app_.AddShare(share));
    ASSERT_TRUE(app_.StartServer());
    bin_ = tmp_.Sub("bin");
    std::filesystem::create_directories(bin_);
    rsync_log_ = tmp_.Sub("rsync.log");
    unreachable_ = tmp_.Sub("unreachable");
    ASSERT_TRUE(WriteScript(
        bin_ + "/rsync", "[ -e " + unreachable_ + " ] && exit 10\n" +
                             "echo \"start $(date +%s%N) $$ $*\" >> " +
                             rsync_log_ + "\n/usr/bin/rsync \"$@\"\nrc=$?\n" +
                             "echo \"end $(date +%s%N) $$\" >> " + rsync_log_ +
                             "\nexit $rc\n"));
    ASSERT_TRUE(WriteFile(s2s_service::ConfigPath(),
                          "[Service]\n\tbeacon_interval=\"3600\"\n" + config));
  }

  // Starts s2sd with `args`; fails the test unless it answers.
  void StartDaemon(const std::vector<std::string>& args = {}) {
    ASSERT_TRUE(s2sd_.Start(tmp_.path(), bin_, tmp_.Sub("s2sd.log"), args))
        << Log();
  }

  std::string Log() { return ReadFile(tmp_.Sub("s2sd.log")); }

  Appliances app_;
  TempDir tmp_;
  S2sdProcess s2sd_;
  std::string bin_, rsync_log_, unreachable_;
};

}  // namespace s2s_test

#endif  // S2S_TESTS_S2SD_PROCESS_H_
