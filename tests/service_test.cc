// The client service: its scheduler through the clock seam, its files, and
// s2sd itself as a process against a real server appliance, driven through
// its control socket.
#include <poll.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include "S2S/is_syncedshare.h"
#include "S2S/sync_obj_pobject.h"
#include "appliances.h"
#include "gtest/gtest.h"
#include "s2sd_process.h"
#include "service/config.h"
#include "service/history.h"
#include "service/record.h"
#include "service/scheduler.h"
#include "service/task_store.h"
#include "testutil.h"

namespace {

using S2S::PObject;
using namespace s2s_service;
using s2s_test::ReadFile;
using s2s_test::WriteFile;

// Every minute from 11:30 to 13:05 (96 runs, the most a day may have) of
// every day, from 2020-01-01.
S2S::Schedule EveryMinute() {
  S2S::Schedule s;
  s.SetMode(S2S::SCHD_WEEKLY);
  s.SetWeekSchedule("1111111");
  s.SetBeginYear(2020);
  s.SetBeginMonth(1);
  s.SetBeginDay(1);
  s.SetStartHour(11);
  s.SetStartMinute(30);
  s.SetPeriod(0, 1);
  s.SetRepeatTimesInDay(95);
  return s;
}

// A local-time instant as epoch seconds.
long At(int year, int month, int day, int hour, int minute) {
  tm t = {};
  t.tm_year = year - 1900;
  t.tm_mon = month - 1;
  t.tm_mday = day;
  t.tm_hour = hour;
  t.tm_min = minute;
  t.tm_isdst = -1;
  return static_cast<long>(mktime(&t));
}

TEST(Scheduler, EarliestFirstOncePerDueAndRecomputedWhenTheClockJumps) {
  s2s_test::ScopedTZ tz("UTC");
  S2S::Schedule daily = EveryMinute();
  daily.SetPeriod(0);  // once a day, at 00:00
  daily.SetStartHour(0);
  daily.SetStartMinute(0);
  S2S::Schedule nine = daily;
  nine.SetStartHour(9);
  S2S::Schedule manual;
  Scheduler s;
  long now = At(2026, 3, 2, 8, 0);
  s.Set(1, daily, true, now);
  s.Set(2, nine, true, now);
  s.Set(3, EveryMinute(), false, now);  // disabled
  s.Set(4, manual, true, now);
  EXPECT_EQ(At(2026, 3, 2, 9, 0), s.Earliest());
  EXPECT_EQ(0, s.NextDue(3));
  EXPECT_EQ(0, s.NextDue(4));

  // Hours late (a suspend): each due task once, the next slot from now.
  long late = At(2026, 3, 3, 10, 30);
  std::vector<Scheduler::Due> due = s.TakeDue(late);
  ASSERT_EQ(2u, due.size());
  EXPECT_EQ(2u, due[0].id);  // 09:00 came before midnight
  EXPECT_EQ(1u, due[1].id);
  EXPECT_TRUE(s.TakeDue(late).empty());
  EXPECT_EQ(At(2026, 3, 4, 0, 0), s.Next(1));

  // The clock is set back a day: next times follow it.
  s.RecomputeAll(At(2026, 3, 1, 12, 0));
  EXPECT_EQ(At(2026, 3, 2, 0, 0), s.Earliest());
  EXPECT_EQ(At(2026, 3, 2, 9, 0), s.Next(2));
  s.Set(3, EveryMinute(), true, At(2026, 3, 1, 12, 0));
  EXPECT_EQ(At(2026, 3, 1, 12, 1), s.Earliest());
  s.Remove(3);
  EXPECT_EQ(At(2026, 3, 2, 0, 0), s.Earliest());
}

TEST(Scheduler, RetriesBackOffUntilTheNextScheduledRun) {
  s2s_test::ScopedTZ tz("UTC");
  S2S::Schedule daily = EveryMinute();
  daily.SetPeriod(0);
  daily.SetStartHour(0);
  daily.SetStartMinute(0);
  Scheduler s;
  long now = At(2026, 3, 2, 23, 0);
  s.Set(1, daily, true, now);
  const long expected[] = {60, 120, 240, 480, 960};
  for (long delay : expected) {
    long at = s.ScheduleRetry(1, now);
    EXPECT_EQ(now + delay, at);
    EXPECT_EQ(at, s.Earliest());
    std::vector<Scheduler::Due> due = s.TakeDue(at);
    ASSERT_EQ(1u, due.size());
    EXPECT_TRUE(due[0].retry);
    now = at;
  }
  // 32 min would pass midnight's run; 30 min is the longest delay anyway.
  EXPECT_EQ(0, s.ScheduleRetry(1, now));
  EXPECT_FALSE(s.RetryPending(1));
  s.ResetRetry(1);
  EXPECT_EQ(now + 60, s.ScheduleRetry(1, now));
  s.CancelRetry(1);
  EXPECT_EQ(At(2026, 3, 3, 0, 0), s.Earliest());
}

TEST(ServiceFiles, StoreRefusesBrokenFilesOneByOneAndHistoryIsBounded) {
  s2s_test::Appliances app(S2S_CMD_HANDLER);
  ASSERT_TRUE(app.AddShare("docs"));
  TaskStore store(TaskDir());
  StoredTask t;
  t.task.SetID(7);
  t.task.GetInfo().SetName("nightly");
  t.task.GetInfo().SetShareList({"docs"});
  t.task.GetInfo().SetSyncInfo(app.Info());
  t.excludes = {"*.tmp", "back\\slash=x"};
  t.enabled = false;
  std::string error;
  ASSERT_TRUE(store.Save(t, error)) << error;
  StoredTask other = t;
  other.task.SetID(8);
  ASSERT_TRUE(store.Save(other, error)) << error;
  struct stat st;
  ASSERT_EQ(0, stat(store.PathOf(7).c_str(), &st));
  EXPECT_EQ(0600u, st.st_mode & 0777);

  const std::pair<const char*, std::string> broken[] = {
      {"/9.task", "s name=x\ns share_list.5=docs\n"},  // a hole in a list
      {"/10.task", "i id=10\nx what=1\n"},             // unknown kind
      {"/11.task", "i id=11\ns name=x\ns user=u\n"},   // no server, invalid
      {"/12.task", ReadFile(store.PathOf(7))},         // id 7 in 12.task
  };
  for (const auto& b : broken) WriteFile(TaskDir() + b.first, b.second);
  std::map<unsigned long long, StoredTask> tasks;
  std::vector<std::string> errors;
  ASSERT_TRUE(store.Load(tasks, errors));
  ASSERT_EQ(2u, tasks.size()) << testing::PrintToString(errors);
  EXPECT_TRUE(tasks[7].task == t.task);
  EXPECT_EQ(t.excludes, tasks[7].excludes);
  EXPECT_FALSE(tasks[7].enabled);
  ASSERT_EQ(4u, errors.size());
  EXPECT_NE(std::string::npos, errors[1].find("no server address"))
      << errors[1];

  // History: bounded, newest first, a run left running is failed on reload.
  History h(HistoryDir());
  for (int i = 0; i < 53; ++i) {
    PObject run;
    run = PObject::Map();
    run["start"] = static_cast<unsigned long long>(i);
    run["outcome"] = i == 52 ? "running" : "ok";
    ASSERT_TRUE(h.Begin(7, run, error)) << error;
  }
  ASSERT_TRUE(h.SetLastDue(7, 1234, error));
  History again(HistoryDir());
  PObject::Array runs = again.Runs(7, 100);
  ASSERT_EQ(History::kMaxRuns, runs.size());
  EXPECT_EQ(52u, runs[0]["start"].asUInt64());
  EXPECT_EQ("failed", runs[0]["outcome"].asString());
  EXPECT_EQ(3u, runs.back()["start"].asUInt64());
  EXPECT_EQ(1234, again.LastDue(7));
}

// ---------------------------------------------------------------------------
// s2sd as a process.

struct Transfer {
  long long start_ns, end_ns;
  std::string share;
};

class ServiceTest : public s2s_test::S2sdTest {
 protected:
  void SetUp() override {
    SetUpServer({"docs", "big", "photos"}, "\tmax_parallel=\"2\"\n");
    std::string error;
    ASSERT_TRUE(MakeDirs(HistoryDir(), error)) << error;
  }

