// The client service's control socket from the front end's side: what
// s2sctl makes of its command line, the JSON it prints for scripts, and
// requests against a real s2sd.
#include <stdlib.h>
#include <sys/stat.h>

#include <string>
#include <vector>

#include "S2S/pobject.h"
#include "ctl_options.h"
#include "ctl_task.h"
#include "gtest/gtest.h"
#include "json_writer.h"
#include "testutil.h"

namespace {

using namespace s2s_tools;

bool ParseCtl(std::vector<std::string> args, CtlOptions& o,
              std::string& error) {
  args.insert(args.begin(), "s2sctl");
  std::vector<char*> argv;
  for (std::string& a : args) argv.push_back(&a[0]);
  argv.push_back(nullptr);
  return ParseCtlArgs(static_cast<int>(args.size()), argv.data(), o, error);
}

TEST(ControlJson, StringsAreValidJsonWhateverTheirBytes) {
  const struct {
    std::string in;
    std::string out;
  } kCases[] = {
      {"plain", "\"plain\""},
      {"q\"b\\s/", "\"q\\\"b\\\\s/\""},
      {"\n\t\r\x01\x7f", "\"\\n\\t\\r\\u0001\\u007f\""},
      {"\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x98\x80",
       "\"\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x98\x80\""},
      {"\xFF", "\"\\u00ff\""},
      {"a\xC3", "\"a\\u00c3\""},                                 // cut sequence
      {"\xC0\xAF", "\"\\u00c0\\u00af\""},                        // overlong '/'
      {"\xED\xA0\x80", "\"\\u00ed\\u00a0\\u0080\""},             // a surrogate
      {"\xF4\x90\x80\x80", "\"\\u00f4\\u0090\\u0080\\u0080\""},  // > U+10FFFF
      {"\xE2\x82", "\"\\u00e2\\u0082\""},
  };
  for (const auto& c : kCases) EXPECT_EQ(c.out, JsonString(c.in)) << c.in;
}

TEST(ControlJson, ValuesKeepTheirKindsAndSignedNumbers) {
  S2S::PObject v;
  v["result"] = 0u;
  v["task_result"] = -1;
  v["big"] = 18446744073709551615ULL - 1;  // -2 as the protocol carries it
  v["epoch"] = 1700000000ULL;
  v["none"] = S2S::PObject();
  v["list"].asArray().push_back(S2S::PObject("x"));
  v["list"].asArray().push_back(S2S::PObject());
  v["empty"].asMap();
  v["k\"ey"] = "v";
  EXPECT_EQ(
      "{\"big\":-2,\"empty\":{},\"epoch\":1700000000,\"k\\\"ey\":\"v\","
      "\"list\":[\"x\",null],\"none\":null,\"result\":0,\"task_result\":-1}",
      ToJson(v, false));
  EXPECT_EQ("{\n  \"a\": [\n    1\n  ]\n}", [] {
    S2S::PObject m;
    m["a"].asArray().push_back(S2S::PObject(1ULL));
    return ToJson(m, true);
  }());
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
      {{"history", "x", "--limit", "5"}, "{}"},
      {{"task", "add", "--password", "secret"}, ""},
      {{"status", "--at", "10:00"}, ""},
      {{"run"}, ""},
      {{"run", "a", "b"}, ""},
      {{"task", "edit", "3", "--task-id", "4"}, ""},
      {{"task", "add", "--days", "funday"}, ""},
      {{"task", "add", "--schedule", "Weekly"}, ""},
      {{"task", "add", "--at", "7"}, ""},
      {{"task", "frobnicate"}, ""},
      {{"status", "--limit", "3"}, ""},
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
  ASSERT_TRUE(s2s_test::WriteFile(pass, "pw1\n"));
  chmod(pass.c_str(), 0600);
  CtlOptions o;
  std::string error, note;
  ASSERT_TRUE(ParseCtl({"task", "add", "--task-file", task, "--user", "other",
                        "--schedule", "weekly"},
                       o, error))
      << error;
  S2S::PObject map;
  ASSERT_TRUE(BuildTaskMap(o, true, map, note, error)) << error;
  EXPECT_EQ("nightly", map["name"].asString());
  EXPECT_EQ("other", map["user"].asString());  // the option wins
  EXPECT_EQ("pw1", map["pswd"].asString());
  EXPECT_EQ(2u, map["share_list"].asArray().size());
  EXPECT_EQ("*.tmp", map["excludes"].asArray()[0].asString());
  EXPECT_TRUE(map["compress"].asBool());
  EXPECT_EQ(2, map["schedule_mode"].asInt32());
  EXPECT_FALSE(map.hasMember("id"));  // the daemon picks one
  EXPECT_FALSE(map.hasMember("port"));
  EXPECT_TRUE(s2s_test::Has(note, "S2S_RSYNC_PORT"));

  // An edit sends what the file describes, never the schedule it cannot
  // hold, and a password only when one is named.
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

}  // namespace
