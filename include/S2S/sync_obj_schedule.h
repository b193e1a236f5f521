// Schedule: when a sync task runs by itself.
//
// A schedule is manual (never by itself), realtime (continuously), weekly
// (on chosen weekdays), monthly (on one day of each month), yearly (on one
// date of each year) or once (on one date). On each run day it runs at a
// start time and then `repeat` more times every `period` seconds. It is a
// plain copyable value; setters store unchecked (apart from the period and
// repeat coupling and the week string normalisation) and Validate() judges
// the whole. Local time comes from the process's time zone (TZ). Thread-
// safety: none beyond that of localtime_r/mktime; one thread per object.
#ifndef S2S_SYNC_OBJ_SCHEDULE_H_
#define S2S_SYNC_OBJ_SCHEDULE_H_

#include <stdint.h>
#include <time.h>

#include <string>

#include "S2S/export.h"

namespace S2S {

// Schedule mode. Only 0 to 5 are valid; other numbers can be stored and
// are rejected by Schedule::Validate().
enum SCHD_MODE : int32_t {
  SCHD_MANUAL = 0,
  SCHD_REALTIME = 1,
  SCHD_WEEKLY = 2,
  SCHD_MONTHLY = 3,
  SCHD_YEARLY = 4,
  SCHD_ONCE = 5,
};

class S2S_EXPORT Schedule {
 public:
  // Manual; period and repeat 0; every weekday; begin 2014-01-01 00:00.
  Schedule();

  SCHD_MODE GetMode() const { return mode_; }
  // "manual", "realtime", "monthly", "yearly", "once"; "weekly" for 2 and
  // for every number out of range.
  std::string GetModeStr() const;
  long GetPeriodSeconds() const { return period_; }
  long GetPeriodHourPart() const { return period_ / 3600; }
  long GetPeriodMinutePart() const { return (period_ / 60) % 60; }
  long GetRepeatTimesInDay() const { return repeat_; }
  // Seven characters, index 0 Sunday (tm_wday numbering), '1' = chosen.
  std::string GetWeekSchedule() const { return week_; }
  int GetBeginYear() const { return begin_year_; }
  int GetBeginMonth() const { return begin_month_; }  // 1 to 12
  int GetBeginDay() const { return begin_day_; }
  int GetStartHour() const { return start_hour_; }
  int GetStartMinute() const { return start_minute_; }
  // The begin date at the start time; every other member 0 (tm_isdst
  // included).
  struct tm GetScheduleBegin() const;

  // True when every field is in range, the begin date exists and the day's
  // last run falls on that day. On failure logs the first broken rule at
  // NOTE and returns false. Never changes the object.
  bool Validate() const;

  // The next run time, in seconds since the epoch, strictly later than
  // `now`: 0 for manual and for a once schedule that is over, now + 1 for
  // realtime. -1 when `now` is negative (silently) or when the local-time
  // arithmetic fails (logged at ERROR).
  long GetNextScheduledSeconds(long now) const;

  void SetMode(SCHD_MODE mode) { mode_ = mode; }
  // Exact, case-sensitive match of the mode strings; anything else,
  // "manual" included, gives SCHD_MANUAL.
  void SetModeByStr(const std::string& mode);
  // A zero period clears the repeat count too.
  void SetPeriod(long seconds);
  void SetPeriod(long hours, long minutes);
  // A zero count clears the period too.
  void SetRepeatTimesInDay(long times);
  // Keeps the first seven characters as '0' (for '0') or '1' (anything
  // else); a shorter string or one with no chosen day means every day.
  void SetWeekSchedule(const std::string& week);
  void SetBeginYear(int year) { begin_year_ = year; }
  void SetBeginMonth(int month) { begin_month_ = month; }
  void SetBeginDay(int day) { begin_day_ = day; }
  void SetStartHour(int hour) { start_hour_ = hour; }
  void SetStartMinute(int minute) { start_minute_ = minute; }

 private:
  SCHD_MODE mode_;
  long period_;
  long repeat_;
  std::string week_;
  int begin_year_;
  int begin_month_;
  int begin_day_;
  int start_hour_;
  int start_minute_;
};

// Field-by-field equality, so that a schedule rebuilt from a map or a
// message can be compared with its source.
S2S_EXPORT bool operator==(const Schedule& a, const Schedule& b);
inline bool operator!=(const Schedule& a, const Schedule& b) {
  return !(a == b);
}

// Days from weekday `wday` (0 Sunday) to the next day marked '1' in `week`,
// today counting as 0; -1 when no day is marked '1'.
S2S_EXPORT int GetDaysToNextSync(unsigned int wday, std::string week);

}  // namespace S2S

#endif  // S2S_SYNC_OBJ_SCHEDULE_H_
