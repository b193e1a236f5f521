// s2s-server and s2s-client end to end, as a person sees them: exit codes,
// files, the registry, and the password nowhere.
#include <fcntl.h>
#include <pwd.h>
#include <signal.h>
#include <stdio.h>
#include <sys/file.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <random>
#include <string>
#include <vector>

#include "S2S/is_syncedshare.h"
#include "gtest/gtest.h"
#include "service/exit_codes.h"
#include "testutil.h"

namespace {

using s2s_test::Child;
using s2s_test::ExpectHas;
using s2s_test::Has;
using s2s_test::ReadFile;
using s2s_test::WriteFile;
using namespace s2s_service;

const char kPassword[] = "pw-Tq83-never-shown";

// The programs run without the test's own root, password and port.
Child Spawn(const std::string& dir, const std::vector<std::string>& argv,
            std::vector<std::string> env = {}) {
  env.insert(env.begin(), {"S2S_ROOT", "S2S_PASSWORD", "S2S_RSYNC_PORT"});
  return s2s_test::Spawn(dir, argv, env);
}

Child RunProgram(const std::string& dir, const std::vector<std::string>& argv,
                 const std::vector<std::string>& env = {}) {
  Child c = Spawn(dir, argv, env);
  c.Wait();
  return c;
}

// The port a started server's last word names, before its line break.
std::string PortOf(const Child& start) {
  size_t at = start.out.rfind(' ') + 1;
  return start.out.substr(at, start.out.size() - at - 1);
}

// The /proc/<pid>/`file` of every process now, by pid.
std::vector<std::pair<pid_t, std::string>> AllProcs(const char* file) {
  std::vector<std::pair<pid_t, std::string>> out;
  for (const auto& e : std::filesystem::directory_iterator("/proc")) {
    const std::string pid = e.path().filename();
    if (isdigit(pid[0])) out.emplace_back(stoi(pid), ReadFile(e.path() / file));
  }
  return out;
}

// The rsync processes whose parent is `parent`, with each one's session.
std::vector<std::pair<pid_t, pid_t>> RsyncChildren(pid_t parent) {
  std::vector<std::pair<pid_t, pid_t>> out;
  for (const auto& p : AllProcs("stat")) {
    // "pid (comm) state ppid pgrp session ..."
    int ppid, session;
    if (Has(p.second, "(rsync)") &&
        sscanf(p.second.c_str() + p.second.rfind(')') + 1, " %*c %d %*d %d",
               &ppid, &session) == 2 &&
        ppid == parent) {
      out.emplace_back(p.first, session);
    }
  }
  return out;
}

// A file of `mb` MiB that neither compresses nor repeats itself.
void WriteBlob(const std::string& path, int mb) {
  std::ofstream blob(path, std::ios::binary);
  std::mt19937_64 random(static_cast<unsigned>(mb));
  std::vector<std::uint64_t> chunk((1 << 20) / sizeof(std::uint64_t));
  for (int i = 0; i < mb; ++i) {
    for (std::uint64_t& word : chunk) word = random();
    blob.write(reinterpret_cast<const char*>(chunk.data()), 1 << 20);
  }
}

// Bytes of data a run's summary says were sent ("N files and 2.1 MiB sent").
double SentBytes(const std::string& out) {
  double v = -1;
  char unit = 0;
  size_t at = out.find(" files and ");
  if (at != std::string::npos)
    sscanf(out.c_str() + at + 11, "%lf %c", &v, &unit);
  return v * (unit == 'K' ? 1 << 10 : unit == 'M' ? 1 << 20 : 1);
}

class ToolsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    server_ = tmp_.Sub("server");
    pw_file_ = tmp_.Sub("password");
    ASSERT_TRUE(WriteFile(pw_file_, std::string(kPassword) + "\n", 0600));
    Child init = Server({"init", "--share", "docs", "--share", "big", "--user",
                         "s2s", "--password-file", pw_file_});
    ASSERT_EQ(0, init.code) << init.err;
    Child start = Server({"start"});
    ASSERT_EQ(0, start.code) << start.err;
    port_ = PortOf(start);
  }

  void TearDown() override {
    Child stop = Server({"stop"});
    EXPECT_EQ(0, stop.code) << stop.err;
  }

  std::vector<std::string> ServerArgv(std::vector<std::string> words) {
    words.insert(words.begin(), {S2S_SERVER_PROGRAM, "--root", server_});
    return words;
  }

  Child Server(const std::vector<std::string>& words) {
    return RunProgram(tmp_.path(), ServerArgv(words));
  }

  // A row: a command line, its exit code, and what its output says.
  struct Run {
    std::vector<std::string> argv;
    int code;
    std::string says;
  };

  void ExpectRuns(const std::vector<Run>& runs) {
    for (const Run& run : runs) {
      Child r = RunProgram(tmp_.path(), run.argv);
      SCOPED_TRACE(run.argv.back() + "\n" + r.out + r.err);
      EXPECT_EQ(run.code, r.code);
      EXPECT_TRUE(Has(r.out + r.err, run.says));
    }
  }

  // A client root made by `s2s-client init` alone, its docs holding a tree.
  std::string MakeClient(const std::string& name, const std::string& serial) {
    std::string root = tmp_.Sub(name);
    Child init = RunProgram(
        tmp_.path(), {S2S_CLIENT_PROGRAM, "--root", root, "init", "--serial",
                      serial, "--share", "docs", "--share", "big"});
    EXPECT_EQ(0, init.code) << init.out << init.err;
    std::string vol = root + "/volume1";
    std::filesystem::create_directories(vol + "/docs/sub/deeper");
    WriteFile(vol + "/docs/a.txt", "alpha\n");
    WriteFile(vol + "/docs/sub/deeper/b.txt", "bravo from " + serial + "\n");
    return root;
  }

  std::vector<std::string> Client(const std::string& root,
                                  const std::string& share,
                                  const std::vector<std::string>& more = {}) {
    // --root=ROOT as one word: the form no other test gives s2s-client.
    std::vector<std::string> argv({S2S_CLIENT_PROGRAM, "--root=" + root,
                                   "--server-ip", "127.0.0.1", "--port", port_,
                                   "--user", "s2s", "--task", "t1", "--share",
                                   share, "--password-file", pw_file_});
    argv.insert(argv.end(), more.begin(), more.end());
    return argv;
  }

  Child Sync(const std::string& root, const std::string& share,
             const std::vector<std::string>& more = {}) {
    return RunProgram(tmp_.path(), Client(root, share, more));
  }

  std::string ShareKey(const std::string& share, const char* key) {
    s2s_test::ScopedEnv root("S2S_ROOT", server_);
    char buf[256] = "";
    S2SServerGetShare(share.c_str(), key, buf, sizeof buf);
    return buf;
  }

  s2s_test::TempDir tmp_;
  std::string server_, pw_file_, port_;
};

