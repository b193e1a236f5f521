#ifndef S2S_TESTS_S2SD_PROCESS_H_
#define S2S_TESTS_S2SD_PROCESS_H_

#include <signal.h>
#include <stdlib.h>
#include <unistd.h>

#include <filesystem>
#include <list>
#include <string>
#include <vector>

#include "S2S/ipc.h"
#include "S2S/sync_obj_pobject.h"
#include "appliances.h"
#include "gtest/gtest.h"
#include "service/config.h"
#include "testutil.h"

namespace s2s_test {

// s2sd on the client root beside a running server, stopped by its own pid;
// its PATH's rsync notes runs in rsync_log_ ("start <ns> <pid> <args>", "end
// <ns> <pid>") and reaches no server while the file unreachable_ exists.
class S2sdTest : public ::testing::Test {
 protected:
  ~S2sdTest() override { StopDaemon(); }

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

  // Starts s2sd, verbose, logging to a file, with `args`; awaits its answer.
  void StartDaemon(const std::vector<std::string>& args = {}) {
    unlink(s2s_service::SocketPath().c_str());
    std::vector<std::string> argv = {S2SD_PROGRAM, "--foreground", "--log",
                                     tmp_.Sub("s2sd.log"), "-v"};
    argv.insert(argv.end(), args.begin(), args.end());
    daemon_ = Spawn(tmp_.path(), argv, {"PATH=" + bin_ + ":" + getenv("PATH")});
    ASSERT_TRUE(WaitUntil(
        [&] { return Request(Action("status"))["result"].isInteger(); }, 10))
        << Log();
  }

  // SIGTERM, and s2sd's exit code (-1 when it was not running).
  int StopDaemon() {
    if (daemon_.pid <= 0) return -1;
    kill(daemon_.pid, SIGTERM);
    int code = daemon_.Wait();
    daemon_.pid = -1;
    return code;
  }

  // The reply to `request`; a null object when s2sd did not answer.
  static S2S::PObject Request(const S2S::PObject& request) {
    S2S::IPCSender sender;
    S2S::PObject reply;
    if (sender.connect(s2s_service::SocketPath()) == 0)
      sender.send(request, true, reply);
    return reply;
  }

  // A request for `action` on task `id` (none when null).
  static S2S::PObject Action(const std::string& action,
                             const S2S::PObject& id = S2S::PObject()) {
    S2S::PObject r;
    r["action"] = action;
    if (!id.isNull()) r["id"] = id;
    return r;
  }

  std::string Log() { return ReadFile(tmp_.Sub("s2sd.log")); }

  // Adds a task over `shares` with the keys of `settings` beside; its id.
  unsigned long long AddTask(const std::string& name,
                             const std::list<std::string>& shares,
                             const S2S::Schedule& schedule,
                             const S2S::PObject& settings = S2S::PObject()) {
    S2S::SyncTask t;
    t.GetInfo().SetName(name);
    t.GetInfo().SetShareList(shares);
    t.GetInfo().SetSyncInfo(app_.Info());
    t.GetInfo().SetSchedule(schedule);
    S2S::PObject req = Action("add");
    S2S::SyncTask2PObj(t, req["task"]);
    req["task"].asMap().erase("id");
    for (const auto& it : settings.asMap()) req["task"][it.first] = it.second;
    S2S::PObject reply = Request(req);
    EXPECT_EQ(0u, reply["result"].asUInt64()) << reply["message"].asString();
    return reply["id"].asUInt64();
  }

  // How many times `what` occurs in `text`.
  static size_t Count(const std::string& text, const std::string& what) {
    size_t n = 0;
    for (size_t at = text.find(what); at != std::string::npos;
         at = text.find(what, at + 1))
      ++n;
    return n;
  }

  // How many times `what` occurs in the recording rsync's log.
  size_t RsyncLogCount(const std::string& what) {
    return Count(ReadFile(rsync_log_), what);
  }

  Appliances app_{S2S_CMD_HANDLER};
  TempDir tmp_;
  Child daemon_;
  std::string bin_, rsync_log_, unreachable_;
};

}  // namespace s2s_test

#endif  // S2S_TESTS_S2SD_PROCESS_H_
