// The client service s2sd, as a real process on a client appliance root:
// - one control request/reply ("list" of 100 tasks, a connection each, as
//   s2sctl makes it) against a socketpair ping-pong of the same bytes
//   between two threads of this process, in the same run; the daemon's own
//   CPU time per request is a counter;
// - the daemon idle with 10,000 enabled tasks whose next runs lie about a
//   year ahead: the time to load them at start-up (exec until the first
//   reply, and the daemon's CPU time until then), its CPU time over an idle
//   window (utime + stime from /proc/<pid>/stat; S2S_BENCH_IDLE_SECONDS,
//   default 60) and its resident memory. Run once; the figures are the
//   counters.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>

#include "S2S/ipc.h"
#include "S2S/stream.h"
#include "appliances.h"
#include "bench_io.h"
#include "control_client.h"

namespace {

using S2S::PObject;
using s2s_bench::ReadAll;
using s2s_bench::WriteAll;
using s2s_tools::ControlClient;

// A client appliance with one share, "docs", and an s2sd on it that this
// object starts and stops by its pid.
class Service {
 public:
  Service() : apps_("") { apps_.AddShare("docs"); }
  ~Service() { Stop(); }

  // Starts s2sd and waits until it answers; the seconds that took.
  double Start() {
    auto start = std::chrono::steady_clock::now();
    int fd = open("/dev/null", O_WRONLY | O_CLOEXEC);
    pid_ = s2s_test::Exec({S2SD_PROGRAM, "--foreground", "--root",
                           apps_.client_root(), "--log", "stderr"},
                          -1, fd);
    close(fd);
    PObject status;
    status["action"] = "status";
    for (int i = 0; pid_ > 0 && i < 600000; ++i) {
      PObject reply;
      std::string error;
      if (client_.Call(status, reply, error) == ControlClient::kReplied) {
        return std::chrono::duration<double>(std::chrono::steady_clock::now() -
                                             start)
            .count();
      }
      if (waitpid(pid_, nullptr, WNOHANG) == pid_) pid_ = -1;
      usleep(1000);
    }
    return -1;
  }

  void Stop() {
    if (pid_ <= 0) return;
    kill(pid_, SIGTERM);
    waitpid(pid_, nullptr, 0);
    pid_ = -1;
  }

  // Adds `n` enabled tasks over "docs": yearly, on yesterday's date, so
  // each next run is about a year away. False on the first refusal.
  bool AddTasks(int n, std::string& error) {
    time_t yesterday = time(nullptr) - 86400;
    struct tm tm;
    localtime_r(&yesterday, &tm);
    for (int i = 0; i < n; ++i) {
      PObject request, reply;
      request["action"] = "add";
      PObject& task = request["task"];
      task["name"] = "task-" + std::to_string(i);
      task["share_list"].asArray().push_back(PObject("docs"));
      task["user"] = "s2s";
      task["pswd"] = "bench-password";
      task["server_ip"] = "127.0.0.1";
      task["schedule_mode"] = 4;
      task["schedule_begin_month"] = tm.tm_mon + 1;
      task["schedule_begin_day"] = tm.tm_mday;
      task["schedule_begin_hour"] = 3;
      task["enabled"] = true;
      if (client_.Call(request, reply, error) != ControlClient::kReplied) {
        return false;
      }
      if (reply["result"].asUInt64() != 0) {
        error = reply["message"].asString();
        return false;
      }
    }
    return true;
  }

  const ControlClient& client() const { return client_; }
  pid_t pid() const { return pid_; }

