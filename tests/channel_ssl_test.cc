#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "S2S/channel.h"
#include "S2S/result_codes.h"
#include "testutil.h"

namespace {

using S2S::Channel;
using s2s_test::Has;
using s2s_test::LogCapture;
using s2s_test::SecondsSince;
using Clock = std::chrono::steady_clock;

std::vector<std::string> Shell(const std::string& command) {
  return {"sh", "-c", "exec " + command};
}

// A CA signing leaves named in the subject ("cn", its file holding the chain),
// the alternative names ("san") or by wildcard ("wild"); "self" signs itself.
bool MakeCertificates(const s2s_test::TempDir& dir) {
  const std::string by_ca = " -CA ca.pem -CAkey ca.key";
  const std::string certs[][4] = {
      {"ca", "/CN=S2S-Test-CA", "ca", ""},
      {"cn", "/CN=server.example.test", "leaf", by_ca},
      {"san", "/O=S2S/CN=Storage-Appliance", "san", by_ca},
      {"wild", "/CN=*.example.test", "leaf", by_ca},
      {"self", "/CN=server.example.test", "leaf", ""}};
  bool ok = s2s_test::WriteFile(
      dir.Sub("x509.cnf"),
      "[req]\ndistinguished_name = dn\nprompt = no\n[dn]\n"
      "[ca]\nbasicConstraints = critical,CA:true\n"
      "keyUsage = critical,keyCertSign\n"
      "[leaf]\nbasicConstraints = CA:false\n"
      "[san]\nbasicConstraints = CA:false\nsubjectAltName = "
      "IP:127.0.0.1,DNS:first.example.test,DNS:second.example.test\n");
  for (const auto& c : certs) {
    ok = ok && s2s_test::RunQuiet(
                   {"sh", "-c",
                    "cd " + dir.path() +
                        " && openssl req -x509 -config x509.cnf -newkey ec"
                        " -pkeyopt ec_paramgen_curve:P-256 -nodes -days 2"
                        " -subj " +
                        c[1] + " -keyout " + c[0] + ".key -out " + c[0] +
                        ".pem -extensions " + c[2] + c[3]});
  }
  return ok && s2s_test::RunQuiet(
                   {"sh", "-c",
                    "cat " + dir.Sub("ca.pem") + " >> " + dir.Sub("cn.pem")});
}

class ChannelSSLTest : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    dir_ = new s2s_test::TempDir;
    made_ = MakeCertificates(*dir_);
  }
  static void TearDownTestSuite() { delete dir_; }
  void SetUp() override {
    ASSERT_TRUE(made_);
    ServeAs("cn");
  }

  static std::string File(const std::string& name) { return dir_->Sub(name); }
  static void ServeAs(const std::string& cert) {
    Channel::SetCERTPath(File(cert + ".pem"));
    Channel::SetPriKeyPath(File(cert + ".key"));
  }
  // A client end that verifies against `ca` (a file here) and `host`.
  static void Verify(Channel& client, const std::string& ca,
                     const std::string& host) {
    client.SetAllowUntrust(false);
    Channel::SetVerifyCAPath(File(ca));
    client.SetSSLHostname(host);
  }

  // Our client and server over loopback TCP; `raw`: the test is the server.
  struct Pair : s2s_test::ChannelPair {
    explicit Pair(unsigned int capacity = 4096, int timeout = 5,
                  bool raw = false)
        : ChannelPair(capacity, true) {
      ok = raw ? ok : Both();
      client.SetTimeout(timeout);
      server.SetTimeout(timeout);
    }
    // Both ends convert at once; the client's result.
    int Convert() {
      std::thread t(
          [this] { server_result = server.ConvertToSSLChannel(true); });
      int r = client.ConvertToSSLChannel(false);
      t.join();
      return r;
    }
    Channel &client = a, &server = b;
    int server_result = 1;
  };

  static s2s_test::TempDir* dir_;
  static bool made_;
};

s2s_test::TempDir* ChannelSSLTest::dir_ = nullptr;
bool ChannelSSLTest::made_ = false;

