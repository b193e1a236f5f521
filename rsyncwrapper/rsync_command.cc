#include "rsync_command.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "karo/rsync_wrapper.h"
#include "karo_root.h"
#include "rsync_child.h"
#include "rsync_log.h"

namespace KARO {
namespace Backup {
namespace detail {

namespace {

const char kTempBase[] = "/tmp/S2S";
const char kCommandFile[] = "cmd";

// A private directory for the command file and the pulled reply, removed
// with its contents when the command is over.
class ScratchDir {
 public:
  ScratchDir() {
    std::string base = KaroRootPath(kTempBase);
    std::error_code ec;
    std::filesystem::create_directories(base, ec);
    if (ec) {
      Log(LOG_ERR, "cannot create %s: %s", base.c_str(), ec.message().c_str());
      return;
    }
    std::string tmpl = base + "/rsync.XXXXXX";
    if (mkdtemp(&tmpl[0]) == nullptr) {
      Log(LOG_ERR, "cannot create a directory in %s: %s", base.c_str(),
          strerror(errno));
      return;
    }
    path_ = tmpl;
  }
  ~ScratchDir() {
    for (const std::string& f : files_) unlink((path_ + "/" + f).c_str());
    if (!path_.empty()) rmdir(path_.c_str());
  }
  bool ok() const { return !path_.empty(); }
  std::string File(const std::string& name) {
    files_.push_back(name);
    return path_ + "/" + name;
  }
  const std::string& path() const { return path_; }

 private:
  std::string path_;
  std::vector<std::string> files_;
};

bool WriteWhole(const std::string& path, const std::string& data, int mode) {
  int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
  if (fd < 0) return false;
  size_t done = 0;
  while (done < data.size()) {
    ssize_t n = write(fd, data.data() + done, data.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    done += static_cast<size_t>(n);
  }
  return close(fd) == 0 && done == data.size();
}

bool ReadWhole(const std::string& path, std::string* data) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return false;
  std::ostringstream out;
  out << in.rdbuf();
  *data = out.str();
  return true;
}

// The local path of the `outfile="..."` line, or "".
std::string OutfileOf(const std::list<std::string>& lines) {
  static const std::string kPrefix = "outfile=\"";
  for (const std::string& line : lines) {
    if (line.size() > kPrefix.size() &&
        line.compare(0, kPrefix.size(), kPrefix) == 0 && line.back() == '"') {
      return line.substr(kPrefix.size(), line.size() - kPrefix.size() - 1);
    }
  }
  return "";
}

}  // namespace

std::string NewRequestId() {
  unsigned char bytes[16];
  size_t got = 0;
  while (got < sizeof bytes) {
    ssize_t n = getrandom(bytes + got, sizeof bytes - got, 0);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    got += static_cast<size_t>(n);
  }
  static const char kHex[] = "0123456789abcdef";
  std::string id;
  for (unsigned char b : bytes) {
    id += kHex[b >> 4];
    id += kHex[b & 15];
  }
  return id;
}

bool ParseReply(const std::string& reply, int* status, std::string* answer) {
  static const std::string kPrefix = "status=";
  size_t eol = reply.find('\n');
  if (eol == std::string::npos ||
      reply.compare(0, kPrefix.size(), kPrefix) != 0) {
    return false;
  }
  std::string digits = reply.substr(kPrefix.size(), eol - kPrefix.size());
  if (digits.empty() || digits.size() > 4 ||
      digits.find_first_not_of("0123456789") != std::string::npos) {
    return false;
  }
  *status = std::stoi(digits);
  *answer = reply.substr(eol + 1);
  return true;
}

int RunCommand(const RsyncSettings& s, const boost::function<bool()>& cancel) {
  ScratchDir dir;
  if (!dir.ok()) return RsyncWrapper::kStartFailed;
  std::string id = NewRequestId();
  std::string text;
  for (const std::string& line : s.command_lines) text += line + "\n";
  text += "requestID=\"" + id + "\"\n";
  std::string command_file = dir.File(kCommandFile);
  if (!WriteWhole(command_file, text, 0600)) {
    Log(LOG_ERR, "cannot write %s: %s", command_file.c_str(), strerror(errno));
    return RsyncWrapper::kStartFailed;
  }

  std::vector<std::string> pull = {"rsync"};
  for (const std::string& o : TransportOptions(s)) pull.push_back(o);
  if (text.size() <= kMaxEarlyInput) {
    pull.push_back("--early-input=" + command_file);
  } else {
    // Too large to travel with the request itself: spool it first.
    std::vector<std::string> push = pull;
    push.insert(push.end(),
                {"--", command_file, RemoteSpec(s, kSpoolModule, id)});
    int status = RunAndLog(push, s, cancel, "command upload");
    if (status != 0) return status;
  }
  std::string reply_file = dir.File(id);
  pull.insert(pull.end(),
              {"--", RemoteSpec(s, kCommandModule, id), dir.path() + "/"});
  int status = RunAndLog(pull, s, cancel, "command");
  if (status != 0) return status;

  std::string reply;
  std::string answer;
  if (!ReadWhole(reply_file, &reply) || !ParseReply(reply, &status, &answer)) {
    Log(LOG_ERR, "command to %s: no valid reply", s.host.c_str());
    return RsyncWrapper::kBadReply;
  }
  std::string outfile = OutfileOf(s.command_lines);
  if (!outfile.empty() && !WriteWhole(outfile, answer, 0600)) {
    Log(LOG_ERR, "cannot write the answer to %s: %s", outfile.c_str(),
        strerror(errno));
    return RsyncWrapper::kStartFailed;
  }
  if (s.debug_log)
    Log(LOG_DEBUG, "command to %s: status %d", s.host.c_str(), status);
  return status;
}

}  // namespace detail
}  // namespace Backup
}  // namespace KARO
