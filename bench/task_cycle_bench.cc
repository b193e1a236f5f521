// What a sync task costs through the Rsyncer against bare rsync to the same
// daemon in the same run:
//   - one command round trip (a beacon, which writes the server's registry,
//     and a version query, which does not) against the smallest bare push;
//   - a full task cycle (probe, pair, start, RunSync, finish share and task)
//     on a tree of about 200 MB in 3000 files against
//     `rsync -a --delete --numeric-ids` of the same tree, for a first sync
//     into an empty share and for a re-sync without changes;
//   - RunSync alone on the re-sync, which separates the transfer's own
//     options from the commands around it.
// The bare pushes go to a second share whose sync the client holds open, so
// that both pass the daemon's same guard hook.
#include <benchmark/benchmark.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "S2S/rsyncer.h"
#include "appliances.h"
#include "karo/rsync_wrapper.h"

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

struct Bench {
  s2s_test::Appliances app{S2S_CMD_HANDLER};
  std::string url;  // the bare pushes' destination
  bool ok = false;

  Bench() {
    KARO::Backup::RsyncWrapper::setLogHandler(QuietLog);
    ok = app.AddShare("cycle") && app.AddShare("bare") && app.StartServer() &&
         MakeTree(app.ClientShare("cycle"));
    url = "rsync://" + app.user() +
          "@127.0.0.1:" + std::to_string(app.daemon().port()) + "/bare/";
    // The client holds the bare share's sync, so the guard lets it in.
    S2S::Rsyncer r;
    int status = -1;
    ok = ok && r.Initialize(app.Info()) == 0 &&
         r.StartSyncShare("bare", status) == 0 && status == 0;
  }

  // Runs rsync with `args` and the password in its environment only.
  int Rsync(const std::vector<std::string>& args) {
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
    pid_t pid = fork();
    if (pid < 0) return -1;
    if (pid == 0) {
      execvpe("rsync", argv.data(), env.data());
      _exit(127);
    }
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

  // `nodelay` adds the socket option the wrapper always sets: without it
  // the client's small writes wait for acknowledgements (Nagle).
  bool Bare(bool nodelay) {
    std::vector<std::string> args = {"-a", "--delete", "--numeric-ids"};
    if (nodelay) args.push_back("--sockopts=TCP_NODELAY");
    args.push_back(app.ClientShare("cycle") + "/");
    args.push_back(url);
    return Rsync(args) == 0;
  }
};

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

void BM_BareTinyPush(benchmark::State& state) {
  Bench& b = TheBench();
  if (!b.ok) return state.SkipWithError("no server");
  std::string tiny = b.app.client_root() + "/tiny";
  std::ofstream(tiny) << "x";
  for (auto _ : state) {
    if (b.Rsync({"--sockopts=TCP_NODELAY", tiny, b.url + "tiny"}) != 0) {
      return state.SkipWithError("push failed");
    }
  }
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
      state.ResumeTiming();
    }
    if (!b.Cycle()) return state.SkipWithError("cycle failed");
  }
}

// state.range(1): 1 adds --sockopts=TCP_NODELAY.
void BM_BareRsync(benchmark::State& state) {
  Bench& b = TheBench();
  if (!b.ok) return state.SkipWithError("no server");
  bool nodelay = state.range(1) == 1;
  if (!b.Bare(nodelay)) return state.SkipWithError("rsync failed");
  for (auto _ : state) {
    if (state.range(0) == 1) {
      state.PauseTiming();
      Empty(b.app.ServerShare("bare"));
      state.ResumeTiming();
    }
    if (!b.Bare(nodelay)) return state.SkipWithError("rsync failed");
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
BENCHMARK(BM_BareTinyPush)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(1)
    ->Repetitions(30)
    ->ReportAggregatesOnly(true);
// Interleaved: first syncs, then re-syncs, each against its bare twin.
BENCHMARK(BM_FullCycle)
    ->Arg(1)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(3);
BENCHMARK(BM_BareRsync)
    ->Args({1, 0})
    ->Args({1, 1})
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(3);
BENCHMARK(BM_FullCycle)
    ->Arg(0)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(10);
BENCHMARK(BM_BareRsync)
    ->Args({0, 0})
    ->Args({0, 1})
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(10);
BENCHMARK(BM_RunSyncOnly)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(10);

}  // namespace
