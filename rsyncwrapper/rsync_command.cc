#include "rsync_command.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/file.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

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

const char kScratchPrefix[] = "rsync.";

void LockFd(int fd, int how) {
  while (flock(fd, how) != 0 && errno == EINTR) {
  }
}

// Removes the scratch directories of runs that were killed: a live run
// holds an flock on its directory, so one whose lock is free is left over.
// REQUIRES: the caller holds the base directory's exclusive lock, which no
// run takes between creating its directory and locking it.
void SweepLeftovers(int base_fd, const std::string& base) {
  DIR* d = fdopendir(dup(base_fd));
  if (d == nullptr) return;
  std::vector<std::string> stale;
  while (dirent* e = readdir(d)) {
    if (strncmp(e->d_name, kScratchPrefix, strlen(kScratchPrefix)) != 0) {
      continue;
    }
    int fd = openat(base_fd, e->d_name,
                    O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0) continue;
    if (flock(fd, LOCK_EX | LOCK_NB) == 0) stale.push_back(e->d_name);
    close(fd);
  }
  closedir(d);
  for (const std::string& name : stale) {
    std::error_code ec;
    std::filesystem::remove_all(base + "/" + name, ec);
    if (ec) {
      Log(LOG_WARNING, "cannot remove %s/%s: %s", base.c_str(), name.c_str(),
          ec.message().c_str());
    }
  }
}

// A private directory for the command file and the pulled reply, removed
// with its contents when the command is over, or by a later command when
// this process is killed first.
class ScratchDir {
 public:
  ScratchDir() {
    std::string base = KaroRootPath(kTempBase);
    std::error_code ec;
    std::filesystem::create_directories(base, ec);
    int base_fd =
        ec ? -1 : open(base.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (base_fd < 0) {
      Log(LOG_ERR, "cannot create %s: %s", base.c_str(),
          ec ? ec.message().c_str() : strerror(errno));
      return;
    }
    // Sweeping is best effort: another run sweeping or creating now
    // leaves it to the next command.
    if (flock(base_fd, LOCK_EX | LOCK_NB) == 0) {
      SweepLeftovers(base_fd, base);
      LockFd(base_fd, LOCK_UN);
    }
    LockFd(base_fd, LOCK_SH);
    std::string tmpl = base + "/" + kScratchPrefix + "XXXXXX";
    if (mkdtemp(&tmpl[0]) == nullptr) {
      Log(LOG_ERR, "cannot create a directory in %s: %s", base.c_str(),
          strerror(errno));
    } else {
      lock_fd_ = open(tmpl.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
      if (lock_fd_ >= 0) LockFd(lock_fd_, LOCK_EX);
      path_ = tmpl;
    }
    close(base_fd);  // drops the shared lock
  }
  ~ScratchDir() {
    for (const std::string& f : files_) unlink((path_ + "/" + f).c_str());
    if (!path_.empty()) rmdir(path_.c_str());
    if (lock_fd_ >= 0) close(lock_fd_);
  }
  bool ok() const { return !path_.empty() && lock_fd_ >= 0; }
  std::string File(const std::string& name) {
    files_.push_back(name);
    return path_ + "/" + name;
  }
  const std::string& path() const { return path_; }

 private:
  std::string path_;
  int lock_fd_ = -1;
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

// Reads the pulled reply: a regular file of at most kMaxReply bytes.
// Returns kOk, kBadReply when there is none, or kReplyTooLarge.
int ReadReply(const std::string& path, std::string* data) {
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK);
  if (fd < 0) return RsyncWrapper::kBadReply;
  struct stat st;
  int status = RsyncWrapper::kOk;
  if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
    status = RsyncWrapper::kBadReply;
  } else if (st.st_size > static_cast<off_t>(kMaxReply)) {
    status = RsyncWrapper::kReplyTooLarge;
  } else {
    data->resize(static_cast<size_t>(st.st_size));
    size_t done = 0;
    while (done < data->size()) {
      ssize_t n = read(fd, &(*data)[done], data->size() - done);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) break;
      done += static_cast<size_t>(n);
    }
    data->resize(done);
  }
  close(fd);
  return status;
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

bool ParseReply(const std::string& reply, int* status, std::string* answer,
                std::string* reason) {
  static const std::string kPrefix = "status=";
  size_t eol = reply.find('\n');
  if (eol == std::string::npos ||
      reply.compare(0, kPrefix.size(), kPrefix) != 0) {
    return false;
  }
  std::string first = reply.substr(kPrefix.size(), eol - kPrefix.size());
  // "status=N" or "status=N reason in words".
  size_t blank = first.find(' ');
  std::string digits = first.substr(0, blank);
  if (digits.empty() || digits.size() > 4 ||
      digits.find_first_not_of("0123456789") != std::string::npos) {
    return false;
  }
  std::string why = blank == std::string::npos ? "" : first.substr(blank + 1);
  if (why.size() > kMaxReason) why.resize(kMaxReason);
  for (char& c : why) {
    if (static_cast<unsigned char>(c) < 0x20 || c == 0x7f) c = '?';
  }
  *status = std::stoi(digits);
  *answer = reply.substr(eol + 1);
  *reason = why;
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
  if (text.size() > kMaxEarlyInput) {
    // Too large to travel with the request itself: spool it first, and
    // send only its request id, which names the upload.
    std::vector<std::string> push = pull;
    push.insert(push.end(),
                {"--", command_file, RemoteSpec(s, kSpoolModule, id)});
    int status = RunAndLog(push, s, cancel, "command upload");
    if (status != 0) return status;
    command_file = dir.File("id");
    if (!WriteWhole(command_file, "requestID=\"" + id + "\"\n", 0600)) {
      Log(LOG_ERR, "cannot write %s: %s", command_file.c_str(),
          strerror(errno));
      return RsyncWrapper::kStartFailed;
    }
  }
  pull.push_back("--early-input=" + command_file);
  std::string reply_file = dir.File(id);
  // A server may answer with anything: rsync skips a reply over the cap
  // (and says so), and no file it writes may grow past it.
  pull.insert(pull.end(),
              {"--max-size=" + std::to_string(kMaxReply), "--info=skip1", "--",
               RemoteSpec(s, kCommandModule, id), dir.path() + "/"});
  std::string output;
  int status = RunAndLog(pull, s, cancel, "command", &output, kMaxReply);
  if (status == 0 && output.find(" is over max-size") != std::string::npos) {
    status = RsyncWrapper::kReplyTooLarge;
  }
  std::string reply;
  std::string answer;
  std::string reason;
  if (status == 0) status = ReadReply(reply_file, &reply);
  if (status == RsyncWrapper::kReplyTooLarge) {
    Log(LOG_ERR, "command to %s: reply larger than %zu bytes, refused",
        s.host.c_str(), kMaxReply);
    return status;
  }
  if (status != 0) return status;
  if (!ParseReply(reply, &status, &answer, &reason)) {
    Log(LOG_ERR, "command to %s: no valid reply", s.host.c_str());
    return RsyncWrapper::kBadReply;
  }
  if (status != 0) SetLastError(reason);
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
