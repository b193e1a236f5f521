// One command round trip through the server's real daemon and handler,
// against the smallest bare rsync push to the same daemon in the same run:
// what the command channel costs on top of an rsync connection.
#include <benchmark/benchmark.h>
#include <unistd.h>

#include <filesystem>
#include <memory>

#include "daemon_config.h"
#include "karo/rsync_wrapper.h"
#include "testutil.h"

namespace {

using KARO::Backup::RsyncWrapper;

const char kUser[] = "s2s";
const char kPassword[] = "bench-Secret";

struct Server {
  s2s_test::TempDir tmp;
  s2s_test::ScopedEnv root{"S2S_ROOT", tmp.path()};
  s2s_test::RsyncDaemon daemon{tmp.path()};
  std::unique_ptr<s2s_test::ScopedEnv> port;
  bool ok = false;

  Server() {
    std::filesystem::create_directories(tmp.Sub("etc/s2s"));
    std::filesystem::create_directories(tmp.Sub("share1"));
    s2s_test::WriteFile(tmp.Sub("etc/s2s/shares.conf"),
                        "[share1]\n\tpath=\"" + tmp.Sub("share1") + "\"\n");
    s2s_test::WriteFile(tmp.Sub("tiny"), "x");
    S2S::server::DaemonConfig c;
    c.handler = S2S_CMD_HANDLER;
    c.user = kUser;
    c.password = kPassword;
    c.uid = geteuid();
    c.gid = getegid();
    ok = S2S::server::WriteDaemonConfig(c) == 0 &&
         daemon.StartWithConfig(S2S::server::DaemonConfigPath());
    if (ok) {
      port.reset(new s2s_test::ScopedEnv("S2S_RSYNC_PORT",
                                         std::to_string(daemon.port())));
    }
  }
};

// Destroyed at exit, which stops the daemon and removes its tree.
Server& TheServer() {
  static Server server;
  return server;
}

void BM_CommandRoundTrip(benchmark::State& state) {
  Server& s = TheServer();
  if (!s.ok) state.SkipWithError("no daemon");
  std::string out = s.tmp.Sub("answer");
  for (auto _ : state) {
    RsyncWrapper w;
    w.setKaroAuth(true, true);
    w.setTimeout(10);
    w.setKaroCustCmdRule({"command=\"S2S_GetProtocolVer\"",
                          "clientID=\"bench\"", "outfile=\"" + out + "\""});
    w.setDestPath(kUser, "127.0.0.1", kPassword, "", "");
    if (w.execute(boost::function<bool()>()) != 0) {
      state.SkipWithError("command failed");
    }
  }
}
BENCHMARK(BM_CommandRoundTrip)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(20)
    ->Repetitions(3)
    ->ReportAggregatesOnly(true);

// The baseline: a bare rsync client pushing one byte into the key module,
// which has no hooks.
void BM_BareRsyncPush(benchmark::State& state) {
  Server& s = TheServer();
  if (!s.ok) state.SkipWithError("no daemon");
  std::string url = "rsync://" + std::string(kUser) +
                    "@127.0.0.1:" + std::to_string(s.daemon.port()) +
                    "/s2skeys/tiny";
  std::string cmd = "RSYNC_PASSWORD=" + std::string(kPassword) +
                    " rsync --sockopts=TCP_NODELAY " + s.tmp.Sub("tiny") + " " +
                    url;
  for (auto _ : state) {
    if (system(cmd.c_str()) != 0) state.SkipWithError("push failed");
  }
}
BENCHMARK(BM_BareRsyncPush)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond)
    ->Iterations(20)
    ->Repetitions(3)
    ->ReportAggregatesOnly(true);

}  // namespace
