// Realtime tasks, with each change source (argument 0: inotify, 1:
// fanotify):
//
// - BM_ChangeToServer: from a small file written on the client to the same
//   file on the server, through s2sd and a real server appliance on
//   loopback, settle delay 0.2 s; median and 99th percentile over 100
//   changes. Baseline in the same run: BM_DirectPushBaseline, the same
//   push made by hand (sync start, RunSync of the file, sync end) with no
//   watcher and no delay.
// - BM_WatchSetup: a source made and every share directory of a tree of
//   100,000 directories watched, in this process: time and resident
//   memory. Baseline: BM_TreeWalkBaseline, every directory of the tree
//   listed once (what any full scan costs).
// - BM_Burst: 10,000 files created in 1,000 new directories as fast as
//   this process can; files per second created, files per second arrived
//   on the server, rsync runs, overflows and s2sd's CPU time per 10,000
//   changes. Baseline: BM_BurstCreateBaseline, the same files made with
//   nothing watching.
//
// The trees live under $S2S_BENCH_DIR (else $TMPDIR, else /tmp).
#include <benchmark/benchmark.h>
#include <dirent.h>
#include <signal.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "S2S/ipc.h"
#include "S2S/rsyncer.h"
#include "S2S/sync_obj_pobject.h"
#include "appliances.h"
#include "service/config.h"
#include "service/watch_source.h"

namespace {

using S2S::PObject;
namespace fs = std::filesystem;

const char* const kSources[] = {"inotify", "fanotify"};

double Now() {
  timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<double>(ts.tv_sec) + ts.tv_nsec / 1e9;
}

std::string BenchDir() {
  for (const char* var : {"S2S_BENCH_DIR", "TMPDIR"}) {
    const char* v = getenv(var);
    if (v != nullptr && *v != '\0') return v;
  }
  return "/tmp";
}

// Resident memory of this process in bytes.
double Rss() {
  std::string status = s2s_test::ReadFile("/proc/self/status");
  size_t at = status.find("VmRSS:");
  return at == std::string::npos ? 0 : atof(status.c_str() + at + 6) * 1024;
}

void Percentiles(benchmark::State& state, std::vector<double> d) {
  if (d.empty()) return;
  std::sort(d.begin(), d.end());
  state.counters["median_ms"] = d[d.size() / 2] * 1e3;
  state.counters["p99_ms"] = d[(d.size() * 99) / 100 - (d.size() >= 100)] * 1e3;
}

// s2sd on the client root of two appliances, with one realtime task over
// share "docs".
class Service {
 public:
  Service() : app_(S2S_CMD_HANDLER) {}
  ~Service() {
    if (pid_ > 0) {
      kill(pid_, SIGTERM);
      waitpid(pid_, nullptr, 0);
    }
  }

  bool Start(const char* source, std::string& error) {
    app_.AddShare("docs");
    if (!app_.StartServer()) return error = "the server did not start", false;
    s2s_test::WriteFile(s2s_service::ConfigPath(),
                        "[Service]\n\tbeacon_interval=\"3600\"\n");
    std::string log = tmp_.Sub("s2sd.log");
    pid_ = fork();
    if (pid_ == 0) {
      execl(S2SD_PROGRAM, S2SD_PROGRAM, "--log", log.c_str(), nullptr);
      _exit(127);
    }
    for (int i = 0; i < 500 && !Request("status")["result"].isInteger(); ++i) {
      usleep(10000);
    }
    S2S::SyncTask t;
    t.GetInfo().SetName("live");
    t.GetInfo().SetShareList({"docs"});
    t.GetInfo().SetSyncInfo(app_.Info());
    S2S::Schedule realtime;
    realtime.SetMode(S2S::SCHD_REALTIME);
    t.GetInfo().SetSchedule(realtime);
    PObject req;
    req = PObject::Map();
    S2S::SyncTask2PObj(t, req["task"]);
    req["task"].asMap().erase("id");
    req["task"]["realtime_source"] = source;
    req["task"]["realtime_settle_ms"] = 200u;
    PObject reply = Request("add", req);
    if (reply["result"].asUInt64() != 0) {
      return error = "add: " + reply["message"].asString(), false;
    }
    for (int i = 0; i < 3000 && Status()["state"].asString() != "watching";
         ++i) {
      usleep(10000);
    }
    if (Status()["source"].asString() != source) {
      return error = std::string(source) + " is not available here: " +
                     Status()["source_note"].asString(),
             false;
    }
    return true;
  }

