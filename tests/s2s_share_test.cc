#include "S2S/s2s_share.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include "S2S/s2s_lock.h"
#include "karo_err.h"
#include "karo_share.h"
#include "testutil.h"

namespace {

using s2s_test::Has;
using s2s_test::SyslogCapture;

const char kShares[] =
    "[docs]\n\tpath=\"/volume1/docs\"\n\tencrypted=\"yes\"\n"
    "\tauto_mount=\"yes\"\n\tkey_length=\"32\"\n\tvolume_type=\"1\"\n"
    "\tenc_path=\"/volume1/@docs@\"\n\tvolume=\"/volume1\"\n"
    "[public]\n\tpath=\"/volume1/public/\"\n\twin_share=\"yes\"\n"
    "\tcluster=\"yes\"\n\tvolume=\"/volume1\"\n"
    "[secret]\n\tpath=\"/volume2/secret\"\n\tencrypted=\"yes\"\n"
    "\tkey_file=\"/keys/secret.key\"\n"
    "[usb]\n\tpath=\"/media/usb/photos\"\n\tvolume=\"/media/usb\"\n"
    "\tvolume_type=\"3\"\n\tsharebin=\"yes\"\n"
    "[nopath]\n\tacl=\"yes\"\n";

class ShareTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(root_.Write("/etc/s2s/shares.conf", kShares));
  }
  s2s_test::TempRoot root_;
};

std::string Flags(const S2S::ShareInfo& i) {
  std::string f;
  if (i.IsEncrypted()) f += "enc ";
  if (i.IsAutoMount()) f += "auto ";
  if (i.IsACL()) f += "acl ";
  if (i.IsWinShare()) f += "win ";
  if (i.IsCluster()) f += "cluster ";
  return f + std::to_string(i.GetEncryptKeyLen());
}

// An encrypted share is served from its lower path; a Windows one has ACLs.
TEST_F(ShareTest, ShareInfoNamesTheModuleAndItsDirectory) {
  const struct {
    const char *name, *path, *module_path, *module, *flags;
  } cases[] = {
      {"public", "/volume1/public/", "/volume1/public/", "public",
       "acl win cluster 0"},
      {"docs", "/volume1/docs", "/volume1/@docs@", "@docs@", "enc auto 32"},
      {"secret", "/volume2/secret", "/volume2/@secret@", "@secret@", "enc 0"},
  };
  for (const auto& c : cases) {
    S2S::ShareInfo info;
    ASSERT_EQ(S2S::GetShareInfo(c.name, info), 0);
    EXPECT_EQ(info.GetPath(), c.path);
    EXPECT_EQ(info.GetModulePath(), c.module_path);
    EXPECT_EQ(info.GetModuleName(), c.module);
    EXPECT_EQ(Flags(info), c.flags);
  }
  // Failures are logged once, except for an empty name.
  SyslogCapture log;
  S2S::ShareInfo info;
  EXPECT_EQ(S2S::GetShareInfo("", info), -1);
  EXPECT_EQ(log.Text(), "");
  for (const char* bad : {"missing", "nopath", "../etc"})
    EXPECT_EQ(S2S::GetShareInfo(bad, info), -1) << bad;
  ASSERT_EQ(log.Messages().size(), 3u);
  EXPECT_TRUE(Has(log.Messages()[0], "S2S/s2s("));
  EXPECT_TRUE(Has(log.Messages()[0], "Fail to get share 'missing'\n"));
  EXPECT_TRUE(Has(log.Messages()[1], "Fail to get the path of share 'nopath'"));
  EXPECT_EQ(info.GetName(), "");  // untouched by the failures
}

TEST_F(ShareTest, VolumesAndValidity) {
  S2S::VolumeInfo vol;
  ASSERT_EQ(S2S::GetVolumeInfo("docs", vol), 0);
  EXPECT_EQ(vol.GetPath(), "/volume1");
  EXPECT_EQ(vol.GetName(), "volume1");
  ASSERT_EQ(S2S::GetVolumeInfo("public", vol), 0);  // type defaults to 1
  EXPECT_TRUE(vol.IsInternal());
  // An external volume's share is refused: the task validation shows it.
  bool valid = true;
  SyslogCapture log;
  EXPECT_EQ(S2S::IsValidShare("missing", valid), -1);
  EXPECT_TRUE(Has(log.Text(), "Fail to get share info\n"));
  EXPECT_TRUE(Has(log.Text(), "Fail to get volume info\n"));
  // A plug unit accepts only shares on its share bin.
  ASSERT_TRUE(root_.Write("/etc/s2s/platform.conf",
                          "[Platform]\n\tplug_unit=\"yes\"\n"));
  EXPECT_EQ(S2S::IsValidShare("usb", valid), 0);
  EXPECT_TRUE(valid);
  EXPECT_EQ(S2S::IsValidShare("docs", valid), 0);
  EXPECT_FALSE(valid);
}

