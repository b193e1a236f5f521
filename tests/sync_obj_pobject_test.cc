#include "S2S/sync_obj_pobject.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>

#include "S2S/ipc.h"
#include "testutil.h"

namespace {

using S2S::PObject;
using S2S::SyncTask;

SyncTask FullTask() {
  SyncTask task;
  task.SetID(0xFFFFFFFFFFFFFFF0ULL);
  S2S::TaskInfo& info = task.GetInfo();
  info.SetName("nightly");
  info.SetShareList({"docs", "photos", "docs"});
  S2S::SyncInfo sync;
  sync.SetUser("admin");
  sync.SetPassword("s3cret");
  sync.SetServerIP("10.0.0.2");
  sync.SetServerName("backup");
  sync.SetCompression(true);
  sync.SetBlockLevelSync(true);
  sync.SetSSHPort(2222);
  sync.SetMaxBandwidth(4096);
  info.SetSyncInfo(sync);
  S2S::Schedule& s = info.GetSchedule();
  s.SetMode(S2S::SCHD_WEEKLY);
  s.SetWeekSchedule("0101010");
  s.SetBeginYear(2024);
  s.SetBeginMonth(2);
  s.SetBeginDay(29);
  s.SetStartHour(8);
  s.SetStartMinute(5);
  s.SetPeriod(5400);
  s.SetRepeatTimesInDay(3);
  return task;
}

TEST(SyncTaskMapping, RoundTripKeepsEveryField) {
  SyncTask task = FullTask();
  PObject map;
  map["other"] = "kept";
  S2S::SyncTask2PObj(task, map);
  EXPECT_EQ(map["other"].asString(), "kept");
  EXPECT_EQ(map["schedule_mode"].asInt32(), 2);
  EXPECT_EQ(map["period_hour"].asInt32(), 1);
  EXPECT_EQ(map["period_minute"].asInt32(), 30);
  EXPECT_EQ(map["compress"].asUInt64(), 1u);
  EXPECT_EQ(map["ssh"].asUInt64(), 0u);
  ASSERT_EQ(map["share_list"].asArray().size(), 3u);

  SyncTask back;
  S2S::PObj2SyncTask(map, back);
  EXPECT_TRUE(back == task);
}

TEST(SyncTaskMapping, PeriodSecondsBelowAMinuteAreLost) {
  SyncTask task = FullTask();
  task.GetInfo().GetSchedule().SetPeriod(5430);
  PObject map;
  S2S::SyncTask2PObj(task, map);
  SyncTask back;
  S2S::PObj2SyncTask(map, back);
  EXPECT_EQ(back.GetInfo().GetSchedule().GetPeriodSeconds(), 5400);
  back.GetInfo().GetSchedule().SetPeriod(5430);
  EXPECT_TRUE(back == task);
}

TEST(SyncTaskMapping, WhatTheMapLacksIsReset) {
  SyncTask task = FullTask();
  PObject map;
  map["name"] = "renamed";
  S2S::PObj2SyncTask(map, task);
  EXPECT_EQ(task.GetID(), 0xFFFFFFFFFFFFFFF0ULL);
  S2S::TaskInfo want;
  want.SetName("renamed");
  EXPECT_TRUE(task.GetInfo() == want);

  // PObj2SyncInfo, by contrast, keeps what the map lacks.
  S2S::SyncInfo sync = FullTask().GetInfo().GetSyncInfo();
  PObject only_user;
  only_user["user"] = "other";
  S2S::PObj2SyncInfo(only_user, sync);
  EXPECT_EQ(sync.GetUser(), "other");
  EXPECT_EQ(sync.GetPassword(), "s3cret");
  EXPECT_TRUE(sync.UseCompression());
}

TEST(SyncTaskMapping, ScheduleKeysAreAppliedThroughTheSetters) {
  const struct {
    const char* what;
    int hour, minute, repeat;  // -1: key absent
    long period, repeat_out;
  } cases[] = {
      {"period 0, repeat 3", 0, 0, 3, 0, 3},
      {"period 1:00, repeat 0", 1, 0, 0, 0, 0},
      {"period 0:30, repeat 2", 0, 30, 2, 1800, 2},
      {"hour without minute", 2, -1, -1, 0, 0},
  };
  for (const auto& c : cases) {
    PObject map;
    if (c.hour >= 0) map["period_hour"] = c.hour;
    if (c.minute >= 0) map["period_minute"] = c.minute;
    if (c.repeat >= 0) map["repeat_times_in_day"] = c.repeat;
    SyncTask task;
    S2S::PObj2SyncTask(map, task);
    const S2S::Schedule& s = task.GetInfo().GetSchedule();
    EXPECT_EQ(s.GetPeriodSeconds(), c.period) << c.what;
    EXPECT_EQ(s.GetRepeatTimesInDay(), c.repeat_out) << c.what;
  }
  PObject map;
  map["week_schd"] = "0000000";
  map["schedule_mode"] = 9;
  SyncTask task;
  S2S::PObj2SyncTask(map, task);
  EXPECT_EQ(task.GetInfo().GetSchedule().GetWeekSchedule(), "1111111");
  EXPECT_EQ(task.GetInfo().GetSchedule().GetMode(), 9);
}

TEST(SyncTaskMapping, StatusAndResultAreReadWhenAskedFor) {
  PObject map;
  map["status"] = -2;
  map["sync_result"] = 5;
  SyncTask task;
  S2S::TASK_STATUS status;
  S2S::TASK_RESULT result;
  S2S::PObj2SyncTask(map, task, status, result);
  EXPECT_EQ(status, -2);
  EXPECT_EQ(result, 5);
  PObject empty;
  S2S::PObj2SyncTask(empty, task, status, result);
  EXPECT_EQ(status, 0);
  EXPECT_EQ(result, 0);
}

// The way tasks really travel: as maps between processes' IPC ends. The
// serving end rebuilds the task and sends it back as a map of its own.
TEST(SyncTaskMapping, TaskCrossesAnIpcLinkAndIsRebuiltEqual) {
  s2s_test::TempDir dir;
  S2S::IPCListener listener;
  ASSERT_EQ(listener.prepare(dir.Sub("ipc.sock")), 0);
  std::thread server([&listener] {
    S2S::IPCSender end;
    if (listener.isReady() != 1 || end.assign(listener.accept()) != 0) return;
    PObject request;
    if (end.recv(request) != 0) return;
    SyncTask rebuilt;
    S2S::PObj2SyncTask(request, rebuilt);
    PObject reply;
    S2S::SyncTask2PObj(rebuilt, reply);
    end.send(reply);
  });
  S2S::IPCSender client;
  ASSERT_EQ(client.connect(dir.Sub("ipc.sock")), 0);
  SyncTask task = FullTask();
  PObject request, reply;
  S2S::SyncTask2PObj(task, request);
  EXPECT_EQ(client.send(request, true, reply), 0);
  server.join();
  SyncTask back;
  S2S::PObj2SyncTask(reply, back);
  EXPECT_TRUE(back == task);
  EXPECT_EQ(back.GetInfo().GetSyncInfo().GetPassword(), "s3cret");
}

}  // namespace
