#include "S2S/sync_obj_dump.h"

#include <gtest/gtest.h>

#include <sstream>
#include <string>

namespace {

template <typename T>
std::string Dump(const T& value) {
  std::ostringstream out;
  out << value;
  return out.str();
}

TEST(Dump, ShareAndEvent) {
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
            "id: ............ 3\n"
            "share_name: .... docs\n"
            "relative_path: . /a/b\n"
            "status: ........ -1\n");
}

TEST(Dump, ScheduleLastRunAndLeftoverFill) {
  S2S::Schedule s;
  s.SetMode(S2S::SCHD_MONTHLY);
  s.SetStartHour(8);
  s.SetStartMinute(5);
  s.SetPeriod(5430);
  s.SetRepeatTimesInDay(2);
  s.SetBeginDay(9);
  std::ostringstream out;
  out << s;
  EXPECT_EQ(out.str(),
            "mode: ................ monthly\n"
            "week_schd: ............. 1111111\n"
            "schedule_begin: ...... 2014-01-09 08:05:00\n"
            "period: .............. 01:30\n"
            "repeat_times_in_day: . 2\n"
            "last sync in day: .... 11:06\n");
  EXPECT_EQ(out.fill(), '0');
}

// The task's schedule is a default one.
TEST(Dump, TaskWithoutPassword) {
  S2S::SyncTask task;
  task.SetID(42);
  S2S::TaskInfo& info = task.GetInfo();
  info.SetName("nightly");
  info.SetShareList({"a", "b"});
  S2S::SyncInfo sync;
  sync.SetUser("admin");
  sync.SetPassword("s3cret");
  sync.SetServerIP("10.0.0.2");
  sync.SetServerName("backup");
  sync.SetSSH(true);
  sync.SetSSHPort(22);
  sync.SetMaxBandwidth(100);
  info.SetSyncInfo(sync);
  EXPECT_EQ(Dump(task),
            "id: ................... 42\n"
            "name: ................. nightly\n"
            "share_list: ........... a,b,\n"
            "<Server Info>\n"
            "user: ................. admin\n"
            "server_ip: ............ 10.0.0.2\n"
            "server_name: .......... backup\n"
            "use compression: ...... no\n"
            "use block level sync: . no\n"
            "use ssh: .............. yes\n"
            "ssh port: ............. 22\n"
            "max bandwidth: ........ 100\n"
            "<Schedule>\n"
            "mode: ................ manual\n"
            "week_schd: ............. 1111111\n"
            "schedule_begin: ...... 2014-01-01 00:00:00\n"
            "period: .............. 00:00\n"
            "repeat_times_in_day: . 0\n"
            "last sync in day: .... 00:00\n");
}

}  // namespace
