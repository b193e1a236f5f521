// The rsync daemon's hooks, as modes of the command handler program.
//
//   early  (s2scmd, early exec) reads the command from the connection's
//          early input (or, when that holds only its request id, from the
//          file uploaded to s2sspool under the id), runs it and writes the
//          reply the same connection then pulls, named by the request id,
//          into the daemon user's own directory of the command module; it
//          leaves a process that removes the reply and upload once the
//          connection has ended (CleanUpAfterConnection)
//   data   (share modules, pre-xfer exec) lets a push through only from the
//          client holding the share's running sync, and a dry run from the
//          client that feeds the share
//   keys   (s2skeys, pre-xfer exec) the same for the key file of one share,
//          "s2skeys/<share>"
//   keys-done (s2skeys, post-xfer exec) removes from the key directory
//          what is not a plain file
//   upload (s2sspool, pre-xfer exec) admits one new file named by a request
//          id while the spool has room
//   upload-done (s2sspool, post-xfer exec) removes from the spool what is
//          not a command file (too large, not a regular file)
//
// Spool entries older than kSpoolStaleSeconds are removed by the upload and
// key hooks before they start, and by a command's cleaner after it.
//
// Inputs come from the daemon's environment (RSYNC_PID, RSYNC_REQUEST,
// RSYNC_MODULE_NAME, RSYNC_HOST_ADDR, RSYNC_USER_NAME, RSYNC_ARG#: the
// arguments the client gave the daemon's rsync) and are validated
// before use. Each returns the hook's exit code: 0 lets the transfer go on.
#ifndef S2S_SERVER_HOOKS_H_
#define S2S_SERVER_HOOKS_H_

#include <stdio.h>

#include <string>
#include <vector>

#include "command_handler.h"

namespace S2S {
namespace server {

// The daemon's environment as the hooks see it.
struct HookEnv {
  std::string pid;                // RSYNC_PID
  std::string request;            // RSYNC_REQUEST ("module/path")
  std::string module;             // RSYNC_MODULE_NAME
  std::string host_addr;          // RSYNC_HOST_ADDR
  std::string user;               // RSYNC_USER_NAME
  std::vector<std::string> args;  // RSYNC_ARG0, RSYNC_ARG1, ...
  static HookEnv FromEnvironment();
};

// Whether the daemon's rsync, started with `args`, receives and runs dry:
// it parses "--server" and then a cluster of short options, of which every
// letter up to the first that takes a value is an option; an 'n' among
// those is --dry-run, which no later option undoes. An 'n' elsewhere (in a
// value such as "-e.n", a path, a later argument) does not count, and any
// "--sender" (the daemon sends) makes it false.
bool IsDryRunReceiver(const std::vector<std::string>& args);

// The spool directories under the root: uploads, replies.
std::string UploadDir();
std::string ReplyDir();

// Whether `user` (RSYNC_USER_NAME) can name a reply directory: 1-64 of
// letters, digits and "._-+", not "." or "..".
bool IsValidDaemonUser(const std::string& user);
// That rule in words, for messages to people.
extern const char kDaemonUserRule[];
// Where the reply to request `id` of daemon user `user` is written.
std::string ReplyPath(const std::string& user, const std::string& id);
// The request id of a command file's last line, requestID="<id>", or ""
// when that line is missing or the id is not valid.
std::string CommandRequestId(const std::string& text);

// The early hook: reads the command from `in`, runs it and writes its
// reply (whatever the command's status). Returns 0 and sets `*id` to the
// request id when the reply was written; 1 (logged) when the input names no
// valid request id, the environment is not a daemon connection's, or the
// reply cannot be written.
int CommandHook(const HookEnv& env, bool old_server, FILE* in,
                std::string* id = nullptr);
// Removes the reply and the upload of request `id` of daemon user `user`.
void RemoveCommandFiles(const std::string& user, const std::string& id);
// Leaves behind a process that waits for the daemon's connection process
// (RSYNC_PID) to end, then removes the command's files and stale spool
// entries, so that neither the command nor the next one waits for a
// cleanup hook. Returns 0 in the caller, or -1 (logged) when no process
// could be started; stale entries are then pruned after a later command.
int CleanUpAfterConnection(const HookEnv& env, const std::string& id);
// `out` receives the refusal, which the daemon shows the client.
int DataHook(const HookEnv& env, FILE* out);
int KeyHook(const HookEnv& env, FILE* out);
int KeyDoneHook();
int UploadHook(const HookEnv& env, FILE* out);
int UploadDoneHook();

}  // namespace server
}  // namespace S2S

#endif  // S2S_SERVER_HOOKS_H_
