#include "S2S/channel.h"

#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <new>
#include <random>
#include <string>
#include <thread>

#include "S2S/result_codes.h"
#include "testutil.h"

// Counts heap allocations made by the current thread while counting is on,
// so the data path can be shown to allocate nothing. The replacements pair
// malloc with free, which GCC cannot see through once they are inlined.
#pragma GCC diagnostic ignored "-Wmismatched-new-delete"
namespace {
thread_local bool counting = false;
thread_local long allocations = 0;
}  // namespace

void* operator new(size_t n) {
  if (counting) ++allocations;
  void* p = malloc(n == 0 ? 1 : n);
  if (p == nullptr) throw std::bad_alloc();
  return p;
}
void operator delete(void* p) noexcept { free(p); }
void operator delete(void* p, size_t) noexcept { free(p); }

namespace {

using S2S::Channel;
using s2s_test::LogCapture;
using Clock = std::chrono::steady_clock;
using s2s_test::SecondsSince;

// Two channels joined by a socket pair of the given kind.
struct ChannelPair {
  ChannelPair(unsigned int capacity, bool tcp) : a(capacity), b(capacity) {
    int fds[2];
    ok = tcp ? s2s_test::TcpSocketPair(fds) : s2s_test::UnixSocketPair(fds);
    ok = ok && a.Open(fds[0], true) == 0 && b.Open(fds[1], true) == 0;
  }
  Channel a, b;
  bool ok;
};

// Adopts one end of a socket pair; the test keeps the raw other end.
struct RawPeer {
  explicit RawPeer(unsigned int capacity = 64) : ch(capacity) {
    int fds[2];
    ok = s2s_test::UnixSocketPair(fds) && ch.Open(fds[0], true) == 0;
    peer = fds[1];
  }
  ~RawPeer() {
    if (peer >= 0) close(peer);
  }
  std::string Pending() {
    char buf[4096];
    ssize_t n = recv(peer, buf, sizeof buf, MSG_DONTWAIT);
    return n > 0 ? std::string(buf, n) : std::string();
  }
  Channel ch;
  int peer = -1;
  bool ok;
};

class ChannelStreamTest : public ::testing::TestWithParam<bool> {};

// Megabytes of random bytes in random write sizes and random read sizes
// (capacity-sized and ring-wrapping ones included) arrive unchanged.
TEST_P(ChannelStreamTest, ArbitraryChunkingKeepsEveryByte) {
  const unsigned int cap = 4093;  // odd, so runs wrap at every position
  ChannelPair pair(cap, GetParam());
  ASSERT_TRUE(pair.ok);
  std::mt19937 rng(42);
  std::string data(3 << 20, '\0');
  for (char& c : data) c = static_cast<char>(rng());

  std::thread writer([&] {
    std::mt19937 wr(7);
    size_t off = 0;
    while (off < data.size()) {
      unsigned int n = wr() % 4 == 0 ? cap : 1 + wr() % cap;
      n = static_cast<unsigned int>(std::min<size_t>(n, data.size() - off));
      ASSERT_EQ(pair.a.Write(&data[off], n), 0);
      if (wr() % 16 == 0) {
        ASSERT_EQ(pair.a.FlushWrite(0), 0);
      }
      off += n;
    }
    pair.a.Close();
  });
  std::string got(data.size(), '\0');
  size_t off = 0;
  while (off < data.size()) {
    unsigned int n = rng() % 4 == 0 ? cap : 1 + rng() % (2 * cap + 7);
    n = static_cast<unsigned int>(std::min<size_t>(n, data.size() - off));
    ASSERT_EQ(pair.b.Read(&got[off], n), 0) << "at " << off;
    off += n;
  }
  writer.join();
  EXPECT_TRUE(got == data);
}

INSTANTIATE_TEST_SUITE_P(UnixAndTcp, ChannelStreamTest, ::testing::Bool());

TEST(ChannelTest, IntegersTravelMostSignificantByteFirst) {
  RawPeer p;
  ASSERT_TRUE(p.ok);
  ASSERT_EQ(p.ch.WriteByte(0xAB), 0);
  ASSERT_EQ(p.ch.WriteInt16(0x0102), 0);
  ASSERT_EQ(p.ch.WriteInt32(0x01020304), 0);
  ASSERT_EQ(p.ch.WriteInt64(1), 0);
  ASSERT_EQ(p.ch.FlushWrite(0), 0);
  EXPECT_EQ(p.Pending(), std::string("\xAB\x01\x02\x01\x02\x03\x04"
                                     "\0\0\0\0\0\0\0\x01",
                                     15));

  const char in[] = "\x01\x02\x03\x04\x0A\x0B\x01\x02\x03\x04\x05\x06\x07\x08";
  ASSERT_EQ(write(p.peer, in, 14), 14);
  unsigned int v32 = 0;
  unsigned short v16 = 0;
  unsigned long long v64 = 0;
  ASSERT_EQ(p.ch.ReadInt32(&v32), 0);
  ASSERT_EQ(p.ch.ReadInt16(&v16), 0);
  ASSERT_EQ(p.ch.ReadInt64(&v64), 0);
  EXPECT_EQ(v32, 0x01020304u);
  EXPECT_EQ(v16, 0x0A0B);
  EXPECT_EQ(v64, 0x0102030405060708ull);
}

TEST(ChannelTest, WriteBuffersUpToCapacityAndFlushesOnlyForRoom) {
  LogCapture log(4);
  RawPeer p(64);
  ASSERT_TRUE(p.ok);
  std::string block(64, 'x');
  ASSERT_EQ(p.ch.Write(block.data(), 64), 0);
  EXPECT_EQ(p.Pending(), "");  // nothing sent yet
  std::string big(65, 'y');
  EXPECT_EQ(p.ch.Write(big.data(), 65), S2S::kInvalidArgument);
  EXPECT_NE(log.Text().find("Write: Exceed maximum data block size"),
            std::string::npos);

  ASSERT_EQ(p.ch.ClearWrite(), 0);
  ASSERT_EQ(p.ch.Write(block.data(), 54), 0);  // capacity - 10
  ASSERT_EQ(p.ch.Write("0123456789abcdefghij", 20), 0);
  EXPECT_GE(p.Pending().size(), 10u);
}

// A read may end exactly at the end of the ring while wrapped bytes remain;
// the next read must continue from the start of the ring.
TEST(ChannelTest, ReadsContinueAcrossTheEndOfAWrappedRing) {
  RawPeer p(8);
  ASSERT_TRUE(p.ok);
  ASSERT_EQ(write(p.peer, "0123456789abcdef", 16), 16);
  char buf[8] = {};
  ASSERT_EQ(p.ch.Read(buf, 3), 0);  // the ring takes 8 bytes: 5 remain
  EXPECT_EQ(std::string(buf, 3), "012");
  ASSERT_EQ(p.ch.ReadMore(1), 0);   // fills the 3 free bytes at the start
  ASSERT_EQ(p.ch.Read(buf, 5), 0);  // up to the very end of the ring
  EXPECT_EQ(std::string(buf, 5), "34567");
  ASSERT_EQ(p.ch.Read(buf, 3), 0);
  EXPECT_EQ(std::string(buf, 3), "89a");
  ASSERT_EQ(p.ch.Read(buf, 5), 0);
  EXPECT_EQ(std::string(buf, 5), "bcdef");
}

TEST(ChannelTest, PeerClosingMidMessageFailsTheReadWithWhatArrived) {
  LogCapture log(4);
  RawPeer p;
  ASSERT_TRUE(p.ok);
  ASSERT_EQ(write(p.peer, "abc", 3), 3);
  close(p.peer);
  p.peer = -1;
  char buf[10];
  unsigned int got = 0;
  EXPECT_EQ(p.ch.Read(buf, 10, got), S2S::kIOError);
  EXPECT_EQ(got, 3u);
  EXPECT_EQ(std::string(buf, 3), "abc");
  EXPECT_NE(log.Text().find("Diagnose: select says the socket is readable"),
            std::string::npos);
  // Writing to the gone peer fails too, without a signal.
  std::string block(64, 'z');
  int r = 0;
  for (int i = 0; i < 4 && r == 0; ++i) r = p.ch.Write(block.data(), 64);
  if (r == 0) r = p.ch.FlushWrite(0);
  EXPECT_EQ(r, S2S::kIOError);
}

TEST(ChannelTest, StalledPeerTimesOutAfterTheChannelTimeout) {
  RawPeer p;
  ASSERT_TRUE(p.ok);
  p.ch.SetTimeout(1);
  char c;
  auto start = Clock::now();
  EXPECT_EQ(p.ch.Read(&c, 1), S2S::kConnectionTimeout);
  EXPECT_LT(SecondsSince(start), 3.5);

  // A full socket with a peer that never reads: the flush gives up too.
  std::string block(64, 'w');
  int r = 0;
  start = Clock::now();
  while (r == 0 && SecondsSince(start) < 30) r = p.ch.Write(block.data(), 64);
  EXPECT_EQ(r, S2S::kConnectionTimeout);
}

TEST(ChannelTest, FlagStopsABlockedReadWithinASlice) {
  RawPeer p;
  ASSERT_TRUE(p.ok);
  std::atomic<int> flag{0};
  p.ch.SetTimeout(0);  // would wait for ever
  p.ch.SetFlag(reinterpret_cast<int*>(&flag));
  std::thread setter([&] {
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    flag = 1;
  });
  char c;
  auto start = Clock::now();
  EXPECT_EQ(p.ch.Read(&c, 1), S2S::kInterrupted);
  EXPECT_LT(SecondsSince(start), 2.0);
  setter.join();
  // Already set: nothing is touched.
  ASSERT_EQ(write(p.peer, "q", 1), 1);
  EXPECT_EQ(p.ch.Read(&c, 1), S2S::kInterrupted);
  flag = 0;
  EXPECT_EQ(p.ch.Read(&c, 1), 0);
  EXPECT_EQ(c, 'q');
}

TEST(ChannelTest, OpenCloseAndReopen) {
  LogCapture log(4);
  Channel ch(128);
  EXPECT_TRUE(ch.IsClosed());
  EXPECT_EQ(ch.Close(), 0);  // harmless when closed
  EXPECT_EQ(ch.Open(nullptr, 80), 0);
  EXPECT_EQ(ch.Open("10.0.0.1", -1), 0);
  EXPECT_TRUE(ch.IsClosed());
  std::string ip = "x";
  int port = 9;
  EXPECT_EQ(ch.GetPeerInfo(ip, port), 0);
  EXPECT_EQ(ip, "");
  EXPECT_EQ(port, 0);
  char c;
  EXPECT_EQ(ch.Read(&c, 1), S2S::kIOError);
  EXPECT_EQ(ch.Write("a", 1), S2S::kIOError);

  for (int round = 0; round < 2; ++round) {
    int fds[2];
    ASSERT_TRUE(s2s_test::TcpSocketPair(fds));
    ASSERT_EQ(ch.Open(fds[0], true), 0);
    EXPECT_EQ(ch.Open(fds[1], true), S2S::kInvalidArgument);
    EXPECT_NE(log.Text().find("Open: Channel already opened"),
              std::string::npos);
    ASSERT_EQ(ch.GetPeerInfo(ip, port), 0);
    EXPECT_EQ(ip, "127.0.0.1");
    sockaddr_in local{};
    socklen_t len = sizeof local;
    getsockname(fds[1], reinterpret_cast<sockaddr*>(&local), &len);
    EXPECT_EQ(port, local.sin_port);  // as stored: network order
    ASSERT_EQ(ch.Write("hi", 2), 0);
    EXPECT_EQ(ch.Close(), 0);  // flushes
    char buf[3] = {};
    EXPECT_EQ(read(fds[1], buf, 3), 2);
    EXPECT_STREQ(buf, "hi");
    EXPECT_TRUE(ch.IsClosed());
    close(fds[1]);
  }
}

TEST(ChannelTest, OpensTcpAndUnixClients) {
  LogCapture log(4);
  s2s_test::TempDir dir;
  Channel ch(128);
  int port = s2s_test::FreeLoopbackPort();
  EXPECT_EQ(ch.Open("127.0.0.1", port), S2S::kIOError);  // nobody listens
  EXPECT_TRUE(ch.IsClosed());
  EXPECT_EQ(ch.Open(dir.Sub("none").c_str()), S2S::kIOError);
  EXPECT_NE(log.Text().find("Channel: Can not connect to server at"),
            std::string::npos);

  int lfd = s2s_test::LoopbackListener(&port);
  ASSERT_GE(lfd, 0);
  ASSERT_EQ(ch.Open("127.0.0.1", port), 0);
  int srv = accept(lfd, nullptr, nullptr);
  ASSERT_EQ(ch.WriteInt32(7), 0);
  ASSERT_EQ(ch.Close(), 0);
  char buf[4];
  EXPECT_EQ(read(srv, buf, 4), 4);
  close(srv);
  close(lfd);

  int ufd = socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un un{};
  un.sun_family = AF_UNIX;
  std::string path = dir.Sub("sock");
  strcpy(un.sun_path, path.c_str());
  ASSERT_EQ(bind(ufd, reinterpret_cast<sockaddr*>(&un), sizeof un), 0);
  ASSERT_EQ(listen(ufd, 1), 0);
  ASSERT_EQ(ch.Open(path.c_str()), 0);
  EXPECT_FALSE(ch.IsClosed());
  ch.Close();
  close(ufd);
}

TEST(ChannelTest, ReadsAndWritesDoNotAllocate) {
  ChannelPair pair(1024, false);
  ASSERT_TRUE(pair.ok);
  char buf[3000] = {};
  allocations = 0;
  counting = true;
  for (int i = 0; i < 200; ++i) {
    pair.a.Write(buf, 700);
    pair.a.WriteInt64(i);
    pair.a.FlushWrite(0);
    pair.b.Read(buf, 700);
    unsigned long long v;
    pair.b.ReadInt64(&v);
  }
  pair.a.Write(buf, 1024);
  pair.a.Write(buf, 1000);  // flushes for room
  pair.a.FlushWrite(0);
  pair.b.Read(buf, 2024);  // larger than the ring
  counting = false;
  EXPECT_EQ(allocations, 0);
}

}  // namespace