TEST_F(ChannelSSLTest, ClientChecksChainAndNameOnlyWhenAskedTo) {
  struct Case {
    const char *cert, *ca, *host;
    int want;
  } cases[] = {
      {"cn", "ca.pem", "server.example.test", 0},
      {"cn", "ca.pem", "SERVER.Example.TEST", 0},
      {"cn", "ca.pem", "", 0},  // chain only
      {"cn", "ca.pem", "other.example.test", S2S::kSSLVerifyFail},
      {"cn", "self.pem", "server.example.test", S2S::kSSLVerifyFail},
      {"self", "ca.pem", "server.example.test", S2S::kSSLVerifyFail},
      {"san", "ca.pem", "first.example.test", 0},
      {"san", "ca.pem", "storage-appliance", 0},
      {"san", "ca.pem", "127.0.0.1", S2S::kSSLVerifyFail},  // not a DNS entry
      {"san", "ca.pem", "third.example.test", S2S::kSSLVerifyFail},
      {"wild", "ca.pem", "a.example.test", 0},
      {"wild", "ca.pem", "A.EXAMPLE.test", 0},
      {"wild", "ca.pem", "a.b.example.test", S2S::kSSLVerifyFail},
      {"wild", "ca.pem", "example.test", S2S::kSSLVerifyFail},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(std::string(c.cert) + " " + c.ca + " '" + c.host + "'");
    LogCapture log(4);
    ServeAs(c.cert);
    Pair p;
    ASSERT_TRUE(p.ok);
    Verify(p.client, c.ca, c.host);
    EXPECT_EQ(p.Convert(), c.want);
    EXPECT_EQ(p.server_result, 0);
    EXPECT_EQ(p.client.IsSSL(), c.want == 0);
    EXPECT_FALSE(p.client.IsClosed());
    EXPECT_EQ(Has(log.Text(), "ConvertToSSLChannel: Verify Fail!"),
              c.want != 0);
  }

  // Allowing untrusted peers (the default) accepts anything and loads no CA.
  LogCapture log(4);
  ServeAs("self");
  Pair p;
  ASSERT_TRUE(p.ok);
  Channel::SetVerifyCAPath(File("missing.pem"));
  p.client.SetSSLHostname("nothing.example.test");
  EXPECT_EQ(p.Convert(), 0);
  EXPECT_FALSE(Has(log.Text(), "SSL_CTX_load_verify_locations"));
  // The single suite the client asks for is gone; it carries on without.
  EXPECT_TRUE(Has(log.Text(), "can't set cipher suit to SSL3_TXT_RSA_RC4"));
  Pair q;
  ASSERT_TRUE(q.ok);
  q.client.SetAllowUntrust(false);
  EXPECT_EQ(q.client.ConvertToSSLChannel(false), S2S::kIOError);
  EXPECT_TRUE(Has(log.Text(), "SSL_CTX_load_verify_locations(" +
                                  File("missing.pem") + ") failed"));
}

TEST_F(ChannelSSLTest, ConversionNeedsASocketAndTheServerItsCertAndKey) {
  LogCapture log(4);
  Channel closed(64);
  EXPECT_EQ(closed.ConvertToSSLChannel(false), S2S::kIOError);
  EXPECT_TRUE(Has(log.Text(), "invalid context"));
  Pair p;
  ASSERT_TRUE(p.ok);
  Channel::SetCERTPath(File("missing.pem"));
  EXPECT_EQ(p.server.ConvertToSSLChannel(true), S2S::kIOError);
  EXPECT_TRUE(Has(log.Text(), "Open: init ssl certificate failed"));
  ServeAs("cn");
  Channel::SetPriKeyPath(File("san.key"));  // not the certificate's key
  EXPECT_EQ(p.server.ConvertToSSLChannel(true), S2S::kIOError);
  EXPECT_TRUE(Has(log.Text(), "Open: init ssl private key failed"));
  EXPECT_FALSE(p.server.IsSSL());
  EXPECT_FALSE(p.server.IsClosed());
}

// Random chunking (a small ring: every run wraps) and time-outs work over
// TLS; closed, the channel is plain again.
TEST_F(ChannelSSLTest, StreamsTravelUnchangedUntilClose) {
  Pair p(4093);
  ASSERT_TRUE(p.ok);
  ASSERT_EQ(p.Convert(), 0);
  ASSERT_EQ(p.server_result, 0);
  std::mt19937 rng(3);
  std::string bulk(1 << 20, '\0');
  for (char& c : bulk) c = static_cast<char>(rng());
  std::thread writer([&] {
    std::mt19937 sizes(5);
    for (size_t off = 0; off < bulk.size();) {
      unsigned int n =
          std::min<unsigned int>(1 + sizes() % 4093, bulk.size() - off);
      ASSERT_EQ(p.server.Write(&bulk[off], n), 0);
      off += n;
    }
    EXPECT_EQ(p.server.FlushWrite(0), 0);
  });
  std::string in(bulk.size(), '\0');
  for (size_t off = 0; off < in.size();) {
    unsigned int n = std::min<unsigned int>(1 + rng() % 9000, in.size() - off);
    ASSERT_EQ(p.client.Read(&in[off], n), 0) << "at " << off;
    off += n;
  }
  writer.join();
  EXPECT_TRUE(in == bulk);

  p.client.SetTimeout(1);
  char c;
  auto start = Clock::now();
  EXPECT_EQ(p.client.Read(&c, 1), S2S::kConnectionTimeout);
  EXPECT_LT(SecondsSince(start), 3.0);

  EXPECT_EQ(p.client.ConvertToSSLChannel(false), 0);  // already TLS
  EXPECT_EQ(p.client.Close(), 0);
  EXPECT_FALSE(p.client.IsSSL());
  EXPECT_EQ(p.server.Read(&c, 1), S2S::kIOError);  // close_notify arrived
  // Writing to the vanished peer is a result code, not SIGPIPE.
  int r = 0;
  for (int i = 0; i < 64 && r == 0; ++i) {
    r = p.server.Write(&bulk[0], 4000);
    if (r == 0) r = p.server.FlushWrite(0);
  }
  EXPECT_LT(r, 0);
  // Reopened, the channel is plain: the peer sees the bytes as written.
  int fds[2];
  ASSERT_TRUE(s2s_test::TcpSocketPair(fds));
  ASSERT_EQ(p.client.Open(fds[0], true), 0);
  ASSERT_EQ(p.client.Write("plain", 5), 0);
  ASSERT_EQ(p.client.FlushWrite(0), 0);
  char buf[6] = {};
  EXPECT_EQ(read(fds[1], buf, 5), 5);
  EXPECT_STREQ(buf, "plain");
  close(fds[1]);
}