  PObject Request(const std::string& action, PObject req = PObject()) {
    if (!req.isMap()) req = PObject::Map();
    req["action"] = action;
    S2S::IPCSender sender;
    PObject reply;
    if (sender.connect(s2s_service::SocketPath()) == 0) {
      sender.send(req, true, reply);
    }
    sender.close();
    return reply;
  }
  PObject Status() {
    const PObject reply = Request("status");
    return reply["realtime"][0u];
  }
  // CPU seconds s2sd has used.
  double CpuSeconds() const {
    std::string stat =
        s2s_test::ReadFile("/proc/" + std::to_string(pid_) + "/stat");
    size_t close = stat.rfind(')');
    if (close == std::string::npos) return 0;
    unsigned long long utime = 0, stime = 0;
    sscanf(stat.c_str() + close + 2,
           "%*c %*d %*d %*d %*d %*d %*u %*u %*u %*u %*u %llu %llu", &utime,
           &stime);
    return static_cast<double>(utime + stime) / sysconf(_SC_CLK_TCK);
  }
  std::string Client() const { return app_.ClientShare("docs"); }
  std::string Server() const { return app_.ServerShare("docs"); }
  s2s_test::Appliances& app() { return app_; }

 private:
  s2s_test::Appliances app_;
  s2s_test::TempDir tmp_;
  pid_t pid_ = -1;
};

bool Holds(const std::string& path, const std::string& content) {
  return s2s_test::ReadFile(path) == content;
}

void BM_ChangeToServer(benchmark::State& state) {
  Service svc;
  std::string error;
  if (!svc.Start(kSources[state.range(0)], error)) {
    state.SkipWithError(error.c_str());
    return;
  }
  std::vector<double> delays;
  int n = 0;
  for (auto _ : state) {
    std::string name = "/f" + std::to_string(n), content = std::to_string(n);
    ++n;
    double t0 = Now();
    s2s_test::WriteFile(svc.Client() + name, content);
    while (!Holds(svc.Server() + name, content) && Now() - t0 < 30) {
      usleep(1000);
    }
    delays.push_back(Now() - t0);
    state.SetIterationTime(delays.back());
  }
  Percentiles(state, delays);
}
BENCHMARK(BM_ChangeToServer)
    ->Arg(0)
    ->Arg(1)
    ->Iterations(100)
    ->UseManualTime()
    ->Unit(benchmark::kMillisecond);

void BM_DirectPushBaseline(benchmark::State& state) {
  s2s_test::Appliances app(S2S_CMD_HANDLER);
  app.AddShare("docs");
  if (!app.StartServer()) {
    state.SkipWithError("the server did not start");
    return;
  }
  S2S::Rsyncer rsyncer;
  std::list<std::string> conflicts;
  int status = 0;
  if (rsyncer.Initialize(app.Info()) != 0 ||
      rsyncer.DoPairing(false, {"docs"}, conflicts, status) != 0 ||
      status != 0) {
    state.SkipWithError("probe or pairing failed");
    return;
  }
  std::vector<double> delays;
  int n = 0;
  for (auto _ : state) {
    std::string name = "/f" + std::to_string(n++);
    double t0 = Now();
    s2s_test::WriteFile(app.ClientShare("docs") + name, name);
    rsyncer.StartSyncShare("docs", status);
    rsyncer.RunSync(1, "docs", name, {}, status);
    rsyncer.FinishSync("share", "docs", status);
    delays.push_back(Now() - t0);
    state.SetIterationTime(delays.back());
  }
  Percentiles(state, delays);
}
BENCHMARK(BM_DirectPushBaseline)
    ->Iterations(100)
    ->UseManualTime()
    ->Unit(benchmark::kMillisecond);

// A tree of 100,000 directories (100 x 1,000), made once per process.
const std::string& Tree() {
  static s2s_test::TempDir* dir = nullptr;
  static std::string root;
  if (dir == nullptr) {
    {
      s2s_test::ScopedEnv tmpdir("TMPDIR", BenchDir());
      dir = new s2s_test::TempDir();  // removed at exit
    }
    root = dir->Sub("tree");
    for (int a = 0; a < 100; ++a) {
      std::string top = root + "/t" + std::to_string(a);
      fs::create_directories(top);
      for (int b = 0; b < 1000; ++b) {
        mkdir((top + "/d" + std::to_string(b)).c_str(), 0755);
      }
    }
    atexit([] { delete dir; });
  }
  return root;
}

void BM_WatchSetup(benchmark::State& state) {
  const std::string& tree = Tree();
  for (auto _ : state) {
    double rss0 = Rss();
    double t0 = Now();
    std::string error;
    s2s_service::WatchLimits limits;
    std::unique_ptr<s2s_service::ChangeSource> source =
        state.range(0) == 1 ? s2s_service::MakeFanotifySource(limits, error)
                            : s2s_service::MakeInotifySource(limits, error);
    if (source == nullptr ||
        !source->Add(s2s_service::WatchedShare{"tree", tree}, error)) {
      state.SkipWithError(error.c_str());
      return;
    }
    std::vector<S2S::Event> events;
    while (source->Busy()) source->Pump(events);
    double took = Now() - t0;
    state.SetIterationTime(took);
    state.counters["setup_ms"] = took * 1e3;
    state.counters["rss_mb"] = (Rss() - rss0) / (1 << 20);
    state.counters["watches"] = static_cast<double>(source->Watches());
  }
}
BENCHMARK(BM_WatchSetup)
    ->Arg(0)
    ->Arg(1)
    ->Iterations(1)
    ->UseManualTime()
    ->Unit(benchmark::kMillisecond);

void BM_TreeWalkBaseline(benchmark::State& state) {
  const std::string& tree = Tree();
  for (auto _ : state) {
    double t0 = Now();
    size_t dirs = 0;
    std::vector<std::string> unvisited = {tree};
    while (!unvisited.empty()) {
      std::string dir = unvisited.back();
      unvisited.pop_back();
      ++dirs;
      DIR* d = opendir(dir.c_str());
      while (dirent* e = d == nullptr ? nullptr : readdir(d)) {
        if (e->d_type == DT_DIR && strcmp(e->d_name, ".") != 0 &&
            strcmp(e->d_name, "..") != 0) {
          unvisited.push_back(dir + "/" + e->d_name);
        }
      }
      if (d != nullptr) closedir(d);
    }
    state.SetIterationTime(Now() - t0);
    state.counters["dirs"] = static_cast<double>(dirs);
  }
}
BENCHMARK(BM_TreeWalkBaseline)
    ->Iterations(1)
    ->UseManualTime()
    ->Unit(benchmark::kMillisecond);

// 10,000 files in 1,000 new directories under `base`; seconds taken.
double MakeBurst(const std::string& base) {
  double t0 = Now();
  for (int d = 0; d < 1000; ++d) {
    std::string dir = base + "/d" + std::to_string(d);
    fs::create_directories(dir);
    for (int f = 0; f < 10; ++f) {
      s2s_test::WriteFile(dir + "/f" + std::to_string(f), "burst");
    }
  }
  return Now() - t0;
}

size_t CountFiles(const std::string& dir) {
  std::error_code ec;
  size_t n = 0;
  for (auto it = fs::recursive_directory_iterator(dir, ec);
       !ec && it != fs::recursive_directory_iterator(); it.increment(ec)) {
    n += it->is_regular_file(ec) ? 1 : 0;
  }
  return n;
}

void BM_Burst(benchmark::State& state) {
  Service svc;
  std::string error;
  if (!svc.Start(kSources[state.range(0)], error)) {
    state.SkipWithError(error.c_str());
    return;
  }
  int round = 0;
  for (auto _ : state) {
    std::string base = "/burst" + std::to_string(round++);
    const PObject before = svc.Status();
    double cpu0 = svc.CpuSeconds();
    double t0 = Now();
    double made = MakeBurst(svc.Client() + base);
    while (CountFiles(svc.Server() + base) < 10000 && Now() - t0 < 600) {
      usleep(50000);
    }
    double arrived = Now() - t0;
    const PObject after = svc.Status();
    state.SetIterationTime(arrived);
    state.counters["created_per_s"] = 10000 / made;
    state.counters["arrived_per_s"] = 10000 / arrived;
    state.counters["behind_s"] = arrived - made;
    state.counters["rsync_runs"] = static_cast<double>(
        after["rsync_runs"].asUInt64() - before["rsync_runs"].asUInt64());
    state.counters["batches"] = static_cast<double>(
        after["batches"].asUInt64() - before["batches"].asUInt64());
    state.counters["overflows"] = static_cast<double>(
        after["overflows"].asUInt64() - before["overflows"].asUInt64());
    state.counters["s2sd_cpu_s"] = svc.CpuSeconds() - cpu0;
  }
}
BENCHMARK(BM_Burst)->Arg(0)->Arg(1)->Iterations(1)->UseManualTime()->Unit(
    benchmark::kMillisecond);

// The same files made with nothing watching: how fast this machine makes
// them at all.
void BM_BurstCreateBaseline(benchmark::State& state) {
  s2s_test::ScopedEnv tmpdir("TMPDIR", BenchDir());
  s2s_test::TempDir dir;
  for (auto _ : state) {
    double made = MakeBurst(dir.Sub("burst"));
    state.SetIterationTime(made);
    state.counters["created_per_s"] = 10000 / made;
  }
}
BENCHMARK(BM_BurstCreateBaseline)
    ->Iterations(1)
    ->UseManualTime()
    ->Unit(benchmark::kMillisecond);

}  // namespace
