// The rsync daemon's hooks, as modes of the command handler program.
//
//   early  (s2scmd, early exec)    spools the early input of this connection
//   pre    (s2scmd, pre-xfer exec) reads the command (spooled early input,
//          else the file uploaded to s2sspool), runs it, writes the reply
//          file named by the request id into the command module
//   post   (s2scmd, post-xfer exec) removes the spool, upload and reply
//   data   (share modules, pre-xfer exec) lets a push through only from the
//          client holding the share's running sync
//
// Inputs come from the daemon's environment (RSYNC_PID, RSYNC_REQUEST,
// RSYNC_MODULE_NAME, RSYNC_HOST_ADDR, RSYNC_USER_NAME) and are validated
// before use. Each returns the hook's exit code: 0 lets the transfer go on.
#ifndef S2S_SERVER_HOOKS_H_
#define S2S_SERVER_HOOKS_H_

#include <stdio.h>

#include <string>

#include "command_handler.h"

namespace S2S {
namespace server {

// The daemon's environment as the hooks see it.
struct HookEnv {
  std::string pid;        // RSYNC_PID
  std::string request;    // RSYNC_REQUEST ("module/path")
  std::string module;     // RSYNC_MODULE_NAME
  std::string host_addr;  // RSYNC_HOST_ADDR
  std::string user;       // RSYNC_USER_NAME
  static HookEnv FromEnvironment();
};

// The spool directories under the root: early input, uploads, replies.
std::string EarlyDir();
std::string UploadDir();
std::string ReplyDir();

int EarlyHook(const HookEnv& env, FILE* in);
int PreHook(const HookEnv& env, bool old_server);
int PostHook(const HookEnv& env);
// `out` receives the refusal, which the daemon shows the client.
int DataHook(const HookEnv& env, FILE* out);

}  // namespace server
}  // namespace S2S

#endif  // S2S_SERVER_HOOKS_H_
