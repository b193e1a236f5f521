#include "S2S/sync_obj_schedule.h"

#include <gtest/gtest.h>

#include <string>

#include "testutil.h"

namespace {

using S2S::Schedule;
using s2s_test::LogCapture;

const char kPrefix[] = "[NOTE] S2S/sync_obj(";

// What Validate() logged after the prefix and line number, or "" if
// nothing was logged.
std::string ValidateMessage(const Schedule& s, bool* ok) {
  LogCapture log;
  *ok = s.Validate();
  std::string text = log.Text();
  if (text.empty()) return text;
  EXPECT_EQ(text.rfind(kPrefix, 0), 0u) << text;
  return text.substr(text.find("): ") + 3);
}

TEST(Schedule, DefaultIsAValidManualSchedule) {
  Schedule s;
  EXPECT_EQ(s.GetMode(), S2S::SCHD_MANUAL);
  EXPECT_EQ(s.GetModeStr(), "manual");
  bool ok = false;
  EXPECT_EQ(ValidateMessage(s, &ok), "");
  EXPECT_TRUE(ok);
  // Every other member of the broken-down begin is zero, tm_isdst included.
  struct tm b = s.GetScheduleBegin();
  EXPECT_EQ(b.tm_year, 114);
  EXPECT_EQ(b.tm_mon, 0);
  EXPECT_EQ(b.tm_mday, 1);
  EXPECT_EQ(b.tm_isdst, 0);
  EXPECT_EQ(b.tm_sec, 0);
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
  }
  Schedule s;
  for (int m : {2, 6, 7, -1}) {
    s.SetMode(static_cast<S2S::SCHD_MODE>(m));
    EXPECT_EQ(s.GetModeStr(), "weekly") << m;
  }
}

TEST(Schedule, ZeroPeriodOrRepeatClearsTheOther) {
  Schedule s;
  s.SetRepeatTimesInDay(5);
  s.SetPeriod(600);
  EXPECT_EQ(s.GetRepeatTimesInDay(), 5);
  s.SetPeriod(0);
  EXPECT_EQ(s.GetRepeatTimesInDay(), 0);
  s.SetPeriod(600);
  s.SetRepeatTimesInDay(3);
  s.SetRepeatTimesInDay(0);
  EXPECT_EQ(s.GetPeriodSeconds(), 0);
  s.SetPeriod(1, 30);
  EXPECT_EQ(s.GetPeriodSeconds(), 5400);
  EXPECT_EQ(s.GetPeriodHourPart(), 1);
  EXPECT_EQ(s.GetPeriodMinutePart(), 30);
  s.SetPeriod(5430);
  EXPECT_EQ(s.GetPeriodHourPart(), 1);
  EXPECT_EQ(s.GetPeriodMinutePart(), 30);
}

TEST(Schedule, WeekScheduleIsNormalisedToSevenFlags) {
  const struct {
    const char* in;
    const char* stored;
  } cases[] = {{"0000000", "1111111"},  {"101", "1111111"},
               {"", "1111111"},         {"0a00000", "0100000"},
               {"10000001", "1000000"}, {"0000010", "0000010"}};
  for (const auto& c : cases) {
    Schedule s;
    s.SetWeekSchedule("0010000");
    s.SetWeekSchedule(c.in);
    EXPECT_EQ(s.GetWeekSchedule(), c.stored) << c.in;
  }
}

TEST(Schedule, ValidateReportsTheFirstBrokenRule) {
  const struct {
    const char* what;
    int hour, minute;
    long period, repeat;
    int year, month, day, mode;
    const char* message;  // "" when valid
  } cases[] = {
      {"negative hour", -1, 0, 0, 0, 2014, 1, 1, 0, "Invalid begin hour\n"},
      {"hour 24", 24, 0, 0, 0, 2014, 1, 1, 0, "Invalid begin hour\n"},
      {"minute 60", 0, 60, 0, 0, 2014, 1, 1, 0, "Invalid begin minute\n"},
      {"period a day", 0, 0, 86400, 1, 2014, 1, 1, 0,
       "Invalid period or repeat\n"},
      {"negative period", 0, 0, -60, 1, 2014, 1, 1, 0,
       "Invalid period or repeat\n"},
      {"repeat 96", 0, 0, 60, 96, 2014, 1, 1, 0, "Invalid period\n"},
      {"last run tomorrow", 23, 0, 3600, 1, 2014, 1, 1, 0,
       "Invalid repeat in day [82800 + 3600 * 1]\n"},
      {"last run 23:59", 22, 59, 3600, 1, 2014, 1, 1, 0, ""},
      {"29 February 2015", 0, 0, 0, 0, 2015, 2, 29, 0, "Invalid begin date\n"},
      {"29 February 2016", 0, 0, 0, 0, 2016, 2, 29, 0, ""},
      {"month 13", 0, 0, 0, 0, 2014, 13, 1, 0, "Invalid begin date\n"},
      {"before the epoch", 0, 0, 0, 0, 1960, 1, 1, 0, "Invalid begin\n"},
      {"mode 6", 0, 0, 0, 0, 2014, 1, 1, 6, "Invalid schedule mode [6]\n"},
      {"mode -1", 0, 0, 0, 0, 2014, 1, 1, -1, "Invalid schedule mode [-1]\n"},
      {"once", 0, 0, 0, 0, 2014, 1, 1, S2S::SCHD_ONCE, ""},
  };
  s2s_test::ScopedTZ tz("UTC");
  for (const auto& c : cases) {
    Schedule s;
    s.SetStartHour(c.hour);
    s.SetStartMinute(c.minute);
    s.SetPeriod(c.period);
    s.SetRepeatTimesInDay(c.repeat);
    s.SetBeginYear(c.year);
    s.SetBeginMonth(c.month);
    s.SetBeginDay(c.day);
    s.SetMode(static_cast<S2S::SCHD_MODE>(c.mode));
    bool ok = true;
    std::string message = ValidateMessage(s, &ok);
    if (std::string(c.message) == "Invalid begin\n") {
      // The normalised date follows on a second line.
      EXPECT_EQ(message.substr(0, 14), c.message) << c.what;
    } else {
      EXPECT_EQ(message, c.message) << c.what;
    }
    EXPECT_EQ(ok, *c.message == '\0') << c.what;
  }
}

TEST(Schedule, GetDaysToNextSyncCountsFromToday) {
  const struct {
    unsigned wday;
    const char* week;
    int days;
  } cases[] = {{6, "1000000", 1},  {3, "0001000", 0}, {0, "0000000", -1},
               {4, "0000000", -1}, {5, "0000010", 0}, {6, "0000010", 6},
               {1, "1111111", 0},  {2, "0200000", -1}};
  for (const auto& c : cases) {
    EXPECT_EQ(S2S::GetDaysToNextSync(c.wday, c.week), c.days)
        << c.wday << " " << c.week;
  }
}

}  // namespace