TEST_F(ShareTest, VolumeFallsBackToTheRootsMountTable) {
  ASSERT_TRUE(root_.Write("/etc/mtab",
                          "/dev/md0 / ext4 rw 0 0\n"
                          "/dev/md1 /volume2 ext4 rw 0 0\n"
                          "/dev/md2 /volume20 ext4 rw 0 0\n"
                          "tmpfs /volume2/sec\\040ret tmpfs rw 0 0\n"));
  KARO_VOLUME vol;
  ASSERT_EQ(VolumePathParseEx("/volume2/secret", &vol), 0);
  EXPECT_STREQ(vol.path, "/volume2");
  EXPECT_EQ(vol.type, KARO_VOLUME_INTERNAL);
  ASSERT_EQ(VolumePathParseEx("/volume2/sec ret/x", &vol), 0);
  EXPECT_STREQ(vol.path, "/sec ret");
  EXPECT_EQ(vol.type, KARO_VOLUME_OTHER);
  // The root file system gets a name too.
  ASSERT_EQ(VolumePathParseEx("/srv/data", &vol), 0);
  EXPECT_STREQ(vol.path, "/root");
  EXPECT_EQ(VolumePathParseEx("volume2", &vol), -1);
  EXPECT_EQ(KLIBCErrGet(), KERR_INVALID_ARG);
}

TEST_F(ShareTest, KeyFilesAndShareNames) {
  KARO_SHARE* share = nullptr;
  char buf[4096];
  int flag = 0;
  ASSERT_EQ(KAROShareGet("docs", &share), 0);
  ASSERT_EQ(KLIBShareIsAutoDecryptGet(share, &flag), 0);
  EXPECT_EQ(flag, 1);
  ASSERT_GT(KAROShareEncKeyFileGet(share, buf, sizeof buf), 0);
  EXPECT_EQ(std::string(buf), root_.Path("/usr/karo/etc/.encrypt/docs.key"));
  ASSERT_GT(KAROShareEncAutoKeyFileGet(share, buf, sizeof buf), 0);
  EXPECT_EQ(std::string(buf),
            root_.Path("/usr/karo/etc/.encrypt/docs.auto.key"));
  KAROShareFree(share);
  ASSERT_EQ(KAROShareGet("secret", &share), 0);  // configured elsewhere
  ASSERT_GT(KAROShareEncKeyFileGet(share, buf, sizeof buf), 0);
  EXPECT_STREQ(buf, "/keys/secret.key");
  KAROShareFree(share);
  ASSERT_EQ(KAROShareGet("public", &share), 0);
  EXPECT_EQ(KAROShareEncKeyFileGet(share, buf, sizeof buf), -1);
  EXPECT_EQ(KLIBCErrGet(), KERR_NOT_FOUND);
  KAROShareFree(share);
  for (const char* bad : {"", ".", "..", "a/b", "a]b", "@x@", " x", "a\nb"})
    EXPECT_EQ(KaroShareNameValid(bad), 0) << bad;
  EXPECT_EQ(KaroShareNameValid("My Share.2"), 1);
  KSZLIST* names = KLIBCSzListAlloc();
  ASSERT_EQ(KAROShareEnum(names), 5);
  EXPECT_STREQ(KLIBCSzListGet(names, 4), "nopath");
  KLIBCSzListFree(names);
}

// The second process is flock(1), which asks without waiting.
TEST(SimpleFileLockTest, ExcludesASecondProcessUntilReleased) {
  s2s_test::TempDir dir;
  const std::string path = dir.Sub("lock");
  const std::vector<std::string> probe = {"flock", "-n", path, "true"};
  S2S::LockFactory factory(path);
  S2S::SimpleFileLock lock = factory.GetLock();
  ASSERT_EQ(lock.UnLock(), 0);  // not held yet
  ASSERT_EQ(lock.ExLock(), 0);
  ASSERT_EQ(lock.ExLock(), 0);  // held already
  EXPECT_FALSE(s2s_test::RunQuiet(probe));
  ASSERT_EQ(lock.UnLock(), 0);
  EXPECT_TRUE(s2s_test::RunQuiet(probe));
  EXPECT_EQ(access(path.c_str(), F_OK), 0);  // the file stays

  SyslogCapture log;
  S2S::SimpleFileLock unopenable("/nonexistent-dir/s2s/lock");
  EXPECT_EQ(unopenable.ExLock(), -1);
  EXPECT_EQ(unopenable.UnLock(), -1);
  EXPECT_TRUE(Has(log.Text(),
                  "Fail to open lock file at '/nonexistent-dir/s2s/lock', "
                  "error:'No such file"));
}

}  // namespace
