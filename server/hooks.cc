#include "hooks.h"

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include "command_file.h"
#include "karo_root.h"
#include "protocol.h"

#define S2S_LOG_AREA "server"
#include "S2S/log.h"

namespace S2S {
namespace server {

namespace {

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
bool ReadLimited(const std::string& path, size_t limit, std::string* out) {
  int fd = open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) return false;
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
                O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644);
  if (fd < 0) return false;
  bool ok =
      write(fd, data.data(), data.size()) == static_cast<ssize_t>(data.size());
  return close(fd) == 0 && ok;
}

// The request id of a pull of "s2scmd/<id>", or "".
std::string RequestId(const std::string& request) {
  std::string prefix = std::string(kCommandModule) + "/";
  if (request.compare(0, prefix.size(), prefix) != 0) return "";
  std::string id = request.substr(prefix.size());
  return IsValidRequestId(id) ? id : "";
}

// Reads and runs the command; the status and answer for the reply.
int RunCommand(const std::string& text, const std::string& id,
               const HookEnv& env, bool old_server, std::string* answer) {
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
  return HandleCommand(cmd, ctx, answer);
}

}  // namespace

HookEnv HookEnv::FromEnvironment() {
  HookEnv e;
  e.pid = Env("RSYNC_PID");
  e.request = Env("RSYNC_REQUEST");
  e.module = Env("RSYNC_MODULE_NAME");
  e.host_addr = Env("RSYNC_HOST_ADDR");
  e.user = Env("RSYNC_USER_NAME");
  return e;
}

std::string EarlyDir() { return KaroRootPath("/var/spool/s2s/early"); }
std::string UploadDir() { return KaroRootPath("/var/spool/s2s/upload"); }
std::string ReplyDir() { return KaroRootPath("/var/spool/s2s/reply"); }

int EarlyHook(const HookEnv& env, FILE* in) {
  if (!IsPid(env.pid)) {
    LOG_ERROR("early hook without a valid RSYNC_PID");
    return 1;
  }
  std::string data;
  char buf[4096];
  size_t n;
  while ((n = fread(buf, 1, sizeof buf, in)) > 0 &&
         data.size() <= kMaxCommandFile) {
    data.append(buf, n);
  }
  std::string path = EarlyDir() + "/" + env.pid;
  unlink(path.c_str());  // a leftover of a crashed connection with this pid
  if (!WriteNew(path, data)) {
    LOG_ERROR("cannot spool the command to %s: %s", path.c_str(),
              strerror(errno));
    return 1;
  }
  return 0;
}

int PreHook(const HookEnv& env, bool old_server) {
  std::string id = RequestId(env.request);
  if (!IsPid(env.pid) || id.empty()) {
    LOG_WARNING("refused a command pull from %s: bad request",
                env.host_addr.c_str());
    return 1;
  }
  std::string text;
  std::string early = EarlyDir() + "/" + env.pid;
  if (!ReadLimited(early, kMaxCommandFile, &text) || text.empty()) {
    ReadLimited(UploadDir() + "/" + id, kMaxCommandFile, &text);
  }
  // Remembered for the post hook, which no longer sees the request.
  std::string mark = EarlyDir() + "/" + env.pid + ".id";
  unlink(mark.c_str());
  WriteNew(mark, id);
  std::string answer;
  int status = text.empty() ? kMalformed
                            : RunCommand(text, id, env, old_server, &answer);
  std::string reply = "status=" + std::to_string(status) + "\n" + answer;
  std::string path = ReplyDir() + "/" + id;
  if (!WriteNew(path, reply)) {
    LOG_ERROR("cannot write the reply %s: %s", path.c_str(), strerror(errno));
    return 1;
  }
  return 0;
}

int PostHook(const HookEnv& env) {
  if (!IsPid(env.pid)) return 0;
  std::string early = EarlyDir() + "/" + env.pid;
  std::string id;
  if (ReadLimited(early + ".id", 64, &id) && IsValidRequestId(id)) {
    unlink((UploadDir() + "/" + id).c_str());
    unlink((ReplyDir() + "/" + id).c_str());
  }
  unlink((early + ".id").c_str());
  unlink(early.c_str());
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
  if (!MayPushShare(share, ctx, &why)) {
    LOG_WARNING("refused a push into '%s' from %s: %s", env.module.c_str(),
                env.host_addr.c_str(), why.c_str());
    fprintf(out, "%s\n", why.c_str());
    return 1;
  }
  return 0;
}

}  // namespace server
}  // namespace S2S
