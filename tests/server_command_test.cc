// The server's command handler on untrusted input: command files, ids and
// hook requests that must be refused before they touch a path or the
// registry.
#include <sys/stat.h>

#include <filesystem>

#include "command_file.h"
#include "command_handler.h"
#include "gtest/gtest.h"
#include "hooks.h"
#include "protocol.h"
#include "testutil.h"

namespace {

using namespace S2S::server;
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
  const char* const bad[] = {
      "",
      "command=\"S2S_Pairing\"\n",                              // no client
      "clientID=\"c\"\ncommand=\"S2S_Pairing\"\n",              // wrong order
      "command=\"S2S_Pairing\"\nclientID=\"c\"\n\n",            // blank line
      "command=\"S2S_Pairing\"\nclientID=\"c\"\ndryRun=yes\n",  // unquoted
      "command=\"S2S_Pairing\"\nclientID=\"c\"\na=\"1\"\na=\"2\"\n",
      "command=\"S2S_Pairing\"\nclientID=\"c\"\nba d=\"1\"\n",
  };
  for (const char* text : bad) {
    CommandFile cmd;
    std::string why;
    EXPECT_EQ(kMalformed, ParseCommandFile(text, &cmd, &why)) << text;
    EXPECT_FALSE(why.empty());
  }
  std::string huge = "command=\"x\"\nclientID=\"c\"\nv=\"" +
                     std::string(kMaxCommandFile, 'x') + "\"\n";
  CommandFile cmd;
  std::string why;
  EXPECT_EQ(kMalformed, ParseCommandFile(huge, &cmd, &why));
}

TEST(CommandFile, IdsThatCouldEscapeAPathAreRefused) {
  for (const char* id : {"", "..", "../x", "a/b", ".hidden", "a b", "a\nb"}) {
    EXPECT_FALSE(IsValidClientId(id)) << id;
    EXPECT_FALSE(IsValidRequestId(id)) << id;
  }
  EXPECT_TRUE(IsValidClientId("0011.2233-AB_c"));
  EXPECT_TRUE(IsValidRequestId("0123456789abcdef0123456789abcdef"));
  for (const char* name :
       {"", ".", "..", "a/b", "../etc", "a:b", "a]b", "a\"b", "a\nb"}) {
    EXPECT_FALSE(IsValidShareName(name)) << name;
  }
  EXPECT_TRUE(IsValidShareName("Public Data"));
  EXPECT_FALSE(IsValidTaskName("t/../x"));
  EXPECT_FALSE(IsValidTaskName(std::string(129, 't')));
  EXPECT_TRUE(IsValidTaskName("nightly task"));
}

class HookTest : public ::testing::Test {
 protected:
  void SetUp() override {
    for (const std::string& d : {EarlyDir(), UploadDir(), ReplyDir()}) {
      std::filesystem::create_directories(d);
    }
    env_.pid = "4242";
    env_.host_addr = "127.0.0.1";
    env_.user = "u";
  }
  std::string Registry() {
    return ReadFile(tmp_.path() + "/usr/karo/etc/karoS2S.info");
  }
  // Spools `text` as this connection's early input and runs the pre hook.
  int Pull(const std::string& text, const std::string& request) {
    WriteFile(EarlyDir() + "/" + env_.pid, text);
    env_.request = request;
    return PreHook(env_, false);
  }

  s2s_test::TempDir tmp_;
  s2s_test::ScopedEnv root_{"S2S_ROOT", tmp_.path()};
  HookEnv env_;
};

TEST_F(HookTest, RequestIdOutsideTheReplyDirectoryIsRefused) {
  std::string cmd = "command=\"S2S_GetProtocolVer\"\nclientID=\"c\"\n";
  for (const char* req : {"s2scmd/../x", "s2scmd/a/b", "s2scmd/", "other/abc",
                          "s2scmd/abc s2scmd/def"}) {
    EXPECT_EQ(1, Pull(cmd, req)) << req;
  }
  EXPECT_TRUE(std::filesystem::is_empty(ReplyDir()));
  EXPECT_FALSE(std::filesystem::exists(tmp_.path() + "/x"));
}

TEST_F(HookTest, BadCommandsGetAClearStatusAndWriteNothing) {
  struct Case {
    std::string text;
    int status;
  } cases[] = {
      {"garbage\n", kMalformed},
      {"command=\"S2S_SyncStart\"\nclientID=\"c\"\nvolumeName=\"v\"\n"
       "shareName=\"../../etc\"\n",
       kBadId},
      {"command=\"S2S_UpdateTaskStatus\"\nclientID=\"c\"\n"
       "taskName=\"../t\"\n",
       kBadId},
      {"command=\"S2S_Pairing\"\nclientID=\"../c\"\ndryRun=\"no\"\n"
       "serverName=\"s\"\n",
       kBadId},
      {"command=\"S2S_Pairing\"\nclientID=\"c\"\ndryRun=\"maybe\"\n"
       "serverName=\"s\"\n",
       kMalformed},
      {"command=\"S2S_Nonsense\"\nclientID=\"c\"\n", kUnknownCommand},
  };
  int n = 0;
  for (const Case& c : cases) {
    std::string id = "req" + std::to_string(n++);
    ASSERT_EQ(0, Pull(c.text + "requestID=\"" + id + "\"\n", "s2scmd/" + id));
    EXPECT_EQ("status=" + std::to_string(c.status) + "\n",
              ReadFile(ReplyDir() + "/" + id))
        << c.text;
  }
  // A request id inside the file that is not the one pulled.
  ASSERT_EQ(0, Pull("command=\"S2S_GetProtocolVer\"\nclientID=\"c\"\n"
                    "requestID=\"other\"\n",
                    "s2scmd/mine"));
  EXPECT_EQ("status=241\n", ReadFile(ReplyDir() + "/mine"));
  EXPECT_EQ("", Registry());
}

TEST_F(HookTest, PostHookRemovesSpoolUploadAndReply) {
  std::string cmd =
      "command=\"S2S_GetProtocolVer\"\nclientID=\"c\"\nrequestID=\"r1\"\n";
  ASSERT_EQ(0, Pull(cmd, "s2scmd/r1"));
  EXPECT_EQ("status=0\n1\n", ReadFile(ReplyDir() + "/r1"));
  WriteFile(UploadDir() + "/r1", cmd);
  EXPECT_EQ(0, PostHook(env_));
  EXPECT_TRUE(std::filesystem::is_empty(ReplyDir()));
  EXPECT_TRUE(std::filesystem::is_empty(UploadDir()));
  EXPECT_TRUE(std::filesystem::is_empty(EarlyDir()));
}

}  // namespace