// A server an ordinary user runs: its daemon cannot change users and must not
// store links as plain files (fake super), yet syncs keep links.
TEST_F(ToolsTest, AServerRunByAnOrdinaryUserWorksAndKeepsLinks) {
  const passwd* nobody = getpwnam("nobody");
  ASSERT_NE(nullptr, nobody);
  // The programs go where that user may run them, outside the build tree.
  std::string built = std::filesystem::path(S2S_SERVER_PROGRAM).parent_path();
  std::string bin = tmp_.Sub("bin"), root = tmp_.Sub("userserver");
  std::filesystem::create_directories(bin);
  for (const char* file :
       {"s2s-server", "s2s-cmd-handler", "libs2s.so.0", "libkarorsync.so.0"}) {
    std::filesystem::copy(built + "/" + file, bin + "/" + file);
  }
  std::string pw = tmp_.Sub("userpassword");
  std::filesystem::copy(pw_file_, pw);
  ASSERT_EQ(0, chown(pw.c_str(), nobody->pw_uid, nobody->pw_gid));
  ASSERT_EQ(0, mkdir(root.c_str(), 0755));
  ASSERT_EQ(0, chown(root.c_str(), nobody->pw_uid, nobody->pw_gid));
  ASSERT_EQ(0, chmod(tmp_.path().c_str(), 0755));
  const std::string uid = std::to_string(nobody->pw_uid),
                    gid = std::to_string(nobody->pw_gid);
  auto as_user = [&](std::vector<std::string> words) {
    words.insert(words.begin(),
                 {"/usr/bin/setpriv", "--reuid", uid, "--regid", gid,
                  "--clear-groups", bin + "/s2s-server", "--root", root});
    return RunProgram(tmp_.path(), words, {"LD_LIBRARY_PATH=" + bin});
  };
  Child init = as_user(
      {"init", "--share", "docs", "--user", "s2s", "--password-file", pw});
  ASSERT_EQ(0, init.code) << init.out << init.err;
  Child start = as_user({"start"});
  ASSERT_EQ(0, start.code) << start.out << start.err;
  // However the test ends, its daemon does not outlive it.
  std::shared_ptr<void> stop_at_end(nullptr, [&](void*) {
    Child stop = as_user({"stop"});
    EXPECT_EQ(0, stop.code) << stop.out << stop.err;
  });

  std::string client = MakeClient("client", "CLIENT-A");
  ASSERT_EQ(
      0, symlink("sub/deeper/b.txt", (client + "/volume1/docs/link").c_str()));
  Child c = Sync(client, "docs", {"--port", PortOf(start)});
  EXPECT_EQ(kExitOk, c.code) << c.out << c.err;
  EXPECT_TRUE(std::filesystem::is_symlink(root + "/volume1/docs/link"));
  EXPECT_EQ("bravo from CLIENT-A\n", ReadFile(root + "/volume1/docs/link"));
}

