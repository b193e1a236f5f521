#include "S2S/channel.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <climits>
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
using s2s_test::Has;
using s2s_test::LogCapture;
using s2s_test::SecondsSince;
using Clock = std::chrono::steady_clock;

using Pair = s2s_test::ChannelPair;

class ChannelStreamTest : public ::testing::TestWithParam<bool> {};

// Random bytes in random write and read sizes (capacity-sized and wrapping
// ones included) arrive unchanged; neither end allocates.
TEST_P(ChannelStreamTest, ArbitraryChunkingKeepsEveryByte) {
  const unsigned int cap = 4093;  // odd, so runs wrap at every position
  Pair pair(cap, GetParam());
  ASSERT_TRUE(pair.Both());
  std::mt19937 rng(42);
  std::string data(3 << 20, '\0');
  for (char& c : data) c = static_cast<char>(rng());

  long writer_allocations = -1;
  std::thread writer([&] {
    std::mt19937 wr(7);
    counting = true;
    for (size_t off = 0; off < data.size();) {
      unsigned int n = wr() % 4 == 0 ? cap : 1 + wr() % cap;
      n = static_cast<unsigned int>(std::min<size_t>(n, data.size() - off));
      ASSERT_EQ(pair.a.Write(&data[off], n), 0);
      if (wr() % 16 == 0) {
        ASSERT_EQ(pair.a.FlushWrite(0), 0);
      }
      off += n;
    }
    counting = false;
    writer_allocations = allocations;
    pair.a.Close();
  });
  std::string got(data.size(), '\0');
  allocations = 0;
  counting = true;
  for (size_t off = 0; off < data.size();) {
    unsigned int n = rng() % 4 == 0 ? cap : 1 + rng() % (2 * cap + 7);
    n = static_cast<unsigned int>(std::min<size_t>(n, data.size() - off));
    ASSERT_EQ(pair.b.Read(&got[off], n), 0) << "at " << off;
    off += n;
  }
  counting = false;
  writer.join();
  EXPECT_TRUE(got == data);
  EXPECT_EQ(allocations + writer_allocations, 0);
}

INSTANTIATE_TEST_SUITE_P(UnixAndTcp, ChannelStreamTest, ::testing::Bool());

TEST(ChannelTest, IntegersTravelMostSignificantByteFirst) {
  Pair p(64);
  ASSERT_EQ(p.a.WriteInt32(0x01020304), 0);
  ASSERT_EQ(p.a.WriteInt64(1), 0);
  ASSERT_EQ(p.a.FlushWrite(0), 0);
  EXPECT_EQ(p.Pending(), std::string("\x01\x02\x03\x04\0\0\0\0\0\0\0\x01", 12));

  const char in[] = "\x01\x02\x03\x04\x01\x02\x03\x04\x05\x06\x07\x08";
  ASSERT_EQ(write(p.peer, in, 12), 12);
  unsigned int v32 = 0;
  unsigned long long v64 = 0;
  ASSERT_EQ(p.a.ReadInt32(&v32), 0);
  ASSERT_EQ(p.a.ReadInt64(&v64), 0);
  EXPECT_EQ(v32, 0x01020304u);
  EXPECT_EQ(v64, 0x0102030405060708ull);
}

TEST(ChannelTest, WriteBuffersUpToCapacityAndFlushesOnlyForRoom) {
  LogCapture log(4);
  Pair p(64);
  std::string block(65, 'x');
  ASSERT_EQ(p.a.Write(block.data(), 64), 0);
  EXPECT_EQ(p.Pending(), "");  // nothing sent yet
  EXPECT_EQ(p.a.Write(block.data(), 65), S2S::kInvalidArgument);
  EXPECT_TRUE(Has(log.Text(), "Write: Exceed maximum data block size"));
  ASSERT_EQ(p.a.ClearWrite(), 0);
  ASSERT_EQ(p.a.Write(block.data(), 54), 0);  // capacity - 10
  ASSERT_EQ(p.a.Write("0123456789abcdefghij", 20), 0);
  EXPECT_GE(p.Pending().size(), 10u);
}

// A read ending at the ring's end, wrapped bytes left: the next one wraps.
TEST(ChannelTest, ReadsContinueAcrossTheEndOfAWrappedRing) {
  Pair p(8);
  ASSERT_EQ(write(p.peer, "0123456789abcdef", 16), 16);
  char buf[8] = {};
  ASSERT_EQ(p.a.Read(buf, 3), 0);  // the ring takes 8 bytes: 5 remain
  EXPECT_EQ(std::string(buf, 3), "012");
  ASSERT_EQ(p.a.ReadMore(1), 0);   // fills the 3 free bytes at the start
  ASSERT_EQ(p.a.Read(buf, 5), 0);  // up to the very end of the ring
  EXPECT_EQ(std::string(buf, 5), "34567");
  ASSERT_EQ(p.a.Read(buf, 3), 0);
  EXPECT_EQ(std::string(buf, 3), "89a");
  ASSERT_EQ(p.a.Read(buf, 5), 0);
  EXPECT_EQ(std::string(buf, 5), "bcdef");
}

