// What a share's tree looks like on the server after a run: awkward names,
// links, modes, owners, times, ACLs and extended attributes.
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <filesystem>
#include <map>

#include "S2S/rsyncer.h"
#include "appliances.h"
#include "gtest/gtest.h"

namespace {

using S2S::Rsyncer;
using s2s_test::ReadFile;
using s2s_test::WriteFile;
namespace fs = std::filesystem;

// A tree as rsync should carry it, one line per entry: name, type and mode,
// owner, modification time (not for directories) and the content or the
// link's target.
std::string Snapshot(const std::string& top) {
  std::string out;
  std::map<std::string, std::string> lines;
  for (const auto& e : fs::recursive_directory_iterator(top)) {
    std::string path = e.path().string();
    struct stat st;
    if (lstat(path.c_str(), &st) != 0) continue;
    char head[64];
    snprintf(head, sizeof head, " %o %d:%d %ld ", st.st_mode, st.st_uid,
             st.st_gid, S_ISDIR(st.st_mode) ? 0L : long(st.st_mtime));
    std::string data = S_ISLNK(st.st_mode) ? fs::read_symlink(e.path()).string()
                       : S_ISREG(st.st_mode) ? ReadFile(path)
                                             : "";
    lines[path.substr(top.size())] = head + data;
  }
  for (const auto& [name, line] : lines) out += name + line + "\n";
  return out;
}

class RsyncerTreeTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(app_.AddShare("tree"));
    ASSERT_TRUE(app_.StartServer()) << app_.DaemonLog();
    ASSERT_EQ(0, r_.Initialize(app_.Info()));
    int status = -1;
    std::list<std::string> conflicts;
    ASSERT_EQ(0, r_.DoPairing(false, {"tree"}, conflicts, status));
    ASSERT_EQ(0, r_.StartSyncShare("tree", status));
    ASSERT_EQ(0, status);
    c_ = app_.ClientShare("tree");
    s_ = app_.ServerShare("tree");
  }

  int Push() {
    int status = -1;
    EXPECT_EQ(0, r_.RunSync(1, "tree", "/", {}, status));
    return status;
  }

  s2s_test::Appliances app_{S2S_CMD_HANDLER};
  Rsyncer r_;
  std::string c_, s_;
};

TEST_F(RsyncerTreeTest, AwkwardNamesLinksModesAndOwners) {
  const std::string names[] = {
      "with space",          "quote\"d 'twice'", "new\nline",   "tab\there",
      "latin1-\xe9\xff\xfe", "-leading-dash",    "back\\slash", "star*?[x]",
  };
  ASSERT_TRUE(fs::create_directories(c_ + "/dir one/sub"));
  for (const std::string& n : names) {
    ASSERT_TRUE(WriteFile(c_ + "/" + n, "content of " + n)) << n;
    ASSERT_TRUE(WriteFile(c_ + "/dir one/sub/" + n, n)) << n;
  }
  ASSERT_EQ(0, chmod((c_ + "/with space").c_str(), 0600));
  ASSERT_EQ(0, chmod((c_ + "/-leading-dash").c_str(), 04755));
  ASSERT_EQ(0, chmod((c_ + "/dir one").c_str(), 0750));
  ASSERT_EQ(0, lchown((c_ + "/tab\there").c_str(), 4321, 8765));
  ASSERT_EQ(0, symlink("with space", (c_ + "/link to file").c_str()));
  ASSERT_EQ(0, symlink("dir one/sub", (c_ + "/link to dir").c_str()));
  ASSERT_EQ(0, symlink("/nonexistent/target", (c_ + "/dangling").c_str()));
  ASSERT_TRUE(WriteFile(c_ + "/hard-a", "shared inode"));
  ASSERT_EQ(0, link((c_ + "/hard-a").c_str(), (c_ + "/hard-b").c_str()));
  ASSERT_TRUE(WriteFile(c_ + "/empty", ""));
  ASSERT_TRUE(fs::create_directories(c_ + "/empty dir"));

  ASSERT_EQ(0, Push()) << app_.DaemonLog();
  // Links travel as links, not as what they point at.
  EXPECT_EQ(Snapshot(c_), Snapshot(s_));
  // A hard link stays one file with two names.
  struct stat a, b;
  ASSERT_EQ(0, stat((s_ + "/hard-a").c_str(), &a));
  ASSERT_EQ(0, stat((s_ + "/hard-b").c_str(), &b));
  EXPECT_EQ(a.st_ino, b.st_ino);

  // A second run sends what changed and removes what went.
  ASSERT_TRUE(fs::remove(c_ + "/new\nline"));
  ASSERT_EQ(0, chmod((c_ + "/quote\"d 'twice'").c_str(), 0444));
  ASSERT_EQ(0, Push());
  EXPECT_FALSE(fs::exists(s_ + "/new\nline"));
  EXPECT_EQ(Snapshot(c_), Snapshot(s_));
}

TEST_F(RsyncerTreeTest, AclsAndExtendedAttributes) {
  std::string file = c_ + "/acl-file";
  ASSERT_TRUE(WriteFile(file, "guarded"));
  ASSERT_TRUE(fs::create_directories(c_ + "/acl-dir"));
  if (!s2s_test::RunQuiet({"setfacl", "-m", "u:12345:r--,g:23456:rw-", file}) ||
      !s2s_test::RunQuiet(
          {"setfacl", "-d", "-m", "u:12345:rwx", c_ + "/acl-dir"})) {
    GTEST_SKIP() << "the temporary file system refuses ACLs";
  }
  bool xattrs = setxattr(file.c_str(), "user.s2s.note", "kept", 4, 0) == 0;

  ASSERT_EQ(0, Push()) << app_.DaemonLog();
  s2s_test::TempDir out;
  auto acl = [&out](const std::string& path, const char* flags = "-cp") {
    return s2s_test::RunProgram(out.path(), {"/usr/bin/getfacl", flags, path})
        .out;
  };
  EXPECT_NE(acl(file).find("user:12345:r--"), std::string::npos);
  EXPECT_EQ(acl(file), acl(s_ + "/acl-file"));
  EXPECT_EQ(acl(c_ + "/acl-dir", "-cpd"), acl(s_ + "/acl-dir", "-cpd"));
  EXPECT_NE(acl(s_ + "/acl-dir", "-cpd").find("user:12345:rwx"),
            std::string::npos);
  if (xattrs) {
    char value[16] = {0};
    EXPECT_EQ(4, getxattr((s_ + "/acl-file").c_str(), "user.s2s.note", value,
                          sizeof value));
    EXPECT_STREQ("kept", value);
  }
}

}  // namespace