// One client's round: a sync whose password no command line, output or log
// shows; failures' exit codes; a dry run; an operator's commands: a share
// added (sparse images stay sparse), a stuck sync and a pairing cleared.
TEST_F(ToolsTest, SyncsFailuresDryRunAndOperatorCommandsOnOneServer) {
  std::string client = MakeClient("client", "CLIENT-A");
  std::vector<std::string> argv = Client(client, "docs", {"-v", "-v"});
  argv.erase(argv.end() - 4, argv.end() - 2);  // --password-file FILE
  Child c =
      Spawn(tmp_.path(), argv, {std::string("S2S_PASSWORD=") + kPassword});
  int rsync_seen = 0;
  bool environ_clean = true;
  siginfo_t ended = {};
  std::string environ_path = "/proc/" + std::to_string(c.pid) + "/environ";
  // Until it has ended, leaving it to be reaped by Wait.
  while (waitid(P_PID, c.pid, &ended, WEXITED | WNOHANG | WNOWAIT) == 0 &&
         ended.si_pid == 0) {
    for (auto& [pid, cmd] : AllProcs("cmdline")) {
      std::replace(cmd.begin(), cmd.end(), '\0', ' ');
      EXPECT_EQ(std::string::npos, cmd.find(kPassword)) << cmd;
      if (cmd.find("rsync") == 0 &&
          cmd.find(":" + port_) != std::string::npos) {
        ++rsync_seen;
        // Past reading it, the client's own environment no longer holds it.
        environ_clean =
            environ_clean && !Has(ReadFile(environ_path), kPassword);
      }
    }
  }
  EXPECT_TRUE(environ_clean) << "the password stayed in " << environ_path;
  ASSERT_EQ(kExitOk, c.Wait()) << c.out << c.err;
  EXPECT_GT(rsync_seen, 0) << "the scan saw none of the client's rsync runs";
  ExpectHas(c.err, {"[INFO]", "karorsync"});
  for (const std::string& text :
       {c.out, c.err, ReadFile(server_ + "/var/log/s2s/rsyncd.log"),
        ReadFile(server_ + "/etc/s2s/rsyncd.conf")}) {
    EXPECT_FALSE(Has(text, kPassword)) << text;
  }
  // rsync's progress and its --stats: both files, 6 + 20 bytes of data.
  ExpectHas(c.out, {"share docs: finished", "1/1 shares synced",
                    "files checked", "2 files and 26 B sent, 0 deleted"});
  EXPECT_EQ("", ShareKey("docs", "RunningID"));

  std::string other = MakeClient("other", "CLIENT-B");
  const std::string wrong_pw = tmp_.Sub("wrong"), open_pw = tmp_.Sub("open");
  const std::string fifo_pw = tmp_.Sub("fifo");
  WriteFile(wrong_pw, "not-the-password\n", 0600);
  WriteFile(open_pw, kPassword, 0644);
  ASSERT_EQ(0, mkfifo(fifo_pw.c_str(), 0600));
  ExpectRuns({
      {Client(client, "docs",
              {"--port", std::to_string(s2s_test::FreeLoopbackPort())}),
       kExitUnreachable, "unreachable"},
      // rsync's own words, not only its exit code.
      {Client(client, "docs", {"--password-file", wrong_pw}), kExitUnreachable,
       "auth failed"},
      // A second client with another serial may not feed the same share.
      {Client(other, "docs"), kExitPairing,
       "shares fed by another client: docs"},
      {Client(client, "nosuch"), kExitUsage, "no local share"},
      {Client(client, "docs", {"--password-file", open_pw}), kExitUsage,
       "0600"},
      // Refused at once: no writer ever opens it.
      {Client(client, "docs", {"--password-file", fifo_pw}), kExitUsage,
       "not a regular file"},
  });
  // The conflict left the first client's copy and record alone.
  EXPECT_EQ("bravo from CLIENT-A\n",
            ReadFile(server_ + "/volume1/docs/sub/deeper/b.txt"));
  EXPECT_EQ("CLIENT-A", ShareKey("docs", "CompleteID"));

  // A dry run lists what a sync would send and delete, and changes nothing.
  WriteFile(client + "/volume1/docs/new.txt", "new\n");
  std::filesystem::remove(client + "/volume1/docs/a.txt");
  const std::string registry = server_ + "/usr/karo/etc/karoS2S.info";
  const std::string before = ReadFile(registry);
  Child dry = Sync(client, "docs", {"--dry-run"});
  ASSERT_EQ(kExitOk, dry.code) << dry.out << dry.err;
  ExpectHas(dry.out, {"share docs: would send 1, delete 1", "    + new.txt\n",
                      "    - a.txt\n", "1/1 shares checked (dry run)"});
  EXPECT_EQ(before, ReadFile(registry));
  EXPECT_EQ("alpha\n", ReadFile(server_ + "/volume1/docs/a.txt"));
  EXPECT_FALSE(std::filesystem::exists(server_ + "/volume1/docs/new.txt"));
  // Its directory gone (a volume not mounted): failed, not "synced".
  std::filesystem::rename(client + "/volume1/docs", client + "/docs.away");
  ExpectRuns({{Client(client, "docs"), kExitShare,
               "is not there (deleted, moved or unmounted)"}});
  std::filesystem::rename(client + "/docs.away", client + "/volume1/docs");

  std::string extra = tmp_.Sub("extra");
  ExpectRuns({{ServerArgv({"share", "add", "extra=" + extra}), 0,
               "configuration rewritten"}});
  std::string on_root = tmp_.Sub("on-root-fs/extra");
  ASSERT_EQ(
      0, RunProgram(tmp_.path(), {S2S_CLIENT_PROGRAM, "--root",
                                  tmp_.Sub("extraclient"), "init", "--serial",
                                  "CLIENT-A", "--share", "extra=" + on_root})
             .code);
  WriteFile(on_root + "/new.txt", "new share\n");
  // A 64 MiB disk image holding 1 MiB of data takes about 1 MiB there too.
  WriteFile(on_root + "/disk.img", std::string(1 << 20, 'd'));
  std::filesystem::resize_file(on_root + "/disk.img", 64 << 20);
  Child sync = Sync(tmp_.Sub("extraclient"), "extra");
  ASSERT_EQ(kExitOk, sync.code) << sync.out << sync.err;
  EXPECT_EQ("new share\n", ReadFile(extra + "/new.txt"));
  struct stat image;
  ASSERT_EQ(0, stat((extra + "/disk.img").c_str(), &image));
  EXPECT_EQ(64 << 20, image.st_size);
  // Data plus the file system's own rounding.
  EXPECT_LE(image.st_blocks * 512, 2ll << 20) << image.st_blocks;

  {
    s2s_test::ScopedEnv root("S2S_ROOT", server_);
    auto stuck = s2s_test::MakeHash({{"RunningID", "GONE-1"}});
    ASSERT_EQ(0, S2SServerUpdateShare("docs", stuck.get()));
    ASSERT_EQ(0, KAROUISetS2S(1, "OLD-1", "oldname"));
  }
  // An upload at 1 KiB/s for a minute, cut by the stop below: the daemon's
  // connections end with it.
  WriteFile(tmp_.Sub("upload"), std::string(60 << 10, 'u'));
  Child upload = Spawn(tmp_.path(),
                       {"rsync", "--bwlimit=1", tmp_.Sub("upload"),
                        "rsync://s2s@127.0.0.1:" + port_ + "/s2sspool/up1"},
                       {std::string("RSYNC_PASSWORD=") + kPassword});
  ExpectRuns({
      {ServerArgv({"status"}), 0, "service:  running"},
      {ServerArgv({"status"}), 0, "last completed by CLIENT-A"},
      {ServerArgv({"status"}), 0, "task  t1"},
      {ServerArgv({"release", "docs"}), 0,
       "released from the sync of client GONE-1"},
      {ServerArgv({"release", "nosuch"}), 1, "no share nosuch"},
      {ServerArgv({"status"}), 0, "paired:   client OLD-1"},
      {ServerArgv({"reset-pairing"}), 0, "client OLD-1 forgotten"},
      {ServerArgv({"status"}), 0, "paired:   open to several clients"},
      {ServerArgv({"pairings"}), 0, "clientID=\"(open to several clients)\""},
      {ServerArgv({"stop"}), 0, "stopped"},
      {ServerArgv({"status"}), 3, "daemon:   not running"},
      {ServerArgv({"status", "--json"}), 3, "\"daemon\": {\"running\": false"},
      {ServerArgv({"pairings", "--json"}), 3, "\"SHARE_extra\": {"},
      {ServerArgv({"start"}), 0, "daemon: pid"},
  });
  EXPECT_NE(0, upload.Wait()) << "the upload outlived the daemon's stop";
  EXPECT_EQ("", ShareKey("docs", "RunningID"));
}

