#include "ctl_print.h"

#include <stdio.h>
#include <time.h>

#include <algorithm>
#include <vector>

namespace s2s_tools {

namespace {

using Row = std::vector<std::string>;

std::string Printable(const std::string& text) {
  std::string out = text;
  for (char& c : out) {
    if (static_cast<unsigned char>(c) < 0x20 || c == 0x7F) c = '?';
  }
  return out;
}

std::string Text(const S2S::PObject& v) {
  if (v.isString()) return v.asString().empty() ? "-" : Printable(v.asString());
  if (v.isInteger()) return std::to_string(v.asUInt64());
  return "-";
}

std::string YesNo(const S2S::PObject& v) {
  if (v.isNull()) return "-";
  return v.asBool() ? "yes" : "no";
}

std::string Format(const char* format, int a, int b, int c = 0) {
  char buf[64];
  snprintf(buf, sizeof buf, format, a, b, c);
  return buf;
}

std::string Duration(unsigned long long s) {
  char buf[64];
  if (s >= 86400) {
    snprintf(buf, sizeof buf, "%llud %02llu:%02llu:%02llu", s / 86400,
             s / 3600 % 24, s / 60 % 60, s % 60);
  } else {
    snprintf(buf, sizeof buf, "%02llu:%02llu:%02llu", s / 3600, s / 60 % 60,
             s % 60);
  }
  return buf;
}

std::string Millis(unsigned long long ms) {
  char buf[32];
  snprintf(buf, sizeof buf, "%.1f s", static_cast<double>(ms) / 1000);
  return buf;
}

std::string Bytes(unsigned long long n) {
  static const char* const kUnits[] = {"KiB", "MiB", "GiB", "TiB"};
  if (n < 1024) return std::to_string(n) + " B";
  double v = static_cast<double>(n) / 1024;
  size_t unit = 0;
  while (v >= 1024 && unit < 3) v /= 1024, ++unit;
  char buf[32];
  snprintf(buf, sizeof buf, "%.1f %s", v, kUnits[unit]);
  return buf;
}

// Rows under a header, columns padded to their widest cell; the last column
// is not padded. A table without rows shows "(none)".
std::string Table(const std::vector<Row>& rows, const std::string& indent) {
  if (rows.size() <= 1) return indent + "(none)\n";
  std::vector<size_t> width(rows[0].size(), 0);
  for (const Row& row : rows) {
    for (size_t i = 0; i < row.size() && i < width.size(); ++i) {
      width[i] = std::max(width[i], row[i].size());
    }
  }
  std::string out;
  for (const Row& row : rows) {
    out += indent;
    for (size_t i = 0; i < row.size(); ++i) {
      out += row[i];
      if (i + 1 < row.size()) out.append(width[i] - row[i].size() + 2, ' ');
    }
    out += '\n';
  }
  return out;
}

std::string Join(const S2S::PObject& array) {
  std::string out;
  for (const S2S::PObject& item : array.asArray()) {
    out += (out.empty() ? "" : ", ") + Printable(item.asString());
  }
  return out.empty() ? "-" : out;
}

std::string WeekText(const std::string& week) {
  static const char* const kDay[] = {"sun", "mon", "tue", "wed",
                                     "thu", "fri", "sat"};
  if (week == "1111111") return "daily";
  if (week == "0111110") return "weekdays";
  if (week == "1000001") return "weekends";
  std::string out;
  for (size_t i = 0; i < 7 && i < week.size(); ++i) {
    if (week[i] != '0') out += (out.empty() ? "" : ",") + std::string(kDay[i]);
  }
  return out.empty() ? "never" : out;
}

}  // namespace

std::string TimeText(unsigned long long epoch) {
  if (epoch == 0) return "-";
  time_t t = static_cast<time_t>(epoch);
  struct tm tm;
  char buf[32];
  if (localtime_r(&t, &tm) == nullptr ||
      strftime(buf, sizeof buf, "%Y-%m-%d %H:%M:%S", &tm) == 0) {
    return std::to_string(epoch);
  }
  return buf;
}

std::string ScheduleText(const S2S::PObject& task) {
  const int hour = task["schedule_begin_hour"].asInt32();
  const int minute = task["schedule_begin_min"].asInt32();
  const std::string at = Format(" at %02d:%02d", hour, minute);
  std::string out;
  switch (task["schedule_mode"].asInt32()) {
    case 0:
      return "manual";
    case 1:
      return "realtime";
    case 2:
      out = WeekText(task["week_schd"].asString()) + at;
      break;
    case 3:
      out = "monthly on day " +
            std::to_string(task["schedule_begin_day"].asInt32()) + at;
      break;
    case 4:
      out = "yearly on " +
            Format("%02d-%02d", task["schedule_begin_month"].asInt32(),
                   task["schedule_begin_day"].asInt32()) +
            at;
      break;
    case 5:
      out = "once on " +
            Format("%04d-%02d-%02d", task["schedule_begin_year"].asInt32(),
                   task["schedule_begin_month"].asInt32(),
                   task["schedule_begin_day"].asInt32()) +
            at;
      break;
    default:
      return "mode " + std::to_string(task["schedule_mode"].asInt32());
  }
  const int repeat = task["repeat_times_in_day"].asInt32();
  if (repeat > 0) {
    out += ", " + std::to_string(repeat) + " more every " +
           Format("%02d:%02d", task["period_hour"].asInt32(),
                  task["period_minute"].asInt32());
  }
  return out;
}

std::string FormatTaskList(const S2S::PObject& reply) {
  std::vector<Row> rows = {
      {"ID", "NAME", "ENABLED", "SCHEDULE", "NEXT RUN", "STATE", "LAST"}};
  for (const S2S::PObject& t : reply["tasks"].asArray()) {
    rows.push_back({Text(t["id"]), Text(t["name"]), YesNo(t["enabled"]),
                    ScheduleText(t), TimeText(t["next_run"].asUInt64()),
                    Text(t["state"]), Text(t["last_result"])});
  }
  return Table(rows, "");
}

std::string FormatTask(const S2S::PObject& reply) {
  const S2S::PObject& t = reply["task"];
  std::string server = Text(t["server_ip"]);
  if (!t["server_name"].isEmpty())
    server += " (" + Text(t["server_name"]) + ")";
  std::string ssh = YesNo(t["ssh"]);
  if (t["ssh_port"].asUInt32() != 0) ssh += ", port " + Text(t["ssh_port"]);
  std::vector<Row> rows = {
      {"KEY", "VALUE"},
      {"id", Text(t["id"])},
      {"name", Text(t["name"])},
      {"enabled", YesNo(t["enabled"])},
      {"state", Text(t["state"])},
      {"schedule", ScheduleText(t)},
      {"next run", TimeText(t["next_run"].asUInt64())},
      {"last result", Text(t["last_result"])},
      {"shares", Join(t["share_list"])},
      {"server", server},
      {"user", Text(t["user"])},
      {"password", t["has_password"].asBool() ? "set" : "not set"},
      {"compress", YesNo(t["compress"])},
      {"delta", YesNo(t["block"])},
      {"ssh", ssh},
      {"max bandwidth", Text(t["max_bandwidth"])},
      {"excludes", Join(t["excludes"])},
      {"delete guard", t["delete_guard"].asBool()
                           ? "deletions of more than " +
                                 Text(t["delete_guard_percent"]) + " % or " +
                                 Text(t["delete_guard_files"]) + " entries held"
                           : "off"},
  };
  if (t.hasMember("schedule_error")) {
    rows.push_back({"schedule error", Text(t["schedule_error"])});
  }
  if (t["schedule_mode"].asInt32() == 1) {
    rows.push_back({"change source", Text(t["realtime_source"])});
    rows.push_back({"settle", Millis(t["realtime_settle_ms"].asUInt64())});
    rows.push_back({"max delay", Text(t["realtime_max_delay"]) + " s"});
    rows.push_back(
        {"full sync every", Duration(t["realtime_full_sync"].asUInt64())});
    rows.push_back({"pending limit", Text(t["realtime_pending_limit"])});
  }
  // Key lines without the header row.
  std::string table = Table(rows, "");
  return table.substr(table.find('\n') + 1);
}

std::string FormatStatus(const S2S::PObject& reply) {
  std::string out =
      "s2sd " + Text(reply["version"]) + ", pid " + Text(reply["pid"]) +
      ", up " + Duration(reply["uptime"].asUInt64()) + " (since " +
      TimeText(reply["started"].asUInt64()) + "), " + Text(reply["tasks"]) +
      " tasks, at most " + Text(reply["max_parallel"]) + " runs at once\n";
  std::vector<Row> running = {
      {"ID", "NAME", "TRIGGER", "STARTED", "SHARE", "STEP", "PROGRESS"}};
  auto progress = [](const S2S::PObject& p) -> std::string {
    if (!p.hasMember("bytes_total") || p["bytes_total"].asUInt64() == 0) {
      return "-";
    }
    return Bytes(p["bytes_done"].asUInt64()) + " of " +
           Bytes(p["bytes_total"].asUInt64()) + ", " +
           Bytes(p["rate"].asUInt64()) + "/s, " +
           Duration(p["seconds_left"].asUInt64()) + " left";
  };
  for (const S2S::PObject& r : reply["running"].asArray()) {
    // A run syncing several shares at once shows a line for each.
    const S2S::PObject::Array& shares = r["shares"].asArray();
    Row row = {Text(r["id"]), Text(r["name"]), Text(r["trigger"]),
               TimeText(r["started"].asUInt64())};
    if (shares.size() < 2) {
      row.insert(row.end(), {Text(r["share"]), Text(r["step"]), progress(r)});
      running.push_back(row);
      continue;
    }
    for (const S2S::PObject& share : shares) {
      row.insert(row.end(),
                 {Text(share["name"]), Text(share["step"]), progress(share)});
      running.push_back(row);
      row = {"", "", "", ""};
    }
  }
  std::vector<Row> next = {{"ID", "NAME", "NEXT RUN"}};
  for (const S2S::PObject& n : reply["next_runs"].asArray()) {
    next.push_back(
        {Text(n["id"]), Text(n["name"]), TimeText(n["next"].asUInt64())});
  }
  out +=
      "running:\n" + Table(running, "  ") + "next runs:\n" + Table(next, "  ");
  if (!reply["realtime"].isArray()) return out;
  std::vector<Row> watching = {{"ID", "NAME", "SOURCE", "STATE", "PENDING",
                                "LAST BATCH", "LAG", "EVENTS", "BATCHES",
                                "RSYNC RUNS", "FAILED"}};
  std::string notes;
  for (const S2S::PObject& w : reply["realtime"].asArray()) {
    watching.push_back(
        {Text(w["id"]), Text(w["name"]), Text(w["source"]), Text(w["state"]),
         Text(w["pending"]), TimeText(w["last_batch"].asUInt64()),
         Millis(w["last_lag_ms"].asUInt64()), Text(w["events"]),
         Text(w["batches"]), Text(w["rsync_runs"]), Text(w["failures"])});
    std::string who = "  task " + Text(w["id"]) + ": ";
    if (!w["source_note"].isEmpty()) {
      notes += who + "not fanotify: " + Text(w["source_note"]) + "\n";
    }
    if (!w["problem"].isEmpty()) notes += who + Text(w["problem"]) + "\n";
    if (!w["last_error"].isEmpty()) {
      notes += who + "last batch failed: " + Text(w["last_error"]) + "\n";
    }
    for (const S2S::PObject& s : w["shares"].asArray()) {
      if (!s["watching"].asBool()) {
        notes += who + "share " + Text(s["name"]) +
                 " not watched: " + Text(s["message"]) + "\n";
      }
    }
  }
  return out + "realtime:\n" + Table(watching, "  ") + notes;
}

std::string FormatHistory(const S2S::PObject& reply) {
  const auto& runs = reply["runs"].asArray();
  if (runs.empty()) return "no runs yet\n";
  std::string out;
  for (const S2S::PObject& run : runs) {
    const unsigned long long start = run["start"].asUInt64();
    const unsigned long long end = run["end"].asUInt64();
    const std::string took =
        end >= start && end != 0 ? Duration(end - start) : "running";
    out += TimeText(start) + "  " + took + "  " + Text(run["trigger"]) +
           (run["dry_run"].asBool() ? " (dry run)" : "") + "  " +
           Text(run["outcome"]) + "  " + Text(run["message"]) + "\n";
    std::vector<Row> shares = {
        {"SHARE", "STEP", "RESULT", "FILES", "BYTES", "TIME"}};
    for (const S2S::PObject& s : run["shares"].asArray()) {
      const bool ok = s["status"].asUInt64() == 0;
      shares.push_back({Text(s["name"]), Text(s["step"]),
                        ok ? "ok" : Text(s["status_text"]), Text(s["files"]),
                        Bytes(s["bytes"].asUInt64()),
                        Duration(s["seconds"].asUInt64())});
    }
    if (shares.size() > 1) out += Table(shares, "    ");
  }
  return out;
}

std::string FormatDryRun(const S2S::PObject& run) {
  std::string out =
      "dry run: " + Text(run["outcome"]) + ", " + Text(run["message"]) + "\n";
  for (const S2S::PObject& s : run["shares"].asArray()) {
    if (s["status"].asUInt64() != 0) {
      out += "  " + Text(s["name"]) + ": " + Text(s["status_text"]) + "\n";
      continue;
    }
    out += "  " + Text(s["name"]) + ": would send " + Text(s["would_send"]) +
           ", delete " + Text(s["would_delete"]) + "\n";
    for (const char* key : {"send_paths", "delete_paths"}) {
      const char* sign = key[0] == 's' ? "+" : "-";
      const S2S::PObject& paths = s[key];
      for (const S2S::PObject& p : paths.asArray()) {
        out += std::string("    ") + sign + " " + Text(p) + "\n";
      }
      unsigned long long count =
          s[key[0] == 's' ? "would_send" : "would_delete"].asUInt64();
      if (count > paths.asArray().size()) {
        out += std::string("    ") + sign + " ... and " +
               std::to_string(count - paths.asArray().size()) + " more\n";
      }
    }
  }
  return out;
}

}  // namespace s2s_tools
