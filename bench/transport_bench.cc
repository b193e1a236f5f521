// Transport against plain socket I/O in the same run:
// - request/reply of a task-sized map between IPC ends over a Unix socket,
//   against the same bytes written and read with write/read on a socketpair;
// - 64 MiB as an array of 1024 strings of 65535 bytes through PStream over a
//   Unix socket, against write/read of the same bytes.
#include <benchmark/benchmark.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>
#include <thread>

#include "S2S/ipc.h"
#include "S2S/stream.h"
#include "bench_io.h"
#include "testutil.h"

namespace {

using S2S::IPCListener;
using S2S::IPCSender;
using S2S::PObject;
using s2s_bench::ReadAll;
using s2s_bench::WriteAll;

constexpr unsigned kBulkStrings = 1024;
constexpr unsigned kBulkStringSize = 65535;  // the largest 16-bit length

PObject TaskMessage() {
  PObject m;
  for (int i = 0; i < 22; ++i) {
    m["key_" + std::to_string(i)] = "value number " + std::to_string(i);
  }
  PObject::Array shares;
  for (int i = 0; i < 3; ++i) shares.emplace_back("share" + std::to_string(i));
  m["share_list"] = shares;
  m["id"] = 123456789ull;
  m["last_sync"] = 1700000000ull;
  return m;
}

std::string SocketPath() {
  const char* t = getenv("TMPDIR");
  return std::string(t != nullptr && *t != '\0' ? t : "/tmp") + "/s2s-bench-" +
         std::to_string(getpid()) + ".sock";
}

// Serves one client: answers each message with itself.
void EchoServer(IPCListener* listener) {
  IPCSender end;
  if (listener->isReady() != 1 || end.assign(listener->accept()) != 0) return;
  PObject msg;
  while (end.recv(msg) == 0) {
    if (end.send(msg) != 0) break;
    msg.clear();
  }
}

size_t WireSize(const PObject& m) {
  int fds[2];
  socketpair(AF_UNIX, SOCK_STREAM, 0, fds);
  S2S::Channel ch(0x14000);
  ch.Open(fds[0], false);
  S2S::PStream().Send(ch, m);
  char buf[4096];
  ssize_t n = recv(fds[1], buf, sizeof buf, MSG_DONTWAIT);
  close(fds[1]);
  return n > 0 ? static_cast<size_t>(n) : 0;
}

void BM_IPCRequestReply(benchmark::State& state) {
  const std::string path = SocketPath();
  IPCListener listener;
  listener.prepare(path);
  std::thread server(EchoServer, &listener);
  IPCSender client;
  if (client.connect(path) != 0) state.SkipWithError("connect failed");
  PObject msg = TaskMessage();
  for (auto _ : state) {
    PObject reply;
    if (client.send(msg, true, reply) != 0) {
      state.SkipWithError("round trip failed");
      break;
    }
  }
  client.close();
  server.join();
  state.counters["wire_bytes"] = static_cast<double>(WireSize(msg));
  state.SetItemsProcessed(state.iterations());
}
BENCHMARK(BM_IPCRequestReply)->UseRealTime();

void BM_RawRequestReply(benchmark::State& state) {
  const size_t size = WireSize(TaskMessage());
  int fds[2];
  socketpair(AF_UNIX, SOCK_STREAM, 0, fds);
  std::thread server([&] {
    std::string buf(size, '\0');
    while (ReadAll(fds[1], &buf[0], size) && WriteAll(fds[1], &buf[0], size)) {
    }
  });
  std::string out(size, 'r'), in(size, '\0');
  for (auto _ : state) {
    if (!WriteAll(fds[0], out.data(), size) || !ReadAll(fds[0], &in[0], size)) {
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
BENCHMARK(BM_RawRequestReply)->UseRealTime();

// Receives one bulk message per round and answers with a small ack.
void BulkServer(IPCListener* listener) {
  IPCSender end;
  if (listener->isReady() != 1 || end.assign(listener->accept()) != 0) return;
  PObject ack;
  ack["ok"] = 1ull;
  for (;;) {
    PObject msg;
    if (end.recv(msg) != 0 || msg.asArray().size() != kBulkStrings) break;
    if (end.send(ack) != 0) break;
  }
}

// The bulk message; the raw baseline sends the bytes of these same strings,
// so both sides read their source from the same (not cache-resident) memory.
PObject BulkMessage() {
  PObject msg;
  for (unsigned i = 0; i < kBulkStrings; ++i) {
    msg.asArray().emplace_back(std::string(kBulkStringSize, 'a' + i % 26));
  }
  return msg;
}

void BM_PStreamBulk(benchmark::State& state) {
  const std::string path = SocketPath();
  IPCListener listener;
  listener.prepare(path);
  std::thread server(BulkServer, &listener);
  IPCSender client;
  if (client.connect(path) != 0) state.SkipWithError("connect failed");
  PObject msg = BulkMessage();
  for (auto _ : state) {
    PObject ack;
    if (client.send(msg, true, ack) != 0) {
      state.SkipWithError("bulk send failed");
      break;
    }
  }
  client.close();
  server.join();
  state.SetBytesProcessed(state.iterations() * kBulkStrings * kBulkStringSize);
}
BENCHMARK(BM_PStreamBulk)->UseRealTime()->Unit(benchmark::kMillisecond);

void BM_RawBulk(benchmark::State& state) {
  int fds[2];
  socketpair(AF_UNIX, SOCK_STREAM, 0, fds);
  std::thread server([&] {
    std::string buf(kBulkStringSize, '\0');
    for (;;) {
      for (unsigned i = 0; i < kBulkStrings; ++i) {
        if (!ReadAll(fds[1], &buf[0], kBulkStringSize)) return;
      }
      if (!WriteAll(fds[1], "k", 1)) return;
    }
  });
  const PObject msg = BulkMessage();
  for (auto _ : state) {
    bool ok = true;
    for (unsigned i = 0; ok && i < kBulkStrings; ++i) {
      const std::string& chunk = msg.asArray()[i].asStringRef();
      ok = WriteAll(fds[0], chunk.data(), kBulkStringSize);
    }
    char ack;
    if (!ok || !ReadAll(fds[0], &ack, 1)) {
      state.SkipWithError("bulk write failed");
      break;
    }
  }
  shutdown(fds[0], SHUT_RDWR);
  server.join();
  close(fds[0]);
  close(fds[1]);
  state.SetBytesProcessed(state.iterations() * kBulkStrings * kBulkStringSize);
}
BENCHMARK(BM_RawBulk)->UseRealTime()->Unit(benchmark::kMillisecond);

}  // namespace
