#include "S2S/ipc.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <thread>

#include "testutil.h"

namespace {

using S2S::IPCListener;
using S2S::IPCSender;
using S2S::PObject;
using s2s_test::Has;
using s2s_test::LogCapture;
using s2s_test::TempDir;

bool Exists(const std::string& path) { return access(path.c_str(), F_OK) == 0; }

// Serves `clients` connections in turn: each request comes back, "echo" n+1.
void Serve(IPCListener& listener, int clients) {
  for (int i = 0; i < clients; ++i) {
    IPCSender end;
    if (listener.isReady() != 1 || end.assign(listener.accept()) != 0) return;
    for (PObject req; end.recv(req) == 0; req.clear()) {
      PObject reply = req;
      reply["echo"] = req["n"].asUInt64() + 1;
      if (end.send(reply) != 0) break;
    }
  }
}

// The echo for a request of `n`, or 0 when the exchange failed.
unsigned long long Echo(IPCSender& client, unsigned long long n) {
  PObject req, reply;
  req["n"] = n;
  return client.send(req, true, reply) == 0 ? reply["echo"].asUInt64() : 0;
}

TEST(IPCTest, DomainListenerServesClientsOneAfterAnother) {
  TempDir dir;
  const std::string path = dir.Sub("ipc.sock");
  ASSERT_TRUE(s2s_test::WriteFile(path, "stale"));  // leftover file
  IPCListener listener;
  ASSERT_EQ(listener.prepare(path), 0);
  EXPECT_EQ(listener.prepare(dir.Sub("other.sock")), -1);  // keeps the first
  EXPECT_FALSE(Exists(dir.Sub("other.sock")));
  std::thread server(Serve, std::ref(listener), 3);
  for (unsigned long long c = 0; c < 3; ++c) {
    IPCSender client;
    ASSERT_EQ(client.connect(path), 0);
    for (unsigned long long n = c * 10; n < c * 10 + 5; ++n)
      EXPECT_EQ(Echo(client, n), n + 1);
  }
  server.join();
  EXPECT_TRUE(Exists(path));
  EXPECT_EQ(listener.close(), 0);
  EXPECT_FALSE(Exists(path));
  EXPECT_EQ(listener.close(), -1);
}

TEST(IPCTest, TcpListenerSearchesForAFreePortUpTo65535) {
  LogCapture log(6);
  int taken_port = s2s_test::FreeLoopbackPort();
  int taken = IPCListener::OpenSocket(taken_port);
  ASSERT_GE(taken, 0);
  IPCListener listener;
  int port = listener.prepare(taken_port);
  ASSERT_GT(port, taken_port);
  EXPECT_TRUE(Has(log.Text(), "Bind port " + std::to_string(taken_port) +
                                  " failed, try next one"));
  std::thread server(Serve, std::ref(listener), 1);
  IPCSender client;
  ASSERT_EQ(client.connect(port), 0);
  EXPECT_EQ(Echo(client, 41), 42u);
  client.close();
  server.join();
  IPCListener::CloseSocket(taken);
  EXPECT_GE(listener.prepare(port), port);  // replaces the TCP listener

  // When this fails the port is busy anyway, which serves as well.
  int last = IPCListener::OpenSocket(65535);
  IPCListener none;
  EXPECT_EQ(none.prepare(65535), -1);
  EXPECT_TRUE(Has(log.Text(), "Port number exceeds 65536"));
  EXPECT_EQ(none.getFD(), -1);
  IPCListener::CloseSocket(last);
}

TEST(IPCTest, RefusedPathsAndIdleListener) {
  LogCapture log(3);
  TempDir dir;
  const std::string too_long = dir.path() + "/" + std::string(120, 'p');
  IPCListener listener;
  EXPECT_EQ(listener.prepare(too_long), -1);
  EXPECT_EQ(listener.prepare(std::string()), -1);
  EXPECT_EQ(listener.isReady(), 0);
  EXPECT_EQ(listener.accept(), -1);
  IPCSender sender;
  EXPECT_EQ(sender.connect(too_long), -1);
  EXPECT_EQ(sender.connect(dir.Sub("nobody")), -1);
  EXPECT_EQ(sender.connect(-1), -1);
  EXPECT_EQ(sender.assign(-1), -1);
  ASSERT_EQ(listener.prepare(dir.Sub("idle.sock")), 0);
  listener.setTimeout(timeval{0, 0});
  EXPECT_EQ(listener.isReady(), 0);
}

}  // namespace
