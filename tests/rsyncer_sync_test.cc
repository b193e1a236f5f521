// A share's sync run against the server's real daemon and handler, and the
// tree it leaves there: awkward names, links, modes, owners, times, ACLs and
// extended attributes.
#include <fcntl.h>
#include <poll.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <map>
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

  // The sync over, the share's module refuses pushes: seen in the status.
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
  std::string c = app_.ClientShare("docs"), s = app_.ServerShare("docs");
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
  s2s_test::ExpectHas(log.Text(),
                      {"SendBeacon: Fail to write command file\n",
                       "FinishSync: Fail to write command file\n",
                       "StartSyncShare: Fail to write command file\n",
                       "Fail to start sync share 'nope' with ACL\n"});
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
  // The daemon's receiver keeps what arrived, if anything, in its hidden
  // partial directory for the next run, and nothing else.
  auto names = [this] {
    std::string all;
    for (const auto& e : fs::directory_iterator(app_.ServerShare("docs")))
      all += e.path().filename().string() + " ";
    return all;
  };
  EXPECT_TRUE(s2s_test::WaitUntil(
      [&] { return names().empty() || names() == ".s2s-partial "; }, 3))
      << names();
}

// A tree, a line per entry: name, mode, owner, time (but for directories) and
// the content or the link's target.
std::string Snapshot(const std::string& top) {
  std::string out;
  std::map<std::string, std::string> lines;
  for (const auto& e : fs::recursive_directory_iterator(top)) {
    std::string path = e.path().string();
    struct stat st;
    if (lstat(path.c_str(), &st) != 0) continue;
    char head[64];
    snprintf(head, sizeof head, " %o %d:%d %ld ", st.st_mode, st.st_uid,
             st.st_gid, S_ISDIR(st.st_mode) ? 0L : long(st.st_mtime));
    std::string data = S_ISLNK(st.st_mode) ? fs::read_symlink(e.path()).string()
                       : S_ISREG(st.st_mode) ? ReadFile(path)
                                             : "";
    lines[path.substr(top.size())] = head + data;
  }
  for (const auto& [name, line] : lines) out += name + line + "\n";
  return out;
}

class RsyncerTreeTest : public RsyncerSyncTest {
 protected:
  void SetUp() override {
    ASSERT_NO_FATAL_FAILURE(StartShare("tree", app_.Info()));
  }

  int Push() {
    int status = -1;
    EXPECT_EQ(0, r_.RunSync(1, "tree", "/", {}, status));
    return status;
  }

  const std::string c_ = app_.ClientShare("tree"),
                    s_ = app_.ServerShare("tree");
};

TEST_F(RsyncerTreeTest, AwkwardNamesLinksModesAndOwners) {
  const std::string names[] = {
      "with space",          "quote\"d 'twice'", "new\nline",   "tab\there",
      "latin1-\xe9\xff\xfe", "-leading-dash",    "back\\slash", "star*?[x]",
  };
  ASSERT_TRUE(fs::create_directories(c_ + "/dir one/sub"));
  for (const std::string& n : names) {
    ASSERT_TRUE(WriteFile(c_ + "/" + n, "content of " + n)) << n;
    ASSERT_TRUE(WriteFile(c_ + "/dir one/sub/" + n, n)) << n;
  }
  ASSERT_EQ(0, chmod((c_ + "/with space").c_str(), 0600));
  ASSERT_EQ(0, chmod((c_ + "/-leading-dash").c_str(), 04755));
  ASSERT_EQ(0, chmod((c_ + "/dir one").c_str(), 0750));
  ASSERT_EQ(0, lchown((c_ + "/tab\there").c_str(), 4321, 8765));
  ASSERT_EQ(0, symlink("with space", (c_ + "/link to file").c_str()));
  ASSERT_EQ(0, symlink("dir one/sub", (c_ + "/link to dir").c_str()));
  ASSERT_EQ(0, symlink("/nonexistent/target", (c_ + "/dangling").c_str()));
  ASSERT_TRUE(WriteFile(c_ + "/hard-a", "shared inode"));
  ASSERT_EQ(0, link((c_ + "/hard-a").c_str(), (c_ + "/hard-b").c_str()));
  ASSERT_TRUE(WriteFile(c_ + "/empty", ""));
  ASSERT_TRUE(fs::create_directories(c_ + "/empty dir"));

  ASSERT_EQ(0, Push()) << app_.DaemonLog();
  // Links travel as links, not as what they point at.
  EXPECT_EQ(Snapshot(c_), Snapshot(s_));
  // A hard link stays one file with two names.
  struct stat a, b;
  ASSERT_EQ(0, stat((s_ + "/hard-a").c_str(), &a));
  ASSERT_EQ(0, stat((s_ + "/hard-b").c_str(), &b));
  EXPECT_EQ(a.st_ino, b.st_ino);

  // A second run sends what changed and removes what went.
  ASSERT_TRUE(fs::remove(c_ + "/new\nline"));
  ASSERT_EQ(0, chmod((c_ + "/quote\"d 'twice'").c_str(), 0444));
  ASSERT_EQ(0, Push());
  EXPECT_FALSE(fs::exists(s_ + "/new\nline"));
  EXPECT_EQ(Snapshot(c_), Snapshot(s_));
}

TEST_F(RsyncerTreeTest, AclsAndExtendedAttributes) {
  std::string file = c_ + "/acl-file";
  ASSERT_TRUE(WriteFile(file, "guarded"));
  ASSERT_TRUE(fs::create_directories(c_ + "/acl-dir"));
  if (!s2s_test::RunQuiet({"setfacl", "-m", "u:12345:r--,g:23456:rw-", file}) ||
      !s2s_test::RunQuiet(
          {"setfacl", "-d", "-m", "u:12345:rwx", c_ + "/acl-dir"})) {
    GTEST_SKIP() << "the temporary file system refuses ACLs";
  }
  bool xattrs = setxattr(file.c_str(), "user.s2s.note", "kept", 4, 0) == 0;

  ASSERT_EQ(0, Push()) << app_.DaemonLog();
  s2s_test::TempDir out;
  auto acl = [&out](const std::string& path, const char* flags = "-cp") {
    return s2s_test::RunProgram(out.path(), {"/usr/bin/getfacl", flags, path})
        .out;
  };
  EXPECT_NE(acl(file).find("user:12345:r--"), std::string::npos);
  EXPECT_EQ(acl(file), acl(s_ + "/acl-file"));
  EXPECT_EQ(acl(c_ + "/acl-dir", "-cpd"), acl(s_ + "/acl-dir", "-cpd"));
  EXPECT_NE(acl(s_ + "/acl-dir", "-cpd").find("user:12345:rwx"),
            std::string::npos);
  if (xattrs) {
    char value[16] = {0};
    EXPECT_EQ(4, getxattr((s_ + "/acl-file").c_str(), "user.s2s.note", value,
                          sizeof value));
    EXPECT_STREQ("kept", value);
  }
}

}  // namespace
