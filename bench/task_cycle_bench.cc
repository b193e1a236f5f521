// What a sync task costs through the Rsyncer against bare rsync to the same
// daemon in the same run:
//   - one command round trip (a beacon, which writes the server's registry,
//     and a version query, which does not) against the floor of a pull: a
//     bare pull of one tiny file with the options the wrapper gives a
//     command (transport, -v, --max-size, --info=skip1) and an early input
//     of a command's size, from a module of the same daemon without hooks;
//     the version query, a probe and so without -v, against the same pull
//     without -v; and against a tiny bare push to that module.
//     BM_CommandVsFloor runs them in turn and reports the ratios;
//     every bare rsync runs through the client's own runner, as a command's
//     rsync does, and the pull once more as a plain fork and exec (below);
//     BM_CommandCpuVsFloor compares the CPU time behind each, which the
//     machine's load does not stretch;
//   - a full task cycle (probe, pair, start, RunSync, finish share and task)
//     on a tree of about 200 MB in 3000 files against bare rsync with the
//     options the wrapper gives the transfer (-a -H --sparse --delete
//     --numeric-ids --whole-file --partial-dir -A -X, transport, -v), for a
//     first sync into an empty share and for a re-sync without changes;
//   - RunSync alone on the re-sync.
// Every bare rsync's output goes through a pipe that is read to its end, as
// the wrapper reads it.
// At the end of a pull, rsync's client signals its receiver and polls for
// its end in 20 ms sleeps; it pays no sleep only when the receiver was
// asleep, is woken on the parent's CPU and runs first. That is decided by
// where the two processes happen to run, which even how the caller starts
// and waits for rsync tips: started as the client starts it (a session of
// its own, waiting for the exec, polling), a bare pull pays the sleep as a
// command does; started by a plain fork and exec and a blocking read, back
// to back, it escaped it in most runs on a 2-core machine
// (BM_BarePullFloor/1). "plain_floor_ms" is that pull between the others.
// The bare pushes of the tree go to a second share whose sync the client
// holds open, so that both pass the daemon's same guard hook.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include "S2S/rsyncer.h"
#include "appliances.h"
#include "karo/rsync_wrapper.h"
#include "rsync_child.h"

extern char** environ;

namespace {

const int kFiles = 3000;
const int kFilesPerDir = 100;
const uint64_t kTreeBytes = 200ull << 20;

// The wrapper's debug lines (rsync -v output) are dropped, as the client
// program drops them unless asked for.
void QuietLog(int, const char*) {}

uint64_t SplitMix(uint64_t& s) {
  uint64_t z = (s += 0x9e3779b97f4a7c15ull);
  z = (z ^ (z >> 30)) * 0xbf58476d1ce4e5b9ull;
  z = (z ^ (z >> 27)) * 0x94d049bb133111ebull;
  return z ^ (z >> 31);
}

// kFiles files of random sizes (mean kTreeBytes / kFiles) and random
// content in sub-directories of kFilesPerDir.
bool MakeTree(const std::string& dir) {
  uint64_t seed = 42;
  std::vector<uint64_t> buf(1 << 16);
  const uint64_t mean = kTreeBytes / kFiles;
  for (int i = 0; i < kFiles; ++i) {
    std::string sub = dir + "/d" + std::to_string(i / kFilesPerDir);
    if (i % kFilesPerDir == 0) std::filesystem::create_directories(sub);
    uint64_t size = SplitMix(seed) % (2 * mean);
    std::ofstream out(sub + "/f" + std::to_string(i), std::ios::binary);
    for (uint64_t left = size; left > 0;) {
      size_t words = std::min<uint64_t>(buf.size(), (left + 7) / 8);
      for (size_t w = 0; w < words; ++w) buf[w] = SplitMix(seed);
      size_t bytes = std::min<uint64_t>(left, words * 8);
      out.write(reinterpret_cast<const char*>(buf.data()), bytes);
      left -= bytes;
    }
    if (!out) return false;
  }
  return true;
}

void Empty(const std::string& dir) {
  for (const auto& e : std::filesystem::directory_iterator(dir)) {
    std::filesystem::remove_all(e.path());
  }
}

// The options the wrapper gives rsync over a daemon socket: its time-outs
// (60 s for a command, 600 s for a transfer; the connection's at most 15 s)
// and -v, since neither a command nor a transfer is a test task.
std::vector<std::string> Transport(int timeout) {
  return {"--timeout=" + std::to_string(timeout), "--contimeout=15",
          "--sockopts=TCP_NODELAY", "-v"};
}

struct Bench {
  s2s_test::Appliances app{S2S_CMD_HANDLER};
  std::string base;   // rsync://user@127.0.0.1:port/
  std::string url;    // the bare pushes' destination
  std::string floor;  // the module without hooks
  std::string early;  // an early input of a command's size
  std::string tiny;   // the tiny push's file
  bool ok = false;

