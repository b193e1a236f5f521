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

// What was logged after the "[NOTE] S2S/sync_obj(<line>): " prefix.
std::string NoteText(const LogCapture& log) {
  std::string text = log.Text();
  EXPECT_EQ(text.rfind("[NOTE] S2S/sync_obj(", 0), 0u) << text;
  return text.substr(text.find("): ") + 3);
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
  S2S::Event e;
  EXPECT_EQ(e.GetRelativePath(), "");
  EXPECT_EQ(e.GetStatus(), 0);
  e.SetID(~0ULL);
  EXPECT_EQ(e.GetID(), ~0ULL);
  S2S::Share s;
  s.SetID(~0ULL);
  EXPECT_EQ(s.GetID(), ~0ULL);
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
  struct Case {
    void (*edit)(SyncInfo&);
    const char* message;  // "" when valid
  };
  const Case cases[] = {
      {[](SyncInfo&) {}, "Empty server ip and name\n"},
      {[](SyncInfo& i) { i.SetServerName("backup"); }, "Empty user name ''\n"},
      {[](SyncInfo& i) {
         i.SetServerIP("10.0.0.2");
         i.SetUser("admin");
       },
       ""},
      {[](SyncInfo& i) {
         i = ValidSyncInfo();
         i.SetSSHPort(65535);
       },
       ""},
      {[](SyncInfo& i) {
         i = ValidSyncInfo();
         i.SetSSHPort(65536);
       },
       "Invalid SSH port '65536'\n"},
  };
  for (const Case& c : cases) {
    SyncInfo info;
    c.edit(info);
    LogCapture log;
    bool ok = info.Validate();
    EXPECT_EQ(ok, *c.message == '\0') << c.message;
    if (!ok) {
      EXPECT_EQ(NoteText(log), c.message);
    }
  }
}

TEST(TaskInfo, ValidateChecksInOrder) {
  TaskInfo task;
  {
    LogCapture log;
    EXPECT_FALSE(task.Validate());
    EXPECT_EQ(NoteText(log), "Empty server ip and name\n");
  }
  task.SetSyncInfo(ValidSyncInfo());
  task.GetSchedule().SetStartHour(24);
  {
    LogCapture log;
    EXPECT_FALSE(task.Validate());
    EXPECT_EQ(NoteText(log), "Invalid begin hour\n");
  }
  task.GetSchedule().SetStartHour(8);
  task.SetShareList({"unknown"});
  {
    // The name is looked at before the share list; no line end follows.
    LogCapture log;
    EXPECT_FALSE(task.Validate());
    EXPECT_EQ(NoteText(log), "Empty task name");
  }
  task.SetName("nightly");
  task.SetShareList({});
  {
    LogCapture log;
    EXPECT_FALSE(task.Validate());
    EXPECT_EQ(NoteText(log), "Empty share list");
  }
}

TEST(TaskInfo, EveryShareMustBeSyncable) {
  s2s_test::TempRoot root;
  ASSERT_TRUE(root.Write("/etc/s2s/shares.conf",
                         "[docs]\n"
                         "\tpath=\"/volume1/docs\"\n"
                         "\tvolume=\"/volume1\"\n"
                         "\tvolume_type=\"1\"\n"
                         "[usb]\n"
                         "\tpath=\"/media/usb/photos\"\n"
                         "\tvolume=\"/media/usb\"\n"
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
  EXPECT_TRUE(task.GetInfo() == info);

  info.SetName("changed");
  info.SetShareList({"c"});
  info.GetSchedule().SetMode(S2S::SCHD_ONCE);
  EXPECT_EQ(task.GetInfo().GetName(), "nightly");
  EXPECT_EQ(task.GetInfo().GetShareList().size(), 2u);
  EXPECT_EQ(task.GetInfo().GetSchedule().GetMode(), S2S::SCHD_MONTHLY);
  EXPECT_EQ(task.GetID(), 7u);
}

}  // namespace