// A transfer cut by SIGTERM past half way resumes from the part the server
// kept; then the delete guard, and a full server disk in rsync's words.
TEST_F(ToolsTest, CancelledTransferResumesDeletionsAreGuardedAFullDiskIsNamed) {
  std::string client = MakeClient("client", "CLIENT-A");
  const double kSize = 24 << 20;
  WriteBlob(client + "/volume1/big/blob", 24);
  // Slow enough to be cut where the test wants it.
  Child c =
      Spawn(tmp_.path(), Client(client, "big", {"--max-bandwidth", "16384"}));
  const std::string share = server_ + "/volume1/big";
  bool past_half = s2s_test::WaitUntil(
      [&] {
        std::error_code ec;
        for (const auto& e : std::filesystem::directory_iterator(share, ec)) {
          // rsync's temporary file of the blob, growing.
          if (e.path().filename().string().find(".blob.") == 0 &&
              e.file_size(ec) > kSize * 0.6) {
            return true;
          }
        }
        return false;
      },
      60);
  kill(c.pid, SIGTERM);
  ASSERT_TRUE(past_half) << "the transfer was never seen half done";
  ASSERT_EQ(kExitCancelled, c.Wait()) << c.out << c.err;
  ExpectHas(c.out, {"cancelled", "task t1: finished"});
  EXPECT_EQ("CLIENT-A", ShareKey("big", "RunningID"));
  // The daemon's side keeps the part once its connection has ended.
  const std::string part = share + "/.s2s-partial/blob";
  ASSERT_TRUE(
      s2s_test::WaitUntil([&] { return std::filesystem::exists(part); }, 30));
  Child next = Sync(client, "big");
  ASSERT_EQ(kExitOk, next.code) << next.out << next.err;
  EXPECT_GT(SentBytes(next.out), 0) << next.out;
  EXPECT_LT(SentBytes(next.out), kSize / 2) << next.out;
  EXPECT_EQ(kSize, std::filesystem::file_size(share + "/blob"));
  EXPECT_FALSE(std::filesystem::exists(share + "/.s2s-partial"));

  // The client's share emptied (a disk not mounted) but for a changed file:
  // it arrives, nothing is deleted and the refusal says why, until confirmed.
  const std::string mine = client + "/volume1/big";
  for (const char* f : {"f1", "f2", "f3", "f4"}) WriteFile(mine + "/" + f, f);
  ASSERT_EQ(kExitOk, Sync(client, "big").code);
  std::filesystem::remove_all(mine);
  std::filesystem::create_directories(mine);
  WriteBlob(mine + "/blob", 3);
  Child held = Sync(client, "big");
  EXPECT_EQ(kExitDeletions, held.code) << held.out << held.err;
  EXPECT_TRUE(Has(held.out,
                  "share big: deletions held back: 4 of 6 entries on the "
                  "server would be deleted, more than the guard allows (3)"))
      << held.out;
  EXPECT_EQ(3u << 20, std::filesystem::file_size(share + "/blob"));
  EXPECT_EQ("f1", ReadFile(share + "/f1"));

  Child confirmed = Sync(client, "big", {"--confirm-deletions"});
  EXPECT_EQ(kExitOk, confirmed.code) << confirmed.out << confirmed.err;
  EXPECT_TRUE(Has(confirmed.out, "4 deleted")) << confirmed.out;
  EXPECT_FALSE(std::filesystem::exists(share + "/f1"));

  struct stat st;
  ASSERT_EQ(0, stat(share.c_str(), &st));
  char options[128];
  snprintf(options, sizeof options, "size=2m,mode=%o,uid=%u,gid=%u",
           st.st_mode & 07777, st.st_uid, st.st_gid);
  if (mount("s2s-full", share.c_str(), "tmpfs", 0, options) != 0) {
    GTEST_SKIP() << "cannot mount a small filesystem on the server share: "
                 << strerror(errno);
  }
  Child full = Sync(client, "big");
  umount2(share.c_str(), MNT_DETACH);
  EXPECT_EQ(kExitShare, full.code) << full.out << full.err;
  ExpectHas(full.out,
            {"share big: transfer failed: ", "No space left on device"});
}

