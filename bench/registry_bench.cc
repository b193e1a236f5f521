// How the server's registry scales with the number of shares it records:
// one S2SServerUpdateShare, and one "S2S_SyncStart" through the command
// handler (its whole path through the registry and the share configuration),
// against registries of 10 / 100 / 1,000 / 10,000 share sections. The
// appliance has as many shares configured as the registry records.
#include <benchmark/benchmark.h>

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

BENCHMARK(BM_UpdateShare)
    ->RangeMultiplier(10)
    ->Range(10, 10000)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond);
BENCHMARK(BM_SyncStart)
    ->RangeMultiplier(10)
    ->Range(10, 10000)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond);

}  // namespace
