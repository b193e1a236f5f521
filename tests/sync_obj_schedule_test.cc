#include "S2S/sync_obj_schedule.h"

#include <gtest/gtest.h>
#include <stdio.h>
#include <time.h>

#include <string>
#include <vector>

#include "testutil.h"

namespace {

using S2S::Schedule;
using s2s_test::Has;
using s2s_test::ScopedEnv;

// "<W|M|Y|O> <week string, or begin YYYY-MM-DD> <HH:MM> [<period>x<repeat>]".
Schedule Make(const std::string& spec) {
  char mode = 0, what[16] = "";
  int hour = 0, minute = 0;
  long period = 0, repeat = 0;
  int n = sscanf(spec.c_str(), "%c %15s %d:%d %ldx%ld", &mode, what, &hour,
                 &minute, &period, &repeat);
  EXPECT_TRUE(n == 4 || n == 6) << spec;
  Schedule s;
  s.SetMode(static_cast<S2S::SCHD_MODE>(std::string("..WMYO").find(mode)));
  if (mode == 'W') {
    s.SetWeekSchedule(what);
  } else {
    int y = 0, m = 0, d = 0;
    EXPECT_EQ(sscanf(what, "%d-%d-%d", &y, &m, &d), 3) << spec;
    s.SetBeginYear(y);
    s.SetBeginMonth(m);
    s.SetBeginDay(d);
  }
  s.SetStartHour(hour);
  s.SetStartMinute(minute);
  s.SetPeriod(period);
  s.SetRepeatTimesInDay(repeat);
  return s;
}

// What Validate() logged after its prefix, first line only ("" if nothing).
std::string ValidateMessage(const Schedule& s, bool* ok) {
  s2s_test::LogCapture log;
  *ok = s.Validate();
  std::string text = log.Text();
  if (text.empty()) return text;
  EXPECT_EQ(text.rfind("[NOTE] S2S/sync_obj(", 0), 0u) << text;
  text = text.substr(text.find("): ") + 3);
  return text.substr(0, text.find('\n') + 1);
}

TEST(Schedule, ModeStringsAreAsymmetricForUnknownValues) {
  const struct {
    const char* text;
    S2S::SCHD_MODE mode;
  } cases[] = {{"realtime", S2S::SCHD_REALTIME}, {"weekly", S2S::SCHD_WEEKLY},
               {"monthly", S2S::SCHD_MONTHLY},   {"yearly", S2S::SCHD_YEARLY},
               {"once", S2S::SCHD_ONCE},         {"manual", S2S::SCHD_MANUAL},
               {"Weekly", S2S::SCHD_MANUAL},     {"", S2S::SCHD_MANUAL}};
  for (const auto& c : cases) {
    Schedule s;
    s.SetMode(S2S::SCHD_ONCE);
    s.SetModeByStr(c.text);
    EXPECT_EQ(s.GetMode(), c.mode) << c.text;
    if (*c.text != '\0' && c.text[0] != 'W') {
      EXPECT_EQ(s.GetModeStr(), c.text);
    }
  }
  Schedule s;
  for (int m : {2, 6, 7, -1}) {
    s.SetMode(static_cast<S2S::SCHD_MODE>(m));
    EXPECT_EQ(s.GetModeStr(), "weekly") << m;
  }
}

TEST(Schedule, SettersNormalisePeriodRepeatAndWeek) {
  Schedule s;
  s.SetRepeatTimesInDay(5);
  s.SetPeriod(0);  // a zero period or repeat clears the other
  EXPECT_EQ(s.GetRepeatTimesInDay(), 0);
  s.SetPeriod(600);
  s.SetRepeatTimesInDay(0);
  EXPECT_EQ(s.GetPeriodSeconds(), 0);

  const struct {
    const char *in, *stored;
  } weeks[] = {{"0000000", "1111111"},  {"101", "1111111"},
               {"", "1111111"},         {"0a00000", "0100000"},
               {"10000001", "1000000"}, {"0000010", "0000010"}};
  for (const auto& w : weeks) {
    s.SetWeekSchedule("0010000");
    s.SetWeekSchedule(w.in);
    EXPECT_EQ(s.GetWeekSchedule(), w.stored) << w.in;
  }
}

TEST(Schedule, ValidateReportsTheFirstBrokenRule) {
  const struct {
    const char *spec, *message;  // "" when valid
  } cases[] = {
      {"O 2014-01-01 -1:00", "Invalid begin hour\n"},
      {"O 2014-01-01 24:00", "Invalid begin hour\n"},
      {"O 2014-01-01 00:60", "Invalid begin minute\n"},
      {"O 2014-01-01 00:00 86400x1", "Invalid period or repeat\n"},
      {"O 2014-01-01 00:00 -60x1", "Invalid period or repeat\n"},
      {"O 2014-01-01 00:00 60x96", "Invalid period\n"},
      {"O 2014-01-01 23:00 3600x1",
       "Invalid repeat in day [82800 + 3600 * 1]\n"},
      {"O 2014-01-01 22:59 3600x1", ""},  // the last run at 23:59
      {"O 2015-02-29 00:00", "Invalid begin date\n"},
      {"O 2016-02-29 00:00", ""},
      {"O 2014-13-01 00:00", "Invalid begin date\n"},
      {"O 1960-01-01 00:00", "Invalid begin\n"},  // before the epoch
  };
  ScopedEnv tz("TZ", "UTC");
  bool ok = false;
  EXPECT_EQ(ValidateMessage(Schedule(), &ok), "");  // manual by default
  EXPECT_TRUE(ok);
  for (const auto& c : cases) {
    EXPECT_EQ(ValidateMessage(Make(c.spec), &ok), c.message) << c.spec;
    EXPECT_EQ(ok, *c.message == '\0') << c.spec;
  }
  for (int mode : {6, -1}) {
    Schedule s;
    s.SetMode(static_cast<S2S::SCHD_MODE>(mode));
    EXPECT_EQ(ValidateMessage(s, &ok),
              "Invalid schedule mode [" + std::to_string(mode) + "]\n");
  }
}

TEST(Schedule, GetDaysToNextSyncCountsFromToday) {
  EXPECT_EQ(S2S::GetDaysToNextSync(6, "1000000"), 1);
  EXPECT_EQ(S2S::GetDaysToNextSync(3, "0001000"), 0);
  EXPECT_EQ(S2S::GetDaysToNextSync(5, "0000010"), 0);
  EXPECT_EQ(S2S::GetDaysToNextSync(6, "0000010"), 6);
  EXPECT_EQ(S2S::GetDaysToNextSync(0, "0000000"), -1);
  EXPECT_EQ(S2S::GetDaysToNextSync(2, "0200000"), -1);
}

// Local "YYYY-MM-DD HH:MM", " D" or " S" after it picking a doubled hour.
long Local(const std::string& text) {
  struct tm t = {};
  EXPECT_NE(strptime(text.c_str(), "%Y-%m-%d %H:%M", &t), nullptr) << text;
  const char flag = text.size() > 16 ? text.back() : 0;
  t.tm_isdst = flag == 'D' ? 1 : flag == 'S' ? 0 : -1;
  const int minute = t.tm_hour * 60 + t.tm_min;
  long s = mktime(&t);
  // The clock must show the time as written, or the case is mistyped.
  EXPECT_EQ(t.tm_hour * 60 + t.tm_min, minute) << text;
  return s;
}

struct Case {
  const char* schedule;
  const char* now;
  const char* next;  // local time, or "0"
};

void Check(const char* zone, const std::vector<Case>& cases) {
  ScopedEnv tz("TZ", zone);
  for (const Case& c : cases) {
    Schedule s = Make(c.schedule);
    ASSERT_TRUE(s.Validate()) << c.schedule;
    long want = std::string(c.next) == "0" ? 0 : Local(c.next);
    EXPECT_EQ(s.GetNextScheduledSeconds(Local(c.now)), want)
        << zone << " " << c.schedule << " now " << c.now << " want " << c.next;
  }
}

// No daylight-saving change lies between `now` and the answer in any zone.
const std::vector<Case> kEverywhere = {
    // Weekly: strictly later than now; repeats; chosen weekdays.
    {"W 1111111 08:00", "2025-01-15 07:59", "2025-01-15 08:00"},
    {"W 1111111 08:00", "2025-01-15 08:00", "2025-01-16 08:00"},
    {"W 0000010 08:00", "2025-01-17 09:00", "2025-01-24 08:00"},
    {"W 0000010 08:00", "2025-01-15 12:00", "2025-01-17 08:00"},
    {"W 1111111 08:00 3600x2", "2025-01-15 08:00", "2025-01-15 09:00"},
    {"W 1111111 08:00 3600x2", "2025-01-15 10:00", "2025-01-16 08:00"},
    {"W 1000000 23:30", "2025-01-18 23:45", "2025-01-19 23:30"},
    {"W 1111111 23:00 1800x1", "2024-12-31 23:45", "2025-01-01 23:00"},
    // Monthly: this month's day, else next month's; missing days roll on.
    {"M 2014-01-15 08:00", "2025-01-14 12:00", "2025-01-15 08:00"},
    {"M 2014-01-15 08:00", "2025-01-15 08:00", "2025-02-15 08:00"},
    {"M 2014-01-31 08:00", "2025-01-31 09:00", "2025-03-03 08:00"},
    {"M 2014-01-31 08:00", "2024-01-31 09:00", "2024-03-02 08:00"},
    {"M 2014-01-29 08:00", "2024-02-10 00:00", "2024-02-29 08:00"},
    {"M 2014-01-01 08:00", "2024-12-31 12:00", "2025-01-01 08:00"},
    {"M 2014-01-01 08:00 600x3", "2025-02-01 08:25", "2025-02-01 08:30"},
    // Yearly: 29 February of a common year is 1 March.
    {"Y 2016-02-29 08:00", "2025-01-10 00:00", "2025-03-01 08:00"},
    {"Y 2016-02-29 08:00", "2024-01-10 00:00", "2024-02-29 08:00"},
    {"Y 2016-02-29 08:00", "2024-02-29 09:00", "2025-03-01 08:00"},
    {"Y 2014-01-20 08:00", "2025-01-21 00:00", "2026-01-20 08:00"},
    {"Y 2014-12-31 08:00", "2024-12-31 07:00", "2024-12-31 08:00"},
    // Once: its date at the start time and repeats, then over.
    {"O 2025-01-16 08:00", "2025-01-15 10:00", "2025-01-16 08:00"},
    {"O 2025-01-14 08:00", "2025-01-15 10:00", "0"},
    {"O 2025-01-15 08:00 3600x2", "2025-01-15 08:30", "2025-01-15 09:00"},
    {"O 2025-01-15 08:00 3600x2", "2025-01-15 10:00", "0"},
    {"O 2027-01-15 08:00", "2025-01-15 10:00", "2027-01-15 08:00"},
};

// Around daylight-saving changes: each candidate inherits the DST flag of the
// time it was derived from, and mktime reads the start time with that flag.
// Berlin: 2025-03-30 02:00 -> 03:00, 2025-10-26 03:00 -> 02:00.
const std::vector<Case> kBerlin = {
    {"W 1111111 02:30", "2025-03-30 01:00", "2025-03-30 03:30"},
    {"W 1111111 02:30", "2025-03-29 12:00", "2025-03-30 03:30"},
    {"W 1111111 08:00", "2025-03-29 12:00", "2025-03-30 09:00"},
    {"W 1111111 08:00", "2025-03-30 12:00", "2025-03-31 08:00"},
    {"W 1111111 01:00 3600x3", "2025-03-30 01:30", "2025-03-30 03:00"},
    {"W 1111111 08:00", "2025-10-25 12:00", "2025-10-26 07:00"},
    {"W 1111111 02:30", "2025-10-26 01:00", "2025-10-26 02:30 D"},
    {"M 2014-01-15 08:00", "2025-10-16 10:00", "2025-11-15 07:00"},
    {"M 2014-01-31 08:00", "2025-04-05 12:00", "2025-05-01 08:00"},
};
// New York: 2025-03-09 02:00 -> 03:00, 2025-11-02 02:00 -> 01:00.
const std::vector<Case> kNewYork = {
    {"W 1111111 02:30", "2025-03-09 00:30", "2025-03-09 03:30"},
    {"W 1111111 01:30", "2025-11-02 00:30", "2025-11-02 01:30 D"},
    {"W 1111111 01:30", "2025-11-02 01:45 D", "2025-11-02 01:30 S"},
    {"M 2014-01-09 08:00", "2025-02-10 12:00", "2025-03-09 09:00"},
    {"M 2014-01-31 08:00", "2025-04-10 12:00", "2025-05-01 08:00"},
};
// Lord Howe, half-hour: 2025-04-06 02:00 -> 01:30, 2025-10-05 02:00 -> 02:30.
const std::vector<Case> kLordHowe = {
    {"W 1111111 02:15", "2025-10-05 01:00", "2025-10-05 02:45"},
    {"W 1111111 08:00", "2025-10-04 12:00", "2025-10-05 08:30"},
    {"W 1111111 01:45", "2025-04-06 01:00", "2025-04-06 01:45 D"},
    {"W 1111111 08:00", "2025-04-05 12:00", "2025-04-06 07:30"},
    {"Y 2014-10-05 08:00", "2025-07-01 12:00", "2025-10-05 08:00"},
};

TEST(NextScheduledSeconds, ModeTableInEveryZoneAndAroundDstChanges) {
  for (const char* zone :
       {"UTC", "Europe/Berlin", "America/New_York", "Australia/Lord_Howe"}) {
    Check(zone, kEverywhere);
  }
  Check("Europe/Berlin", kBerlin);
  Check("America/New_York", kNewYork);
  Check("Australia/Lord_Howe", kLordHowe);
}

TEST(NextScheduledSeconds, ManualRealtimeNegativeNowAndFailures) {
  ScopedEnv tz("TZ", "Europe/Berlin");
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
  s2s_test::LogCapture log;
  s.SetMode(static_cast<S2S::SCHD_MODE>(9));
  EXPECT_EQ(s.GetNextScheduledSeconds(1735689600L), -1);
  EXPECT_TRUE(Has(log.Text(), "[ERROR] S2S/sync_obj("));
  EXPECT_TRUE(Has(log.Text(), "): Unknown schedule mode [9]\n"));
  // A day that never has a run cannot make the walk go on for ever.
  log.Clear();
  s.SetMode(S2S::SCHD_WEEKLY);
  s.SetPeriod(60);
  s.SetRepeatTimesInDay(-1);
  EXPECT_EQ(s.GetNextScheduledSeconds(1735689600L), -1);
  EXPECT_TRUE(Has(log.Text(), "Fail to align to scheduled day"));
}

}  // namespace
