#include "rsync_progress.h"

#include <stdio.h>
#include <stdlib.h>
#include <string.h>

namespace KARO {
namespace Backup {
namespace detail {

namespace {

// "3,000,003" -> 3000003; stops at the first character that is neither a
// digit nor a comma.
unsigned long long Number(const char* p) {
  unsigned long long n = 0;
  for (; *p == ',' || (*p >= '0' && *p <= '9'); ++p) {
    if (*p != ',') n = n * 10 + static_cast<unsigned>(*p - '0');
  }
  return n;
}

// The number after `label` at the start of `line`.
bool Labelled(const std::string& line, const char* label,
              unsigned long long* value) {
  size_t n = strlen(label);
  if (line.compare(0, n, label) != 0) return false;
  *value = Number(line.c_str() + n);
  return true;
}

}  // namespace

bool ProgressParser::Feed(const std::string& line) {
  return FeedProgress(line) || FeedStats(line) || (itemized_ && FeedItem(line));
}

// "<f+++++++++ dir/file", "cd+++++++++ dir/", "*deleting   old/file":
// eleven characters of change flags, a blank, the name; "cL..." adds
// " -> TARGET" and "hf..." " => LINK".
bool ProgressParser::FeedItem(const std::string& line) {
  if (line.size() < 13 || line[11] != ' ') return false;
  bool deleting = line.compare(0, 11, "*deleting  ") == 0;
  char update = line[0];
  if (!deleting && (strchr("<>ch.", update) == nullptr ||
                    strchr("fdLDS", line[1]) == nullptr)) {
    return false;
  }
  // Attributes only ('.'): no data goes, nothing is created.
  if (update == '.') return true;
  std::string path = line.substr(12);
  const char* arrow = line[1] == 'L' ? " -> " : update == 'h' ? " => " : "";
  if (*arrow != '\0') path = path.substr(0, path.find(arrow));
  unsigned long long& count =
      deleting ? stats_.would_delete : stats_.would_send;
  std::vector<std::string>& paths =
      deleting ? stats_.delete_paths : stats_.send_paths;
  ++count;
  if (paths.size() < RsyncWrapper::TransferStats::kListedPaths) {
    paths.push_back(path);
  }
  return true;
}

// "      3,000,003 100%  476.84MB/s    0:00:00 (xfr#2, to-chk=0/4)"
bool ProgressParser::FeedProgress(const std::string& line) {
  size_t i = line.find_first_not_of(' ');
  if (i == std::string::npos || i == 0 || line[i] < '0' || line[i] > '9') {
    return false;
  }
  std::string words = line.substr(i);
  for (char& c : words) {
    if (c == ',') c = '_';
  }
  char done[32], unit[8];
  unsigned percent = 0, h = 0, m = 0, s = 0;
  double rate = 0;
  if (sscanf(words.c_str(), "%31s %u%% %lf%7[kMGT]B/s %u:%u:%u", done, &percent,
             &rate, unit, &h, &m, &s) != 7) {
    return false;
  }
  RsyncWrapper::TransferProgress p;
  p.bytes_done = Number(line.c_str() + i);
  p.percent = percent;
  double scale = 1024;
  for (const char* u = "kMGT"; *u != '\0' && *u != unit[0]; ++u) scale *= 1024;
  p.bytes_per_second = rate * scale;
  p.seconds_left = h * 3600 + m * 60 + s;
  p.bytes_total = percent > 0 ? p.bytes_done * 100 / percent : 0;
  size_t chk = line.find("-chk=");
  if (chk != std::string::npos) {
    unsigned long long left = Number(line.c_str() + chk + 5);
    size_t slash = line.find('/', chk);
    if (slash != std::string::npos) {
      p.files_total = Number(line.c_str() + slash + 1);
      p.files_checked = p.files_total - std::min(left, p.files_total);
    }
  }
  if (handler_) handler_(p);
  return true;
}

bool ProgressParser::FeedStats(const std::string& line) {
  RsyncWrapper::TransferStats& t = stats_;
  unsigned long long ignored = 0;
  if (Labelled(line, "Number of files: ", &t.files) ||
      Labelled(line,
               "Number of regular files transferred: ", &t.files_transferred) ||
      Labelled(line, "Number of deleted files: ", &t.files_deleted) ||
      Labelled(line, "Total file size: ", &t.total_size) ||
      Labelled(line, "Literal data: ", &t.literal_bytes) ||
      Labelled(line, "Matched data: ", &t.matched_bytes) ||
      Labelled(line, "Total bytes sent: ", &t.bytes_sent) ||
      Labelled(line, "Total bytes received: ", &t.bytes_received) ||
      Labelled(line, "Number of created files: ", &t.files_created) ||
      // Printed when --max-delete held deletions back.
      Labelled(line, "Deletions stopped due to --max-delete limit (",
               &t.deletions_skipped) ||
      Labelled(line, "Total transferred file size: ", &ignored) ||
      Labelled(line, "File list ", &ignored) ||
      Labelled(line, "total size is ", &ignored)) {
    return true;
  }
  // "sent 3,000,937 bytes  received 62 bytes  6,001,998.00 bytes/sec"
  size_t rate = line.find("bytes  ", line.find("received "));
  if (line.compare(0, 5, "sent ") == 0 && rate != std::string::npos &&
      line.find("bytes/sec") != std::string::npos) {
    std::string digits;
    for (size_t k = rate + 7; k < line.size() && line[k] != ' '; ++k) {
      if (line[k] != ',') digits += line[k];
    }
    t.bytes_per_second = strtod(digits.c_str(), nullptr);
    t.complete = true;
    return true;
  }
  return false;
}

}  // namespace detail
}  // namespace Backup
}  // namespace KARO