  // Starts s2sd, its schedules' clock `offset` seconds ahead.
  void StartDaemon(long offset) {
    S2sdTest::StartDaemon({"--clock-offset", std::to_string(offset)});
  }

  static PObject Action(const std::string& action, unsigned long long id = 0) {
    PObject req;
    req = PObject::Map();
    req["action"] = action;
    if (id != 0) req["id"] = id;
    return req;
  }

  PObject::Array Runs(unsigned long long id) {
    return Request(Action("history", id))["runs"].asArray();
  }

  // Whether the task's newest run has ended with `outcome`.
  std::function<bool()> Ended(unsigned long long id,
                              const std::string& outcome) {
    return [this, id, outcome] {
      PObject::Array runs = Runs(id);
      return !runs.empty() && runs[0]["outcome"].asString() == outcome;
    };
  }

  // Waits up to `seconds` for `done`, woken by every change of the
  // history directory (each run's start and end rewrites a file there).
  bool WaitFor(const std::function<bool()>& done, double seconds) {
    int fd = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
    inotify_add_watch(fd, HistoryDir().c_str(), IN_MOVED_TO | IN_CREATE);
    auto start = std::chrono::steady_clock::now();
    bool ok = done();
    while (!ok && s2s_test::SecondsSince(start) < seconds) {
      // Other signs (a transfer's start in the rsync log) come without a
      // history change; ask again at least every 100 ms.
      pollfd p = {fd, POLLIN, 0};
      poll(&p, 1, 100);
      char buf[4096];
      while (read(fd, buf, sizeof buf) > 0) {
      }
      ok = done();
    }
    close(fd);
    return ok;
  }

