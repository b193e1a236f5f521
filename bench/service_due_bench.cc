// How soon s2sd starts a task that comes due: from the due time to the
// task's first rsync (the probe of the server), median and worst over 100
// due runs, against a real server appliance on loopback.
//
// The service runs with its schedules' clock 30 times as fast as the
// system's (s2sd --clock-rate), so a task due every minute is due every two
// seconds, and each due time is known in system time. An rsync wrapper
// first in the service's PATH notes when each rsync starts. The baseline in
// the same run is that wrapper started bare (fork, exec, its first line):
// the part of the figure that is the measuring itself.
#include <benchmark/benchmark.h>
#include <signal.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <sstream>
#include <string>
#include <vector>

#include "S2S/ipc.h"
#include "S2S/sync_obj_pobject.h"
#include "appliances.h"
#include "service/config.h"

namespace {

using S2S::PObject;

const long kRate = 30;
const size_t kDueRuns = 100;

double Now() {
  timespec ts;
  clock_gettime(CLOCK_REALTIME, &ts);
  return static_cast<double>(ts.tv_sec) + ts.tv_nsec / 1e9;
}

long LocalAt(int hour, int minute) {
  time_t now = time(nullptr);
  tm t;
  localtime_r(&now, &t);
  t.tm_hour = hour;
  t.tm_min = minute;
  t.tm_sec = 0;
  t.tm_isdst = -1;
  return static_cast<long>(mktime(&t));
}

// Every minute from `hour`:`minute`, 96 runs.
S2S::Schedule EveryMinuteFrom(int hour, int minute) {
  S2S::Schedule s;
  s.SetMode(S2S::SCHD_WEEKLY);
  s.SetWeekSchedule("1111111");
  s.SetBeginYear(2020);
  s.SetBeginMonth(1);
  s.SetBeginDay(1);
  s.SetStartHour(hour);
  s.SetStartMinute(minute);
  s.SetPeriod(0, 1);
  s.SetRepeatTimesInDay(95);
  return s;
}

PObject Request(const PObject& request) {
  S2S::IPCSender sender;
  PObject reply;
  if (sender.connect(s2s_service::SocketPath()) == 0) {
    sender.send(request, true, reply);
  }
  sender.close();
  return reply;
}

// Start times (system seconds) of the rsync runs the wrapper noted.
std::vector<double> RsyncStarts(const std::string& log) {
  std::vector<double> out;
  std::istringstream in(s2s_test::ReadFile(log));
  std::string what;
  long long ns = 0;
  std::string rest;
  while (in >> what >> ns && std::getline(in, rest)) {
    if (what == "start") out.push_back(ns / 1e9);
  }
  std::sort(out.begin(), out.end());
  return out;
}

std::string WrapperScript(const std::string& log) {
  return "echo \"start $(date +%s%N) $$\" >> " + log +
         "\nexec /usr/bin/rsync \"$@\"\n";
}

void BM_DueToFirstRsync(benchmark::State& state) {
  s2s_test::Appliances app(S2S_CMD_HANDLER);
  s2s_test::TempDir tmp;
  for (const char* share : {"a", "b"}) app.AddShare(share);
  if (!app.StartServer()) {
    state.SkipWithError("the server did not start");
    return;
  }
  std::string bin = tmp.Sub("bin"), log = tmp.Sub("rsync.log");
  std::filesystem::create_directories(bin);
  s2s_test::WriteScript(bin + "/rsync", WrapperScript(log));
  s2s_test::WriteFile(app.ClientShare("a") + "/f", "data\n");
  s2s_test::WriteFile(app.ClientShare("b") + "/f", "data\n");
  // The service's clock reads 11:29:50 now; two tasks due every minute
  // from 11:30 and from 13:06 give 192 due times, two seconds apart.
  long offset = LocalAt(11, 29) + 50 - static_cast<long>(time(nullptr)) * kRate;
  std::string path = bin + ":" + getenv("PATH");
  std::string slog = tmp.Sub("s2sd.log");
  pid_t pid = fork();
  if (pid == 0) {
    setenv("PATH", path.c_str(), 1);
    execl(S2SD_PROGRAM, S2SD_PROGRAM, "--log", slog.c_str(), "--clock-offset",
          std::to_string(offset).c_str(), "--clock-rate",
          std::to_string(kRate).c_str(), nullptr);
    _exit(127);
  }
  for (int i = 0; i < 500 && !Request(PObject())["result"].isInteger(); ++i) {
    usleep(10000);
  }
  const struct {
    const char* name;
    const char* share;
    int hour, minute;
  } tasks[] = {{"early", "a", 11, 30}, {"late", "b", 13, 6}};
  for (const auto& t : tasks) {
    S2S::SyncTask task;
    task.GetInfo().SetName(t.name);
    task.GetInfo().SetShareList({t.share});
    task.GetInfo().SetSyncInfo(app.Info());
    task.GetInfo().SetSchedule(EveryMinuteFrom(t.hour, t.minute));
    PObject req;
    req = PObject::Map();
    req["action"] = "add";
    S2S::SyncTask2PObj(task, req["task"]);
    req["task"].asMap().erase("id");
    PObject reply = Request(req);
    if (reply["result"].asUInt64() != 0) {
      state.SkipWithError(("add: " + reply["message"].asString()).c_str());
    }
  }
  // The due times in system seconds.
  std::vector<double> due;
  for (long wall = LocalAt(11, 30); due.size() < kDueRuns + 1; wall += 60) {
    due.push_back(static_cast<double>(wall - offset) / kRate);
  }
  for (auto _ : state) {
    double until = due.back() + 1;
    while (Now() < until) usleep(200000);
    std::vector<double> starts = RsyncStarts(log);
    std::vector<double> delays;
    for (size_t k = 0; k + 1 < due.size(); ++k) {
      auto first = std::lower_bound(starts.begin(), starts.end(), due[k]);
      if (first != starts.end() && *first < due[k + 1]) {
        delays.push_back(*first - due[k]);
      }
    }
    if (delays.size() < kDueRuns / 2) {
      state.SkipWithError("most due runs did not start");
      break;
    }
    std::sort(delays.begin(), delays.end());
    double median = delays[delays.size() / 2];
    state.SetIterationTime(median);
    state.counters["median_ms"] = median * 1e3;
    state.counters["worst_ms"] = delays.back() * 1e3;
    state.counters["runs"] = static_cast<double>(delays.size());
  }
  kill(pid, SIGTERM);
  waitpid(pid, nullptr, 0);
}
BENCHMARK(BM_DueToFirstRsync)
    ->Iterations(1)
    ->UseManualTime()
    ->Unit(benchmark::kMillisecond);

// The wrapper alone: fork, exec of the script, its first line written.
void BM_WrapperStartBaseline(benchmark::State& state) {
  s2s_test::TempDir tmp;
  std::string script = tmp.Sub("rsync"), log = tmp.Sub("rsync.log");
  s2s_test::WriteScript(script, WrapperScript(log));
  std::vector<double> delays;
  for (auto _ : state) {
    unlink(log.c_str());
    double t0 = Now();
    pid_t pid = fork();
    if (pid == 0) {
      freopen("/dev/null", "w", stdout);
      execl(script.c_str(), script.c_str(), "--version", nullptr);
      _exit(127);
    }
    waitpid(pid, nullptr, 0);
    std::vector<double> starts = RsyncStarts(log);
    double d = starts.empty() ? 0 : starts[0] - t0;
    delays.push_back(d);
    state.SetIterationTime(d);
  }
  std::sort(delays.begin(), delays.end());
  state.counters["median_ms"] = delays[delays.size() / 2] * 1e3;
  state.counters["worst_ms"] = delays.back() * 1e3;
}
BENCHMARK(BM_WrapperStartBaseline)
    ->Iterations(100)
    ->UseManualTime()
    ->Unit(benchmark::kMillisecond);

}  // namespace
