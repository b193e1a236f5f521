// Random schedules and random moments checked against a brute-force scan.
//
// The oracle keeps its own calendar (day numbers, not the C library's date
// normalisation) and uses the clock only to read a date and time of day with
// a DST flag, the way the scheduler does. Its rules:
// - From a walk position (a day, a time of day and the DST flag it carries)
//   the candidate day is: weekly, the next chosen weekday from that day;
//   monthly, the begin day of that month; yearly, the begin date of that
//   year; once, the begin date. A day the month lacks rolls into the next
//   month (31 April is 1 May, 29 February 2025 is 1 March).
// - The candidate keeps the position's time of day and flag and is read by
//   the clock, which may move it. If it lies before the position, a monthly
//   one moves on a month and a yearly one a year (keeping the flag), and a
//   once schedule is over.
// - The day's runs are the start time read with the candidate's flag, then
//   every period seconds, 1 + repeat runs. The next position is the day
//   after the candidate at midnight, with the candidate's flag.
// The answer must then be the first run time that a minute-by-minute scan
// from `now` meets: strictly later than `now` and with none in between.
#include <gtest/gtest.h>
#include <string.h>

#include <algorithm>
#include <random>
#include <string>
#include <vector>

#include "S2S/sync_obj_dump.h"
#include "S2S/sync_obj_schedule.h"
#include "testutil.h"

