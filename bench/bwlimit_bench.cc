// The task's bandwidth limit on a push of 200 MB of random data (so that
// compression cannot shrink it) through the Rsyncer: the rate achieved at a
// limit of 5000 KiB/s, with and without compression, beside the unlimited
// push of the same file in the same run. Counters: "KiB_per_s" achieved
// (file bytes over the push's wall time), "limit_KiB_per_s" and "of_limit"
// (achieved / limit; the limit holds when it stays within 0.9-1.1).
#include <benchmark/benchmark.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "S2S/rsyncer.h"
#include "appliances.h"
#include "karo/rsync_wrapper.h"

namespace {

const uint64_t kFileBytes = 200ull << 20;
const unsigned int kLimit = 5000;  // KiB/s

void QuietLog(int, const char*) {}

bool WriteRandom(const std::string& path) {
  uint64_t s = 7;
  std::vector<uint64_t> buf(1 << 16);
  std::ofstream out(path, std::ios::binary);
  for (uint64_t left = kFileBytes; left > 0;) {
    for (uint64_t& w : buf) {
      uint64_t z = (s += 0x9e3779b97f4a7c15ull);
      z = (z ^ (z >> 30)) * 0xbf58476d1ce4e5b9ull;
      z = (z ^ (z >> 27)) * 0x94d049bb133111ebull;
      w = z ^ (z >> 31);
    }
    size_t bytes = std::min<uint64_t>(left, buf.size() * 8);
    out.write(reinterpret_cast<const char*>(buf.data()), bytes);
    left -= bytes;
  }
  return static_cast<bool>(out);
}

struct Bench {
  s2s_test::Appliances app{S2S_CMD_HANDLER};
  bool ok = false;

  Bench() {
    KARO::Backup::RsyncWrapper::setLogHandler(QuietLog);
    ok = app.AddShare("bw") && app.StartServer() &&
         WriteRandom(app.ClientShare("bw") + "/blob");
  }

  // One push of the file into an empty server share; its wall time in
  // seconds, or -1 on failure.
  double Push(unsigned int limit, bool compress) {
    std::filesystem::remove(app.ServerShare("bw") + "/blob");
    S2S::SyncInfo info = app.Info();
    info.SetMaxBandwidth(limit);
    info.SetCompression(compress);
    S2S::Rsyncer r;
    std::list<std::string> conflicts;
    int status = -1;
    if (r.Initialize(info) != 0 ||
        r.DoPairing(false, {"bw"}, conflicts, status) != 0 || status != 0 ||
        r.StartSyncShare("bw", status) != 0 || status != 0) {
      return -1;
    }
    auto t0 = std::chrono::steady_clock::now();
    if (r.RunSync(1, "bw", "/", {}, status) != 0 || status != 0) return -1;
    std::chrono::duration<double> took = std::chrono::steady_clock::now() - t0;
    r.FinishSync("share", "bw", status);
    return took.count();
  }
};

Bench& TheBench() {
  static Bench bench;
  return bench;
}

// Arguments: the limit in KiB/s (0: none), compression on (1) or off (0).
void BM_Push200MB(benchmark::State& state) {
  Bench& b = TheBench();
  if (!b.ok) {
    state.SkipWithError("appliances not set up");
    return;
  }
  unsigned int limit = static_cast<unsigned int>(state.range(0));
  double seconds = 0;
  for (auto _ : state) {
    seconds = b.Push(limit, state.range(1) != 0);
    if (seconds <= 0) {
      state.SkipWithError("push failed");
      return;
    }
    state.SetIterationTime(seconds);
  }
  double rate = kFileBytes / 1024.0 / seconds;
  state.counters["KiB_per_s"] = rate;
  state.counters["limit_KiB_per_s"] = limit;
  if (limit > 0) state.counters["of_limit"] = rate / limit;
}
BENCHMARK(BM_Push200MB)
    ->ArgNames({"limit", "compress"})
    ->Args({0, 0})
    ->Args({kLimit, 0})
    ->Args({kLimit, 1})
    ->Iterations(1)
    ->UseManualTime()
    ->Unit(benchmark::kSecond);

}  // namespace