TEST(ChannelTest, PeerClosingMidMessageFailsTheReadWithWhatArrived) {
  LogCapture log(4);
  Pair p(64);
  ASSERT_EQ(write(p.peer, "abc", 3), 3);
  close(p.peer);
  p.peer = -1;
  char buf[10];
  unsigned int got = 0;
  EXPECT_EQ(p.a.Read(buf, 10, got), S2S::kIOError);
  EXPECT_EQ(std::string(buf, got), "abc");
  EXPECT_TRUE(Has(log.Text(), "Diagnose: select says the socket is readable"));
  // Writing to the gone peer fails too, without a signal.
  std::string block(64, 'z');
  int r = 0;
  for (int i = 0; i < 4 && r == 0; ++i) r = p.a.Write(block.data(), 64);
  if (r == 0) r = p.a.FlushWrite(0);
  EXPECT_EQ(r, S2S::kIOError);
}

TEST(ChannelTest, StalledPeerTimesOutAndTheFlagStopsAWait) {
  Pair p(64);
  p.a.SetTimeout(1);
  char c;
  auto start = Clock::now();
  EXPECT_EQ(p.a.Read(&c, 1), S2S::kConnectionTimeout);
  EXPECT_LT(SecondsSince(start), 3.5);
  // A full socket with a peer that never reads: the flush gives up too.
  std::string block(64, 'w');
  int r = 0;
  start = Clock::now();
  while (r == 0 && SecondsSince(start) < 30) r = p.a.Write(block.data(), 64);
  EXPECT_EQ(r, S2S::kConnectionTimeout);

  Pair q(64);
  std::atomic<int> flag{0};
  q.a.SetTimeout(0);  // would wait for ever
  q.a.SetFlag(reinterpret_cast<int*>(&flag));
  std::thread setter([&] {
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    flag = 1;
  });
  start = Clock::now();
  EXPECT_EQ(q.a.Read(&c, 1), S2S::kInterrupted);
  EXPECT_LT(SecondsSince(start), 2.0);
  setter.join();
  // Already set: nothing is touched.
  ASSERT_EQ(write(q.peer, "q", 1), 1);
  EXPECT_EQ(q.a.Read(&c, 1), S2S::kInterrupted);
  flag = 0;
  EXPECT_EQ(q.a.Read(&c, 1), 0);
  EXPECT_EQ(c, 'q');
}

TEST(ChannelTest, OpensTcpClientsAndReopensAfterClose) {
  LogCapture log(4);
  Channel ch(128);
  EXPECT_EQ(ch.Close(), 0);            // harmless when closed
  EXPECT_EQ(ch.Open(nullptr, 80), 0);  // no address: left closed
  EXPECT_TRUE(ch.IsClosed());
  char c;
  EXPECT_EQ(ch.Read(&c, 1), S2S::kIOError);
  EXPECT_EQ(ch.Write("a", 1), S2S::kIOError);
  EXPECT_EQ(ch.Open("127.0.0.1", s2s_test::FreeLoopbackPort()),
            S2S::kIOError);  // nobody listens

  int tcp_port = 0, port = 0;
  int lfd = s2s_test::LoopbackListener(&tcp_port);
  std::string ip;
  for (int round = 0; round < 2; ++round) {
    ASSERT_EQ(ch.Open("127.0.0.1", tcp_port), 0);
    EXPECT_EQ(ch.Open(lfd, true), S2S::kInvalidArgument);  // already open
    ASSERT_EQ(ch.GetPeerInfo(ip, port), 0);
    EXPECT_EQ(ip, "127.0.0.1");
    EXPECT_EQ(port, htons(tcp_port));  // as stored: network order
    ASSERT_EQ(ch.Write("hi", 2), 0);
    EXPECT_EQ(ch.Close(), 0);  // flushes
    EXPECT_TRUE(ch.IsClosed());
    int peer = accept(lfd, nullptr, nullptr);
    char buf[3] = {};
    EXPECT_EQ(read(peer, buf, 3), 2);
    EXPECT_STREQ(buf, "hi");
    close(peer);
  }
  close(lfd);
}

TEST(ResultMessage, EveryCodeHasItsTextAsWrittenAndOutsidersAreUnknown) {
  EXPECT_STREQ(S2S::ResultMessage(0), "Successful");
  EXPECT_STREQ(S2S::ResultMessage(-5), "Protocal error");
  EXPECT_STREQ(S2S::ResultMessage(-19), "no permission ");
  EXPECT_STREQ(S2S::ResultMessage(-25), "permission is read-only");
  for (int r = 0; r > -S2S::kResultCodeCount; --r)
    EXPECT_STRNE(S2S::ResultMessage(r), "Unknown error") << r;
  for (int r : {-S2S::kResultCodeCount, 1, INT_MIN, INT_MAX})
    EXPECT_STREQ(S2S::ResultMessage(r), "Unknown error") << r;
}

}  // namespace