  Bench() {
    KARO::Backup::RsyncWrapper::setLogHandler(QuietLog);
    ok = app.AddShare("cycle") && app.AddShare("bare") && app.StartServer() &&
         MakeTree(app.ClientShare("cycle")) && AddFloorModule();
    tiny = app.client_root() + "/tiny";
    std::ofstream(tiny) << "x";
    base = "rsync://" + app.user() +
           "@127.0.0.1:" + std::to_string(app.daemon().port()) + "/";
    url = base + "bare/";
    // The client holds the bare share's sync, so the guard lets it in.
    S2S::Rsyncer r;
    int status = -1;
    ok = ok && r.Initialize(app.Info()) == 0 &&
         r.StartSyncShare("bare", status) == 0 && status == 0;
    // The tree's 200 MB are written back now rather than under the first
    // measurements, where the journal made every file created (a reply, a
    // pulled file) wait.
    sync();
  }

  // A module of the same daemon with the same users and no hooks, holding
  // one tiny file. The daemon reads its configuration for every connection.
  bool AddFloorModule() {
    std::string dir = app.server_root() + "/floor";
    early = app.client_root() + "/early";
    std::filesystem::create_directories(dir);
    std::ofstream(dir + "/tiny") << "status=0\n";
    std::ofstream(early) << "command=\"S2S_UpdateTaskStatus\"\n"
                            "clientID=\"0011AABBCCDD-client-a\"\n"
                            "taskName=\"bench\"\n"
                            "requestID=\"0123456789abcdef0123456789abcdef\"\n";
    const std::string path = app.server_root() + "/etc/s2s/rsyncd.conf";
    std::string conf;
    {
      std::ifstream in(path);
      conf.assign(std::istreambuf_iterator<char>(in), {});
    }
    size_t auth = conf.find("\tauth users");
    size_t end = conf.find("\n", conf.find("\tsecrets file", auth));
    if (auth == std::string::npos || end == std::string::npos) return false;
    std::ofstream out(path, std::ios::app);
    out << "[floor]\n\tpath = " << dir << "\n\tread only = no\n\tlist = no\n"
        << conf.substr(auth, end + 1 - auth);
    return static_cast<bool>(out);
  }

  // Runs rsync with `args` and the password in its environment only, its
  // output read to the end and dropped: through the client's runner, or
  // `plain`ly by a fork and exec and a blocking read.
  int Rsync(const std::vector<std::string>& args, bool plain = false) {
    if (!plain) {
      std::vector<std::string> a = args;
      a.insert(a.begin(), "rsync");
      return KARO::Backup::detail::RunRsync(a, app.Info().GetPassword(), {})
          .status;
    }
    std::vector<std::string> env_store = {"RSYNC_PASSWORD=" +
                                          app.Info().GetPassword()};
    for (char** e = environ; *e != nullptr; ++e) env_store.push_back(*e);
    std::vector<char*> env, argv;
    for (std::string& e : env_store) env.push_back(&e[0]);
    env.push_back(nullptr);
    std::vector<std::string> a = args;
    a.insert(a.begin(), "rsync");
    for (std::string& s : a) argv.push_back(&s[0]);
    argv.push_back(nullptr);
    int out[2];
    if (pipe2(out, O_CLOEXEC) != 0) return -1;
    pid_t pid = fork();
    if (pid < 0) return -1;
    if (pid == 0) {
      dup2(out[1], 1);
      dup2(out[1], 2);
      execvpe("rsync", argv.data(), env.data());
      _exit(127);
    }
    close(out[1]);
    char buf[4096];
    while (read(out[0], buf, sizeof buf) > 0) {
    }
    close(out[0]);
    int st = 0;
    waitpid(pid, &st, 0);
    return WIFEXITED(st) ? WEXITSTATUS(st) : -1;
  }