  // The transfers of data (not the command exchanges) from the rsync log.
  std::vector<Transfer> Transfers() {
    std::map<std::string, Transfer> open;
    std::vector<Transfer> out;
    std::istringstream in(ReadFile(rsync_log_));
    std::string line;
    while (std::getline(in, line)) {
      std::istringstream words(line);
      std::string what, pid;
      long long ns = 0;
      words >> what >> ns >> pid;
      if (what == "start") {
        for (const char* share : {"docs", "big", "photos"}) {
          if (line.find(app_.ClientShare(share)) != std::string::npos) {
            open[pid] = Transfer{ns, 0, share};
          }
        }
      } else if (open.count(pid) != 0) {
        open[pid].end_ns = ns;
        out.push_back(open[pid]);
        open.erase(pid);
      }
    }
    return out;
  }

  // Runs the task now and waits for that run's end; its outcome.
  std::string RunOnce(unsigned long long id) {
    size_t before = Runs(id).size();
    EXPECT_EQ(0u, Request(Action("run", id))["result"].asUInt64());
    std::string outcome;
    WaitFor(
        [&] {
          PObject::Array runs = Runs(id);
          outcome = runs.size() > before ? runs[0]["outcome"].asString() : "";
          return outcome != "" && outcome != "running";
        },
        30);
    return outcome;
  }

  // What the server's daemon has served, from the connections it logs as
  // let into a module: {commands (the command module, whose hooks run the
  // handler), data transfers (any other module)}.
  std::pair<int, int> Served() {
    const std::string log = app_.DaemonLog();
    int all = 0, commands = 0;
    for (size_t at = log.find("access on module "); at != std::string::npos;
         at = log.find("access on module ", at + 1)) {
      ++all;
      commands += log.compare(at, 24, "access on module s2scmd ") == 0;
    }
    return {commands, all - commands};
  }

