#include "hooks.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

#include <string>

#include "command_file.h"
#include "karo_root.h"
#include "karo_share.h"
#include "protocol.h"

#define S2S_LOG_AREA "server"
#include "S2S/log.h"

namespace S2S {
namespace server {

namespace {

// More arguments than any client of ours sends.
const size_t kMaxHookArgs = 1024;

std::string Env(const char* name) {
  const char* v = getenv(name);
  return v != nullptr ? v : "";
}

bool IsPid(const std::string& s) {
  return !s.empty() && s.size() <= 10 &&
         s.find_first_not_of("0123456789") == std::string::npos;
}

// Reads at most `limit` + 1 bytes, so that an oversized file is noticed
// without reading all of it. O_NOFOLLOW: spool names are ours, never links.
// Only regular files: an uploaded FIFO must not block the hook.
bool ReadLimited(const std::string& path, size_t limit, std::string* out) {
  int fd = open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
  if (fd < 0) return false;
  struct stat st;
  if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
    close(fd);
    return false;
  }
  out->clear();
  char buf[8192];
  ssize_t n;
  while (out->size() <= limit && (n = read(fd, buf, sizeof buf)) != 0) {
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) break;
    out->append(buf, static_cast<size_t>(n));
  }
  close(fd);
  return true;
}

bool WriteNew(const std::string& path, const std::string& data) {
  int fd = open(path.c_str(),
                O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
  if (fd < 0) return false;
  bool ok =
      write(fd, data.data(), data.size()) == static_cast<ssize_t>(data.size());
  return close(fd) == 0 && ok;
}

// The path of a request "<module>/<path>" for `module`, or "".
std::string RequestPath(const std::string& request, const char* module) {
  std::string prefix = std::string(module) + "/";
  if (request.compare(0, prefix.size(), prefix) != 0) return "";
  return request.substr(prefix.size());
}

// The request id of a transfer of "<module>/<id>", or "".
std::string RequestId(const std::string& request, const char* module) {
  std::string id = RequestPath(request, module);
  return IsValidRequestId(id) ? id : "";
}

// Calls `fn(path, stat)` for each entry of `dir` but "." and "..".
template <typename Fn>
void ForEachEntry(const std::string& dir, Fn fn) {
  DIR* d = opendir(dir.c_str());
  if (d == nullptr) return;
  while (dirent* e = readdir(d)) {
    std::string name = e->d_name;
    if (name == "." || name == "..") continue;
    std::string path = dir + "/" + name;
    struct stat st;
    if (lstat(path.c_str(), &st) == 0) fn(path, st);
  }
  closedir(d);
}

// Removes a file, or a directory tree that should never have been there.
void RemoveEntry(const std::string& path, const struct stat& st) {
  if (S_ISDIR(st.st_mode)) {
    ForEachEntry(path, RemoveEntry);
    rmdir(path.c_str());
  } else {
    unlink(path.c_str());
  }
}

// Entries of a crashed or abandoned connection: older than any command may
// take.
void PruneStale(const std::string& dir) {
  time_t oldest = time(nullptr) - kSpoolStaleSeconds;
  ForEachEntry(dir, [oldest](const std::string& path, const struct stat& st) {
    if (st.st_mtime < oldest) RemoveEntry(path, st);
  });
}

// Reads and runs the command, which arrived at `arrival`; the status and
// answer for the reply.
int RunCommand(const std::string& text, const std::string& id,
               const HookEnv& env, bool old_server, time_t arrival,
               std::string* answer) {
  CommandFile cmd;
  std::string why;
  if (ParseCommandFile(text, &cmd, &why) != kOk) {
    LOG_WARNING("refused a command from %s: %s", env.host_addr.c_str(),
                why.c_str());
    return kMalformed;
  }
  // The id inside must be the one pulled, or an upload could be answered
  // under another request's name.
  auto last = cmd.params.empty() ? nullptr : &cmd.params.back();
  if (last == nullptr || last->first != "requestID" || last->second != id) {
    LOG_WARNING("refused a command from %s: request id mismatch",
                env.host_addr.c_str());
    return kBadId;
  }
  cmd.params.pop_back();
  HandlerContext ctx;
  ctx.old_server = old_server;
  ctx.peer_address = env.host_addr;
  ctx.peer_user = env.user;
  ctx.deadline = arrival + kCommandBudgetSeconds;
  return HandleCommand(cmd, ctx, answer);
}

// `path` and its missing parents, 0755 whatever the daemon's umask.
void MakeDirs(const std::string& path) {
  for (size_t slash = path.find('/', 1);; slash = path.find('/', slash + 1)) {
    std::string dir = path.substr(0, slash);
    if (mkdir(dir.c_str(), 0755) == 0) chmod(dir.c_str(), 0755);
    if (slash == std::string::npos) return;
  }
}

}  // namespace

HookEnv HookEnv::FromEnvironment() {
  HookEnv e;
  e.pid = Env("RSYNC_PID");
  e.request = Env("RSYNC_REQUEST");
  e.module = Env("RSYNC_MODULE_NAME");
  e.host_addr = Env("RSYNC_HOST_ADDR");
  e.user = Env("RSYNC_USER_NAME");
  for (size_t i = 0; i < kMaxHookArgs; ++i) {
    const char* arg = getenv(("RSYNC_ARG" + std::to_string(i)).c_str());
    if (arg == nullptr) break;
    e.args.push_back(arg);
  }
  return e;
}

bool IsDryRunReceiver(const std::vector<std::string>& args) {
  // rsync's short options that take no value; any other letter either
  // takes the rest of the cluster as its value (B e @ T f M) or is unknown.
  static const char kNoValue[] =
      "0468ACDEFHIJKLNOPRSUVWXabcdghiklmnopqrstuvxyz";
  if (args.size() < 3 || args[1] != "--server") return false;
  for (const std::string& a : args) {
    if (a == "--sender") return false;
  }
  const std::string& cluster = args[2];
  if (cluster.size() < 2 || cluster[0] != '-' || cluster[1] == '-') {
    return false;
  }
  for (size_t i = 1; i < cluster.size(); ++i) {
    if (cluster[i] == '\0' || strchr(kNoValue, cluster[i]) == nullptr) break;
    if (cluster[i] == 'n') return true;
  }
  return false;
}

std::string UploadDir() { return KaroRootPath("/var/spool/s2s/upload"); }
std::string ReplyDir() { return KaroRootPath("/var/spool/s2s/reply"); }

const char kDaemonUserRule[] =
    "1-64 of letters, digits and . _ - +, not . or ..";

bool IsValidDaemonUser(const std::string& user) {
  return !user.empty() && user.size() <= 64 && user != "." && user != ".." &&
         user.find_first_not_of(
             "abcdefghijklmnopqrstuvwxyz"
             "ABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789._-+") == std::string::npos;
}

std::string ReplyPath(const std::string& user, const std::string& id) {
  return ReplyDir() + "/" + user + "/" + id;
}

std::string CommandRequestId(const std::string& text) {
  static const std::string kKey = "requestID=\"";
  if (text.size() < 2 || text.back() != '\n') return "";
  size_t begin = text.rfind('\n', text.size() - 2);
  begin = begin == std::string::npos ? 0 : begin + 1;
  std::string line = text.substr(begin, text.size() - 1 - begin);
  if (line.size() < kKey.size() + 1 ||
      line.compare(0, kKey.size(), kKey) != 0 || line.back() != '"') {
    return "";
  }
  std::string id = line.substr(kKey.size(), line.size() - kKey.size() - 1);
  return IsValidRequestId(id) ? id : "";
}

int CommandHook(const HookEnv& env, bool old_server, FILE* in,
                std::string* id_out) {
  if (!IsPid(env.pid) || !IsValidDaemonUser(env.user)) {
    LOG_ERROR("command hook without a valid RSYNC_PID and RSYNC_USER_NAME");
    return 1;
  }
  time_t arrival = time(nullptr);
  std::string text;
  char buf[4096];
  size_t n;
  while (text.size() <= kMaxCommandFile &&
         (n = fread(buf, 1, sizeof buf, in)) > 0) {
    text.append(buf, n);
  }
  std::string id = CommandRequestId(text);
  if (id.empty()) {
    // Without an id there is no reply to write: the daemon ends the
    // connection, which the client reports as refused.
    LOG_WARNING("refused a command from %s: no valid request id",
                env.host_addr.c_str());
    return 1;
  }
  if (text.size() == std::string("requestID=\"\"\n").size() + id.size()) {
    // Only the id: the command was too large to travel with the
    // connection and was uploaded under it; it arrived with its upload.
    std::string upload = UploadDir() + "/" + id;
    struct stat st;
    if (stat(upload.c_str(), &st) == 0) arrival = st.st_mtime;
    if (!ReadLimited(upload, kMaxCommandFile, &text)) text.clear();
  }
  std::string answer;
  int status = text.empty()
                   ? kMalformed
                   : RunCommand(text, id, env, old_server, arrival, &answer);
  std::string reply = "status=" + std::to_string(status) + "\n" + answer;
  // One reply directory per daemon user, which is all that user's pulls
  // can reach: the command module's path names it.
  std::string dir = ReplyDir() + "/" + env.user;
  int made = mkdir(dir.c_str(), 0700);
  if (made != 0 && errno == ENOENT) {
    // Someone removed the spool since the configuration made it (by hand,
    // a restored volume): made again, or no command would be answered
    // until the configuration was written again.
    MakeDirs(UploadDir());
    MakeDirs(ReplyDir());
    made = mkdir(dir.c_str(), 0700);
  }
  if (made != 0 && errno != EEXIST) {
    LOG_ERROR("cannot create %s: %s", dir.c_str(), strerror(errno));
    return 1;
  }
  std::string path = ReplyPath(env.user, id);
  if (!WriteNew(path, reply)) {
    LOG_ERROR("cannot write the reply %s: %s", path.c_str(), strerror(errno));
    return 1;
  }
  if (id_out != nullptr) *id_out = id;
  return 0;
}

void RemoveCommandFiles(const std::string& user, const std::string& id) {
  unlink((UploadDir() + "/" + id).c_str());
  unlink(ReplyPath(user, id).c_str());
}

int CleanUpAfterConnection(const HookEnv& env, const std::string& id) {
  if (!IsPid(env.pid)) return -1;
  pid_t connection = static_cast<pid_t>(std::stol(env.pid));
  pid_t child = fork();
  if (child < 0) {
    LOG_WARNING("cannot leave a cleaner for connection %s: %s", env.pid.c_str(),
                strerror(errno));
    return -1;
  }
  if (child > 0) return 0;
  // The cleaner holds none of the daemon's pipes, or the daemon would wait
  // for it, and leaves the hook's session.
  setsid();
  int null = open("/dev/null", O_RDWR | O_CLOEXEC);
  for (int fd = 0; fd < 3; ++fd) dup2(null, fd);
  close_range(3, ~0u, 0);
  int pidfd = static_cast<int>(syscall(SYS_pidfd_open, connection, 0));
  if (pidfd >= 0) {
    // Readable once the connection's process has ended; a connection that
    // outlives every command's budget is left to the stale pruning.
    struct pollfd p = {pidfd, POLLIN, 0};
    int wait_ms = kSpoolStaleSeconds * 1000;
    while (poll(&p, 1, wait_ms) < 0 && errno == EINTR) {
    }
    if ((p.revents & POLLIN) == 0) _exit(0);
  }
  RemoveCommandFiles(env.user, id);
  // An upload directory removed on its own is made again; a spool removed
  // as a whole (a purge while this waited) stays removed.
  if (access(ReplyDir().c_str(), F_OK) == 0) MakeDirs(UploadDir());
  PruneStale(UploadDir());
  // The users' directories stay: a reply may be on its way into one.
  ForEachEntry(ReplyDir(), [](const std::string& path, const struct stat& st) {
    if (S_ISDIR(st.st_mode)) PruneStale(path);
  });
  _exit(0);
}

int UploadHook(const HookEnv& env, FILE* out) {
  PruneStale(UploadDir());
  UploadDoneHook();
  std::string id = RequestId(env.request, kSpoolModule);
  const char* why = nullptr;
  struct stat st;
  off_t used = 0;
  ForEachEntry(UploadDir(), [&used](const std::string&, const struct stat& e) {
    used += e.st_size;
  });
  if (id.empty()) {
    why = "an upload names one file by its request id";
  } else if (lstat((UploadDir() + "/" + id).c_str(), &st) == 0) {
    why = "an upload of this request id is already there";
  } else if (used >= static_cast<off_t>(kMaxSpool)) {
    why = "the upload spool is full";
  }
  if (why != nullptr) {
    LOG_WARNING("refused an upload from %s: %s", env.host_addr.c_str(), why);
    fprintf(out, "%s\n", why);
    return 1;
  }
  return 0;
}

int UploadDoneHook() {
  ForEachEntry(UploadDir(), [](const std::string& path, const struct stat& st) {
    if (!S_ISREG(st.st_mode) ||
        st.st_size > static_cast<off_t>(kMaxCommandFile)) {
      LOG_WARNING("removed %s from the upload spool: not a command file",
                  path.c_str());
      RemoveEntry(path, st);
    }
  });
  return 0;
}

// A key file is a plain file named after its share; anything else in the
// key directory was pushed there in spite of the module's filter.
void RemoveNonKeys() {
  ForEachEntry(KaroRootPath(KARO_SHARE_KEY_DIR),
               [](const std::string& path, const struct stat& st) {
                 if (!S_ISREG(st.st_mode)) RemoveEntry(path, st);
               });
}

int KeyHook(const HookEnv& env, FILE* out) {
  RemoveNonKeys();
  // The key file of one share, named after it: "s2skeys/<share>".
  std::string share = RequestPath(env.request, kKeyModule);
  HandlerContext ctx;
  ctx.peer_address = env.host_addr;
  ctx.peer_user = env.user;
  std::string why;
  if (!MayPushShare(share, ctx, &why)) {
    LOG_WARNING("refused a key push into '%s' from %s: %s", env.request.c_str(),
                env.host_addr.c_str(), why.c_str());
    fprintf(out, "%s\n", why.c_str());
    return 1;
  }
  return 0;
}

int KeyDoneHook() {
  RemoveNonKeys();
  return 0;
}

int DataHook(const HookEnv& env, FILE* out) {
  std::string share = env.module;
  // An encrypted share's module is "@share@".
  if (share.size() > 2 && share.front() == '@' && share.back() == '@') {
    share = share.substr(1, share.size() - 2);
  }
  HandlerContext ctx;
  ctx.peer_address = env.host_addr;
  ctx.peer_user = env.user;
  std::string why;
  // A dry run holds no sync: the client shows what a sync would do before
  // it starts one, and the daemon changes nothing.
  bool dry = IsDryRunReceiver(env.args);
  if (dry ? !MayDryRunShare(share, ctx, &why)
          : !MayPushShare(share, ctx, &why)) {
    LOG_WARNING("refused a %s into '%s' from %s: %s", dry ? "dry run" : "push",
                env.module.c_str(), env.host_addr.c_str(), why.c_str());
    fprintf(out, "%s\n", why.c_str());
    return 1;
  }
  return 0;
}

}  // namespace server
}  // namespace S2S