namespace {

using S2S::Schedule;

// Days since 1970-01-01 of a proleptic Gregorian date, month 1 to 12.
long DaysFromCivil(long y, long m, long d) {
  y -= m <= 2;
  long era = (y >= 0 ? y : y - 399) / 400;
  long yoe = y - era * 400;
  long doy = (153 * (m + (m > 2 ? -3 : 9)) + 2) / 5 + d - 1;
  long doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
  return era * 146097 + doe - 719468;
}

void CivilFromDays(long z, int* y, int* m, int* d) {
  z += 719468;
  long era = (z >= 0 ? z : z - 146096) / 146097;
  long doe = z - era * 146097;
  long yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
  long doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
  long mp = (5 * doy + 2) / 153;
  *d = static_cast<int>(doy - (153 * mp + 2) / 5 + 1);
  *m = static_cast<int>(mp < 10 ? mp + 3 : mp - 9);
  *y = static_cast<int>(yoe + era * 400 + (*m <= 2));
}

// A date whose month may be past 12 and whose day may be past the month's
// end, rolled forward.
long RolledDay(long y, long m, long d) {
  y += (m - 1) / 12;
  m = (m - 1) % 12 + 1;
  return DaysFromCivil(y, m, 1) + d - 1;
}

int Weekday(long day) { return static_cast<int>(((day % 7) + 11) % 7); }

struct Pos {
  long day;
  int tod;  // seconds since midnight
  int dst;
  long at;  // the instant the clock reads
};

// The clock's reading of a day and time of day under a DST flag.
Pos Read(long day, int tod, int dst) {
  struct tm t;
  memset(&t, 0, sizeof t);
  int y, m, d;
  CivilFromDays(day, &y, &m, &d);
  t.tm_year = y - 1900;
  t.tm_mon = m - 1;
  t.tm_mday = d;
  t.tm_sec = tod;
  t.tm_isdst = dst;
  long at = mktime(&t);
  return {DaysFromCivil(t.tm_year + 1900, t.tm_mon + 1, t.tm_mday),
          t.tm_hour * 3600 + t.tm_min * 60 + t.tm_sec, t.tm_isdst, at};
}

Pos FromInstant(long now) {
  time_t t = now;
  struct tm lt;
  localtime_r(&t, &lt);
  return {DaysFromCivil(lt.tm_year + 1900, lt.tm_mon + 1, lt.tm_mday),
          lt.tm_hour * 3600 + lt.tm_min * 60 + lt.tm_sec, lt.tm_isdst, now};
}

// Run times of the first few run days the walk reaches from `now`.
std::vector<long> RunTimes(const Schedule& s, long now) {
  std::vector<long> runs;
  Pos pos = FromInstant(now);
  for (int pass = 0; pass < 8; ++pass) {
    Pos ref = Read(pos.day, pos.tod, pos.dst);
    int y, m, d;
    CivilFromDays(ref.day, &y, &m, &d);
    long day = 0;
    switch (s.GetMode()) {
      case S2S::SCHD_WEEKLY: {
        int k = 0;
        while (s.GetWeekSchedule()[(Weekday(ref.day) + k) % 7] != '1') ++k;
        day = ref.day + k;
        break;
      }
      case S2S::SCHD_MONTHLY:
        day = RolledDay(y, m, s.GetBeginDay());
        break;
      case S2S::SCHD_YEARLY:
        day = RolledDay(y, s.GetBeginMonth(), s.GetBeginDay());
        break;
      default:
        day = RolledDay(s.GetBeginYear(), s.GetBeginMonth(), s.GetBeginDay());
        break;
    }
    Pos cand = Read(day, ref.tod, ref.dst);
    if (cand.at < ref.at) {
      if (s.GetMode() == S2S::SCHD_ONCE) break;
      CivilFromDays(cand.day, &y, &m, &d);
      cand.day = s.GetMode() == S2S::SCHD_MONTHLY ? RolledDay(y, m + 1, d)
                                                  : RolledDay(y + 1, m, d);
    }
    long first =
        Read(cand.day, s.GetStartHour() * 3600 + s.GetStartMinute() * 60,
             cand.dst)
            .at;
    bool ahead = false;
    for (long i = 0; i <= s.GetRepeatTimesInDay(); ++i) {
      runs.push_back(first + i * s.GetPeriodSeconds());
      ahead = ahead || runs.back() > now;
    }
    if (ahead && pass > 0) break;
    pos = {cand.day + 1, 0, cand.dst, 0};
  }
  std::sort(runs.begin(), runs.end());
  return runs;
}

// Moments at which the zone's DST flag changes, 2024 to 2026.
std::vector<long> Changes() {
  std::vector<long> out;
  const long from = 1704067200, to = 1798761600;
  int last = FromInstant(from).dst;
  for (long t = from; t < to; t += 1800) {
    int dst = FromInstant(t).dst;
    if (dst != last) out.push_back(t);
    last = dst;
  }
  return out;
}

Schedule RandomSchedule(std::mt19937& rng, long now) {
  auto pick = [&rng](int lo, int hi) {
    return std::uniform_int_distribution<int>(lo, hi)(rng);
  };
  Schedule s;
  s.SetMode(static_cast<S2S::SCHD_MODE>(pick(2, 5)));
  std::string week(7, '0');
  while (week == "0000000") {
    for (char& c : week) c = pick(0, 2) == 0 ? '1' : '0';
  }
  s.SetWeekSchedule(week);
  const int hours[] = {0, 1, 2, 3, 23};
  s.SetStartHour(pick(0, 1) ? hours[pick(0, 4)] : pick(0, 23));
  s.SetStartMinute(pick(0, 1) ? pick(0, 3) * 15 : pick(0, 59));
  if (pick(0, 1)) {
    long first = s.GetStartHour() * 3600 + s.GetStartMinute() * 60;
    long period = 60L * pick(1, 240);
    long repeat = std::min<long>(pick(1, 6), (86399 - first) / period);
    s.SetPeriod(period);
    s.SetRepeatTimesInDay(repeat);
  }
  // Begin dates near `now` keep the scans short.
  long day = FromInstant(now).day + pick(-10, 40);
  int y, m, d;
  CivilFromDays(day, &y, &m, &d);
  if (s.GetMode() == S2S::SCHD_YEARLY) y = 2024;  // 29 February is valid
  s.SetBeginYear(y);
  s.SetBeginMonth(m);
  s.SetBeginDay(s.GetMode() == S2S::SCHD_MONTHLY && pick(0, 1) ? pick(28, 31)
                                                               : d);
  if (s.GetMode() == S2S::SCHD_MONTHLY) s.SetBeginMonth(1);
  return s;
}

TEST(NextScheduledSecondsOracle, AgreesWithAMinuteByMinuteScan) {
  const char* const zones[] = {"UTC", "Europe/Berlin", "America/New_York",
                               "Australia/Lord_Howe"};
  std::mt19937 rng(20250330);
  for (const char* zone : zones) {
    s2s_test::ScopedTZ tz(zone);
    std::vector<long> changes = Changes();
    for (int n = 0; n < 150; ++n) {
      long base = changes.empty() || n % 4 == 0
                      ? 1704067200 + static_cast<long>(rng() % 94000000)
                      : changes[rng() % changes.size()];
      long now = base + static_cast<long>(rng() % 518400) - 259200;
      Schedule s = RandomSchedule(rng, now);
      ASSERT_TRUE(s.Validate());

      std::vector<long> runs = RunTimes(s, now);
      long want = 0;
      if (!runs.empty() && runs.back() > now) {
        // Brute force: the first minute from now on that is a run time.
        for (long t = (now / 60 + 1) * 60;; t += 60) {
          if (std::binary_search(runs.begin(), runs.end(), t)) {
            want = t;
            break;
          }
        }
      }
      EXPECT_EQ(s.GetNextScheduledSeconds(now), want)
          << zone << " now " << now << "\n"
          << s;
    }
  }
}

}  // namespace
