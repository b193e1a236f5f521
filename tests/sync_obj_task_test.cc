// Shares, events, server settings and tasks: validation, dumps, IPC maps.
#include "S2S/sync_obj_task.h"

#include <gtest/gtest.h>

#include <list>
#include <sstream>
#include <string>

#include "S2S/sync_obj_dump.h"
#include "S2S/sync_obj_pobject.h"
#include "S2S/sync_obj_share.h"
#include "testutil.h"

namespace {

using S2S::PObject;
using S2S::SyncInfo;
using S2S::SyncTask;
using S2S::TaskInfo;
using s2s_test::Has;

// Validate()'s answer, and its last message after the "[NOTE] ...): " prefix.
template <typename T>
std::string Validated(const T& obj, bool* ok) {
  s2s_test::LogCapture log;
  *ok = obj.Validate();
  std::string text = log.Text();
  if (text.empty()) return text;
  EXPECT_TRUE(Has(text, "[NOTE] S2S/sync_obj(")) << text;
  return text.substr(text.rfind("): ") + 3);
}

template <typename T>
std::string Dump(const T& value) {
  std::ostringstream out;
  out << value;
  return out.str();
}

SyncTask FullTask() {
  SyncTask task;
  task.SetID(0xFFFFFFFFFFFFFFF0ULL);
  TaskInfo& info = task.GetInfo();
  info.SetName("nightly");
  info.SetShareList({"docs", "photos", "docs"});
  SyncInfo sync;
  sync.SetServerName("backup");
  sync.SetUser("admin");
  sync.SetPassword("s3cret");
  sync.SetServerIP("10.0.0.2");
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
  s.SetPeriod(5430);  // the seconds below a minute do not travel
  s.SetRepeatTimesInDay(3);
  return task;
}

TEST(ShareAndEvent, RelativePathIsMadeAbsoluteAndBothDump) {
  const struct {
    const char *in, *stored;
  } cases[] = {{"", "/"},     {"/", "/"},      {"//x", "//x"},
               {"x/", "/x/"}, {"a/b", "/a/b"}, {"/a/../b", "/a/../b"}};
  for (const auto& c : cases) {
    S2S::Event e;
    e.SetRelativePath(c.in);
    EXPECT_EQ(e.GetRelativePath(), c.stored) << c.in;
  }
  S2S::Share share;
  share.SetID(18446744073709551615ULL);
  share.SetName("docs");
  EXPECT_EQ(Dump(share), "id: ... 18446744073709551615\nname: . docs\n");
  S2S::Event event;
  event.SetID(3);
  event.SetShareName("docs");
  event.SetRelativePath("a/b");
  event.SetStatus(static_cast<S2S::EVENT_STATUS>(-1));
  EXPECT_EQ(Dump(event),
            "id: ............ 3\nshare_name: .... docs\n"
            "relative_path: . /a/b\nstatus: ........ -1\n");
}

// The first broken rule is logged: server, schedule, name, share list, shares.
TEST(TaskInfo, ValidateChecksInOrderAndEveryShareMustBeSyncable) {
  s2s_test::TempRoot root;
  ASSERT_TRUE(
      root.Write("/etc/s2s/shares.conf",
                 "[docs]\n\tpath=\"/volume1/docs\"\n\tvolume=\"/volume1\"\n"
                 "[usb]\n\tpath=\"/media/usb/p\"\n\tvolume=\"/media/usb\"\n"
                 "\tvolume_type=\"3\"\n"));
  const struct {
    const char *ip, *server, *user;
    unsigned port;
    int hour;
    const char *name, *shares, *message;  // message: "" when valid
  } cases[] = {
      {"", "", "", 0, 8, "", "", "Empty server ip and name\n"},
      {"", "backup", "", 0, 8, "", "", "Empty user name ''\n"},
      {"", "backup", "admin", 65536, 8, "", "", "Invalid SSH port '65536'\n"},
      {"", "backup", "admin", 0, 24, "", "", "Invalid begin hour\n"},
      // The name is looked at before the share list; no line end follows.
      {"", "backup", "admin", 0, 8, "", "unknown", "Empty task name"},
      {"", "backup", "admin", 0, 8, "nightly", "", "Empty share list"},
      {"10.0.0.2", "", "admin", 65535, 8, "nightly", "docs", ""},
      // An unknown share is reported by the host layer first.
      {"", "backup", "admin", 0, 8, "nightly", "docs usb missing",
       "Share 'usb' is not valid\n"},
      {"", "backup", "admin", 0, 8, "nightly", "missing usb",
       "Share 'missing' is not valid\n"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.message);
    SyncInfo sync;
    sync.SetServerIP(c.ip);
    sync.SetServerName(c.server);
    sync.SetUser(c.user);
    sync.SetSSHPort(c.port);
    TaskInfo task;
    task.SetSyncInfo(sync);
    task.GetSchedule().SetStartHour(c.hour);
    task.SetName(c.name);
    std::istringstream names(c.shares);
    std::list<std::string> shares;
    for (std::string n; names >> n;) shares.push_back(n);
    task.SetShareList(shares);
    bool ok = false;
    EXPECT_EQ(Validated(task, &ok), c.message);
    EXPECT_EQ(ok, *c.message == '\0');
  }
}

TEST(SyncTaskDump, ScheduleWithItsLastRunAndTaskWithoutPassword) {
  // What the dump works out rather than copies.
  std::string text = Dump(FullTask().GetInfo().GetSchedule());
  s2s_test::ExpectHas(text, {"schedule_begin: ...... 2024-02-29 08:05:00\n",
                             "period: .............. 01:30\n",
                             "last sync in day: .... 12:36\n"});

  std::string dump = Dump(FullTask());
  EXPECT_TRUE(Has(dump,
                  "use compression: ...... yes\n"
                  "use block level sync: . yes\n"
                  "use ssh: .............. no\n"));
  EXPECT_FALSE(Has(dump, "s3cret"));
}

// The task rebuilt from its IPC map equals it but for the period's seconds.
TEST(SyncTaskMapping, TaskBecomesAMapAndIsRebuiltEqual) {
  SyncTask task = FullTask();
  PObject map;
  map["other"] = "kept";
  S2S::SyncTask2PObj(task, map);
  EXPECT_EQ(map["other"].asString(), "kept");
  EXPECT_EQ(map["schedule_mode"].asInt32(), 2);
  EXPECT_EQ(map["period_hour"].asInt32(), 1);
  EXPECT_EQ(map["period_minute"].asInt32(), 30);
  SyncTask back;
  S2S::PObj2SyncTask(map, back);
  EXPECT_EQ(back.GetInfo().GetSchedule().GetPeriodSeconds(), 5400);
  back.GetInfo().GetSchedule().SetPeriod(5430);
  EXPECT_TRUE(back == task);
  EXPECT_EQ(back.GetInfo().GetSyncInfo().GetPassword(), "s3cret");
}

TEST(SyncTaskMapping, WhatTheMapLacksIsResetExceptForServerSettings) {
  SyncTask task = FullTask();
  PObject map;
  map["name"] = "renamed";
  map["status"] = -2;
  map["sync_result"] = 5;
  S2S::TASK_STATUS status;
  S2S::TASK_RESULT result;
  S2S::PObj2SyncTask(map, task, status, result);
  EXPECT_EQ(task.GetID(), 0xFFFFFFFFFFFFFFF0ULL);
  TaskInfo want;
  want.SetName("renamed");
  EXPECT_TRUE(task.GetInfo() == want);
  EXPECT_EQ(status, -2);
  EXPECT_EQ(result, 5);
  S2S::PObj2SyncTask(PObject(), task, status, result);
  EXPECT_EQ(status, 0);
  EXPECT_EQ(result, 0);

  // PObj2SyncInfo, by contrast, keeps what the map lacks.
  SyncInfo sync = FullTask().GetInfo().GetSyncInfo();
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

}  // namespace
