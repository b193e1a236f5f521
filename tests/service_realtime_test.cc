// Realtime tasks: the batcher through its clock seam, and s2sd watching real
// shares with each change source, pushing to a real server daemon.
#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <string>
#include <tuple>
#include <vector>

#include "s2sd_process.h"
#include "service/batcher.h"

namespace {

using namespace s2s_service;

std::string Str(const std::vector<S2S::Event>& batch) {
  std::string out;
  for (const S2S::Event& e : batch) {
    out +=
        (out.empty() ? "" : " ") + e.GetShareName() + ":" + e.GetRelativePath();
  }
  return out;
}

TEST(Batcher, CoalescesIntoTheSmallestSetOfSubPaths) {
  using Add = std::tuple<const char*, std::string, EventKind>;
  // `n` paths, from "<dir>/f10<leaf>" on.
  auto Files = [](const std::string& dir, int n, const std::string& leaf) {
    std::vector<Add> adds;
    for (int i = 0; i < n; ++i) {
      adds.emplace_back("docs", dir + "/f" + std::to_string(i + 10) + leaf,
                        kEventChanged);
    }
    return adds;
  };
  struct Case {
    const char* what;
    std::vector<Add> adds;
    std::string want;
    size_t pending_limit = 0;
  };
  const EventKind C = kEventChanged, G = kEventGone, W = kEventWhole;
  const Case cases[] = {
      {"duplicates", {{"docs", "/a/x", C}, {"docs", "/a/x", C}}, "docs:/a/x"},
      {"inside a queued directory",
       {{"docs", "/a", C}, {"docs", "/a/b/c", C}},
       "docs:/a"},
      {"a directory drops what it holds",
       {{"docs", "/a/b/c", C}, {"docs", "/a/b/d", C}, {"docs", "/a", C}},
       "docs:/a"},
      {"a common prefix is not a parent",
       {{"docs", "/ab", C}, {"docs", "/a b", C}, {"docs", "/a", C}},
       "docs:/a docs:/a b docs:/ab"},
      {"any bytes",
       {{"docs", "/x\ny", C}, {"docs", "/\xff\xfe", C}},
       "docs:/x\ny docs:/\xff\xfe"},
      {"gone pushes the parent", {{"docs", "/a/x", G}}, "docs:/a"},
      {"gone at the top is the whole share", {{"docs", "/x", G}}, "docs:/"},
      {"whole swallows the rest",
       {{"docs", "/", W}, {"docs", "/a/b", C}},
       "docs:/"},
      {"shares apart",
       {{"photos", "/a", C}, {"docs", "/a", C}},
       "docs:/a photos:/a"},
      {"a crowded directory", Files("/d", 9, ""), "docs:/d"},
      {"a crowded top is the whole share", Files("", 9, ""), "docs:/"},
      {"over the pending limit", Files("", 5, "/x"), "docs:/", 4},
      // More than 16 runs: the files are lifted to their directories, which
      // crowd their parent.
      {"many runs", Files("/p", 20, "/f"), "docs:/p"},
  };
  for (const Case& c : cases) {
    BatcherSettings s;
    if (c.pending_limit != 0) s.pending_limit = c.pending_limit;
    Batcher b(s);
    for (const Add& a : c.adds)
      b.Add(MakeEvent(std::get<0>(a), std::get<1>(a), std::get<2>(a)), 100);
    EXPECT_EQ(c.want, Str(b.Take())) << c.what;
    EXPECT_TRUE(b.Empty()) << c.what;
  }
}

TEST(Batcher, SettlesAfterTheLastChangeButNeverPastTheMaximumDelay) {
  BatcherSettings s;  // settle 2 s, at most 30 s
  Batcher b(s);
  EXPECT_EQ(0, b.Due());
  for (double t : {100.0, 100.5, 101.0}) b.Add(MakeEvent("docs", "/a"), t);
  EXPECT_DOUBLE_EQ(103.0, b.Due());
  for (double t = 101; t <= 140; t += 1) b.Add(MakeEvent("docs", "/a"), t);
  EXPECT_DOUBLE_EQ(130.0, b.Due());
  std::vector<S2S::Event> batch = b.Take();
  EXPECT_EQ(0, b.Due());
  // A batch that could not be pushed comes back as new changes.
  b.Restore(batch, 200);
  b.Add(MakeEvent("docs", "/b/c", kEventGone), 201);
  EXPECT_EQ(2u, b.Pending());
  EXPECT_DOUBLE_EQ(203.0, b.Due());
  EXPECT_EQ("docs:/a docs:/b", Str(b.Take()));
}

// s2sd watching a share, with each change source.

using S2S::PObject;
using s2s_test::ReadFile;
using s2s_test::WaitUntil;
using s2s_test::WriteFile;
namespace fs = std::filesystem;

class RealtimeTest : public s2s_test::S2sdTest,
                     public ::testing::WithParamInterface<const char*> {
 protected:
  void SetUp() override {
    SetUpServer({"docs"}, "");
    client_ = app_.ClientShare("docs");
    server_ = app_.ServerShare("docs");
  }

  // Adds the realtime task over docs (the test's source, 0.2 s settle, and
  // `settings`); its status once it watches, or a null object.
  PObject AddLive(PObject settings = PObject()) {
    settings["realtime_source"] = GetParam();
    settings["realtime_settle_ms"] = 200u;
    S2S::Schedule realtime;
    realtime.SetMode(S2S::SCHD_REALTIME);
    AddTask("live", {"docs"}, realtime, settings);
    PObject status;
    WaitUntil(
        [&] {
          status = Status();
          return status["state"].asString() == "watching";
        },
        20);
    return status;
  }

  // The task's realtime status (null when the daemon did not answer).
  PObject Status() {
    const PObject reply = Request(Action("status"));
    return reply["realtime"][0u];
  }

  // Seconds until `path` on the server holds `content`, -1 after `seconds`.
  double Arrival(const std::string& path, const std::string& content,
                 double seconds = 10) {
    auto start = std::chrono::steady_clock::now();
    bool ok =
        WaitUntil([&] { return ReadFile(server_ + path) == content; }, seconds);
    return ok ? s2s_test::SecondsSince(start) : -1;
  }

  bool Gone(const std::string& path) {
    return WaitUntil(
        [&] { return !fs::exists(fs::symlink_status(server_ + path)); }, 10);
  }

  bool Same() { return s2s_test::RunQuiet({"diff", "-r", client_, server_}); }

  // How often waits compare whole trees: seldom, for the daemon's sake.
  static constexpr double kSlowly = 0.05;

  size_t Files(const std::string& dir) {
    std::error_code ec;
    size_t n = 0;
    for (auto it = fs::recursive_directory_iterator(dir, ec);
         !ec && it != fs::recursive_directory_iterator(); it.increment(ec)) {
      n += it->is_regular_file(ec) ? 1 : 0;
    }
    return n;
  }

  // The status of the task's share.
  PObject Share() {
    const PObject status = Status();
    return status["shares"][0u];
  }

  std::string client_, server_;
};

#define SKIP_UNLESS_SOURCE(status)                         \
  if (status["source"].asString() != GetParam())           \
  GTEST_SKIP() << GetParam() << " is not available here: " \
               << status["source_note"].asString()

TEST_P(RealtimeTest, ChangesArriveWithinTheSettleDelayWhateverTheirBytes) {
  WriteFile(client_ + "/before.txt", "made before the task\n");
  // Enough for the deletions below to stay within the delete guard.
  fs::create_directories(client_ + "/base");
  for (int i = 0; i < 30; ++i)
    WriteFile(client_ + "/base/" + std::to_string(i), "");
  // A share's directory is looked at every 0.2 s instead of 2 s.
  StartDaemon({"--watch-check-ms", "200"});
  const PObject status = AddLive();
  SKIP_UNLESS_SOURCE(status);
  // The start-up full sync.
  ASSERT_LE(0, Arrival("/before.txt", "made before the task\n")) << Log();
  EXPECT_NE("idle", app_.ServerRegistry("TASK_live", "status"));

  WriteFile(client_ + "/a.txt", "alpha\n");
  double took = Arrival("/a.txt", "alpha\n");
  EXPECT_LE(0, took);
  // Pushed for the change itself: far sooner than the 30 s most a batch
  // waits or the hourly full sync, with room for a loaded machine.
  EXPECT_LT(took, 0.2 + 5) << "settle delay plus five seconds";

  // Deleted, renamed, made and filled at once, any bytes in names.
  fs::create_directories(client_ + "/old/sub");
  WriteFile(client_ + "/old/sub/x", "x\n");
  ASSERT_LE(0, Arrival("/old/sub/x", "x\n"));
  unlink((client_ + "/a.txt").c_str());
  fs::rename(client_ + "/old", client_ + "/new");
  fs::create_directories(client_ + "/quick/deep/er");
  for (int i = 0; i < 50; ++i)
    WriteFile(client_ + "/quick/deep/er/f" + std::to_string(i), "q");
  const std::string odd[] = {"/line\nbreak", "/\xff\xfe.bin", "/caf\xe9"};
  fs::create_directories(client_ + odd[2]);
  WriteFile(client_ + odd[0], "newline\n");
  WriteFile(client_ + odd[1], "latin\n");
  WriteFile(client_ + odd[2] + odd[0], "both\n");
  EXPECT_TRUE(Gone("/a.txt"));
  EXPECT_TRUE(Gone("/old"));
  EXPECT_LE(0, Arrival("/new/sub/x", "x\n"));
  EXPECT_LE(0, Arrival("/quick/deep/er/f49", "q"));
  EXPECT_LE(0, Arrival(odd[2] + odd[0], "both\n"));
  EXPECT_TRUE(WaitUntil([&] { return Same(); }, 10, kSlowly));

  // A burst: 200 files in 20 new directories, more than a batch's paths.
  size_t runs_before = RsyncLogCount(client_);
  for (int d = 0; d < 20; ++d) {
    std::string dir = client_ + "/burst/d" + std::to_string(d);
    fs::create_directories(dir);
    for (int f = 0; f < 10; ++f) WriteFile(dir + "/f" + std::to_string(f), "b");
  }
  ASSERT_TRUE(
      WaitUntil([&] { return Files(server_ + "/burst") == 200; }, 60, kSlowly))
      << Log();
  EXPECT_TRUE(Same());
  EXPECT_LE(RsyncLogCount(client_) - runs_before, 10u);

  // The share's directory goes: not watched, and watched again once back.
  fs::rename(client_, client_ + ".away");
  EXPECT_TRUE(WaitUntil(
      [&] {
        const PObject share = Share();
        return !share["watching"].asBool() &&
               share["message"].asString().find("deleted, moved") !=
                   std::string::npos;
      },
      10))
      << Log();
  fs::rename(client_ + ".away", client_);
  EXPECT_TRUE(WaitUntil([&] { return Share()["watching"].asBool(); }, 10));
  WriteFile(client_ + "/back.txt", "back\n");
  EXPECT_LE(0, Arrival("/back.txt", "back\n"));

  // Back empty (a volume mounted over it, say): the guard holds the mass
  // deletion while the rest arrives, until a confirmed full sync.
  size_t kept = Files(server_);
  fs::rename(client_, client_ + ".old");
  fs::create_directories(client_);
  WriteFile(client_ + "/fresh.txt", "fresh\n");
  EXPECT_LE(0, Arrival("/fresh.txt", "fresh\n")) << Log();
  PObject last;
  EXPECT_TRUE(WaitUntil(
      [&] {
        const PObject runs = Request(Action("history", 1u))["runs"];
        last = runs[0u];
        return last["outcome"].asString() == "held";
      },
      10))
      << Log();
  EXPECT_EQ(kept + 1, Files(server_));
  // The batch's figures count what it sent: fresh.txt's 6 bytes.
  const PObject shares = last["shares"];
  EXPECT_LE(6u, shares[0u]["bytes"].asUInt64()) << last["message"].asString();
  PObject confirmed = Action("run", 1u);
  confirmed["confirm_deletions"] = 1u;
  ASSERT_EQ(0u, Request(confirmed)["result"].asUInt64());
  EXPECT_TRUE(WaitUntil([&] { return Same(); }, 10, kSlowly)) << Log();
  fs::remove_all(client_ + ".old");

  // Disabled: the server shows the task idle again.
  ASSERT_EQ(0u, Request(Action("disable", 1u))["result"].asUInt64());
  EXPECT_TRUE(WaitUntil(
      [&] { return app_.ServerRegistry("TASK_live", "status") == "idle"; },
      10));
  EXPECT_TRUE(Request(Action("status"))["realtime"].asArray().empty());
}

TEST_P(RealtimeTest, OverflowWatchLimitAndAnUnreachableServerEndEqual) {
  for (int d = 0; d < 10; ++d)
    fs::create_directories(client_ + "/tree/d" + std::to_string(d) + "/e");
  // At most 16 events per wake-up and 4 inotify watches; the full syncs
  // that cover what is not watched come every 2 s.
  StartDaemon({"--watch-queue-limit", "16", "--watch-limit", "4",
               "--watch-check-ms", "200"});
  PObject settings;
  settings["realtime_full_sync"] = 2u;
  const PObject added = AddLive(settings);
  SKIP_UNLESS_SOURCE(added);
  // Into the share's directory, which is watched, and into directories
  // that are not; while s2sd is stopped, so that the events pile up.
  kill(daemon_.pid, SIGSTOP);
  for (int i = 0; i < 100; ++i) {
    std::string dir = i < 40 ? "" : "/tree/d" + std::to_string(i % 10) + "/e";
    WriteFile(client_ + dir + "/f" + std::to_string(i), std::to_string(i));
  }
  kill(daemon_.pid, SIGCONT);
  EXPECT_TRUE(WaitUntil([&] { return Same(); }, 30, kSlowly)) << Log();
  const PObject status = Status();
  EXPECT_LE(1u, status["overflows"].asUInt64());
  if (std::string(GetParam()) == "inotify") {
    EXPECT_NE(std::string::npos,
              status["problem"].asString().find("watch limit"))
        << status["problem"].asString();
    EXPECT_EQ(4u, status["watches"].asUInt64());
  } else {
    EXPECT_EQ(1u, status["watches"].asUInt64());
  }

  // The server unreachable: the change waits, and arrives once it answers.
  WriteFile(unreachable_, "");
  WriteFile(client_ + "/later.txt", "later\n");
  EXPECT_TRUE(WaitUntil(
      [&] {
        const PObject s = Status();
        return s["state"].asString() == "retry_wait" &&
               s["last_error"].asString().find("unreachable") !=
                   std::string::npos &&
               s["pending"].asUInt64() >= 1;
      },
      30))
      << Log();
  unlink(unreachable_.c_str());
  EXPECT_LE(0, Arrival("/later.txt", "later\n", 30)) << Log();
}

INSTANTIATE_TEST_SUITE_P(Sources, RealtimeTest,
                         ::testing::Values("inotify", "fanotify"),
                         [](const ::testing::TestParamInfo<const char*>& p) {
                           return std::string(p.param);
                         });

}  // namespace
