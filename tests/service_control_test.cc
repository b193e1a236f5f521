// The client service's control socket from the front end's side: s2sctl's
// command line, its JSON and its words for a person (schedules, progress,
// why a realtime task is not watching), and requests to a real s2sd.
#include <pwd.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "S2S/pobject.h"
#include "control_client.h"
#include "ctl_options.h"
#include "ctl_print.h"
#include "ctl_task.h"
#include "json_writer.h"
#include "s2sd_process.h"

namespace {

using namespace s2s_tools;
using S2S::PObject;

bool ParseCtl(std::vector<std::string> args, CtlOptions& o,
              std::string& error) {
  args.insert(args.begin(), "s2sctl");
  std::vector<char*> argv;
  for (std::string& a : args) argv.push_back(&a[0]);
  argv.push_back(nullptr);
  return ParseCtlArgs(static_cast<int>(args.size()), argv.data(), o, error);
}

TEST(ControlJson, StringsAreValidWhateverTheirBytesValuesKeepTheirKinds) {
  const struct {
    std::string in, out;
  } kCases[] = {
      {"q\"b\\s/", "\"q\\\"b\\\\s/\""},
      {"\n\t\r\x01\x7f", "\"\\n\\t\\r\\u0001\\u007f\""},
      {"\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x98\x80",
       "\"\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x98\x80\""},
      {"\xFF", "\"\\u00ff\""},
      {"a\xC3", "\"a\\u00c3\""},                                 // cut sequence
      {"\xC0\xAF", "\"\\u00c0\\u00af\""},                        // overlong '/'
      {"\xED\xA0\x80", "\"\\u00ed\\u00a0\\u0080\""},             // a surrogate
      {"\xF4\x90\x80\x80", "\"\\u00f4\\u0090\\u0080\\u0080\""},  // > U+10FFFF
  };
  for (const auto& c : kCases) EXPECT_EQ(c.out, JsonString(c.in)) << c.in;

  PObject v;
  v["result"] = 0u;
  v["task_result"] = -1;
  v["big"] = 18446744073709551615ULL - 1;  // -2 as the protocol carries it
  v["epoch"] = 1700000000ULL;
  v["none"] = PObject();
  v["list"].asArray().push_back(PObject("x"));
  v["list"].asArray().push_back(PObject());
  v["empty"].asMap();
  v["k\"ey"] = "v";
  EXPECT_EQ(
      "{\"big\":-2,\"empty\":{},\"epoch\":1700000000,\"k\\\"ey\":\"v\","
      "\"list\":[\"x\",null],\"none\":null,\"result\":0,\"task_result\":-1}",
      ToJson(v, false));
}

TEST(CtlOptions, TaskOptionsBecomeOnlyTheKeysTheyName) {
  const struct {
    std::vector<std::string> args;
    std::string changes;  // compact JSON; "" when the parse must fail
  } kCases[] = {
      {{"task", "edit", "3", "--days", "mon,fri", "--at", "7:05"},
       "{\"schedule_begin_hour\":7,\"schedule_begin_min\":5,"
       "\"week_schd\":\"0100010\"}"},
      {{"--json", "task", "add", "--share", "a", "--share", "b",
        "--compress=no", "--disabled", "--schedule", "once", "--begin",
        "2026-02-03", "--every", "1:30", "--repeat", "2"},
       "{\"compress\":0,\"enabled\":0,\"period_hour\":1,\"period_minute\":30,"
       "\"repeat_times_in_day\":2,\"schedule_begin_day\":3,"
       "\"schedule_begin_month\":2,\"schedule_begin_year\":2026,"
       "\"schedule_mode\":5,\"share_list\":[\"a\",\"b\"]}"},
      {{"task", "edit", "x", "--exclude", "*.tmp", "--no-excludes", "--ssh"},
       "{\"excludes\":[],\"ssh\":1}"},
      {{"task", "edit", "x", "--settle", "0.25", "--max-delay", "9",
        "--full-sync-every", "600", "--change-source", "inotify"},
       "{\"realtime_full_sync\":600,\"realtime_max_delay\":9,"
       "\"realtime_settle_ms\":250,\"realtime_source\":\"inotify\"}"},
      {{"task", "edit", "x", "--settle", "0.0005"}, ""},
      {{"task", "edit", "x", "--settle", "1e3"}, ""},
      {{"task", "edit", "x", "--change-source", "dnotify"}, ""},
      {{"history", "x", "--limit", "5"}, "{}"},
      {{"history", "x", "--limit", "0"}, ""},
      {{"task", "add", "--password", "secret"}, ""},
      {{"status", "--at", "10:00"}, ""},
      {{"run"}, ""},
      {{"task", "edit", "3", "--task-id", "4"}, ""},
      {{"task", "add", "--days", "funday"}, ""},
      {{"task", "add", "--schedule", "Weekly"}, ""},
      {{"task", "add", "--at", "7"}, ""},
      {{"task", "frobnicate"}, ""},
      {{"task", "edit", "x", "--delete-guard=no", "--delete-guard-files", "9"},
       "{\"delete_guard\":0,\"delete_guard_files\":9}"},
      {{"run", "x", "--dry-run"}, "{}"},
      {{"history", "x", "--confirm-deletions"}, ""},
      {{"task", "add", "--delete-guard-percent", "101"}, ""},
  };
  for (const auto& c : kCases) {
    CtlOptions o;
    std::string error;
    bool ok = ParseCtl(c.args, o, error);
    EXPECT_EQ(!c.changes.empty(), ok) << c.args[0] << " " << error;
    if (ok) {
      EXPECT_EQ(c.changes, ToJson(o.changes, false)) << c.args[0];
    }
    EXPECT_FALSE(s2s_test::Has(error, "secret"));
  }
}

TEST(CtlOptions, AddTakesTheTaskFileUnderTheOptionsAndAPrivatePassword) {
  s2s_test::TempDir tmp;
  std::string task = tmp.Sub("t.task"), pass = tmp.Sub("pass");
  ASSERT_TRUE(s2s_test::WriteFile(
      task,
      "[Task]\n\tname=\"nightly\"\n\tserver_ip=\"127.0.0.1\"\n"
      "\tport=\"8873\"\n\tuser=\"s2s\"\n\tshares=\"docs:photos\"\n"
      "\texcludes=\"*.tmp\"\n\tcompress=\"yes\"\n"
      "\tpassword_file=\"" +
          pass + "\"\n"));
  ASSERT_TRUE(s2s_test::WriteFile(pass, "pw1\n", 0600));
  CtlOptions o;
  std::string error, note;
  ASSERT_TRUE(ParseCtl({"task", "add", "--task-file", task, "--user", "other",
                        "--schedule", "weekly"},
                       o, error))
      << error;
  PObject map;
  ASSERT_TRUE(BuildTaskMap(o, true, map, note, error)) << error;
  // The option wins over the file; no port (the daemon's own) and no id.
  EXPECT_EQ(
      "{\"block\":0,\"compress\":1,\"delete_guard\":1,"
      "\"delete_guard_files\":10000,\"delete_guard_percent\":50,"
      "\"excludes\":[\"*.tmp\"],\"max_bandwidth\":0,\"name\":\"nightly\","
      "\"period_hour\":0,\"period_minute\":0,\"pswd\":\"pw1\","
      "\"repeat_times_in_day\":0,\"schedule_begin_day\":1,"
      "\"schedule_begin_hour\":0,\"schedule_begin_min\":0,"
      "\"schedule_begin_month\":1,\"schedule_begin_year\":2014,"
      "\"schedule_mode\":2,\"server_ip\":\"127.0.0.1\",\"server_name\":\"\","
      "\"share_list\":[\"docs\",\"photos\"],\"ssh\":0,\"ssh_port\":0,"
      "\"user\":\"other\",\"week_schd\":\"1111111\"}",
      ToJson(map, false));
  EXPECT_TRUE(s2s_test::Has(note, "S2S_RSYNC_PORT"));

  // An edit sends what the file holds, no schedule, a password only if named.
  CtlOptions e;
  ASSERT_TRUE(ParseCtl({"task", "edit", "1", "--task-file", task}, e, error));
  chmod(pass.c_str(), 0644);
  EXPECT_FALSE(BuildTaskMap(e, false, map, note, error));
  EXPECT_TRUE(s2s_test::Has(error, "0600")) << error;
  CtlOptions bare;
  ASSERT_TRUE(ParseCtl({"task", "edit", "1", "--ssh-port", "22"}, bare, error));
  unsetenv("S2S_PASSWORD");
  ASSERT_TRUE(BuildTaskMap(bare, false, map, note, error)) << error;
  EXPECT_EQ("{\"ssh_port\":22}", ToJson(map, false));
}

TEST(CtlPrint, SchedulesSettingsProgressAndWhyNotWatchingInWords) {
  const struct {
    int mode;
    const char* week;
    int repeat;
    const char* text;
  } cases[] = {
      {0, "1111111", 0, "manual"},
      {1, "1111111", 0, "realtime"},
      {2, "1111111", 0, "daily at 02:05"},
      {2, "0111110", 0, "weekdays at 02:05"},
      {2, "1000001", 0, "weekends at 02:05"},
      {2, "0100100", 0, "mon,thu at 02:05"},
      {2, "0000000", 0, "never at 02:05"},
      {2, "1111111", 3, "daily at 02:05, 3 more every 01:30"},
      {3, "", 0, "monthly on day 9 at 02:05"},
      {4, "", 0, "yearly on 12-09 at 02:05"},
      {5, "", 0, "once on 2027-12-09 at 02:05"},
      {9, "", 0, "mode 9"},
  };
  for (const auto& c : cases) {
    PObject task;
    task["schedule_mode"] = c.mode;
    task["week_schd"] = c.week;
    task["schedule_begin_hour"] = 2;
    task["schedule_begin_min"] = 5;
    task["schedule_begin_day"] = 9;
    task["schedule_begin_month"] = 12;
    task["schedule_begin_year"] = 2027;
    task["repeat_times_in_day"] = c.repeat;
    task["period_hour"] = 1;
    task["period_minute"] = 30;
    EXPECT_EQ(c.text, ScheduleText(task)) << c.mode << " " << c.week;
  }

  PObject task;
  PObject& t = task["task"];
  t["schedule_mode"] = 1;
  t["realtime_source"] = "inotify";
  t["realtime_settle_ms"] = 1500;
  t["realtime_max_delay"] = 30;
  t["realtime_full_sync"] = 90061;
  t["ssh"] = true;
  t["ssh_port"] = 2222;
  t["server_ip"] = "10.0.0.2";
  t["server_name"] = "backup1";
  t["schedule_error"] = "no such day";
  PObject status;
  PObject& run = status["running"].asArray().emplace_back();
  run["id"] = 4;
  run["bytes_total"] = 2u << 20;
  run["bytes_done"] = 1u << 20;
  run["rate"] = 512u << 10;
  run["seconds_left"] = 2;
  PObject& both = status["running"].asArray().emplace_back();
  both["id"] = 5;
  for (const char* name : {"alpha", "beta"}) {
    PObject& share = both["shares"].asArray().emplace_back();
    share["name"] = name;
    share["step"] = "transfer";
  }
  PObject& alpha = both["shares"].asArray()[0];
  alpha["bytes_total"] = 4u << 20;
  alpha["bytes_done"] = 3u << 20;
  PObject& watch = status["realtime"].asArray().emplace_back();
  watch["id"] = 7;
  watch["source_note"] = "not root";
  watch["problem"] = "the server is unreachable";
  watch["last_error"] = "rsync\x1b[31m failed";
  PObject& share = watch["shares"].asArray().emplace_back();
  share["name"] = "docs";
  share["watching"] = false;
  share["message"] = "no such directory";
  const std::string text = FormatTask(task) + FormatStatus(status);
  s2s_test::ExpectHas(
      text, {"settle           1.5 s\n", "max delay        30 s\n",
             "full sync every  1d 01:01:01\n", "change source    inotify\n",
             "ssh              yes, port 2222\n",
             "server           10.0.0.2 (backup1)\n",
             "schedule error   no such day\n", "delete guard     off\n",
             "1.0 MiB of 2.0 MiB, 512.0 KiB/s, 00:00:02 left\n",
             "  task 7: not fanotify: not root\n",
             "  task 7: the server is unreachable\n",
             "  task 7: last batch failed: rsync?[31m failed\n",
             "  task 7: share docs not watched: no such directory\n",
             "alpha  transfer  3.0 MiB of 4.0 MiB",
             "\n                              beta   transfer  -\n"});
}

// Against a real s2sd whose server runs a real rsync daemon.

const char kPassword[] = "Pw-never-back-4711";

// The PStream bytes of a string element.
std::string Str(const std::string& s) {
  return std::string("\x10") + static_cast<char>(s.size() >> 8) +
         static_cast<char>(s.size() & 0xFF) + s;
}

class ServiceControlTest : public s2s_test::S2sdTest {
 protected:
  void SetUp() override {
    SetUpServer({"docs"}, "");
    StartDaemon();
  }

