// RsyncTask: the wrapper settings every invocation starts from, what the
// Rsyncer copies into it, and the time-outs of the two kinds of run.
#include "S2S/rsyncer.h"
#include "gtest/gtest.h"
#include "testutil.h"

namespace {

using S2S::Rsyncer;

TEST(RsyncerTaskTest, DefaultsAndTheInvertedTestSwitch) {
  Rsyncer::RsyncTask task;
  EXPECT_TRUE(task.getDelete());
  EXPECT_TRUE(task.getNumericIds());
  EXPECT_TRUE(task.getKaroAuthUse());
  EXPECT_TRUE(task.getKaroAuthRequire());
  EXPECT_TRUE(task.getKaroPseudoRoot());
  // Block-level sync is rsync's delta transfer, not its compression.
  task.SetBlockLevelSync(true);
  EXPECT_TRUE(task.getDeltaCopy());
  EXPECT_FALSE(task.getCompress());
  // A test task runs quietly, every other one with the debug log.
  task.SetTestTask(true);
  EXPECT_FALSE(task.getDebugLog());
  task.SetTestTask(false);
  EXPECT_TRUE(task.getDebugLog());
}

TEST(RsyncerTaskTest, InitCopiesConnectionAndSetsThePortOnlyForSsh) {
  S2S::SyncInfo info;
  info.SetServerIP("127.0.0.9");
  info.SetUser("backup");
  info.SetPassword("pw");
  info.SetSSHPort(2222);
  info.SetCompression(true);
  info.SetBlockLevelSync(true);
  // Initialize probes the server; without a client identity no request is
  // even written, so nothing runs.
  s2s_test::TempRoot root;
  ASSERT_TRUE(root.Write("/etc/s2s/platform.conf",
                         "[Platform]\n\tha=\"yes\"\n\tserial=\"\"\n"));
  Rsyncer r;
  r.Initialize(info);

  Rsyncer::RsyncTask plain;
  r.InitRsyncTask(plain, true);
  EXPECT_EQ("127.0.0.9", plain.GetServerIP());
  EXPECT_EQ("backup", plain.GetUser());
  EXPECT_FALSE(plain.getSsh());
  EXPECT_EQ(0u, plain.getPort());
  EXPECT_FALSE(plain.getDebugLog());
  // Transfer options are the callers' business.
  EXPECT_FALSE(plain.getCompress());
  EXPECT_FALSE(plain.getDeltaCopy());

  info.SetSSH(true);
  r.Initialize(info);
  Rsyncer::RsyncTask ssh;
  r.InitRsyncTask(ssh, false);
  EXPECT_TRUE(ssh.getSsh());
  EXPECT_EQ(2222u, ssh.getPort());
  EXPECT_TRUE(ssh.getDebugLog());
}

TEST(RsyncerTaskTest, CommandsWaitAMinuteDataTenMinutes) {
  // No server address: the wrapper refuses before starting rsync.
  Rsyncer::RsyncTask command;
  EXPECT_EQ(Rsyncer::RsyncTask::kBadSettings,
            command.ExecuteCmd({"command=\"S2S_Pairing\""}, nullptr));
  EXPECT_EQ(60u, command.getTimeout());
  Rsyncer::RsyncTask data;
  data.setTimeout(5);
  EXPECT_EQ(Rsyncer::RsyncTask::kBadSettings,
            data.Execute("/src/", "share", nullptr, "", {}));
  EXPECT_EQ(600u, data.getTimeout());
}

}  // namespace
