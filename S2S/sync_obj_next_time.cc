// The next run time of a schedule. The walk goes forward one local calendar
// day at a time through localtime_r/mktime. No broken-down time ever gets
// tm_isdst = -1: each keeps the flag its last localtime_r or mktime gave, so
// a run time that daylight saving makes missing or doubled comes out as
// mktime reads it with that inherited flag.
#include <string.h>

#include "S2S/sync_obj_schedule.h"

#define S2S_LOG_AREA "sync_obj"
#include "S2S/log.h"

namespace S2S {

namespace {

// A schedule that can run finds its day within a few passes (each pass jumps
// to the next candidate day); one that never runs, such as one with a
// negative repeat count, would otherwise walk for ever.
const int kMaxPasses = 64;

long AlignmentFailure() {
  LOG_ERROR("Fail to align to scheduled day");
  return -1;
}

void LogBadScheduledSeconds(const struct tm& t) {
  LOG_ERROR(
      "Fail to get scheduled seconds, year:[%d], mon:[%d], mday:[%d], "
      "hour:[%d], min:[%d], sec:[%d], dst:[%d]",
      t.tm_year, t.tm_mon, t.tm_mday, t.tm_hour, t.tm_min, t.tm_sec,
      t.tm_isdst);
}

}  // namespace

int GetDaysToNextSync(unsigned int wday, std::string week) {
  for (unsigned int k = 0; k < 7; ++k) {
    size_t i = (wday + k) % 7;
    if (i < week.size() && week[i] == '1') return static_cast<int>(k);
  }
  return -1;
}

long Schedule::GetNextScheduledSeconds(long now) const {
  if (now < 0) return -1;
  struct tm day;
  memset(&day, 0, sizeof day);
  time_t now_t = now;
  localtime_r(&now_t, &day);
  if (mode_ == SCHD_MANUAL) return 0;
  if (mode_ == SCHD_REALTIME) return now + 1;

  const struct tm begin = GetScheduleBegin();
  for (int pass = 0; pass < kMaxPasses; ++pass) {
    struct tm norm = day;
    if (mktime(&norm) == -1) {
      LOG_ERROR("Failed to mktime");
      return AlignmentFailure();
    }
    // The candidate keeps norm's time of day: comparing it with the day
    // being examined compares dates.
    struct tm candidate = norm;
    switch (mode_) {
      case SCHD_WEEKLY: {
        int k = GetDaysToNextSync(norm.tm_wday, week_);
        if (k < 0) {
          LOG_ERROR("No chosen week day for sync '%s'", week_.c_str());
          return AlignmentFailure();
        }
        candidate.tm_mday += k;
        break;
      }
      case SCHD_MONTHLY:
        candidate.tm_mday = begin.tm_mday;
        break;
      case SCHD_YEARLY:
        candidate.tm_mon = begin.tm_mon;
        candidate.tm_mday = begin.tm_mday;
        break;
      case SCHD_ONCE:
        candidate.tm_year = begin.tm_year;
        candidate.tm_mon = begin.tm_mon;
        candidate.tm_mday = begin.tm_mday;
        break;
      default:
        LOG_ERROR("Unknown schedule mode [%d]", static_cast<int>(mode_));
        return AlignmentFailure();
    }

    struct tm ref = day;
    time_t ref_s = mktime(&ref);
    if (ref_s < 0) {
      LOG_ERROR(
          "Fail to get reference seconds, year:[%d], mon:[%d], mday:[%d], "
          "hour:[%d], min:[%d], sec:[%d], dst:[%d]",
          ref.tm_year, ref.tm_mon, ref.tm_mday, ref.tm_hour, ref.tm_min,
          ref.tm_sec, ref.tm_isdst);
      return -1;
    }
    // Normalising rolls a day the month lacks (the 31st of a 30-day month,
    // 29 February of a common year) into the next month.
    time_t cand_s = mktime(&candidate);
    if (cand_s < ref_s) {
      if (cand_s < 0) {
        LogBadScheduledSeconds(candidate);
        return -1;
      }
      switch (mode_) {
        case SCHD_MONTHLY:
          candidate.tm_mon += 1;
          break;
        case SCHD_YEARLY:
          candidate.tm_year += 1;
          break;
        case SCHD_ONCE:
          return 0;
        case SCHD_WEEKLY:
          LOG_ERROR("No chosen week day for sync");
          return -1;
        default:
          LOG_ERROR("Unsupported schedule mode [%d]", static_cast<int>(mode_));
          return -1;
      }
    }

    struct tm run = candidate;
    run.tm_hour = start_hour_;
    run.tm_min = start_minute_;
    run.tm_sec = 0;
    time_t first = mktime(&run);
    if (first < 0) {
      // A run time the clock cannot represent: try the next day.
      LogBadScheduledSeconds(run);
    } else if (repeat_ >= 0) {
      if (now < first) {
        if (first > 0) return first;
      } else {
        for (long i = 1; i <= repeat_; ++i) {
          long t = first + i * period_;
          if (now < t) return t;
        }
      }
    }

    day = candidate;
    day.tm_hour = 0;
    day.tm_min = 0;
    day.tm_sec = 0;
    day.tm_mday += 1;
  }
  return AlignmentFailure();
}

}  // namespace S2S
