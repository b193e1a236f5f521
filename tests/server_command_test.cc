// The server's command handler refuses untrusted input before it acts.
#include <sched.h>
#include <sys/time.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <thread>

#include "S2S/is_syncedshare.h"
#include "command_file.h"
#include "command_handler.h"
#include "gtest/gtest.h"
#include "hooks.h"
#include "protocol.h"
#include "testutil.h"

namespace {

using namespace S2S::server;
using s2s_test::Has;
using s2s_test::ReadFile;
using s2s_test::WriteFile;

TEST(CommandFile, ParsesOrderedLinesAfterCommandAndClient) {
  CommandFile cmd;
  std::string why;
  ASSERT_EQ(kOk,
            ParseCommandFile("command=\"S2S_SyncStart\"\nclientID=\"c1\"\n"
                             "shareName=\"a \\\"b\\\"\"\nvolumeName=\"\"\n",
                             &cmd, &why));
  EXPECT_EQ("S2S_SyncStart", cmd.command);
  EXPECT_EQ("c1", cmd.client_id);
  ASSERT_EQ(2u, cmd.params.size());
  EXPECT_EQ("a \\\"b\\\"", *cmd.Get("shareName"));
  EXPECT_EQ("", *cmd.Get("volumeName"));
  EXPECT_EQ(nullptr, cmd.Get("dryRun"));
}

TEST(CommandFile, RefusesMalformedFiles) {
  const std::string bad[] = {
      "",
      "command=\"S2S_Pairing\"\n",                              // no client
      "clientID=\"c\"\ncommand=\"S2S_Pairing\"\n",              // wrong order
      "command=\"S2S_Pairing\"\nclientID=\"c\"\n\n",            // blank line
      "command=\"S2S_Pairing\"\nclientID=\"c\"\ndryRun=yes\n",  // unquoted
      "command=\"S2S_Pairing\"\nclientID=\"c\"\na=\"1\"\na=\"2\"\n",
      "command=\"S2S_Pairing\"\nclientID=\"c\"\nba d=\"1\"\n",
      "command=\"x\"\nclientID=\"c\"\nv=\"" +
          std::string(kMaxCommandFile, 'x') + "\"\n",
  };
  for (const std::string& text : bad) {
    CommandFile cmd;
    std::string why;
    EXPECT_EQ(kMalformed, ParseCommandFile(text, &cmd, &why))
        << text.substr(0, 80);
    EXPECT_FALSE(why.empty());
  }
}

TEST(CommandFile, IdsThatCouldEscapeAPathAreRefused) {
  for (const char* id : {"", "..", "../x", "a/b", ".hidden", "a b", "a\nb"}) {
    EXPECT_FALSE(IsValidClientId(id)) << id;
    EXPECT_FALSE(IsValidRequestId(id)) << id;
  }
  EXPECT_TRUE(IsValidClientId("0011.2233-AB_c"));
  EXPECT_TRUE(IsValidRequestId("0123456789abcdef0123456789abcdef"));
  for (std::string name : {"", ".", "..", "a/b", "../etc", "a:b", "a]b", "a\"b",
                           "a\nb", "a ", " a"}) {
    EXPECT_FALSE(IsValidShareName(name)) << name;
  }
  EXPECT_FALSE(IsValidShareName(std::string("a\0b", 3)));
  EXPECT_TRUE(IsValidShareName("Public Data"));
  for (std::string name : {std::string("t/../x"), std::string("t "),
                           std::string(" t"), std::string("t\0u", 3)}) {
    EXPECT_FALSE(IsValidTaskName(name)) << name;
  }
  EXPECT_FALSE(IsValidTaskName(std::string(129, 't')));
  EXPECT_TRUE(IsValidTaskName("nightly task"));
}

// Only what makes the daemon's rsync run dry passes for a dry run: an 'n'
// among the leading value-less options of the cluster after --server.
TEST(DataHook, OnlyArgumentsThatMakeTheDaemonRunDryCountAsADryRun) {
  const struct {
    std::vector<std::string> args;
    bool dry;
  } cases[] = {
      {{"rsyncd", "--server", "-nlogDtpre.iLsfxCIvu", "--delete", ".", "d/"},
       true},
      {{"rsyncd", "--server", "-vvnlHogDtpArSze.iLsfxCIvu", ".", "d/"}, true},
      {{"rsyncd", "--server", "-logDtpre.niLsfxCIvu", ".", "d/"}, false},
      {{"rsyncd", "--server", "-B1024n", ".", "d/"}, false},
      {{"rsyncd", "--server", "-lZn", ".", "d/"}, false},
      {{"rsyncd", "--server", "-logDtpr", "-n", ".", "d/"}, false},
      {{"rsyncd", "--server", "--dry-run", ".", "d/"}, false},
      {{"rsyncd", "--server", "-nlogDtpr", "--sender", ".", "d/"}, false},
      {{"rsyncd", "-n", "--server", "-logDtpr", ".", "d/"}, false},
      {{"rsyncd", "--server"}, false},
  };
  for (const auto& c : cases)
    EXPECT_EQ(c.dry, IsDryRunReceiver(c.args)) << c.args[2 % c.args.size()];
}

// A command file: `command` from `client`, then the lines of `params`.
std::string Cmd(const std::string& command, const std::string& params = "",
                const std::string& client = "c") {
  return "command=\"" + command + "\"\nclientID=\"" + client + "\"\n" + params;
}

class HookTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::filesystem::create_directories(UploadDir());
    std::filesystem::create_directories(ReplyDir());
    env_.pid = "4242";
    env_.host_addr = "127.0.0.1";
    env_.user = "u";
  }
  std::string Registry() { return ReadFile(registry_); }
  void DeclareShares(const std::vector<std::string>& names) {
    std::string conf;
    for (const std::string& n : names)
      conf += "[" + n + "]\n\tpath=\"" + tmp_.Sub(n) + "\"\n";
    tmp_.Write("/etc/s2s/shares.conf", conf);
  }
  // Runs `text` as request `id` through the early hook; the reply's status.
  int Status(const std::string& text, const std::string& id) {
    if (Early(text + "requestID=\"" + id + "\"\n") != 0) return -1;
    std::string reply = ReadFile(ReplyPath(env_.user, id));
    return reply.compare(0, 7, "status=") == 0 ? std::stoi(reply.substr(7))
                                               : -1;
  }
  // Feeds `text` to the early hook as a connection's early input.
  int Early(const std::string& text) {
    FILE* in = fmemopen(const_cast<char*>(text.data()), text.size(), "r");
    int rc = CommandHook(env_, false, in);
    fclose(in);
    return rc;
  }

  s2s_test::TempRoot tmp_;
  const std::string registry_ = tmp_.Path("/usr/karo/etc/karoS2S.info");
  HookEnv env_;
};

