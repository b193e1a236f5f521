#include "S2S/sync_obj_task.h"

#include <gtest/gtest.h>

#include <list>
#include <string>

#include "S2S/sync_obj_share.h"
#include "testutil.h"

namespace {

using S2S::SyncInfo;
using S2S::TaskInfo;
using s2s_test::LogCapture;

// Validate()'s answer and what it logged after the "[NOTE] S2S/sync_obj(
// <line>): " prefix ("" when nothing was logged).
template <typename T>
std::string Validated(const T& obj, bool* ok) {
  LogCapture log;
  *ok = obj.Validate();
  std::string text = log.Text();
  if (text.empty()) return text;
  EXPECT_EQ(text.rfind("[NOTE] S2S/sync_obj(", 0), 0u) << text;
  return text.substr(text.find("): ") + 3);
}

// The message of a Validate() that must fail.
template <typename T>
std::string Rejection(const T& obj) {
  bool ok = true;
  std::string message = Validated(obj, &ok);
  EXPECT_FALSE(ok) << message;
  return message;
}

SyncInfo ValidSyncInfo() {
  SyncInfo info;
  info.SetServerName("backup");
  info.SetUser("admin");
  return info;
}

TEST(ShareAndEvent, RelativePathIsMadeAbsoluteOnly) {
  const struct {
    const char* in;
    const char* stored;
  } cases[] = {{"", "/"},     {"/", "/"},      {"//x", "//x"},
               {"x/", "/x/"}, {"a/b", "/a/b"}, {"/a/../b", "/a/../b"}};
  for (const auto& c : cases) {
    S2S::Event e;
    e.SetRelativePath(c.in);
    EXPECT_EQ(e.GetRelativePath(), c.stored) << c.in;
  }
  S2S::Event e;  // empty until set, not "/"
  EXPECT_EQ(e.GetRelativePath(), "");
  EXPECT_EQ(e.GetStatus(), 0);
}

TEST(SyncInfo, FlagSettersTouchOnlyTheirBit) {
  SyncInfo info;
  info.SetSyncConfigFlag(0xF0);
  info.SetSSH(true);
  EXPECT_EQ(info.GetSyncConfigFlag(), 0xF2u);
  EXPECT_FALSE(info.UseCompression());
  info.SetCompression(true);
  info.SetBlockLevelSync(true);
  EXPECT_EQ(info.GetSyncConfigFlag(), 0xF7u);
  info.SetSSH(false);
  EXPECT_EQ(info.GetSyncConfigFlag(), 0xF5u);
  EXPECT_TRUE(info.UseBlockLevelSync());
  EXPECT_FALSE(info.UseSSH());
}

TEST(SyncInfo, ValidateNeedsAServerAUserAndAPort) {
  const struct {
    const char *ip, *name, *user;
    unsigned port;
    const char* message;  // "" when valid
  } cases[] = {
      {"", "", "", 0, "Empty server ip and name\n"},
      {"", "backup", "", 0, "Empty user name ''\n"},
      {"10.0.0.2", "", "admin", 0, ""},
      {"", "backup", "admin", 65535, ""},
      {"", "backup", "admin", 65536, "Invalid SSH port '65536'\n"},
  };
  for (const auto& c : cases) {
    SyncInfo info;
    info.SetServerIP(c.ip);
    info.SetServerName(c.name);
    info.SetUser(c.user);
    info.SetSSHPort(c.port);
    bool ok = false;
    EXPECT_EQ(Validated(info, &ok), c.message);
    EXPECT_EQ(ok, *c.message == '\0') << c.message;
  }
}

TEST(TaskInfo, ValidateChecksInOrder) {
  TaskInfo task;
  EXPECT_EQ(Rejection(task), "Empty server ip and name\n");
  task.SetSyncInfo(ValidSyncInfo());
  task.GetSchedule().SetStartHour(24);
  EXPECT_EQ(Rejection(task), "Invalid begin hour\n");
  task.GetSchedule().SetStartHour(8);
  task.SetShareList({"unknown"});
  // The name is looked at before the share list; no line end follows.
  EXPECT_EQ(Rejection(task), "Empty task name");
  task.SetName("nightly");
  task.SetShareList({});
  EXPECT_EQ(Rejection(task), "Empty share list");
}

TEST(TaskInfo, EveryShareMustBeSyncable) {
  s2s_test::TempRoot root;
  ASSERT_TRUE(
      root.Write("/etc/s2s/shares.conf",
                 "[docs]\n\tpath=\"/volume1/docs\"\n\tvolume=\"/volume1\"\n"
                 "[usb]\n\tpath=\"/media/usb/p\"\n\tvolume=\"/media/usb\"\n"
                 "\tvolume_type=\"3\"\n"));
  const struct {
    std::list<std::string> shares;
    const char* message;  // "" when valid
  } cases[] = {
      {{"docs"}, ""},
      {{"docs", "usb", "missing"}, "Share 'usb' is not valid\n"},
      {{"missing", "usb"}, "Share 'missing' is not valid\n"},
  };
  for (const auto& c : cases) {
    TaskInfo task;
    task.SetName("nightly");
    task.SetSyncInfo(ValidSyncInfo());
    task.SetShareList(c.shares);
    LogCapture log;
    bool ok = task.Validate();
    EXPECT_EQ(ok, *c.message == '\0') << c.message;
    // An unknown share is reported by the host layer first.
    std::string text = log.Text();
    if (!ok) {
      EXPECT_EQ(text.substr(text.rfind("): ") + 3), c.message);
      EXPECT_NE(text.rfind("[NOTE] S2S/sync_obj("), std::string::npos);
    }
  }
}

TEST(SyncTask, SetInfoCopiesEveryField) {
  TaskInfo info;
  info.SetName("nightly");
  info.SetShareList({"a", "b"});
  info.SetSyncInfo(ValidSyncInfo());
  info.GetSchedule().SetMode(S2S::SCHD_MONTHLY);
  S2S::SyncTask task;
  task.SetID(7);
  task.SetInfo(info);
  const TaskInfo before = info;
  EXPECT_TRUE(task.GetInfo() == before);
  info.SetName("changed");
  info.SetShareList({"c"});
  info.GetSchedule().SetMode(S2S::SCHD_ONCE);
  EXPECT_TRUE(task.GetInfo() == before);
  EXPECT_FALSE(task.GetInfo() == info);
  EXPECT_EQ(task.GetID(), 7u);
}

}  // namespace
