// Runs of a task as the client service makes them when nothing has changed:
// 1, 10 and 50 shares of ten small files each through the task runner, each
// run reusing the session (probe and pairing) of the run before, as s2sd
// does for ten minutes. The second argument is the number of shares synced
// at once: 1, and s2sd's default. Beside the time, per run: the commands and
// the data transfers the server's daemon served (counted in its log), and their
// sum, the rsync invocations.
#include <benchmark/benchmark.h>
#include <stdio.h>

#include <fstream>
#include <mutex>
#include <string>

#include "appliances.h"
#include "karo/rsync_wrapper.h"
#include "service/config.h"
#include "service/task_runner.h"

namespace {

const int kShares = 50;

void QuietLog(int, const char*) {}
// A run's report, kept for the failure of a run, which goes to stderr.
struct Report {
  std::mutex mu;
  std::string text;
  s2s_service::Reporter Keep() {
    text.clear();
    return [this](const std::string& line) {
      std::lock_guard<std::mutex> lock(mu);
      text += line + "\n";
    };
  }
  void Failed(benchmark::State& state, const char* what) {
    fprintf(stderr, "%s:\n%s", what, text.c_str());
    state.SkipWithError(what);
  }
};

std::string ShareName(int i) { return "share" + std::to_string(i); }

size_t Count(const std::string& text, const std::string& what) {
  size_t n = 0;
  for (size_t at = text.find(what); at != std::string::npos;
       at = text.find(what, at + 1)) {
    ++n;
  }
  return n;
}

struct Server {
  s2s_test::Appliances app{S2S_CMD_HANDLER};
  bool ok = true;

  Server() {
    KARO::Backup::RsyncWrapper::setLogHandler(QuietLog);
    for (int i = 0; i < kShares && ok; ++i) ok = app.AddShare(ShareName(i));
    ok = ok && app.StartServer();
    for (int i = 0; i < kShares && ok; ++i) {
      for (int f = 0; f < 10; ++f) {
        std::ofstream(app.ClientShare(ShareName(i)) + "/f" + std::to_string(f))
            << "file " << f << " of share " << i << "\n";
      }
    }
  }

  // {commands, data transfers} the daemon has served so far: it logs every
  // connection it lets into a module.
  std::pair<size_t, size_t> Served() const {
    std::string log = app.DaemonLog();
    size_t commands = Count(log, "access on module s2scmd ");
    return {commands, Count(log, "access on module ") - commands};
  }
};

Server& TheServer() {
  static Server server;
  return server;
}

void BM_NoChangeRun(benchmark::State& state) {
  Server& s = TheServer();
  if (!s.ok) return state.SkipWithError("no server");
  const int n = static_cast<int>(state.range(0));
  s2s_service::RunOptions options;
  options.share_parallel = static_cast<unsigned int>(state.range(1));
  S2S::SyncTask task;
  task.SetID(static_cast<unsigned long long>(n * 100 + state.range(1)));
  task.GetInfo().SetName("bench-" + std::to_string(n) + "-" +
                         std::to_string(options.share_parallel));
  std::list<std::string> shares;
  for (int i = 0; i < n; ++i) shares.push_back(ShareName(i));
  task.GetInfo().SetShareList(shares);
  task.GetInfo().SetSyncInfo(s.app.Info());
  s2s_service::Session session;
  Report report;
  // The first sync, and the session the runs below reuse.
  if (s2s_service::RunTask(task, {}, 30, report.Keep(), nullptr, options,
                           &session)
          .exit_code != 0) {
    return report.Failed(state, "first run failed");
  }
  std::pair<size_t, size_t> before = s.Served();
  for (auto _ : state) {
    if (s2s_service::RunTask(task, {}, 30, report.Keep(), nullptr, options,
                             &session)
            .exit_code != 0) {
      return report.Failed(state, "run failed");
    }
  }
  std::pair<size_t, size_t> after = s.Served();
  double runs = static_cast<double>(state.iterations());
  state.counters["commands"] = (after.first - before.first) / runs;
  state.counters["transfers"] = (after.second - before.second) / runs;
  state.counters["invocations"] =
      (after.first + after.second - before.first - before.second) / runs;
}

// One run per repetition, so that the median is the median run.
const int kServiceDefault =
    static_cast<int>(s2s_service::DaemonConfig().share_parallel);

BENCHMARK(BM_NoChangeRun)
    ->Args({1, 1})
    ->Args({10, 1})
    ->Args({10, kServiceDefault})
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(1)
    ->Repetitions(10)
    ->ReportAggregatesOnly(true);
BENCHMARK(BM_NoChangeRun)
    ->Args({50, 1})
    ->Args({50, kServiceDefault})
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(1)
    ->Repetitions(5)
    ->ReportAggregatesOnly(true);

}  // namespace