TEST_F(HookTest, BadRequestsGetAClearStatusAndWriteNothing) {
  // An id or a daemon user that could leave the reply directory: no reply.
  std::string cmd = Cmd("S2S_GetProtocolVer");
  for (const char* id : {"../x", "a/b", "", "a b"})
    EXPECT_EQ(1, Early(cmd + "requestID=\"" + id + "\"\n")) << id;
  // The id on another line than the last, or missing.
  EXPECT_EQ(1, Early("requestID=\"r\"\n" + cmd));
  EXPECT_EQ(1, Early(cmd));
  for (const char* user : {"..", ".", "a/b", ""}) {
    env_.user = user;
    EXPECT_EQ(1, Early(cmd + "requestID=\"r\"\n")) << user;
  }
  EXPECT_TRUE(std::filesystem::is_empty(ReplyDir()));
  EXPECT_FALSE(std::filesystem::exists(tmp_.path() + "/x"));
  env_.user = "u";

  struct Case {
    std::string text;
    int status;
  } cases[] = {
      {"garbage\n", kMalformed},
      {Cmd("S2S_SyncStart", "volumeName=\"v\"\nshareName=\"../../etc\"\n"),
       kBadId},
      {Cmd("S2S_UpdateTaskStatus", "taskName=\"../t\"\n"), kBadId},
      {Cmd("S2S_Pairing", "dryRun=\"no\"\nserverName=\"s\"\n", "../c"), kBadId},
      {Cmd("S2S_Pairing", "dryRun=\"maybe\"\nserverName=\"s\"\n"), kMalformed},
      {Cmd("S2S_Nonsense"), kUnknownCommand},
      // Refused, not truncated at the NUL or trimmed.
      {Cmd("S2S_SyncStart",
           "volumeName=\"v\"\nshareName=\"a" + std::string(1, '\0') + "b\"\n"),
       kBadId},
      {Cmd("S2S_UpdateTaskStatus", "taskName=\"t \"\n"), kBadId},
  };
  int n = 0;
  for (const Case& c : cases)
    EXPECT_EQ(c.status, Status(c.text, "req" + std::to_string(n++))) << c.text;
  EXPECT_EQ("", Registry());
}

