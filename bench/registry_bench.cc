// How the server's registry scales with the number of shares it records:
// one S2SServerUpdateShare, and one "S2S_SyncStart" through the command
// handler (its whole path through the registry and the share configuration),
// against registries of 10 / 100 / 1,000 / 10,000 share sections. The
// appliance has as many shares configured as the registry records. Beside
// them, the floor of any registry write: the file of that size written
// through the same atomic replace (temporary file, fsync, rename, fsync of
// the directory), which no parsing can avoid.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <stdlib.h>
#include <unistd.h>

#include <memory>
#include <string>

#include "S2S/is_syncedshare.h"
#include "command_file.h"
#include "command_handler.h"
#include "protocol.h"
#include "testutil.h"

namespace {

struct HashFree {
  void operator()(KSZHASH* h) const { KLIBCSzHashFree(h); }
};

// A server root whose registry and share configuration hold `n` shares, the
// client "bench-client" paired and the last to complete a sync of each.
class Registry {
 public:
  explicit Registry(int n) {
    std::string registry =
        "[PairedClientInfo]\n\ts2sEnabled=\"yes\"\n"
        "\tclientID=\"S2SMULTI-SRC-SUPPORT\"\n"
        "\tserverName=\"S2SMULTI-SRC-SUPPORT\"\n";
    std::string shares;
    for (int i = 0; i < n; ++i) {
      std::string name = Share(i);
      registry += "[SHARE_" + name +
                  "]\n\tRunningID=\"\"\n\tRunningHost=\"\"\n"
                  "\tRunningUser=\"\"\n\tvolumeName=\"/volume1\"\n"
                  "\tCompleteID=\"bench-client\"\n";
      shares += "[" + name + "]\n\tpath=\"" + root_.path() + "/data/" + name +
                "\"\n\tvolume=\"/volume1\"\n\tvolume_type=\"1\"\n";
    }
    ok_ = root_.Write("/usr/karo/etc/karoS2S.info", registry) &&
          root_.Write("/etc/s2s/shares.conf", shares);
  }

  bool ok() const { return ok_; }
  std::string File() const { return root_.Path("/usr/karo/etc/karoS2S.info"); }
  static std::string Share(int i) { return "share" + std::to_string(i); }

 private:
  s2s_test::TempRoot root_;
  bool ok_ = false;
};

// The share in the middle of the file: neither the first section found nor
// the last.
std::string Middle(int n) { return Registry::Share(n / 2); }

void BM_UpdateShare(benchmark::State& state) {
  const int n = static_cast<int>(state.range(0));
  Registry reg(n);
  std::unique_ptr<KSZHASH, HashFree> values(KLIBCSzHashAlloc(16));
  if (!reg.ok() || !values ||
      KLIBCSzHashSetValue(values.get(), "CompleteID", "bench-client") != 0) {
    return state.SkipWithError("setup failed");
  }
  const std::string share = Middle(n);
  for (auto _ : state) {
    if (S2SServerUpdateShare(share.c_str(), values.get()) != 0) {
      return state.SkipWithError("update failed");
    }
  }
}

void BM_SyncStart(benchmark::State& state) {
  using namespace S2S::server;
  const int n = static_cast<int>(state.range(0));
  Registry reg(n);
  CommandFile cmd;
  std::string why;
  if (!reg.ok() ||
      ParseCommandFile("command=\"S2S_SyncStart\"\nclientID=\"bench-client\"\n"
                       "volumeName=\"/volume1\"\nshareName=\"" +
                           Middle(n) + "\"\n",
                       &cmd, &why) != kOk) {
    return state.SkipWithError("setup failed");
  }
  HandlerContext ctx;
  ctx.peer_address = "127.0.0.1";
  ctx.peer_user = "bench";
  std::string answer;
  for (auto _ : state) {
    if (HandleCommand(cmd, ctx, &answer) != kOk) {
      return state.SkipWithError("S2S_SyncStart refused");
    }
  }
}

void BM_AtomicReplaceFloor(benchmark::State& state) {
  Registry reg(static_cast<int>(state.range(0)));
  const std::string file = reg.File();
  const std::string text = s2s_test::ReadFile(file);
  const std::string dir = file.substr(0, file.rfind('/'));
  if (!reg.ok() || text.empty()) return state.SkipWithError("setup failed");
  for (auto _ : state) {
    std::string tmp = dir + "/.floor.XXXXXX";
    int fd = mkstemp(&tmp[0]);
    bool ok = fd >= 0 &&
              write(fd, text.data(), text.size()) ==
                  static_cast<ssize_t>(text.size()) &&
              fsync(fd) == 0;
    ok = fd >= 0 && close(fd) == 0 && ok &&
         rename(tmp.c_str(), file.c_str()) == 0;
    int dfd = open(dir.c_str(), O_RDONLY | O_DIRECTORY);
    ok = ok && dfd >= 0 && fsync(dfd) == 0;
    if (dfd >= 0) close(dfd);
    if (!ok) return state.SkipWithError("write failed");
  }
}

// Five repetitions each: medians, as the machine's load comes and goes.
BENCHMARK(BM_UpdateShare)
    ->RangeMultiplier(10)
    ->Range(10, 10000)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Repetitions(5)
    ->ReportAggregatesOnly(true);
BENCHMARK(BM_SyncStart)
    ->RangeMultiplier(10)
    ->Range(10, 10000)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Repetitions(5)
    ->ReportAggregatesOnly(true);
BENCHMARK(BM_AtomicReplaceFloor)
    ->RangeMultiplier(10)
    ->Range(10, 10000)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Repetitions(5)
    ->ReportAggregatesOnly(true);

}  // namespace
