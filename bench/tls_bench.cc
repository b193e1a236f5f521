// Bulk throughput of a Channel pair over loopback TCP, TLS against plain in
// the same run: 64 MiB written in ring-sized blocks by one end (its own
// thread) and read in ring-sized blocks by the other. The handshake is set
// up outside the timed part. The TLS run reports its rate relative to the
// plain one ("tls_to_plain").
#include <benchmark/benchmark.h>

#include <chrono>
#include <string>
#include <thread>

#include "S2S/channel.h"
#include "testutil.h"

namespace {

using S2S::Channel;

constexpr unsigned int kCapacity = 0x14000;  // the IPC sender's ring
constexpr size_t kTotal = 64u << 20;

// A CA-less self-signed server certificate; the client end allows untrusted
// peers, as it does by default.
class ServerCert {
 public:
  ServerCert() {
    ok_ = s2s_test::RunQuiet({"openssl", "req", "-x509", "-newkey", "ec",
                              "-pkeyopt", "ec_paramgen_curve:P-256", "-nodes",
                              "-days", "1", "-subj", "/CN=bench.example.test",
                              "-keyout", dir_.Sub("server.key"), "-out",
                              dir_.Sub("server.pem")});
    Channel::SetCERTPath(dir_.Sub("server.pem"));
    Channel::SetPriKeyPath(dir_.Sub("server.key"));
  }
  bool ok() const { return ok_; }

 private:
  s2s_test::TempDir dir_;
  bool ok_;
};

double plain_rate = 0;  // bytes per second of the plain run

void BM_Bulk(benchmark::State& state) {
  const bool tls = state.range(0) != 0;
  static ServerCert cert;
  if (tls && !cert.ok()) {
    state.SkipWithError("cannot make a certificate");
    return;
  }
  std::string block(kCapacity, 'b');
  std::string sink(kCapacity, '\0');
  double seconds = 0;
  for (auto _ : state) {
    Channel writer(kCapacity), reader(kCapacity);
    int fds[2];
    if (!s2s_test::TcpSocketPair(fds) || writer.Open(fds[0], true) != 0 ||
        reader.Open(fds[1], true) != 0) {
      state.SkipWithError("no socket pair");
      return;
    }
    if (tls) {
      int server = -1;
      std::thread t([&] { server = writer.ConvertToSSLChannel(true); });
      int client = reader.ConvertToSSLChannel(false);
      t.join();
      if (server != 0 || client != 0) {
        state.SkipWithError("handshake failed");
        return;
      }
    }
    auto start = std::chrono::steady_clock::now();
    std::thread send([&] {
      for (size_t sent = 0; sent < kTotal;) {
        unsigned int n = static_cast<unsigned int>(
            std::min<size_t>(kCapacity, kTotal - sent));
        if (writer.Write(block.data(), n) != 0) return;
        sent += n;
      }
      writer.FlushWrite(0);
    });
    bool ok = true;
    for (size_t got = 0; got < kTotal && ok;) {
      unsigned int n =
          static_cast<unsigned int>(std::min<size_t>(kCapacity, kTotal - got));
      ok = reader.Read(&sink[0], n) == 0;
      got += n;
    }
    send.join();
    double s =
        std::chrono::duration<double>(std::chrono::steady_clock::now() - start)
            .count();
    state.SetIterationTime(s);
    seconds += s;
    if (!ok) {
      state.SkipWithError("transfer failed");
      return;
    }
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * kTotal));
  double rate = static_cast<double>(state.iterations() * kTotal) / seconds;
  state.counters["MiB_per_s"] = rate / (1 << 20);
  if (!tls) {
    plain_rate = rate;
  } else if (plain_rate > 0) {
    state.counters["tls_to_plain"] = rate / plain_rate;
  }
}

// Plain first: the TLS run divides by its rate.
BENCHMARK(BM_Bulk)->ArgName("tls")->Arg(0)->Arg(1)->UseManualTime()->Unit(
    benchmark::kMillisecond);

}  // namespace