TEST_F(HookTest, AnUploadedCommandRunsAndTheCleanupRemovesUploadAndReply) {
  std::string cmd = Cmd("S2S_GetProtocolVer", "requestID=\"r1\"\n");
  WriteFile(UploadDir() + "/r1", cmd);
  ASSERT_EQ(0, Early("requestID=\"r1\"\n"));
  EXPECT_EQ("status=0\n1\n", ReadFile(ReplyPath("u", "r1")));
  EXPECT_EQ(0600, s2s_test::Mode(ReplyPath("u", "r1")));
  // An upload whose own id is another request's is not answered as this one.
  WriteFile(UploadDir() + "/r2", cmd);
  ASSERT_EQ(0, Early("requestID=\"r2\"\n"));
  EXPECT_EQ("status=241\n", ReadFile(ReplyPath("u", "r2")));
  RemoveCommandFiles("u", "r1");
  RemoveCommandFiles("u", "r2");
  EXPECT_TRUE(std::filesystem::is_empty(ReplyDir() + "/u"));
  EXPECT_TRUE(std::filesystem::is_empty(UploadDir()));
}

TEST_F(HookTest, ARemovedSpoolIsMadeAgainByTheNextCommand) {
  std::filesystem::remove_all(tmp_.Path("/var/spool/s2s"));
  EXPECT_EQ(0, Status(Cmd("S2S_GetProtocolVer"), "r"));
  for (const std::string& dir : {UploadDir(), ReplyDir()})
    EXPECT_EQ(0755, s2s_test::Mode(dir)) << dir;
}

TEST_F(HookTest, ClientIdStaysWithItsDaemonUserAndALostRegistryStaysLost) {
  DeclareShares({"s"});
  const std::string pair =
      Cmd("S2S_Pairing", "dryRun=\"no\"\nserverName=\"srv\"\n", "CL1");
  const std::string start =
      Cmd("S2S_SyncStart", "volumeName=\"v\"\nshareName=\"s\"\n", "CL1");
  env_.user = "u1";
  EXPECT_EQ(kOk, Status(pair, "p1"));
  // Another daemon user naming CL1 gets nothing, whatever the command.
  env_.user = "u2";
  EXPECT_EQ(kBadId, Status(start, "s1"));
  EXPECT_EQ(kBadId, Status(pair, "p2"));
  env_.user = "u1";
  EXPECT_EQ(kOk, Status(start, "s2"));
  // The registry vanishes: refused, and not recreated open.
  ASSERT_EQ(0, unlink(registry_.c_str()));
  env_.user = "u2";
  EXPECT_EQ(kRegistryFailure, Status(pair, "p3"));
  EXPECT_FALSE(std::filesystem::exists(registry_));
}