  // probe, pair, start, RunSync, finish share and task.
  bool Cycle() {
    S2S::Rsyncer r;
    std::list<std::string> conflicts;
    int status = -1;
    return r.Initialize(app.Info()) == 0 &&
           r.DoPairing(false, {"cycle"}, conflicts, status) == 0 &&
           status == 0 && conflicts.empty() &&
           r.StartSyncShare("cycle", status) == 0 && status == 0 &&
           r.RunSync(1, "cycle", "/", {}, status) == 0 && status == 0 &&
           r.FinishSync("share", "cycle", status) == 0 && status == 0 &&
           r.FinishSync("task", "bench", status) == 0 && status == 0;
  }

  // The transfer's own options, as the wrapper gives them to RunSync.
  bool Bare() {
    std::vector<std::string> args = {"-a",
                                     "-H",
                                     "--sparse",
                                     "--delete",
                                     "--numeric-ids",
                                     "--whole-file",
                                     "--partial-dir=.s2s-partial",
                                     "-A",
                                     "-X"};
    for (const std::string& o : Transport(600)) args.push_back(o);
    args.insert(args.end(), {"--", app.ClientShare("cycle") + "/", url});
    return Rsync(args) == 0;
  }

  // A command's pull without the command: one tiny file from the module
  // without hooks, with an early input, into a fresh place. A probe's
  // commands run without -v, which changes how often rsync's client waits
  // 20 ms for its receiver at the end.
  bool FloorPull(bool verbose = true, bool plain = false) {
    std::string dest = app.client_root() + "/pulled";
    std::filesystem::remove_all(dest);
    std::vector<std::string> args = Transport(60);
    if (!verbose) args.pop_back();
    args.insert(args.end(),
                {"--early-input=" + early, "--max-size=1048576", "--info=skip1",
                 "--", base + "floor/tiny", dest + "/"});
    return Rsync(args, plain) == 0;
  }

