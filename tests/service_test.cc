// The client service: its scheduler through the clock seam, its files, and
// s2sd itself against a real server appliance, through its control socket.
#include <poll.h>
#include <sys/inotify.h>
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
#include "s2sd_process.h"
#include "service/history.h"
#include "service/record.h"
#include "service/run_worker.h"
#include "service/scheduler.h"
#include "service/task_store.h"

namespace {

using S2S::PObject;
using namespace s2s_service;
using s2s_test::ReadFile;
using s2s_test::WriteFile;

// Every minute from 11:30 to 13:05 (96 runs, a day's most), from 2020-01-01.
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

TEST(Scheduler, EarliestFirstOncePerDueFollowsClockJumpsRetriesBackOff) {
  s2s_test::ScopedEnv tz("TZ", "UTC");
  S2S::Schedule daily = EveryMinute();
  daily.SetPeriod(0);  // once a day, at 00:00
  daily.SetStartHour(0);
  daily.SetStartMinute(0);
  S2S::Schedule nine = daily;
  nine.SetStartHour(9);
  Scheduler s;
  long now = At(2026, 3, 2, 8, 0);
  s.Set(1, daily, true, now);
  s.Set(2, nine, true, now);
  s.Set(3, EveryMinute(), false, now);  // disabled
  s.Set(4, S2S::Schedule(), true, now);
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

  // A failed run's retries back off until they would pass the next run.
  now = At(2026, 3, 1, 23, 0);
  for (long delay : {60, 120, 240, 480, 960}) {
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
  EXPECT_EQ(At(2026, 3, 2, 0, 0), s.Earliest());
}

TEST(ActiveRun, SharesInProgressFollowTheRunnersLines) {
  const std::pair<const char*, const char*> lines[] = {
      {"share a: started", "a:started"},
      {"share b: started", "a:started b:started"},
      {"beacon: sent", "a:started b:started"},
      {"share a: transferred in 1.00 s", "a:transferred b:started"},
      {"share a: key file copied", "a:key b:started"},
      {"share b: transfer failed: timeout", "a:key"},
      {"share a: key failed: no key", ""},
      {"share c: started", "c:started"},
      {"share c: would send 2, delete 0", ""},
      {"share d: started", "d:started"},
      {"task t: finished with errors", ""},
  };
  ActiveRun run;
  for (const auto& line : lines) {
    run.Note(line.first);
    std::string shown;
    for (const ActiveRun::ShareProgress& s : run.Shares())
      shown += (shown.empty() ? "" : " ") + s.name + ":" + s.step;
    EXPECT_EQ(line.second, shown) << line.first;
  }
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
  EXPECT_EQ(0600, s2s_test::Mode(store.PathOf(7)));

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
  ASSERT_EQ(1u, tasks.size()) << testing::PrintToString(errors);
  EXPECT_TRUE(tasks[7].task == t.task);
  EXPECT_EQ(t.excludes, tasks[7].excludes);
  EXPECT_FALSE(tasks[7].enabled);
  ASSERT_EQ(4u, errors.size());
  EXPECT_TRUE(s2s_test::Has(errors[1], "no server address")) << errors[1];

  // History: bounded, newest first, a run left running is failed on reload.
  History h(HistoryDir());
  for (int i = 0; i < 53; ++i) {
    PObject run;
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

// s2sd as a process.

class ServiceTest : public s2s_test::S2sdTest {
 protected:
  void SetUp() override {
    SetUpServer({"docs", "big", "photos", "more"}, "\tmax_parallel=\"2\"\n");
  }

  PObject::Array Runs(unsigned long long id) {
    return Request(Action("history", id))["runs"].asArray();
  }

  // Whether the task has `runs` runs or more, the newest ended `outcome`.
  std::function<bool()> Ended(unsigned long long id, const std::string& outcome,
                              size_t runs = 1) {
    return [this, id, outcome, runs] {
      PObject::Array all = Runs(id);
      return all.size() >= runs && all[0]["outcome"].asString() == outcome;
    };
  }

  // Waits up to `seconds` for `done`, woken by each history file's rewrite.
  bool WaitFor(const std::function<bool()>& done, double seconds) {
    int fd = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
    inotify_add_watch(fd, HistoryDir().c_str(), IN_MOVED_TO | IN_CREATE);
    auto start = std::chrono::steady_clock::now();
    bool ok = done();
    while (!ok && s2s_test::SecondsSince(start) < seconds) {
      // Some signs (a transfer's start) change no history: 100 ms at most.
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

  // The most data transfers at once in the rsync log; two of a share fail.
  size_t MostAtOnce() {
    std::map<std::string, std::string> running;  // pid -> share
    size_t most = 0;
    std::istringstream in(ReadFile(rsync_log_));
    for (std::string line; std::getline(in, line);) {
      std::istringstream words(line);
      std::string what, ns, pid;
      words >> what >> ns >> pid;
      if (what == "end") running.erase(pid);
      for (const char* share : {"docs", "photos", "more"}) {
        if (what == "start" && s2s_test::Has(line, app_.ClientShare(share))) {
          for (const auto& r : running)
            EXPECT_NE(share, r.second) << "two syncs of " << share;
          running[pid] = share;
        }
      }
      most = std::max(most, running.size());
    }
    return most;
  }

  // Runs the task now; whether that run ends "ok" within 30 s.
  bool RunOk(unsigned long long id) {
    size_t runs = Runs(id).size() + 1;
    EXPECT_EQ(0u, Request(Action("run", id))["result"].asUInt64());
    return WaitFor(Ended(id, "ok", runs), 30);
  }

  // What the server's daemon has served, from the connections it let into a
  // module: {commands (module s2scmd), data transfers (any other)}.
  std::pair<size_t, size_t> Served() {
    const std::string log = app_.DaemonLog();
    size_t commands = Count(log, "access on module s2scmd ");
    return {commands, Count(log, "access on module ") - commands};
  }

  // s2sd's options that set its schedules' clock to today 12:00 + `second`.
  static std::vector<std::string> ClockAt(int second) {
    long now = static_cast<long>(time(nullptr));
    tm t;
    localtime_r(&now, &t);
    long noon = At(t.tm_year + 1900, t.tm_mon + 1, t.tm_mday, 12, 0);
    return {"--clock-offset", std::to_string(noon + second - now)};
  }
};

void WriteBlob(const std::string& path, int mb) {
  std::ofstream(path, std::ios::binary) << std::string(mb << 20, 'x');
}

TEST_F(ServiceTest, ScheduledRunsByThemselvesApartAndCatchUpOnceManualWaits) {
  for (const char* share : {"docs", "photos", "more"})
    WriteBlob(app_.ClientShare(share) + "/blob", 1);
  WriteFile(app_.ClientShare("docs") + "/a.txt", "alpha\n");
  WriteBlob(app_.ClientShare("big") + "/blob", 4);
  // Four tasks due 3 s after the start, two of them over docs; at 1 MiB/s
  // each transfer lasts a second, long enough to overlap the next.
  StartDaemon(ClockAt(57));
  PObject slow;
  slow["max_bandwidth"] = 1024u;
  const char* const tasks[][2] = {
      {"a", "docs"}, {"b", "docs"}, {"c", "photos"}, {"d", "more"}};
  for (const auto& t : tasks) AddTask(t[0], {t[1]}, EveryMinute(), slow);
  unsigned long long manual = AddTask("manual", {"big"}, S2S::Schedule());
  for (unsigned long long id = 1; id <= 4; ++id)
    ASSERT_TRUE(WaitFor(Ended(id, "ok"), 60)) << Log();
  EXPECT_EQ(2u, MostAtOnce()) << ReadFile(rsync_log_);
  EXPECT_EQ("alpha\n", ReadFile(app_.ServerShare("docs") + "/a.txt"));
  EXPECT_EQ("schedule", Runs(1)[0]["trigger"].asString());
  EXPECT_TRUE(Runs(manual).empty()) << "a manual task ran by itself";

  EXPECT_EQ(0u, Request(Action("run", manual))["result"].asUInt64());
  PObject again = Request(Action("run", manual));
  EXPECT_EQ(5u, again["result"].asUInt64());
  EXPECT_TRUE(s2s_test::Has(again["message"].asString(), "running already"));
  ASSERT_TRUE(WaitFor(Ended(manual, "ok"), 30));
  // rsync's --stats of the run: one file, all of it sent as data.
  PObject big = Runs(manual)[0]["shares"].asArray()[0];
  EXPECT_EQ(1u, big["files"].asUInt64());
  EXPECT_EQ(4u << 20, big["bytes"].asUInt64());
  EXPECT_EQ(0u, big["matched"].asUInt64());
  EXPECT_LT(0u, big["speed"].asUInt64());
  EXPECT_EQ(0, StopDaemon());

  // At 12:10:30: one catch-up run for the missed slots; all else remains.
  StartDaemon(ClockAt(600 + 30));
  ASSERT_TRUE(WaitFor(Ended(1, "ok", 2), 30));
  PObject::Array runs = Runs(1);
  ASSERT_EQ(2u, runs.size());
  EXPECT_EQ("catch-up", runs[0]["trigger"].asString());
  EXPECT_EQ(1u, Runs(manual).size());
  EXPECT_EQ(5u, Request(Action("list"))["tasks"].asArray().size());
}

// A second run reuses the first's probe and pairing; a single-client server
// that forgot its client refuses the reused session, and the run pairs again.
TEST_F(ServiceTest, RunsSendOnlyNeededCommandsCancelCleanlyAndPairAgain) {
  StartDaemon();
  unsigned long long id =
      AddTask("steady", {"docs", "photos"}, S2S::Schedule());
  const std::pair<size_t, size_t> expected[] = {{3 + 2 * 2 + 1, 2},
                                                {2 * 2 + 1, 2}};
  for (const auto& want : expected) {
    std::pair<size_t, size_t> before = Served();
    ASSERT_TRUE(RunOk(id)) << Log();
    std::pair<size_t, size_t> after = Served();
    EXPECT_EQ(want.first, after.first - before.first) << app_.DaemonLog();
    EXPECT_EQ(want.second, after.second - before.second);
  }

  // A cancel ends a long transfer and leaves the server's task idle.
  WriteBlob(app_.ClientShare("big") + "/blob", 40);
  unsigned long long id_long = AddTask("long", {"big"}, S2S::Schedule());
  // 10 MiB/s: long enough for rsync to report its progress.
  PObject limit = Action("update", id_long);
  limit["task"]["max_bandwidth"] = 10240u;
  ASSERT_EQ(0u, Request(limit)["result"].asUInt64());
  ASSERT_EQ(0u, Request(Action("run", id_long))["result"].asUInt64());
  ASSERT_TRUE(
      WaitFor([&] { return RsyncLogCount(app_.ClientShare("big")) == 1; }, 30));
  // rsync's progress shows in the running entry.
  EXPECT_TRUE(WaitFor(
      [&] {
        PObject::Array running = Request(Action("status"))["running"].asArray();
        if (running.size() != 1) return false;
        const PObject::Array& shares = running[0]["shares"].asArray();
        return running[0]["bytes_done"].asUInt64() > 0 &&
               running[0]["share"].asString() == "big" && shares.size() == 1 &&
               shares[0]["name"].asString() == "big" &&
               shares[0]["bytes_done"].asUInt64() > 0;
      },
      10));
  // A task on the same share waits in the queue until the share is free.
  unsigned long long id_same = AddTask("same", {"big"}, S2S::Schedule());
  ASSERT_EQ(0u, Request(Action("run", id_same))["result"].asUInt64());
  EXPECT_EQ("queued",
            Request(Action("get", id_same))["task"]["state"].asString());
  EXPECT_EQ(0u, Request(Action("cancel", id_same))["was_running"].asUInt64());
  auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(1u, Request(Action("cancel", id_long))["was_running"].asUInt64());
  ASSERT_TRUE(WaitFor(Ended(id_long, "cancelled"), 10));
  // A bound, not a speed target: the checker is polled every second or so.
  EXPECT_LT(s2s_test::SecondsSince(start), 5.0);
  EXPECT_EQ("idle", app_.ServerRegistry("TASK_long", "status"));
  EXPECT_EQ("idle",
            Request(Action("get", id_long))["task"]["state"].asString());

  // SIGTERM during the next transfer: cancelled the same way, and s2sd ends.
  // New data outlasts the stop, whatever the cancelled run left to resume.
  WriteBlob(app_.ClientShare("big") + "/blob2", 41);
  ASSERT_EQ(0u, Request(Action("run", id_long))["result"].asUInt64());
  ASSERT_TRUE(
      WaitFor([&] { return RsyncLogCount(app_.ClientShare("big")) == 2; }, 30));
  EXPECT_EQ(0, StopDaemon());
  PObject::Array runs = History(HistoryDir()).Runs(id_long, 1);
  ASSERT_EQ(1u, runs.size());
  EXPECT_EQ("cancelled", runs[0]["outcome"].asString());
  EXPECT_EQ("idle", app_.ServerRegistry("TASK_long", "status"));
  EXPECT_FALSE(std::filesystem::exists(PidFilePath()));

  // Against a single-client server (s2sd started again sees its port).
  ASSERT_TRUE(app_.StartServer(/*old_server=*/true)) << app_.DaemonLog();
  StartDaemon();
  ASSERT_TRUE(RunOk(id)) << Log();
  {
    s2s_test::ScopedEnv root("S2S_ROOT", app_.server_root());
    ASSERT_EQ(0, s2s_svr_reset_pair());
  }
  ASSERT_NE("CLIENT-A", app_.ServerRegistry("PairedClientInfo", "clientID"));
  WriteFile(app_.ClientShare("docs") + "/after.txt", "again\n");
  ASSERT_TRUE(RunOk(id)) << Log();
  EXPECT_TRUE(s2s_test::Has(Log(), "not paired with this client [247]"));
  EXPECT_EQ("CLIENT-A", app_.ServerRegistry("PairedClientInfo", "clientID"));
  EXPECT_EQ("again\n", ReadFile(app_.ServerShare("docs") + "/after.txt"));
}

}  // namespace