  // One request; the reply's result (kept for the password check), or 100.
  unsigned long long Ask(const PObject& request, PObject* out = nullptr) {
    PObject reply;
    std::string error;
    if (client_.Call(request, reply, error) != ControlClient::kReplied)
      return 100;
    replies_ += ToJson(reply, false);
    if (out != nullptr) *out = reply;
    return reply["result"].asUInt64();
  }

  // Raw bytes, the sending side then shut; the reply's result, or 100.
  unsigned long long AskRaw(const std::string& bytes, std::string* message) {
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un addr = {};
    addr.sun_family = AF_UNIX;
    snprintf(addr.sun_path, sizeof addr.sun_path, "%s", client_.path().c_str());
    bool up = connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0;
    for (size_t sent = 0; up && sent < bytes.size();) {
      ssize_t n =
          send(fd, bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
      if (n <= 0) break;  // the daemon stopped reading: that is allowed
      sent += static_cast<size_t>(n);
    }
    shutdown(fd, SHUT_WR);
    S2S::IPCSender sender;
    if (sender.assign(fd) != 0 || !up) return 200;
    PObject reply;
    if (sender.recv(reply) != 0) return 100;
    replies_ += ToJson(reply, false);
    *message = reply["message"].asString();
    return reply["result"].asUInt64();
  }

  // The stored tasks as the daemon lists them.
  std::string Tasks() {
    PObject reply;
    EXPECT_EQ(0u, Ask(Action("list"), &reply));
    return ToJson(reply["tasks"], false);
  }

  // A complete manual task over "docs".
  PObject ValidTask(const std::string& name) {
    PObject task;
    task["name"] = name;
    task["share_list"].asArray().push_back(PObject("docs"));
    task["user"] = app_.user();
    task["pswd"] = kPassword;
    task["server_ip"] = "127.0.0.1";
    task["schedule_mode"] = 0;
    return task;
  }

  // A child as "nobody" asks to add a task: its exit code, the reply's
  // result, or 100 + the client's status when no reply came.
  int AddAsNobody() {
    const passwd* nobody = getpwnam("nobody");
    return s2s_test::RunInChildren(1, [&](int) -> int {
      if (nobody == nullptr ||
          setresgid(nobody->pw_gid, nobody->pw_gid, nobody->pw_gid) != 0 ||
          setresuid(nobody->pw_uid, nobody->pw_uid, nobody->pw_uid) != 0) {
        return 10;
      }
      PObject request = Action("add"), reply;
      request["task"] = ValidTask("intruder");
      std::string error;
      auto st = ControlClient(client_.path()).Call(request, reply, error);
      return st == ControlClient::kReplied ? reply["result"].asUInt64()
                                           : 100 + st;
    })[0];
  }

  ControlClient client_;
  std::string replies_;
};

TEST_F(ServiceControlTest, BadRequestsChangeNothingAndCtlRunsATaskEndToEnd) {
  PObject add = Action("add");
  add["task"] = ValidTask("kept");
  ASSERT_EQ(0u, Ask(add));
  const std::string before = Tasks();
  ASSERT_TRUE(s2s_test::Has(before, "\"kept\"")) << before;

  // Maps that decode but ask for something wrong, each with its result.
  auto with = [&](const std::string& key, const PObject& value) {
    PObject r = add;
    r["task"][key] = value;
    return r;
  };
  PObject deep("docs");
  for (int i = 0; i < 6; ++i) deep = PObject::Array{deep};
  PObject no_action;
  no_action["id"] = 1ULL;
  PObject action_number;
  action_number["action"] = 7ULL;
  PObject update_bad = Action("update", 1ULL);
  update_bad["task"]["share_list"].asArray().push_back(PObject("nope"));
  const struct {
    const char* what;
    PObject request;
    unsigned long long result;
  } kCases[] = {
      {"unknown action", Action("frobnicate"), 2},
      {"no action", no_action, 1},
      {"action not a string", action_number, 1},
      {"get without id", Action("get"), 1},
      {"id not a number", Action("get", "abc"), 1},
      {"add without task", Action("add"), 1},
      {"unknown share", with("share_list", update_bad["task"]["share_list"]),
       4},
      {"no server", with("server_ip", PObject("")), 4},
      {"name taken", with("name", PObject("kept")), 4},
      {"name the server refuses", with("name", PObject("..")), 4},
      {"address with a blank", with("server_ip", PObject("10.0.0.1 x")), 4},
      {"hour 24", with("schedule_begin_hour", PObject(24ULL)), 4},
      {"name mistyped", with("name", PObject(5ULL)), 1},
      {"unknown key", with("colour", PObject("red")), 1},
      {"name of 65535 bytes", with("name", PObject(std::string(65535, 'n'))),
       1},
      {"nested too deep", with("share_list", deep), 1},
      {"update to unknown share", update_bad, 4},
  };
  for (const auto& c : kCases) EXPECT_EQ(c.result, Ask(c.request)) << c.what;
  for (const char* action : {"get", "delete", "run", "enable", "history"})
    EXPECT_EQ(3u, Ask(Action(action, 999ULL))) << action;

  // Bytes that are no request: dropped, or an error, never a change.
  const std::string list_map = "\x42" + Str("action") + Str("list") + "\x40";
  std::string oversized = "\x42" + Str("action") + Str("add") + Str("task") +
                          "\x42" + Str("excludes") + "\x41";
  for (int i = 0; i < 20; ++i) oversized += Str(std::string(60000, 'x'));
  oversized += "\x40\x40\x40";
  // The size cap answers before the whole request is read, in words.
  const struct {
    const char* what;
    std::string bytes;
    const char* refusal;  // nullptr: no reply or any error will do
  } kRaw[] = {
      {"garbage", "\xff\xfe hello", nullptr},
      {"truncated", list_map.substr(0, list_map.size() - 3), nullptr},
      {"not a map", Str("list"), nullptr},
      {"nested past the wire limit",
       "\x42" + Str("action") + Str("list") + Str("x") +
           std::string(600, '\x41') + std::string(600, '\x40') + "\x40",
       nullptr},
      {"oversized", oversized, "the request is too large"},
  };
  for (const auto& c : kRaw) {
    std::string message;
    unsigned long long result = AskRaw(c.bytes, &message);
    if (c.refusal != nullptr) {
      EXPECT_EQ(s2s_service::kResultMalformed, result) << c.what;
      EXPECT_EQ(c.refusal, message) << c.what;
    } else {
      EXPECT_TRUE(result == 100 || (result != 0 && result < 8))
          << c.what << ": " << result;
    }
  }

  // Peers other than root: the socket's mode keeps them out; widened by
  // hand with the directories above it, the daemon's own check still does.
  if (geteuid() == 0) {
    EXPECT_EQ(100 + ControlClient::kRefused, AddAsNobody());
    const std::string& path = client_.path();
    const std::string& root = app_.client_root();
    const std::string top = root.substr(0, root.rfind('/'));
    ASSERT_EQ(0, chmod(path.c_str(), 0666));
    for (std::string dir = path.substr(0, path.rfind('/'));
         dir.size() >= top.size(); dir = dir.substr(0, dir.rfind('/'))) {
      struct stat st;
      ASSERT_EQ(0, stat(dir.c_str(), &st));
      ASSERT_EQ(0, chmod(dir.c_str(), st.st_mode | 0011));
    }
    EXPECT_EQ(s2s_service::kResultNotPermitted, AddAsNobody());
  }

  EXPECT_EQ(before, Tasks());
  EXPECT_EQ(0u, Ask(Action("status"))) << "the daemon stopped serving";

  // The password went in and never came back; that one is stored is said.
  PObject got;
  ASSERT_EQ(0u, Ask(Action("get", 1ULL), &got));
  EXPECT_TRUE(got["task"]["has_password"].asBool());
  EXPECT_FALSE(s2s_test::Has(replies_, kPassword));
  EXPECT_FALSE(s2s_test::Has(Log(), kPassword));

  const std::string password = app_.Info().GetPassword();
  const std::string pass = tmp_.Sub("pass");
  ASSERT_TRUE(s2s_test::WriteFile(pass, password + "\n", 0600));
  const std::string docs = app_.ClientShare("docs");
  for (const char* f : {"/a.txt", "/b.txt", "/c.txt"})
    ASSERT_TRUE(s2s_test::WriteFile(docs + f, "a\n"));
  // s2sctl as a script uses it: its exit code, its output.
  s2s_test::Child last;
  auto ctl = [&](std::vector<std::string> args) {
    args.insert(args.begin(), S2SCTL_PROGRAM);
    last = s2s_test::RunProgram(tmp_.path(), args);
    return last.code;
  };
  const std::vector<std::string> add_cmd = {
      "task",       "add",       "--task",          "docs-copy",
      "--share",    "docs",      "--server-ip",     "127.0.0.1",
      "--user",     app_.user(), "--password-file", pass,
      "--schedule", "manual"};
  ASSERT_EQ(0, ctl(add_cmd)) << last.out;
  EXPECT_EQ(5, ctl(add_cmd)) << last.out;  // the name is taken
  ASSERT_EQ(0, ctl({"task", "list"}));
  EXPECT_TRUE(s2s_test::Has(last.out, "docs-copy")) << last.out;
  ASSERT_EQ(0, ctl({"--json", "task", "show", "docs-copy"}));
  EXPECT_TRUE(s2s_test::Has(last.out, "\"has_password\": 1")) << last.out;
  EXPECT_EQ(4, ctl({"task", "show", "no-such-task"}));
  EXPECT_EQ(4, ctl({"run", "999"}));
  EXPECT_EQ(3, ctl({"--socket", tmp_.Sub("none.sock"), "status"}));
  EXPECT_EQ(2, ctl({"task", "edit", "docs-copy", "--exclude",
                    std::string(70000, 'x')}));  // the wire would wrap it

  // Runs the task and leaves its newest history entry in last.out.
  auto run = [&](std::vector<std::string> args) {
    args.insert(args.begin(), {"run", "docs-copy"});
    ASSERT_EQ(0, ctl(args)) << last.out;
    ASSERT_TRUE(s2s_test::WaitUntil(
        [&] {
          return ctl({"history", "docs-copy", "--json", "--limit", "1"}) == 0 &&
                 s2s_test::Has(last.out, "\"outcome\": \"") &&
                 !s2s_test::Has(last.out, "\"outcome\": \"running\"");
        },
        30))
        << last.out;
  };
  ASSERT_NO_FATAL_FAILURE(run({}));
  s2s_test::ExpectHas(last.out,
                      {"\"outcome\": \"ok\"", "\"trigger\": \"manual\""});
  ASSERT_EQ(0, ctl({"status"}));
  EXPECT_FALSE(s2s_test::Has(last.out, password));

  // The share emptied: a dry run lists the deletions, a run holds them
  // back, a confirmed run makes them.
  std::filesystem::remove_all(docs);
  std::filesystem::create_directories(docs);
  ASSERT_EQ(0, ctl({"run", "docs-copy", "--dry-run"})) << last.out;
  s2s_test::ExpectHas(last.out,
                      {"docs: would send 0, delete 3", "    - b.txt\n"});
  ASSERT_NO_FATAL_FAILURE(run({}));
  s2s_test::ExpectHas(last.out, {"\"outcome\": \"held\"", "3 of 4 entries"});
  EXPECT_EQ("a\n", s2s_test::ReadFile(app_.ServerShare("docs") + "/a.txt"));
  ASSERT_NO_FATAL_FAILURE(run({"--confirm-deletions"}));
  EXPECT_TRUE(s2s_test::Has(last.out, "\"outcome\": \"ok\"")) << last.out;
  EXPECT_FALSE(std::filesystem::exists(app_.ServerShare("docs") + "/a.txt"));
}

}  // namespace