TEST_F(HookTest, ParallelSyncStartsForAFreeShareHaveOneWinner) {
  const int kRounds = 5, kRacers = 8;
  std::vector<std::string> shares;
  for (int r = 0; r < kRounds; ++r) shares.push_back("r" + std::to_string(r));
  DeclareShares(shares);
  for (const std::string& share : shares) {
    std::vector<int> codes = s2s_test::RunInChildren(kRacers, [&](int i) {
      CommandFile cmd;
      cmd.command = "S2S_SyncStart";
      cmd.client_id = "racer" + std::to_string(i);
      cmd.params = {{"volumeName", "v"}, {"shareName", share}};
      HandlerContext ctx;
      ctx.peer_user = "u" + std::to_string(i);
      std::string answer;
      return HandleCommand(cmd, ctx, &answer) == kOk ? 0 : 1;
    });
    std::vector<int> one_winner(kRacers, 1);
    one_winner[0] = 0;
    std::sort(codes.begin(), codes.end());
    EXPECT_EQ(one_winner, codes) << share;
  }
}

// Runs in a private IPC namespace, so that the held lock blocks no other
// root's test. The child's exit code names the first failed step.
TEST_F(HookTest, HeldLockTimesOutAndLateCommandsAreNotApplied) {
  int code = s2s_test::RunInChildren(1, [&](int) {
    if (unshare(CLONE_NEWIPC) != 0 &&
        unshare(CLONE_NEWUSER | CLONE_NEWIPC) != 0) {
      _exit(77);
    }
    CommandFile cmd;
    cmd.command = "S2S_UpdateTaskStatus";
    cmd.client_id = "c1";
    cmd.params = {{"taskName", "t1"}};
    HandlerContext ctx;
    std::string answer;
    // The command's status when its client waits `seconds` more.
    auto run = [&](int seconds) {
      ctx.deadline = time(nullptr) + seconds;
      return HandleCommand(cmd, ctx, &answer);
    };
    int held[2], release[2];
    if (pipe(held) != 0 || pipe(release) != 0) _exit(10);
    std::thread holder([&] {
      char c = S2SRegistryLock(-1) == 0 ? 'y' : 'n';
      if (write(held[1], &c, 1) == 1) read(release[0], &c, 1);
      S2SRegistryUnlock();
    });
    char c = 0;
    if (read(held[0], &c, 1) != 1 || c != 'y') _exit(11);
    int busy = run(1);
    if (write(release[1], "x", 1) != 1) _exit(12);
    holder.join();
    // Then the lock is free, but the client stopped waiting long ago.
    if (busy != kRegistryFailure || run(-1) != kRegistryFailure ||
        Has(Registry(), "TASK_t1")) {
      _exit(13);
    }
    // The same through the hook: the command was uploaded long ago.
    std::string upload = UploadDir() + "/late";
    WriteFile(upload, Cmd("S2S_UpdateTaskStatus",
                          "taskName=\"t1\"\nrequestID=\"late\"\n", "c1"));
    struct timeval old[2] = {{time(nullptr) - kCommandBudgetSeconds - 5, 0},
                             {time(nullptr) - kCommandBudgetSeconds - 5, 0}};
    if (utimes(upload.c_str(), old) != 0 ||
        Early("requestID=\"late\"\n") != 0 ||
        ReadFile(ReplyPath("u", "late")) != "status=242\n" ||
        Has(Registry(), "TASK_t1")) {
      _exit(15);
    }
    return run(30) == kOk && Has(Registry(), "TASK_t1") ? 0 : 16;
  })[0];
  if (code == 77)
    GTEST_SKIP() << "no private IPC namespace (unshare needs CAP_SYS_ADMIN or "
                    "user namespaces)";
  EXPECT_EQ(0, code) << "failed step (see the child's codes)";
}

}  // namespace
