// A share's sync run end to end: the client driver against the server's
// real daemon and handler on loopback.
#include <fcntl.h>
#include <poll.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <thread>

#include "S2S/rsyncer.h"
#include "appliances.h"
#include "gtest/gtest.h"

namespace {

using S2S::Rsyncer;
using s2s_test::Has;
using s2s_test::LogCapture;
using s2s_test::ReadFile;
using s2s_test::WriteFile;
namespace fs = std::filesystem;

class RsyncerSyncTest : public ::testing::Test {
 protected:
  // Pairs and starts `share` on a fresh multi-source server.
  void StartShare(const std::string& share, const S2S::SyncInfo& info) {
    ASSERT_TRUE(app_.AddShare(share));
    ASSERT_TRUE(app_.StartServer()) << app_.DaemonLog();
    ASSERT_EQ(0, r_.Initialize(info)) << app_.DaemonLog();
    int status = -1;
    std::list<std::string> conflicts;
    ASSERT_EQ(0, r_.DoPairing(false, {share}, conflicts, status));
    ASSERT_EQ(0, status);
    ASSERT_EQ(0, r_.StartSyncShare(share, status));
    ASSERT_EQ(0, status);
  }

  s2s_test::Appliances app_{S2S_CMD_HANDLER};
  Rsyncer r_;
};

TEST_F(RsyncerSyncTest, PushBeaconAndFinish) {
  ASSERT_NO_FATAL_FAILURE(StartShare("docs", app_.Info()));
  ASSERT_TRUE(WriteFile(app_.ClientShare("docs") + "/a.txt", "alpha"));
  EXPECT_EQ("CLIENT-A", app_.ServerRegistry("SHARE_docs", "RunningID"));
  int status = -1;
  ASSERT_EQ(0, r_.RunSync(1, "docs", "/", {}, status));
  EXPECT_EQ(0, status) << app_.DaemonLog();
  EXPECT_EQ("alpha", ReadFile(app_.ServerShare("docs") + "/a.txt"));

  // The beacon marks the task busy since now.
  ASSERT_EQ(0, r_.SendBeacon("nightly", status));
  EXPECT_EQ(0, status);
  EXPECT_NEAR(time(nullptr),
              atol(app_.ServerRegistry("TASK_nightly", "status").c_str()), 60);

  ASSERT_EQ(0, r_.FinishSync("share", "docs", status));
  EXPECT_EQ(0, status);
  EXPECT_EQ("CLIENT-A", app_.ServerRegistry("SHARE_docs", "CompleteID"));
  EXPECT_EQ("", app_.ServerRegistry("SHARE_docs", "RunningID"));
  ASSERT_EQ(0, r_.FinishSync("task", "nightly", status));
  EXPECT_EQ(0, status);
  EXPECT_EQ("idle", app_.ServerRegistry("TASK_nightly", "status"));

  // The sync is over: the share's module refuses further pushes, which only
  // shows in the status.
  ASSERT_EQ(0, r_.RunSync(1, "docs", "/", {}, status));
  EXPECT_NE(0, status);
  // The server's own refusal of a finish it does not know.
  ASSERT_EQ(0, r_.FinishSync("share", "docs", status));
  EXPECT_EQ(246, status);
}

TEST_F(RsyncerSyncTest, SubPathWithExcludesThenWholeShareWithDelete) {
  S2S::SyncInfo info = app_.Info();
  info.SetCompression(true);
  info.SetBlockLevelSync(true);
  ASSERT_NO_FATAL_FAILURE(StartShare("docs", info));
  std::string c = app_.ClientShare("docs");
  std::string s = app_.ServerShare("docs");
  ASSERT_TRUE(fs::create_directories(c + "/a/b"));
  ASSERT_TRUE(WriteFile(c + "/a/b/keep.txt", std::string(200000, 'k')));
  ASSERT_TRUE(WriteFile(c + "/a/b/skip.tmp", "temporary"));
  ASSERT_TRUE(WriteFile(c + "/a/other.txt", "other"));
  ASSERT_TRUE(WriteFile(c + "/top.txt", "top"));

  int status = -1;
  ASSERT_EQ(0, r_.RunSync(2, "docs", "/a/b", {"*.tmp"}, status));
  EXPECT_EQ(0, status) << app_.DaemonLog();
  // The path below the share is recreated, nothing beside it is sent.
  EXPECT_TRUE(std::string(200000, 'k') == ReadFile(s + "/a/b/keep.txt"));
  EXPECT_FALSE(fs::exists(s + "/a/b/skip.tmp"));
  EXPECT_FALSE(fs::exists(s + "/a/other.txt"));
  EXPECT_FALSE(fs::exists(s + "/top.txt"));
  EXPECT_FALSE(fs::exists(s + "/b"));

  // A change in the middle of a large file travels as a delta.
  std::string changed(200000, 'k');
  changed.replace(100000, 5, "DELTA");
  ASSERT_TRUE(WriteFile(c + "/a/b/keep.txt", changed));
  // Same size: only a different time tells rsync's quick check.
  timespec times[2] = {{0, UTIME_OMIT}, {1000000000, 0}};
  ASSERT_EQ(0, utimensat(AT_FDCWD, (c + "/a/b/keep.txt").c_str(), times, 0));
  ASSERT_TRUE(fs::remove(c + "/a/other.txt"));
  ASSERT_TRUE(WriteFile(s + "/stray", "only on the server"));
  ASSERT_EQ(0, r_.RunSync(3, "docs", "/", {}, status));
  EXPECT_EQ(0, status) << app_.DaemonLog();
  EXPECT_TRUE(changed == ReadFile(s + "/a/b/keep.txt"));
  EXPECT_EQ("temporary", ReadFile(s + "/a/b/skip.tmp"));
  EXPECT_EQ("top", ReadFile(s + "/top.txt"));
  EXPECT_FALSE(fs::exists(s + "/a/other.txt"));
  EXPECT_FALSE(fs::exists(s + "/stray"));
}

TEST_F(RsyncerSyncTest,
       VanishedPathUnknownShareAndUnwritableRequestsRunNothing) {
  ASSERT_NO_FATAL_FAILURE(StartShare("docs", app_.Info()));
  // Were anything run now, it would fail to connect.
  app_.StopServer();
  int status = -5;
  ASSERT_EQ(0, r_.RunSync(4, "docs", "/gone/away", {}, status));
  EXPECT_EQ(0, status);
  LogCapture log;
  status = -5;
  EXPECT_EQ(-1, r_.RunSync(4, "nope", "/", {}, status));
  EXPECT_EQ(-5, status);
  EXPECT_TRUE(Has(log.Text(), "Fail to get share info of 'nope'\n"));
  // Requests that cannot be written never reach the server either.
  EXPECT_EQ(-1, r_.SendBeacon("", status));
  EXPECT_EQ(-1, r_.FinishSync("share", "", status));
  EXPECT_EQ(-1, r_.StartSyncShare("nope", status));
  EXPECT_EQ(-5, status);
  for (const char* line : {"SendBeacon: Fail to write command file\n",
                           "FinishSync: Fail to write command file\n",
                           "StartSyncShare: Fail to write command file\n",
                           "Fail to start sync share 'nope' with ACL\n"}) {
    EXPECT_TRUE(Has(log.Text(), line)) << line;
  }
}

TEST_F(RsyncerSyncTest, ShareDescriptionIsLookedUpOnce) {
  ASSERT_TRUE(app_.AddShare("docs"));
  S2S::ShareInfo first, again, fresh;
  ASSERT_EQ(0, r_.GetShareInfo("docs", first));
  ASSERT_TRUE(WriteFile(app_.client_root() + "/etc/s2s/shares.conf",
                        "[docs]\n\tpath=\"/moved/docs\"\n"));
  ASSERT_EQ(0, r_.GetShareInfo("docs", again));
  EXPECT_EQ(first.GetPath(), again.GetPath());
  EXPECT_EQ(app_.ClientShare("docs"), again.GetModulePath());
  ASSERT_EQ(0, S2S::GetShareInfo("docs", fresh));
  EXPECT_EQ("/moved/docs", fresh.GetPath());
  EXPECT_EQ(-1, r_.GetShareInfo("nope", fresh));
}

// Set by the watcher thread, read by the cancel checker on the run's thread.
std::atomic<bool> stop_run{false};
bool StopRun() { return stop_run.load(); }

TEST_F(RsyncerSyncTest, CancelStopsALargeTransferPromptly) {
  ASSERT_NO_FATAL_FAILURE(StartShare("docs", app_.Info()));
  // Sparse on the client, a gigabyte of data on the wire.
  int fd = open((app_.ClientShare("docs") + "/big").c_str(), O_WRONLY | O_CREAT,
                0644);
  ASSERT_GE(fd, 0);
  ASSERT_EQ(0, ftruncate(fd, 1LL << 30));
  close(fd);

  // The server's receiver creates its temporary file once data flows.
  int in = inotify_init1(IN_CLOEXEC);
  ASSERT_GE(in, 0);
  ASSERT_GE(inotify_add_watch(in, app_.ServerShare("docs").c_str(), IN_CREATE),
            0);
  stop_run = false;
  std::chrono::steady_clock::time_point stopped;
  std::thread watcher([&] {
    char buf[4096];
    pollfd p = {in, POLLIN, 0};
    if (poll(&p, 1, 20000) == 1 && read(in, buf, sizeof buf) > 0) {
      stopped = std::chrono::steady_clock::now();
      stop_run = true;
    }
  });
  r_.SetCancelChecker(&StopRun);
  int status = -1;
  ASSERT_EQ(0, r_.RunSync(5, "docs", "/", {}, status));
  auto ended = std::chrono::steady_clock::now();
  close(in);
  watcher.join();
  ASSERT_TRUE(stop_run.load()) << "no data reached the server";
  EXPECT_EQ(Rsyncer::RsyncTask::kCancelled, status);
  EXPECT_LT(ended - stopped, std::chrono::milliseconds(1200));
  // Once the link is gone the daemon's receiver keeps what arrived (if any
  // data did) in its hidden partial directory, for the next run to build
  // on, and nothing else.
  auto names = [this] {
    std::string all;
    for (const auto& e : fs::directory_iterator(app_.ServerShare("docs"))) {
      all += e.path().filename().string() + " ";
    }
    return all;
  };
  EXPECT_TRUE(s2s_test::WaitUntil(
      [&] { return names().empty() || names() == ".s2s-partial "; }, 3))
      << names();
}

}  // namespace