  // Seconds to add to the clock so that it reads 12:00 and `second`
  // seconds today, amid the runs of EveryMinute.
  static long OffsetTo(int second) {
    long now = static_cast<long>(time(nullptr));
    tm t;
    localtime_r(&now, &t);
    return At(t.tm_year + 1900, t.tm_mon + 1, t.tm_mday, 12, 0) + second - now;
  }
};

void WriteBlob(const std::string& path, int mb) {
  std::ofstream blob(path, std::ios::binary);
  std::string chunk(1 << 20, 'x');
  for (int i = 0; i < mb; ++i) {
    chunk[i] = static_cast<char>(i);
    blob << chunk;
  }
}

TEST_F(ServiceTest, ScheduledRunsByItselfManualWaitsAndRestartCatchesUpOnce) {
  WriteFile(app_.ClientShare("docs") + "/a.txt", "alpha\n");
  WriteBlob(app_.ClientShare("big") + "/blob", 4);
  // The next run, as the service sees the clock, is 3 s away.
  StartDaemon(OffsetTo(57));
  unsigned long long sched = AddTask("sched", {"docs"}, EveryMinute());
  unsigned long long manual = AddTask("manual", {"big"}, S2S::Schedule());
  ASSERT_TRUE(WaitFor(Ended(sched, "ok"), 30)) << Log();
  EXPECT_EQ("alpha\n", ReadFile(app_.ServerShare("docs") + "/a.txt"));
  EXPECT_EQ("schedule", Runs(sched)[0]["trigger"].asString());
  EXPECT_TRUE(Runs(manual).empty()) << "a manual task ran by itself";

  PObject run = Request(Action("run", manual));
  EXPECT_EQ(0u, run["result"].asUInt64()) << run["message"].asString();
  PObject again = Request(Action("run", manual));
  EXPECT_EQ(5u, again["result"].asUInt64()) << again["message"].asString();
  EXPECT_NE(std::string::npos,
            again["message"].asString().find("running already"));
  ASSERT_TRUE(WaitFor(Ended(manual, "ok"), 30));
  EXPECT_EQ(1u, Runs(manual).size()) << "the second run was started";
  EXPECT_EQ(4u << 20,
            std::filesystem::file_size(app_.ServerShare("big") + "/blob"));
  // rsync's --stats of the run: one file, all of it sent as data.
  PObject big = Runs(manual)[0]["shares"].asArray()[0];
  EXPECT_EQ(1u, big["files"].asUInt64());
  EXPECT_EQ(4u << 20, big["bytes"].asUInt64());
  EXPECT_EQ(0u, big["matched"].asUInt64());
  EXPECT_LT(0u, big["speed"].asUInt64());
  EXPECT_EQ(0, StopDaemon());

  // At 12:10:30: the missed slots give one catch-up run; tasks and history
  // are still there.
  StartDaemon(OffsetTo(600 + 30));
  ASSERT_TRUE(WaitFor(
      [&] {
        PObject::Array runs = Runs(sched);
        return runs.size() >= 2 && runs[0]["outcome"].asString() == "ok";
      },
      30));
  PObject::Array runs = Runs(sched);
  ASSERT_EQ(2u, runs.size());
  EXPECT_EQ("catch-up", runs[0]["trigger"].asString());
  EXPECT_EQ(1u, Runs(manual).size());
  PObject list = Request(Action("list"));
  ASSERT_EQ(2u, list["tasks"].asArray().size());
  for (const PObject& t : list["tasks"].asArray()) {
    EXPECT_FALSE(t.hasMember("pswd"));
    EXPECT_TRUE(t["has_password"].asBool());
  }
}

TEST_F(ServiceTest, CancelEndsALongTransferAndTheServerShowsTheTaskIdle) {
  WriteBlob(app_.ClientShare("big") + "/blob", 40);
  StartDaemon(0);
  unsigned long long id = AddTask("long", {"big"}, S2S::Schedule());
  // 10 MiB/s: long enough for rsync to report its progress.
  PObject limit = Action("update", id);
  limit["task"] = PObject::Map();
  limit["task"]["max_bandwidth"] = 10240u;
  ASSERT_EQ(0u, Request(limit)["result"].asUInt64());
  ASSERT_EQ(0u, Request(Action("run", id))["result"].asUInt64());
  // Wait for the data transfer itself.
  ASSERT_TRUE(
      WaitFor([&] { return RsyncLogCount(app_.ClientShare("big")) == 1; }, 30));
  // rsync's progress shows in the running entry.
  EXPECT_TRUE(WaitFor(
      [&] {
        PObject::Array running = Request(Action("status"))["running"].asArray();
        return running.size() == 1 && running[0]["bytes_done"].asUInt64() > 0 &&
               running[0]["share"].asString() == "big";
      },
      10));
  auto start = std::chrono::steady_clock::now();
  PObject cancel = Request(Action("cancel", id));
  EXPECT_EQ(1u, cancel["was_running"].asUInt64())
      << cancel["message"].asString();
  ASSERT_TRUE(WaitFor(Ended(id, "cancelled"), 10));
  // A bound, not a speed target: the checker is polled every second or so.
  EXPECT_LT(s2s_test::SecondsSince(start), 5.0);
  EXPECT_EQ("idle", app_.ServerRegistry("TASK_long", "status"));
  EXPECT_EQ("idle", Request(Action("get", id))["task"]["state"].asString());

  // SIGTERM during the next transfer: cancelled the same way, and s2sd ends.
  ASSERT_EQ(0u, Request(Action("run", id))["result"].asUInt64());
  ASSERT_TRUE(
      WaitFor([&] { return RsyncLogCount(app_.ClientShare("big")) == 2; }, 30));
  EXPECT_EQ(0, StopDaemon());
  PObject::Array runs = History(HistoryDir()).Runs(id, 1);
  ASSERT_EQ(1u, runs.size());
  EXPECT_EQ("cancelled", runs[0]["outcome"].asString());
  EXPECT_EQ("idle", app_.ServerRegistry("TASK_long", "status"));
  EXPECT_FALSE(std::filesystem::exists(PidFilePath()));
}

TEST_F(ServiceTest, SharedShareNeverAtOnceAndNoMoreThanMaxParallelRuns) {
  for (const char* share : {"docs", "big", "photos"}) {
    WriteBlob(app_.ClientShare(share) + "/blob", 1);
  }
  StartDaemon(OffsetTo(57));
  // Four tasks due at the same minute; two of them over docs. At 1 MiB/s
  // each transfer lasts a second, long enough to overlap the next.
  PObject slow;
  slow = PObject::Map();
  slow["max_bandwidth"] = 1024u;
  for (const char* name : {"a", "b"})
    AddTask(name, {"docs"}, EveryMinute(), slow);
  AddTask("c", {"big"}, EveryMinute(), slow);
  AddTask("d", {"photos"}, EveryMinute(), slow);
  ASSERT_TRUE(WaitFor(
      [&] {
        for (unsigned long long id = 1; id <= 4; ++id) {
          if (!Ended(id, "ok")()) return false;
        }
        return true;
      },
      60))
      << Log();
  std::vector<Transfer> transfers = Transfers();
  ASSERT_EQ(4u, transfers.size()) << ReadFile(rsync_log_);
  size_t most = 0;
  for (const Transfer& t : transfers) {
    size_t at_once = 0;
    for (const Transfer& u : transfers) {
      bool overlap = u.start_ns <= t.start_ns && t.start_ns < u.end_ns;
      at_once += overlap ? 1 : 0;
      if (overlap && &u != &t) {
        EXPECT_NE(t.share, u.share) << "two syncs of " << t.share << " at once";
      }
    }
    most = std::max(most, at_once);
  }
  EXPECT_EQ(2u, most) << "runs at once";
}

// The second run reuses the first one's probe and pairing: per share its
// start, transfer and end, then the task's end; no beacon before its time.
TEST_F(ServiceTest, SteadyRunsSendOnlyTheCommandsTheirSharesNeed) {
  StartDaemon(0);
  unsigned long long id =
      AddTask("steady", {"docs", "photos"}, S2S::Schedule());
  const std::pair<int, int> expected[] = {{3 + 2 * 2 + 1, 2}, {2 * 2 + 1, 2}};
  for (const auto& want : expected) {
    std::pair<int, int> before = Served();
    ASSERT_EQ("ok", RunOnce(id)) << Log();
    std::pair<int, int> after = Served();
    EXPECT_EQ(want.first, after.first - before.first) << app_.DaemonLog();
    EXPECT_EQ(want.second, after.second - before.second);
  }
}

// A server of the single-client protocol that forgot its client between
// runs refuses the reused session's sync start; the run pairs again and
// goes on.
TEST_F(ServiceTest, AClientItsServerForgotPairsAgainWithinTheRun) {
  ASSERT_TRUE(app_.StartServer(/*old_server=*/true)) << app_.DaemonLog();
  StartDaemon(0);
  unsigned long long id = AddTask("forgotten", {"docs"}, S2S::Schedule());
  ASSERT_EQ("ok", RunOnce(id)) << Log();
  {
    s2s_test::ScopedEnv root("S2S_ROOT", app_.server_root());
    ASSERT_EQ(0, s2s_svr_reset_pair());
  }
  ASSERT_NE("CLIENT-A", app_.ServerRegistry("PairedClientInfo", "clientID"));
  WriteFile(app_.ClientShare("docs") + "/after.txt", "again\n");
  ASSERT_EQ("ok", RunOnce(id)) << Log();
  EXPECT_TRUE(s2s_test::Has(Log(), "not paired with this client [247]"));
  EXPECT_EQ("CLIENT-A", app_.ServerRegistry("PairedClientInfo", "clientID"));
  EXPECT_EQ("again\n", ReadFile(app_.ServerShare("docs") + "/after.txt"));
}

}  // namespace