TEST_F(ChannelSSLTest, HandshakeGivesUpOnSilentOrFailingPeers) {
  LogCapture log(4);
  {  // accepts the connection and never answers
    Pair r(256, 1, true);
    ASSERT_TRUE(r.ok);
    auto start = Clock::now();
    EXPECT_EQ(r.client.ConvertToSSLChannel(false), S2S::kIOError);
    EXPECT_GE(SecondsSince(start), 0.9);
    EXPECT_LT(SecondsSince(start), 3.0);
    EXPECT_TRUE(Has(log.Text(), "timed out during connect (1 seconds)"));
  }
  {  // reads the client's hello and hangs up
    Pair r(256, 10, true);
    ASSERT_TRUE(r.ok);
    std::thread peer([&] {
      char buf[64];
      EXPECT_GT(read(r.peer, buf, sizeof buf), 0);
      shutdown(r.peer, SHUT_RDWR);
    });
    auto start = Clock::now();
    EXPECT_EQ(r.client.ConvertToSSLChannel(false), S2S::kIOError);
    EXPECT_LT(SecondsSince(start), 5.0);
    peer.join();
  }
  {  // our end serving a client that speaks something else
    Pair r(256, 10, true);
    ASSERT_TRUE(r.ok);
    const char request[] = "GET / HTTP/1.0\r\n\r\n";
    ASSERT_EQ(write(r.peer, request, sizeof request - 1),
              static_cast<ssize_t>(sizeof request - 1));
    EXPECT_EQ(r.client.ConvertToSSLChannel(true), S2S::kIOError);
    EXPECT_TRUE(Has(log.Text(), "SSLHandshake: SSL fatel error code: 1"));
  }
}

// Our client against a real TLS 1.2 server (its failed request for an old
// suite once removed every suite); TLS 1.1 it refuses.
TEST_F(ChannelSSLTest, ClientTalksToOpenSSLServer) {
  for (const char* opts : {"-tls1_2", "-tls1_1 -cipher DEFAULT@SECLEVEL=0"}) {
    SCOPED_TRACE(opts);
    // Port 0: the server names the free one it took; it echoes lines reversed.
    s2s_test::Child server = s2s_test::Spawn(
        dir_->path(),
        Shell("openssl s_server -accept 127.0.0.1:0 -naccept 1 -rev -cert " +
              File("cn.pem") + " -key " + File("cn.key") + " " + opts));
    std::string out;
    ASSERT_TRUE(s2s_test::WaitUntil(
        [&] {
          return Has(out = s2s_test::ReadFile(server.out_path), "ACCEPT");
        },
        5));
    int port = atoi(out.c_str() + out.find("ACCEPT 127.0.0.1:") + 17);
    Channel ch(4096);
    ch.SetTimeout(5);
    ASSERT_EQ(ch.Open("127.0.0.1", port), 0);
    Verify(ch, "ca.pem", "server.example.test");
    if (Has(opts, "tls1_1")) {
      EXPECT_EQ(ch.ConvertToSSLChannel(false), S2S::kIOError);
    } else {
      ASSERT_EQ(ch.ConvertToSSLChannel(false), 0);
      ASSERT_EQ(ch.Write("ping from s2s\n", 14), 0);
      ASSERT_EQ(ch.FlushWrite(0), 0);
      char buf[15] = {};
      EXPECT_EQ(ch.Read(buf, 14), 0);
      EXPECT_STREQ(buf, "s2s morf gnip\n");
    }
    s2s_test::StopChild(&server.pid);
  }
}

}  // namespace