// kill -9 of a client mid-transfer: while it lives a second run is refused;
// its rsync runs end with it, and the next run clears what it left.
TEST_F(ToolsTest, KilledClientLeavesNoRsyncRunningAndNoCommandFiles) {
  std::string client = MakeClient("client", "CLIENT-A");
  WriteBlob(client + "/volume1/big/blob", 16);
  // At 1 MiB/s the transfer outlasts the test.
  Child c =
      Spawn(tmp_.path(),
            Client(client, "big",
                   {"--beacon-interval", "0", "--max-bandwidth", "1024"}));
  std::vector<std::pair<pid_t, pid_t>> rsyncs;
  s2s_test::WaitUntil(
      [&] {
        rsyncs = RsyncChildren(c.pid);
        return rsyncs.size() >= 2;
      },
      20);
  ASSERT_EQ(2u, rsyncs.size()) << "no transfer with a beacon beside it";
  for (const auto& r : rsyncs)
    EXPECT_EQ(r.first, r.second) << "rsync is not in a session of its own";

  Child again = Sync(client, "docs");
  EXPECT_EQ(kExitBusy, again.code) << again.out << again.err;
  EXPECT_TRUE(Has(again.err, "is running already")) << again.err;

  kill(c.pid, SIGKILL);
  EXPECT_EQ(128 + SIGKILL, c.Wait());
  int lock = open((client + "/run/lock/s2s-task-1.lock").c_str(), O_RDONLY);
  EXPECT_TRUE(s2s_test::WaitUntil(
      [&] { return flock(lock, LOCK_EX | LOCK_NB) == 0; }, 30));
  close(lock);
  EXPECT_FALSE(std::filesystem::exists(server_ + "/volume1/big/blob"));
  std::string tmp = client + "/tmp/S2S";
  ASSERT_FALSE(std::filesystem::is_empty(tmp)) << "no command was running";

  // The next run, from a task file, with a beacon at every poll: their rsync
  // runs nest inside the transfer's wait without disturbing it.
  std::string task = tmp_.Sub("t.task");
  WriteFile(task,
            "[Task]\n\tname=\"filetask\"\n\tserver_ip=\"127.0.0.1\"\n"
            "\tuser=\"s2s\"\n\tshares=\"docs:big\"\n\tport=\"" +
                port_ + "\"\n\tpassword_file=\"" + pw_file_ + "\"\n");
  Child next = RunProgram(
      tmp_.path(), {S2S_CLIENT_PROGRAM, "--root", client, "--task-file", task,
                    "--beacon-interval", "0", "--max-bandwidth", "8192"});
  ASSERT_EQ(kExitOk, next.code) << next.out << next.err;
  ExpectHas(next.out, {"beacon: transfer running", "2/2 shares synced"});
  EXPECT_EQ(16u << 20,
            std::filesystem::file_size(server_ + "/volume1/big/blob"));
  EXPECT_TRUE(Has(Server({"status"}).out, "task  filetask         idle"));
  for (const auto& e : std::filesystem::directory_iterator(tmp))
    ADD_FAILURE() << "left behind: " << e.path();
}

}  // namespace