 private:
  s2s_test::Appliances apps_;
  ControlClient client_;
  pid_t pid_ = -1;
};

// The PStream bytes of `m`.
std::string Encode(const PObject& m) {
  int fds[2];
  if (socketpair(AF_UNIX, SOCK_STREAM, 0, fds) != 0) return "";
  std::string out;
  std::thread reader([&] {
    char buf[65536];
    ssize_t n;
    while ((n = read(fds[1], buf, sizeof buf)) > 0) out.append(buf, n);
  });
  {
    S2S::IPCSender sender;
    sender.assign(fds[0]);
    sender.send(m);
  }  // closes fds[0]: the reader sees the end
  reader.join();
  close(fds[1]);
  return out;
}

// utime + stime of `pid` in seconds; -1 when unreadable.
double CpuSeconds(pid_t pid) {
  std::ifstream f("/proc/" + std::to_string(pid) + "/stat");
  std::string text((std::istreambuf_iterator<char>(f)),
                   std::istreambuf_iterator<char>());
  size_t paren = text.rfind(')');
  if (paren == std::string::npos) return -1;
  std::istringstream rest(text.substr(paren + 2));
  std::string field;
  unsigned long long utime = 0, stime = 0;
  // Fields from the state (3rd) on; utime and stime are the 14th and 15th.
  for (int i = 3; i <= 15 && rest >> field; ++i) {
    if (i == 14) utime = std::stoull(field);
    if (i == 15) stime = std::stoull(field);
  }
  return static_cast<double>(utime + stime) /
         static_cast<double>(sysconf(_SC_CLK_TCK));
}

// The request and reply bytes of the measured "list", for the baseline.
std::string g_request, g_reply;

void BM_ControlList100(benchmark::State& state) {
  Service service;
  std::string error;
  if (service.Start() < 0 || !service.AddTasks(100, error)) {
    state.SkipWithError(("s2sd: " + error).c_str());
    return;
  }
  PObject request;
  request["action"] = "list";
  PObject reply;
  const double cpu_before = CpuSeconds(service.pid());
  for (auto _ : state) {
    reply = PObject();
    if (service.client().Call(request, reply, error) !=
            ControlClient::kReplied ||
        reply["tasks"].asArray().size() != 100) {
      state.SkipWithError(("list: " + error).c_str());
      break;
    }
  }
  // The daemon's own CPU per request: the rest of the time is the
  // client's and the waits for the scheduler between the processes.
  state.counters["daemon_cpu_us"] = (CpuSeconds(service.pid()) - cpu_before) *
                                    1e6 /
                                    static_cast<double>(state.iterations());
  g_request = Encode(request);
  g_reply = Encode(reply);
  state.counters["request_bytes"] = static_cast<double>(g_request.size());
  state.counters["reply_bytes"] = static_cast<double>(g_reply.size());
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_ControlList100)->UseRealTime()->Unit(benchmark::kMicrosecond);

// The same bytes, request one way and reply the other, between two threads
// on a socketpair that stays open.
void BM_RawList100PingPong(benchmark::State& state) {
  if (g_reply.empty()) {
    state.SkipWithError("needs BM_ControlList100's bytes");
    return;
  }
  int fds[2];
  socketpair(AF_UNIX, SOCK_STREAM, 0, fds);
  std::thread server([&] {
    std::string in(g_request.size(), '\0');
    while (ReadAll(fds[1], &in[0], in.size()) &&
           WriteAll(fds[1], g_reply.data(), g_reply.size())) {
    }
  });
  std::string in(g_reply.size(), '\0');
  for (auto _ : state) {
    if (!WriteAll(fds[0], g_request.data(), g_request.size()) ||
        !ReadAll(fds[0], &in[0], in.size())) {
      state.SkipWithError("round trip failed");
      break;
    }
  }
  shutdown(fds[0], SHUT_RDWR);
  server.join();
  close(fds[0]);
  close(fds[1]);
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_RawList100PingPong)->UseRealTime()->Unit(benchmark::kMicrosecond);

// VmRSS of `pid` in MiB; -1 when unreadable.
double RssMiB(pid_t pid) {
  std::ifstream f("/proc/" + std::to_string(pid) + "/status");
  std::string line;
  while (std::getline(f, line)) {
    if (line.compare(0, 6, "VmRSS:") == 0) {
      return std::stod(line.substr(6)) / 1024;  // kB
    }
  }
  return -1;
}

void BM_IdleDaemon10k(benchmark::State& state) {
  const char* env = getenv("S2S_BENCH_IDLE_SECONDS");
  const int idle = env != nullptr ? atoi(env) : 60;
  Service service;
  std::string error;
  double add_seconds = 0, load_seconds = 0, startup_cpu = 0, cpu = 0, rss = 0;
  for (auto _ : state) {
    auto start = std::chrono::steady_clock::now();
    if (service.Start() < 0 || !service.AddTasks(10000, error)) {
      state.SkipWithError(("s2sd: " + error).c_str());
      return;
    }
    add_seconds =
        std::chrono::duration<double>(std::chrono::steady_clock::now() - start)
            .count();
    service.Stop();
    load_seconds = service.Start();
    if (load_seconds < 0) {
      state.SkipWithError("s2sd did not come back");
      return;
    }
    const double before = CpuSeconds(service.pid());
    startup_cpu = before;
    sleep(static_cast<unsigned>(idle));
    cpu = CpuSeconds(service.pid()) - before;
    rss = RssMiB(service.pid());
  }
  state.counters["add_10k_s"] = add_seconds;
  state.counters["startup_s"] = load_seconds;
  state.counters["startup_cpu_s"] = startup_cpu;
  state.counters["idle_window_s"] = idle;
  state.counters["idle_cpu_s"] = cpu;
  state.counters["rss_MiB"] = rss;
}
BENCHMARK(BM_IdleDaemon10k)
    ->Iterations(1)
    ->UseRealTime()
    ->Unit(benchmark::kSecond);

}  // namespace