  // The push floor: one tiny file into the module without hooks.
  bool TinyPush() {
    std::vector<std::string> args = Transport(60);
    args.insert(args.end(), {"--", tiny, base + "floor/pushed"});
    return Rsync(args) == 0;
  }
};

// CPU seconds used so far by this process, its waited-for children (the
// client's rsync runs) and the children the server daemon `daemon` has
// reaped (its connections, with the hooks they waited for).
double Cpu(pid_t daemon) {
  rusage self, children;
  getrusage(RUSAGE_SELF, &self);
  getrusage(RUSAGE_CHILDREN, &children);
  auto seconds = [](const timeval& t) { return t.tv_sec + t.tv_usec / 1e6; };
  double cpu = seconds(self.ru_utime) + seconds(self.ru_stime) +
               seconds(children.ru_utime) + seconds(children.ru_stime);
  std::ifstream in("/proc/" + std::to_string(daemon) + "/stat");
  std::string stat((std::istreambuf_iterator<char>(in)), {});
  size_t paren = stat.rfind(')');
  if (paren == std::string::npos) return cpu;
  // After the name: state and 11 fields, then utime, stime, cutime, cstime.
  std::istringstream fields(stat.substr(paren + 2));
  std::string field;
  for (int i = 0; i < 13; ++i) fields >> field;
  long cutime = 0, cstime = 0;
  fields >> cutime >> cstime;
  return cpu + static_cast<double>(cutime + cstime) / sysconf(_SC_CLK_TCK);
}

// Destroyed at exit: the daemon stopped, the tree removed.
Bench& TheBench() {
  static Bench bench;
  return bench;
}

void BM_CommandRoundTrip(benchmark::State& state) {
  Bench& b = TheBench();
  if (!b.ok) return state.SkipWithError("no server");
  S2S::Rsyncer r;
  if (r.Initialize(b.app.Info()) != 0) return state.SkipWithError("probe");
  for (auto _ : state) {
    int status = -1;
    if (r.SendBeacon("bench", status) != 0 || status != 0) {
      return state.SkipWithError("beacon failed");
    }
  }
}

// A command that only reads on the server (no registry write).
void BM_VersionRoundTrip(benchmark::State& state) {
  Bench& b = TheBench();
  if (!b.ok) return state.SkipWithError("no server");
  S2S::Rsyncer r;
  if (r.Initialize(b.app.Info()) != 0) return state.SkipWithError("probe");
  for (auto _ : state) {
    if (r.GetServerVersion() <= 0) {
      return state.SkipWithError("version query failed");
    }
  }
}

// state.range(0): 1 for the plain pull.
void BM_BarePullFloor(benchmark::State& state) {
  Bench& b = TheBench();
  if (!b.ok) return state.SkipWithError("no server");
  for (auto _ : state) {
    if (!b.FloorPull(true, state.range(0) == 1)) {
      return state.SkipWithError("pull failed");
    }
  }
}

void BM_BareTinyPush(benchmark::State& state) {
  Bench& b = TheBench();
  if (!b.ok) return state.SkipWithError("no server");
  for (auto _ : state) {
    if (!b.TinyPush()) return state.SkipWithError("push failed");
  }
}

// A floor pull, a beacon, a floor pull without -v, a version query, a tiny
// push and a plain floor pull in turn, so that all see the same load: the
// time is the beacon's, "floor_ms" the pull's, "push_ms" the push's,
// "ratio" and "push_ratio" the beacon's over each, "version_ratio" the
// query's (a command that writes no registry, so no fsync) over the pull
// without -v, "quiet_floor_ms"; "plain_ratio" the beacon's over the plain
// pull. With one iteration per repetition, the median of a ratio is the
// median pair's.
void BM_CommandVsFloor(benchmark::State& state) {
  using Clock = std::chrono::steady_clock;
  Bench& b = TheBench();
  if (!b.ok) return state.SkipWithError("no server");
  S2S::Rsyncer r;
  if (r.Initialize(b.app.Info()) != 0) return state.SkipWithError("probe");
  double command = 0, floor = 0, push = 0, version = 0, quiet = 0, plain = 0;
  auto seconds = [](Clock::time_point from, Clock::time_point to) {
    return std::chrono::duration<double>(to - from).count();
  };
  for (auto _ : state) {
    auto t0 = Clock::now();
    if (!b.FloorPull()) return state.SkipWithError("pull failed");
    auto t1 = Clock::now();
    int status = -1;
    if (r.SendBeacon("bench", status) != 0 || status != 0) {
      return state.SkipWithError("beacon failed");
    }
    auto t2 = Clock::now();
    if (!b.FloorPull(false)) return state.SkipWithError("pull failed");
    auto t3 = Clock::now();
    if (r.GetServerVersion() <= 0) {
      return state.SkipWithError("version query failed");
    }
    auto t4 = Clock::now();
    if (!b.TinyPush()) return state.SkipWithError("push failed");
    auto t5 = Clock::now();
    if (!b.FloorPull(true, true)) return state.SkipWithError("pull failed");
    auto t6 = Clock::now();
    floor += seconds(t0, t1);
    command += seconds(t1, t2);
    quiet += seconds(t2, t3);
    version += seconds(t3, t4);
    push += seconds(t4, t5);
    plain += seconds(t5, t6);
    state.SetIterationTime(seconds(t1, t2));
  }
  state.counters["floor_ms"] = floor * 1e3 / state.iterations();
  state.counters["quiet_floor_ms"] = quiet * 1e3 / state.iterations();
  state.counters["push_ms"] = push * 1e3 / state.iterations();
  state.counters["version_ms"] = version * 1e3 / state.iterations();
  state.counters["ratio"] = command / floor;
  state.counters["push_ratio"] = command / push;
  state.counters["version_ratio"] = version / quiet;
  state.counters["plain_floor_ms"] = plain * 1e3 / state.iterations();
  state.counters["plain_ratio"] = command / plain;
}

// The CPU time behind a floor pull and behind a beacon, 20 of each per
// repetition: "cpu_floor_ms" and "cpu_command_ms" per call, "cpu_ratio" the
// one over the other. The daemon reaps its connections after they end, so
// each batch is given a moment before it is read. Not counted: the cleaner
// a command's hook leaves behind, which no process waits for.
void BM_CommandCpuVsFloor(benchmark::State& state) {
  const int kCalls = 20;
  Bench& b = TheBench();
  if (!b.ok) return state.SkipWithError("no server");
  S2S::Rsyncer r;
  if (r.Initialize(b.app.Info()) != 0) return state.SkipWithError("probe");
  const pid_t daemon = b.app.daemon().pid();
  double command = 0, floor = 0;
  for (auto _ : state) {
    double c0 = Cpu(daemon);
    for (int i = 0; i < kCalls; ++i) {
      if (!b.FloorPull()) return state.SkipWithError("pull failed");
    }
    usleep(300000);
    double c1 = Cpu(daemon);
    for (int i = 0; i < kCalls; ++i) {
      int status = -1;
      if (r.SendBeacon("bench", status) != 0 || status != 0) {
        return state.SkipWithError("beacon failed");
      }
    }
    usleep(300000);
    double c2 = Cpu(daemon);
    floor += c1 - c0;
    command += c2 - c1;
  }
  double calls = static_cast<double>(kCalls) * state.iterations();
  state.counters["cpu_floor_ms"] = floor * 1e3 / calls;
  state.counters["cpu_command_ms"] = command * 1e3 / calls;
  state.counters["cpu_ratio"] = command / floor;
}

// state.range(0): 1 for a first sync into an empty share, 0 for a re-sync.
void BM_FullCycle(benchmark::State& state) {
  Bench& b = TheBench();
  if (!b.ok) return state.SkipWithError("no server");
  if (!b.Cycle()) return state.SkipWithError("cycle failed");
  for (auto _ : state) {
    if (state.range(0) == 1) {
      state.PauseTiming();
      Empty(b.app.ServerShare("cycle"));
      sync();  // each first sync starts with nothing left to write back
      state.ResumeTiming();
    }
    if (!b.Cycle()) return state.SkipWithError("cycle failed");
  }
}

void BM_BareRsync(benchmark::State& state) {
  Bench& b = TheBench();
  if (!b.ok) return state.SkipWithError("no server");
  if (!b.Bare()) return state.SkipWithError("rsync failed");
  for (auto _ : state) {
    if (state.range(0) == 1) {
      state.PauseTiming();
      Empty(b.app.ServerShare("bare"));
      sync();  // each first sync starts with nothing left to write back
      state.ResumeTiming();
    }
    if (!b.Bare()) return state.SkipWithError("rsync failed");
  }
}

// The transfer alone, re-sync: the wrapper's options against bare rsync's.
void BM_RunSyncOnly(benchmark::State& state) {
  Bench& b = TheBench();
  if (!b.ok) return state.SkipWithError("no server");
  S2S::Rsyncer r;
  int status = -1;
  if (r.Initialize(b.app.Info()) != 0 ||
      r.StartSyncShare("cycle", status) != 0 || status != 0) {
    return state.SkipWithError("start failed");
  }
  if (r.RunSync(1, "cycle", "/", {}, status) != 0 || status != 0) {
    return state.SkipWithError("RunSync failed");
  }
  for (auto _ : state) {
    if (r.RunSync(1, "cycle", "/", {}, status) != 0 || status != 0) {
      return state.SkipWithError("RunSync failed");
    }
  }
  r.FinishSync("share", "cycle", status);
}

// One call per repetition, so that the median is the median call.
BENCHMARK(BM_CommandRoundTrip)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(1)
    ->Repetitions(30)
    ->ReportAggregatesOnly(true);
BENCHMARK(BM_VersionRoundTrip)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(1)
    ->Repetitions(30)
    ->ReportAggregatesOnly(true);
BENCHMARK(BM_BarePullFloor)
    ->Arg(0)
    ->Arg(1)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(1)
    ->Repetitions(30)
    ->ReportAggregatesOnly(true);
BENCHMARK(BM_BareTinyPush)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(1)
    ->Repetitions(30)
    ->ReportAggregatesOnly(true);
BENCHMARK(BM_CommandVsFloor)
    ->UseManualTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(1)
    ->Repetitions(30)
    ->ReportAggregatesOnly(true);
BENCHMARK(BM_CommandCpuVsFloor)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(1)
    ->Repetitions(5)
    ->ReportAggregatesOnly(true);
// Interleaved: first syncs, then re-syncs, each against its bare twin.
BENCHMARK(BM_FullCycle)
    ->Arg(1)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(3);
BENCHMARK(BM_BareRsync)
    ->Arg(1)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(3);
BENCHMARK(BM_FullCycle)
    ->Arg(0)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(10);
BENCHMARK(BM_BareRsync)
    ->Arg(0)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(10);
BENCHMARK(BM_RunSyncOnly)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(10);

}  // namespace
