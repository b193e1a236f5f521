#include "S2S/sync_obj_schedule.h"

#include <string.h>

#define S2S_LOG_AREA "sync_obj"
#include "S2S/log.h"

namespace S2S {

namespace {

const char kEveryDay[] = "1111111";
// Last second of a day: every run of a day has to start by then.
const long kLastSecondOfDay = 86399;
const unsigned long kMaxRepeatTimesInDay = 95;

}  // namespace

Schedule::Schedule()
    : mode_(SCHD_MANUAL),
      period_(0),
      repeat_(0),
      week_(kEveryDay),
      begin_year_(2014),
      begin_month_(1),
      begin_day_(1),
      start_hour_(0),
      start_minute_(0) {}

std::string Schedule::GetModeStr() const {
  switch (mode_) {
    case SCHD_MANUAL:
      return "manual";
    case SCHD_REALTIME:
      return "realtime";
    case SCHD_MONTHLY:
      return "monthly";
    case SCHD_YEARLY:
      return "yearly";
    case SCHD_ONCE:
      return "once";
    default:
      return "weekly";
  }
}

struct tm Schedule::GetScheduleBegin() const {
  struct tm begin;
  memset(&begin, 0, sizeof begin);
  begin.tm_year = begin_year_ - 1900;
  begin.tm_mon = begin_month_ - 1;
  begin.tm_mday = begin_day_;
  begin.tm_hour = start_hour_;
  begin.tm_min = start_minute_;
  return begin;
}

void Schedule::SetModeByStr(const std::string& mode) {
  static const struct {
    const char* name;
    SCHD_MODE mode;
  } kModes[] = {{"realtime", SCHD_REALTIME},
                {"weekly", SCHD_WEEKLY},
                {"monthly", SCHD_MONTHLY},
                {"yearly", SCHD_YEARLY},
                {"once", SCHD_ONCE}};
  mode_ = SCHD_MANUAL;
  for (const auto& m : kModes) {
    if (mode == m.name) {
      mode_ = m.mode;
      return;
    }
  }
}

void Schedule::SetPeriod(long seconds) {
  period_ = seconds;
  if (seconds == 0) repeat_ = 0;
}

void Schedule::SetPeriod(long hours, long minutes) {
  SetPeriod(hours * 3600 + minutes * 60);
}

void Schedule::SetRepeatTimesInDay(long times) {
  repeat_ = times;
  if (times == 0) period_ = 0;
}

void Schedule::SetWeekSchedule(const std::string& week) {
  if (week.size() < 7) {
    week_ = kEveryDay;
    return;
  }
  bool any = false;
  for (size_t i = 0; i < 7; ++i) {
    week_[i] = week[i] == '0' ? '0' : '1';
    any = any || week_[i] == '1';
  }
  if (!any) week_ = kEveryDay;
}

bool Schedule::Validate() const {
  if (static_cast<unsigned>(start_hour_) > 23) {
    LOG_NOTE("Invalid begin hour");
    return false;
  }
  if (static_cast<unsigned>(start_minute_) > 59) {
    LOG_NOTE("Invalid begin minute");
    return false;
  }
  if (static_cast<unsigned long>(period_) >
      static_cast<unsigned long>(kLastSecondOfDay)) {
    LOG_NOTE("Invalid period or repeat");
    return false;
  }
  if (static_cast<unsigned long>(repeat_) > kMaxRepeatTimesInDay) {
    LOG_NOTE("Invalid period");
    return false;
  }
  // Both factors are bounded above, so 32 bits hold the product.
  int32_t first = start_hour_ * 3600 + start_minute_ * 60;
  int32_t last = first + static_cast<int32_t>(period_ * repeat_);
  if (last > kLastSecondOfDay) {
    LOG_NOTE("Invalid repeat in day [%d + %d * %d]", first,
             static_cast<int>(period_), static_cast<int>(repeat_));
    return false;
  }
  // Noon, so that a daylight-saving change at midnight cannot move the date.
  struct tm begin = GetScheduleBegin();
  begin.tm_hour = 12;
  struct tm norm = begin;
  if (mktime(&norm) < 0) {
    LOG_NOTE("Invalid begin");
    LOG_NOTE("%d %d %d %d %d %d", norm.tm_year, norm.tm_mon, norm.tm_mday,
             norm.tm_hour, norm.tm_min, norm.tm_sec);
    return false;
  }
  if (norm.tm_year != begin.tm_year || norm.tm_mon != begin.tm_mon ||
      norm.tm_mday != begin.tm_mday) {
    LOG_NOTE("Invalid begin date");
    return false;
  }
  if (week_.size() != 7) {
    LOG_NOTE("Wrong length of weekday '%s'", week_.c_str());
    return false;
  }
  if (week_.find_first_not_of('0') == std::string::npos) {
    LOG_NOTE("Invalid weekday '%s'", week_.c_str());
    return false;
  }
  if (static_cast<uint32_t>(mode_) > SCHD_ONCE) {
    LOG_NOTE("Invalid schedule mode [%d]", static_cast<int>(mode_));
    return false;
  }
  return true;
}

bool operator==(const Schedule& a, const Schedule& b) {
  return a.GetMode() == b.GetMode() &&
         a.GetPeriodSeconds() == b.GetPeriodSeconds() &&
         a.GetRepeatTimesInDay() == b.GetRepeatTimesInDay() &&
         a.GetWeekSchedule() == b.GetWeekSchedule() &&
         a.GetBeginYear() == b.GetBeginYear() &&
         a.GetBeginMonth() == b.GetBeginMonth() &&
         a.GetBeginDay() == b.GetBeginDay() &&
         a.GetStartHour() == b.GetStartHour() &&
         a.GetStartMinute() == b.GetStartMinute();
}

}  // namespace S2S
