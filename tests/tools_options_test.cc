// The client program's inputs: task files, options on top of them, password
// sources, and the cancel checker's beacons.
#include <stdlib.h>

#include <string>
#include <thread>
#include <vector>

#include "client_options.h"
#include "gtest/gtest.h"
#include "secret.h"
#include "service/cancel.h"
#include "task_file.h"
#include "testutil.h"

namespace {

using namespace s2s_tools;
using s2s_test::WriteFile;

bool Parse(std::vector<std::string> args, ClientOptions& o,
           std::string& error) {
  args.insert(args.begin(), "s2s-client");
  std::vector<char*> argv;
  for (std::string& a : args) argv.push_back(&a[0]);
  argv.push_back(nullptr);
  return ParseClientArgs(static_cast<int>(args.size()), argv.data(), o, error);
}

TEST(ClientOptions, TaskFileKeysThenOptionsOnTop) {
  s2s_test::TempDir tmp;
  std::string task = tmp.Sub("t.task");
  ASSERT_TRUE(WriteFile(task,
                        "[Task]\n\tname=\"nightly\"\n\tid=\"7\"\n"
                        "\tserver_ip=\"10.0.0.9\"\n\tport=\"8873\"\n"
                        "\tuser=\"s2s\"\n\tshares=\"docs:photos\"\n"
                        "\texcludes=\":*.tmp::\"\n\tcompress=\"yes\"\n"
                        "\tdelta=\"no\"\n\tssh=\"no\"\n\tssh_port=\"2222\"\n"
                        "\tpassword_file=\"/p\"\n"));
  ClientOptions o;
  std::string error;
  ASSERT_TRUE(Parse({"--task-file", task, "--server-ip", "127.0.0.1", "--share",
                     "a", "--share", "b", "--delta", "-v", "-v"},
                    o, error))
      << error;
  EXPECT_EQ("nightly", o.spec.name);
  EXPECT_EQ(7u, o.spec.id);
  EXPECT_EQ("127.0.0.1", o.spec.server_ip);  // the option wins
  EXPECT_EQ(8873u, o.spec.port);
  EXPECT_EQ((std::list<std::string>{"a", "b"}), o.spec.shares);
  // Empty pieces of a list are dropped.
  EXPECT_EQ(std::list<std::string>{"*.tmp"}, o.spec.excludes);
  EXPECT_TRUE(o.spec.compress);
  EXPECT_TRUE(o.spec.delta);
  EXPECT_EQ(2222u, o.spec.ssh_port);
  EXPECT_EQ("/p", o.spec.password_file);
  EXPECT_EQ(2, o.verbose);

  S2S::SyncTask t = MakeSyncTask(o.spec, "pw");
  EXPECT_EQ(7u, t.GetID());
  EXPECT_TRUE(t.GetInfo().GetSyncInfo().UseCompression());
  EXPECT_TRUE(t.GetInfo().GetSyncInfo().UseBlockLevelSync());
}

// Names the server would refuse fail here too, before anything is sent.
TEST(ClientOptions, RefusesBadInputsWithoutEchoingSecrets) {
  s2s_test::TempDir tmp;
  struct Case {
    std::string task_file;  // "" for none
    std::vector<std::string> args;
    std::string error_part;
  };
  const Case cases[] = {
      {"", {"--password=hunter2-x"}, "command line"},
      {"", {"--port", "70000"}, "--port"},
      {"", {"--task-id", "12x"}, "--task-id"},
      {"", {"stray"}, "unexpected argument"},
      {"", {"--bogus"}, "unknown"},
      {"[Task]\n\tpassword=\"hunter2-x\"\n", {}, "passwords do not go"},
      {"[Task]\n\tcolour=\"red\"\n", {}, "unknown key 'colour'"},
      {"[Task]\n\tcompress=\"maybe\"\n", {}, "'compress'"},
      {"[Other]\n\tname=\"x\"\n", {}, "no [Task] section"},
      {"", {"--task=t1 "}, "task name \"t1 \" would be refused"},
      {"", {"--share=a=b"}, "share name \"a=b\" would be refused"},
      {"", {"--share=docs", "--share=docs"}, "\"docs\" is listed twice"},
      {"", {"--server-ip=::1"}, "neither an IPv4 address nor a host name"},
      {"", {"--server-ip=-oX=y"}, "neither an IPv4 address nor a host name"},
      {"", {"--server-name=a..b"}, "\"a..b\" is not a host name"},
      {"", {"--user=u@h"}, "user \"u@h\" would be refused"},
  };
  // A complete task but for what the case says.
  const std::vector<std::string> base = {"--task=t1", "--share=docs",
                                         "--server-ip=127.0.0.1", "--user=s2s"};
  for (const Case& c : cases) {
    std::vector<std::string> args = base;
    args.insert(args.end(), c.args.begin(), c.args.end());
    if (!c.task_file.empty()) {
      ASSERT_TRUE(WriteFile(tmp.Sub("t.task"), c.task_file));
      args.push_back("--task-file=" + tmp.Sub("t.task"));
    }
    ClientOptions o;
    std::string error;
    EXPECT_FALSE(Parse(args, o, error) && CheckTaskSpec(o.spec, error))
        << c.error_part;
    EXPECT_NE(std::string::npos, error.find(c.error_part)) << error;
    EXPECT_EQ(std::string::npos, error.find("hunter2")) << error;
  }
}

TEST(Secret, FirstLineOfTheFileWinsAndTheEnvironmentIsConsumed) {
  s2s_test::TempDir tmp;
  std::string path = tmp.Sub("pw");
  ASSERT_TRUE(WriteFile(path, "s3cret-line\nsecond line\n", 0600));
  std::string pw, error;
  ASSERT_TRUE(ReadPassword(path, pw, error)) << error;
  EXPECT_EQ("s3cret-line", pw);

  ASSERT_TRUE(WriteFile(tmp.Sub("empty"), "\n", 0600));
  EXPECT_FALSE(ReadPassword(tmp.Sub("empty"), pw, error));

  // A file wins over the variable, removed all the same: no child inherits it.
  setenv(kPasswordEnv, "from-env", 1);
  ASSERT_TRUE(ReadPassword(path, pw, error));
  EXPECT_EQ("s3cret-line", pw);
  EXPECT_EQ(nullptr, getenv(kPasswordEnv));
}

int g_beacons = 0;

TEST(CancelChecker, BeaconsFromThePollNeverNest) {
  using namespace s2s_service;
  CancelFlag flag;
  BindCancelFlag(&flag);
  g_beacons = 0;
  // The hook polls the checker itself, as a beacon's own rsync run does.
  SetBeaconHook(
      [] {
        ++g_beacons;
        EXPECT_FALSE(CancelChecker());
      },
      0);
  EXPECT_FALSE(CancelChecker());
  EXPECT_FALSE(CancelChecker());
  EXPECT_EQ(2, g_beacons);

  SetBeaconHook([] { ++g_beacons; }, 3600);
  EXPECT_FALSE(CancelChecker());
  EXPECT_EQ(2, g_beacons);  // not due yet

  flag.Set();
  EXPECT_TRUE(CancelChecker());
  // Another thread's runs have flags of their own.
  bool other = true;
  std::thread([&other] { other = CancelChecker(); }).join();
  EXPECT_FALSE(other);
  BindCancelFlag(nullptr);
  EXPECT_FALSE(CancelChecker());
  SetBeaconHook(nullptr, 0);
}

}  // namespace
