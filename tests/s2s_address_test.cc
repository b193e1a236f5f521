#include "S2S/s2s_address.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "karo_net.h"
#include "testutil.h"

namespace {

using s2s_test::ScopedEnv;
using s2s_test::SyslogCapture;
using s2s_test::TempRoot;
using Addrs = std::vector<std::string>;

// A root whose hosts file names the servers, with the system resolver shut
// off, and an nmblookup on PATH that answers only for 127.0.0.5.
class UsableIpTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(root_.Write("/etc/hosts",
                            "# test servers\n"
                            "127.0.0.7  backup  backup.example  # first\n"
                            "127.0.0.8  Backup\n"
                            "::1        backup\n"
                            "127.0.0.5  storage01\n"));
    ASSERT_TRUE(root_.Write("/etc/s2s/platform.conf",
                            "[Platform]\n\tlookup=\"hosts\"\n"));
    ASSERT_TRUE(root_.MakeDir("/bin"));
    ASSERT_TRUE(s2s_test::WriteScript(
        root_.Path("/bin/nmblookup"),
        "[ \"$1\" = -A ] || exit 2\n"
        "echo \"Looking up status of $2\"\n"
        "if [ \"$2\" = 127.0.0.5 ]; then\n"
        "  printf '\\tSTORAGE01       <00> -         B <ACTIVE> \\n'\n"
        "  printf '\\tOTHER           <20> -         B <ACTIVE> \\n'\n"
        "  exit 0\n"
        "fi\n"
        "echo \"No reply from $2\"; exit 1\n"));
  }

  TempRoot root_;
  ScopedEnv path_{"PATH", root_.Path("/bin") + ":/usr/bin:/bin"};
};

TEST_F(UsableIpTest, WithoutHostTheAddressIsTakenAsGiven) {
  Addrs out{"kept"};
  EXPECT_EQ(S2S::GetUsableIP("", "10.0.0.5", out), 0);
  EXPECT_EQ(out, (Addrs{"kept", "10.0.0.5"}));
}

TEST_F(UsableIpTest, WithoutAddressEveryResolvedAddressIsOffered) {
  KARO_IPADDR table[1];
  EXPECT_EQ(KARONetLookupIP("BACKUP", table, 1, 0), 1);  // bounded by max
  Addrs out;
  EXPECT_EQ(S2S::GetUsableIP("backup", "", out), 0);
  EXPECT_EQ(out, (Addrs{"127.0.0.7", "127.0.0.8"}));
  EXPECT_EQ(S2S::GetUsableIP("nosuch", "", out), -1);
  EXPECT_EQ(out.size(), 2u);
}

TEST_F(UsableIpTest, RememberedAddressWinsWhileItBelongsToTheHost) {
  Addrs out;
  EXPECT_EQ(S2S::GetUsableIP("backup", "127.0.0.8", out), 0);
  EXPECT_EQ(out, Addrs{"127.0.0.8"});

  out.clear();  // silent machine, address no longer the host's
  EXPECT_EQ(S2S::GetUsableIP("backup", "127.0.0.9", out), 0);
  EXPECT_EQ(out, (Addrs{"127.0.0.7", "127.0.0.8"}));

  out.clear();  // unknown name: the remembered address is all there is
  EXPECT_EQ(S2S::GetUsableIP("nosuch", "127.0.0.9", out), 0);
  EXPECT_EQ(out, Addrs{"127.0.0.9"});
}

TEST_F(UsableIpTest, NetbiosNameMatchesIgnoringCase) {
  Addrs out;
  EXPECT_EQ(S2S::GetUsableIP("Storage01", "127.0.0.5", out), 0);
  EXPECT_EQ(out, Addrs{"127.0.0.5"});
  out.clear();  // the name of another machine sends it to the resolver
  EXPECT_EQ(S2S::GetUsableIP("backup", "127.0.0.5", out), 0);
  EXPECT_EQ(out, (Addrs{"127.0.0.7", "127.0.0.8"}));
}

TEST_F(UsableIpTest, MissingNmblookupIsLoggedAndLookupGoesOn) {
  ScopedEnv no_path("PATH", root_.Path("/empty"));
  SyslogCapture log;
  Addrs out;
  EXPECT_EQ(S2S::GetUsableIP("backup", "127.0.0.8", out), 0);
  EXPECT_EQ(out, Addrs{"127.0.0.8"});
  ASSERT_EQ(log.Messages().size(), 1u);
  EXPECT_NE(log.Messages()[0].find("[ERROR] S2S/s2s("), std::string::npos);
  EXPECT_NE(log.Messages()[0].find("): nmblookup_r: popen error\n"),
            std::string::npos);
}

TEST_F(UsableIpTest, SystemResolverAnswersNamesTheRootDoesNotKnow) {
  ASSERT_TRUE(root_.Write("/etc/s2s/platform.conf", "[Platform]\n"));
  Addrs out;
  EXPECT_EQ(S2S::GetUsableIP("localhost", "", out), 0);
  ASSERT_FALSE(out.empty());
  EXPECT_EQ(out[0].rfind("127.", 0), 0u);
}

}  // namespace
