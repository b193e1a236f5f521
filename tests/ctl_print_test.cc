// What s2sctl shows a person for the daemon's replies: schedules in words,
// a running transfer's progress, and why a realtime task is not watching.
#include "ctl_print.h"

#include <string>

#include "gtest/gtest.h"
#include "testutil.h"

namespace {

using S2S::PObject;
using s2s_tools::FormatStatus;
using s2s_tools::FormatTask;
using s2s_tools::ScheduleText;

TEST(CtlPrint, SchedulesSettingsProgressAndWhyNotWatchingInWords) {
  const struct {
    int mode;
    const char* week;
    int repeat;
    const char* text;
  } cases[] = {
      {0, "1111111", 0, "manual"},
      {1, "1111111", 0, "realtime"},
      {2, "1111111", 0, "daily at 02:05"},
      {2, "0111110", 0, "weekdays at 02:05"},
      {2, "1000001", 0, "weekends at 02:05"},
      {2, "0100100", 0, "mon,thu at 02:05"},
      {2, "0000000", 0, "never at 02:05"},
      {2, "1111111", 3, "daily at 02:05, 3 more every 01:30"},
      {3, "", 0, "monthly on day 9 at 02:05"},
      {4, "", 0, "yearly on 12-09 at 02:05"},
      {5, "", 0, "once on 2027-12-09 at 02:05"},
      {9, "", 0, "mode 9"},
  };
  for (const auto& c : cases) {
    PObject task;
    task["schedule_mode"] = c.mode;
    task["week_schd"] = c.week;
    task["schedule_begin_hour"] = 2;
    task["schedule_begin_min"] = 5;
    task["schedule_begin_day"] = 9;
    task["schedule_begin_month"] = 12;
    task["schedule_begin_year"] = 2027;
    task["repeat_times_in_day"] = c.repeat;
    task["period_hour"] = 1;
    task["period_minute"] = 30;
    EXPECT_EQ(c.text, ScheduleText(task)) << c.mode << " " << c.week;
  }

  PObject task;
  PObject& t = task["task"];
  t["schedule_mode"] = 1;
  t["realtime_source"] = "inotify";
  t["realtime_settle_ms"] = 1500;
  t["realtime_max_delay"] = 30;
  t["realtime_full_sync"] = 90061;
  t["ssh"] = true;
  t["ssh_port"] = 2222;
  t["server_ip"] = "10.0.0.2";
  t["server_name"] = "backup1";
  t["schedule_error"] = "no such day";
  PObject status;
  PObject& run = status["running"].asArray().emplace_back();
  run["id"] = 4;
  run["bytes_total"] = 2u << 20;
  run["bytes_done"] = 1u << 20;
  run["rate"] = 512u << 10;
  run["seconds_left"] = 2;
  PObject& both = status["running"].asArray().emplace_back();
  both["id"] = 5;
  for (const char* name : {"alpha", "beta"}) {
    PObject& share = both["shares"].asArray().emplace_back();
    share["name"] = name;
    share["step"] = "transfer";
  }
  PObject& alpha = both["shares"].asArray()[0];
  alpha["bytes_total"] = 4u << 20;
  alpha["bytes_done"] = 3u << 20;
  PObject& watch = status["realtime"].asArray().emplace_back();
  watch["id"] = 7;
  watch["source_note"] = "not root";
  watch["problem"] = "the server is unreachable";
  watch["last_error"] = "rsync\x1b[31m failed";
  PObject& share = watch["shares"].asArray().emplace_back();
  share["name"] = "docs";
  share["watching"] = false;
  share["message"] = "no such directory";
  const std::string text = FormatTask(task) + FormatStatus(status);
  for (const char* line :
       {"settle           1.5 s\n", "max delay        30 s\n",
        "full sync every  1d 01:01:01\n", "change source    inotify\n",
        "ssh              yes, port 2222\n",
        "server           10.0.0.2 (backup1)\n",
        "schedule error   no such day\n", "delete guard     off\n",
        "1.0 MiB of 2.0 MiB, 512.0 KiB/s, 00:00:02 left\n",
        "  task 7: not fanotify: not root\n",
        "  task 7: the server is unreachable\n",
        "  task 7: last batch failed: rsync?[31m failed\n",
        "  task 7: share docs not watched: no such directory\n",
        "alpha  transfer  3.0 MiB of 4.0 MiB",
        "\n                              beta   transfer  -\n"}) {
    EXPECT_TRUE(s2s_test::Has(text, line)) << line << "\n" << text;
  }
}

}  // namespace
