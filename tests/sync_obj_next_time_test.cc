#include <gtest/gtest.h>
#include <stdio.h>
#include <string.h>

#include <string>

#include "S2S/sync_obj_schedule.h"
#include "testutil.h"

namespace {

using S2S::Schedule;
using s2s_test::ScopedTZ;

const char* const kZones[] = {"UTC", "Europe/Berlin", "America/New_York",
                              "Australia/Lord_Howe"};

// Local "YYYY-MM-DD HH:MM:SS" in the current zone, with " D" or " S" after
// it to pick the daylight or standard reading of a doubled hour.
long Local(const std::string& text) {
  struct tm t;
  memset(&t, 0, sizeof t);
  char flag = 0;
  int n = sscanf(text.c_str(), "%d-%d-%d %d:%d:%d %c", &t.tm_year, &t.tm_mon,
                 &t.tm_mday, &t.tm_hour, &t.tm_min, &t.tm_sec, &flag);
  EXPECT_GE(n, 6) << text;
  struct tm want = t;
  t.tm_year -= 1900;
  t.tm_mon -= 1;
  t.tm_isdst = flag == 'D' ? 1 : flag == 'S' ? 0 : -1;
  long s = mktime(&t);
  // The clock must show the time as written, or the case is mistyped.
  EXPECT_EQ(t.tm_hour * 60 + t.tm_min, want.tm_hour * 60 + want.tm_min) << text;
  return s;
}

struct Case {
  const char* zone;  // nullptr: every zone of kZones
  S2S::SCHD_MODE mode;
  const char* week;
  int begin_year, begin_month, begin_day;
  int hour, minute;
  long period, repeat;
  const char* now;
  const char* next;  // local time, or "0"
};

Schedule Make(const Case& c) {
  Schedule s;
  s.SetMode(c.mode);
  s.SetWeekSchedule(c.week);
  s.SetBeginYear(c.begin_year);
  s.SetBeginMonth(c.begin_month);
  s.SetBeginDay(c.begin_day);
  s.SetStartHour(c.hour);
  s.SetStartMinute(c.minute);
  s.SetPeriod(c.period);
  s.SetRepeatTimesInDay(c.repeat);
  return s;
}

void Check(const Case& c, const char* zone) {
  ScopedTZ tz(zone);
  Schedule s = Make(c);
  ASSERT_TRUE(s.Validate()) << c.now;
  long want = std::string(c.next) == "0" ? 0 : Local(c.next);
  EXPECT_EQ(s.GetNextScheduledSeconds(Local(c.now)), want)
      << zone << " mode " << c.mode << " now " << c.now << " want " << c.next;
}

const S2S::SCHD_MODE W = S2S::SCHD_WEEKLY, M = S2S::SCHD_MONTHLY,
                     Y = S2S::SCHD_YEARLY, O = S2S::SCHD_ONCE;
const char* const kAll = "1111111";

// No daylight-saving change lies between `now` and the answer in any zone,
// so these hold everywhere.
const Case kEverywhere[] = {
    // Weekly: strictly later than now; repeats; chosen weekdays.
    {nullptr, W, kAll, 2014, 1, 1, 8, 0, 0, 0, "2025-01-15 07:59:59",
     "2025-01-15 08:00:00"},
    {nullptr, W, kAll, 2014, 1, 1, 8, 0, 0, 0, "2025-01-15 08:00:00",
     "2025-01-16 08:00:00"},
    {nullptr, W, "0000010", 2014, 1, 1, 8, 0, 0, 0, "2025-01-17 09:00:00",
     "2025-01-24 08:00:00"},
    {nullptr, W, "0000010", 2014, 1, 1, 8, 0, 0, 0, "2025-01-15 12:00:00",
     "2025-01-17 08:00:00"},
    {nullptr, W, kAll, 2014, 1, 1, 8, 0, 3600, 2, "2025-01-15 08:00:00",
     "2025-01-15 09:00:00"},
    {nullptr, W, kAll, 2014, 1, 1, 8, 0, 3600, 2, "2025-01-15 09:30:00",
     "2025-01-15 10:00:00"},
    {nullptr, W, kAll, 2014, 1, 1, 8, 0, 3600, 2, "2025-01-15 10:00:00",
     "2025-01-16 08:00:00"},
    {nullptr, W, "1000000", 2014, 1, 1, 23, 30, 0, 0, "2025-01-18 23:45:00",
     "2025-01-19 23:30:00"},
    {nullptr, W, kAll, 2014, 1, 1, 23, 0, 1800, 1, "2024-12-31 23:45:00",
     "2025-01-01 23:00:00"},
    // Monthly: this month's day, else next month's; missing days roll on.
    {nullptr, M, kAll, 2014, 1, 15, 8, 0, 0, 0, "2025-01-14 12:00:00",
     "2025-01-15 08:00:00"},
    {nullptr, M, kAll, 2014, 1, 15, 8, 0, 0, 0, "2025-01-15 08:00:00",
     "2025-02-15 08:00:00"},
    {nullptr, M, kAll, 2014, 1, 15, 8, 0, 0, 0, "2025-01-16 00:00:00",
     "2025-02-15 08:00:00"},
    {nullptr, M, kAll, 2014, 1, 31, 8, 0, 0, 0, "2025-01-31 09:00:00",
     "2025-03-03 08:00:00"},
    {nullptr, M, kAll, 2014, 1, 30, 8, 0, 0, 0, "2025-01-31 09:00:00",
     "2025-03-02 08:00:00"},
    {nullptr, M, kAll, 2014, 1, 31, 8, 0, 0, 0, "2024-01-31 09:00:00",
     "2024-03-02 08:00:00"},
    {nullptr, M, kAll, 2014, 1, 29, 8, 0, 0, 0, "2024-02-10 00:00:00",
     "2024-02-29 08:00:00"},
    {nullptr, M, kAll, 2014, 1, 1, 8, 0, 0, 0, "2024-12-31 12:00:00",
     "2025-01-01 08:00:00"},
    {nullptr, M, kAll, 2014, 1, 1, 8, 0, 600, 3, "2025-02-01 08:25:00",
     "2025-02-01 08:30:00"},
    // Yearly: 29 February of a common year is 1 March.
    {nullptr, Y, kAll, 2016, 2, 29, 8, 0, 0, 0, "2025-01-10 00:00:00",
     "2025-03-01 08:00:00"},
    {nullptr, Y, kAll, 2016, 2, 29, 8, 0, 0, 0, "2024-01-10 00:00:00",
     "2024-02-29 08:00:00"},
    {nullptr, Y, kAll, 2016, 2, 29, 8, 0, 0, 0, "2024-02-29 09:00:00",
     "2025-03-01 08:00:00"},
    {nullptr, Y, kAll, 2014, 1, 20, 8, 0, 0, 0, "2025-01-21 00:00:00",
     "2026-01-20 08:00:00"},
    {nullptr, Y, kAll, 2014, 12, 31, 8, 0, 0, 0, "2024-12-31 07:00:00",
     "2024-12-31 08:00:00"},
    // Once: its date at the start time and repeats, then over.
    {nullptr, O, kAll, 2025, 1, 16, 8, 0, 0, 0, "2025-01-15 10:00:00",
     "2025-01-16 08:00:00"},
    {nullptr, O, kAll, 2025, 1, 14, 8, 0, 0, 0, "2025-01-15 10:00:00", "0"},
    {nullptr, O, kAll, 2025, 1, 15, 8, 0, 3600, 2, "2025-01-15 08:30:00",
     "2025-01-15 09:00:00"},
    {nullptr, O, kAll, 2025, 1, 15, 8, 0, 3600, 2, "2025-01-15 10:00:00", "0"},
    {nullptr, O, kAll, 2027, 1, 15, 8, 0, 0, 0, "2025-01-15 10:00:00",
     "2027-01-15 08:00:00"},
};

// Around daylight-saving changes. Every broken-down time inherits its DST
// flag, so a run on the day of a change, or a month or year after a
// candidate read on the other side of one, comes out as mktime reads the
// start time with that flag.
const Case kAroundChanges[] = {
    // Berlin: 2025-03-30 02:00 -> 03:00, 2025-10-26 03:00 -> 02:00.
    {"Europe/Berlin", W, kAll, 2014, 1, 1, 2, 30, 0, 0, "2025-03-30 01:00:00",
     "2025-03-30 03:30:00"},
    {"Europe/Berlin", W, kAll, 2014, 1, 1, 2, 30, 0, 0, "2025-03-29 12:00:00",
     "2025-03-30 03:30:00"},
    {"Europe/Berlin", W, kAll, 2014, 1, 1, 8, 0, 0, 0, "2025-03-29 12:00:00",
     "2025-03-30 09:00:00"},
    {"Europe/Berlin", W, kAll, 2014, 1, 1, 8, 0, 0, 0, "2025-03-30 12:00:00",
     "2025-03-31 08:00:00"},
    {"Europe/Berlin", W, kAll, 2014, 1, 1, 1, 0, 3600, 3, "2025-03-30 01:30:00",
     "2025-03-30 03:00:00"},
    {"Europe/Berlin", W, kAll, 2014, 1, 1, 8, 0, 0, 0, "2025-10-25 12:00:00",
     "2025-10-26 07:00:00"},
    {"Europe/Berlin", W, kAll, 2014, 1, 1, 2, 30, 0, 0, "2025-10-26 01:00:00",
     "2025-10-26 02:30:00 D"},
    {"Europe/Berlin", M, kAll, 2014, 1, 15, 8, 0, 0, 0, "2025-10-16 10:00:00",
     "2025-11-15 07:00:00"},
    {"Europe/Berlin", M, kAll, 2014, 1, 31, 8, 0, 0, 0, "2025-04-05 12:00:00",
     "2025-05-01 08:00:00"},
    // New York: 2025-03-09 02:00 -> 03:00, 2025-11-02 02:00 -> 01:00.
    {"America/New_York", W, kAll, 2014, 1, 1, 2, 30, 0, 0,
     "2025-03-09 00:30:00", "2025-03-09 03:30:00"},
    {"America/New_York", W, kAll, 2014, 1, 1, 1, 30, 0, 0,
     "2025-11-02 00:30:00", "2025-11-02 01:30:00 D"},
    {"America/New_York", W, kAll, 2014, 1, 1, 1, 30, 0, 0,
     "2025-11-02 01:45:00 D", "2025-11-02 01:30:00 S"},
    {"America/New_York", M, kAll, 2014, 1, 9, 8, 0, 0, 0, "2025-02-10 12:00:00",
     "2025-03-09 09:00:00"},
    {"America/New_York", M, kAll, 2014, 1, 31, 8, 0, 0, 0,
     "2025-04-10 12:00:00", "2025-05-01 08:00:00"},
    // Lord Howe, half-hour shifts: 2025-04-06 02:00 -> 01:30,
    // 2025-10-05 02:00 -> 02:30.
    {"Australia/Lord_Howe", W, kAll, 2014, 1, 1, 2, 15, 0, 0,
     "2025-10-05 01:00:00", "2025-10-05 02:45:00"},
    {"Australia/Lord_Howe", W, kAll, 2014, 1, 1, 8, 0, 0, 0,
     "2025-10-04 12:00:00", "2025-10-05 08:30:00"},
    {"Australia/Lord_Howe", W, kAll, 2014, 1, 1, 1, 45, 0, 0,
     "2025-04-06 01:00:00", "2025-04-06 01:45:00 D"},
    {"Australia/Lord_Howe", W, kAll, 2014, 1, 1, 8, 0, 0, 0,
     "2025-04-05 12:00:00", "2025-04-06 07:30:00"},
    {"Australia/Lord_Howe", Y, kAll, 2014, 10, 5, 8, 0, 0, 0,
     "2025-07-01 12:00:00", "2025-10-05 08:00:00"},
};

TEST(NextScheduledSeconds, ModeTableInEveryZone) {
  for (const char* zone : kZones) {
    for (const Case& c : kEverywhere) Check(c, zone);
  }
}

TEST(NextScheduledSeconds, AroundDaylightSavingChanges) {
  for (const Case& c : kAroundChanges) Check(c, c.zone);
}

TEST(NextScheduledSeconds, ManualRealtimeAndNegativeNow) {
  ScopedTZ tz("Europe/Berlin");
  Schedule s;
  for (long now : {0L, 1L, 1735689600L}) {
    s.SetMode(S2S::SCHD_MANUAL);
    EXPECT_EQ(s.GetNextScheduledSeconds(now), 0);
    s.SetMode(S2S::SCHD_REALTIME);
    EXPECT_EQ(s.GetNextScheduledSeconds(now), now + 1);
  }
  for (int mode = 0; mode <= 6; ++mode) {
    s.SetMode(static_cast<S2S::SCHD_MODE>(mode));
    EXPECT_EQ(s.GetNextScheduledSeconds(-5), -1) << mode;
  }
}

TEST(NextScheduledSeconds, FailuresAreLoggedOnce) {
  ScopedTZ tz("UTC");
  Schedule s;
  s.SetMode(static_cast<S2S::SCHD_MODE>(9));
  {
    s2s_test::LogCapture log;
    EXPECT_EQ(s.GetNextScheduledSeconds(1735689600L), -1);
    std::string text = log.Text();
    EXPECT_NE(text.find("[ERROR] S2S/sync_obj("), std::string::npos);
    EXPECT_NE(text.find("): Unknown schedule mode [9]\n"), std::string::npos);
    EXPECT_NE(text.find("): Fail to align to scheduled day\n"),
              std::string::npos);
  }
  // A day that never has a run cannot make the walk go on for ever.
  s.SetMode(S2S::SCHD_WEEKLY);
  s.SetPeriod(60);
  s.SetRepeatTimesInDay(-1);
  s2s_test::LogCapture log;
  EXPECT_EQ(s.GetNextScheduledSeconds(1735689600L), -1);
  EXPECT_NE(log.Text().find("Fail to align to scheduled day"),
            std::string::npos);
}

}  // namespace
