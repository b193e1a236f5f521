#include "S2S/s2s_address.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "karo_net.h"
#include "testutil.h"

namespace {

using s2s_test::Has;
using s2s_test::ScopedEnv;
using Addrs = std::vector<std::string>;

// A root whose hosts file (no system resolver) names the servers; nmblookup
// on PATH answers only for 127.0.0.5.
class UsableIpTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(root_.Write("/etc/hosts",
                            "# test servers\n"
                            "127.0.0.7  backup  backup.example  # first\n"
                            "127.0.0.8  Backup\n"
                            "::1        backup\n"
                            "127.0.0.6  storage01\n"));
    ASSERT_TRUE(root_.Write("/etc/s2s/platform.conf",
                            "[Platform]\n\tlookup=\"hosts\"\n"));
    ASSERT_TRUE(root_.MakeDir("/bin"));
    ASSERT_TRUE(s2s_test::WriteScript(
        root_.Path("/bin/nmblookup"),
        "echo \"Looking up status of $2\"\n"
        "[ \"$1 $2\" = \"-A 127.0.0.5\" ] || exit 1\n"
        "printf '\\tSTORAGE01       <00> -         B <ACTIVE> \\n'\n"
        "printf '\\tOTHER           <20> -         B <ACTIVE> \\n'\n"));
  }

  s2s_test::TempRoot root_;
  ScopedEnv path_{"PATH", root_.Path("/bin") + ":/usr/bin:/bin"};
};

// The remembered address wins while it belongs to the host: by name
// resolution, or by its NetBIOS name (case ignored) when it answers one.
TEST_F(UsableIpTest, RememberedAddressWinsWhileItBelongsToTheHost) {
  const struct {
    const char *host, *remembered;
    Addrs out;
  } cases[] = {
      {"", "10.0.0.5", {"10.0.0.5"}},  // no host: taken as given
      {"backup", "127.0.0.8", {"127.0.0.8"}},
      // A silent machine no longer the host's; an unknown name.
      {"backup", "127.0.0.9", {"127.0.0.7", "127.0.0.8"}},
      {"nosuch", "127.0.0.9", {"127.0.0.9"}},
      {"Storage01", "127.0.0.5", {"127.0.0.5"}},
      // The NetBIOS name of another machine sends it to the resolver.
      {"backup", "127.0.0.5", {"127.0.0.7", "127.0.0.8"}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(std::string(c.host) + " " + c.remembered);
    Addrs out = {"kept"}, want = {"kept"};  // addresses are appended
    want.insert(want.end(), c.out.begin(), c.out.end());
    EXPECT_EQ(S2S::GetUsableIP(c.host, c.remembered, out), 0);
    EXPECT_EQ(out, want);
  }
  KARO_IPADDR table[1];
  EXPECT_EQ(KARONetLookupIP("BACKUP", table, 1, 0), 1);  // bounded by max
}

TEST_F(UsableIpTest, MissingNmblookupIsLoggedAndLookupGoesOn) {
  ScopedEnv no_path("PATH", root_.Path("/empty"));
  s2s_test::SyslogCapture log;
  Addrs out;
  EXPECT_EQ(S2S::GetUsableIP("backup", "127.0.0.8", out), 0);
  EXPECT_EQ(out, Addrs{"127.0.0.8"});
  ASSERT_EQ(log.Messages().size(), 1u);
  EXPECT_TRUE(Has(log.Messages()[0], "[ERROR] S2S/s2s("));
  EXPECT_TRUE(Has(log.Messages()[0], "): nmblookup_r: popen error\n"));
  // The system resolver answers names the root's hosts file does not know.
  ASSERT_TRUE(root_.Write("/etc/s2s/platform.conf", "[Platform]\n"));
  out.clear();
  EXPECT_EQ(S2S::GetUsableIP("localhost", "", out), 0);
  ASSERT_FALSE(out.empty());
  EXPECT_EQ(out[0].rfind("127.", 0), 0u);
}

}  // namespace
