// Calls per second of Schedule::GetNextScheduledSeconds, one run per mode,
// in a zone with daylight saving.
#include <benchmark/benchmark.h>
#include <stdlib.h>
#include <time.h>

#include "S2S/sync_obj_schedule.h"

namespace {

void BM_NextScheduledSeconds(benchmark::State& state) {
  setenv("TZ", "Europe/Berlin", 1);
  tzset();
  S2S::Schedule s;
  s.SetMode(static_cast<S2S::SCHD_MODE>(state.range(0)));
  s.SetWeekSchedule("0100100");
  s.SetBeginYear(2026);
  s.SetBeginMonth(2);
  s.SetBeginDay(28);
  s.SetStartHour(8);
  s.SetPeriod(3600);
  s.SetRepeatTimesInDay(3);
  // Walk across a year of moments so every path of the walk is taken.
  long now = 1735689600;  // 2025-01-01
  long sum = 0;
  for (auto _ : state) {
    sum += s.GetNextScheduledSeconds(now);
    now += 7919;
    if (now > 1767225600) now = 1735689600;
  }
  benchmark::DoNotOptimize(sum);
  state.SetItemsProcessed(state.iterations());
  state.SetLabel(s.GetModeStr());
}
BENCHMARK(BM_NextScheduledSeconds)->DenseRange(0, 5);

}  // namespace
