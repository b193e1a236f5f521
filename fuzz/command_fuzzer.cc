// Feeds arbitrary bytes to the server's command handler as a network command
// file, run when it parses against a scratch root with two shares and a real
// registry. Any status is fine; a crash, hang, overrun or stray write is not.
#include <stdarg.h>
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/sem.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>

#include "S2S/is_syncedshare_detail.h"
#include "S2S/logger.h"
#include "S2S/syslog_sink.h"
#include "command_file.h"
#include "command_handler.h"
#include "karo_root.h"
#include "protocol.h"

namespace {

std::string root;

// Messages are formatted, as they would be for the system log, and dropped.
void FormatOnly(int, const char* format, va_list ap) {
  char buf[1024];
  vsnprintf(buf, sizeof buf, format, ap);
}

void RemoveRoot() {
  int id = semget(S2S::detail::RegistrySemKeyFor(root), 1, 0);
  if (id >= 0) semctl(id, 0, IPC_RMID);
  std::error_code ec;
  std::filesystem::remove_all(root, ec);
}

void MakeRoot() {
  char dir[] = "/tmp/s2s-command-fuzz.XXXXXX";
  if (mkdtemp(dir) == nullptr) abort();
  root = dir;
  setenv(KARO_ROOT_ENV, dir, 1);
  std::filesystem::create_directories(root + "/etc/s2s");
  std::ofstream(root + "/etc/s2s/shares.conf")
      << "[docs]\n\tpath=\"" << root << "/docs\"\n[vault]\n\tpath=\"" << root
      << "/vault\"\n\tencrypted=\"yes\"\n";
  S2S::detail::SetSyslogWriter(FormatOnly);
  S2S::Logger::Initialize(S2S::Logger::Syslog, S2S::Logger::Debug, "", 0);
  atexit(RemoveRoot);
}

// The registry grows a section per task name: start afresh now and then.
void TrimRegistry() {
  std::string registry = root + "/usr/karo/etc/karoS2S.info";
  struct stat st;
  if (stat(registry.c_str(), &st) == 0 && st.st_size > 64 * 1024) {
    unlink(registry.c_str());
    unlink((root + "/usr/karo/etc/karoS2S.initialised").c_str());
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (root.empty()) MakeRoot();
  if (size > S2S::server::kMaxCommandFile + 1) return 0;
  std::string text(reinterpret_cast<const char*>(data), size);
  S2S::server::CommandFile cmd;
  std::string why;
  if (S2S::server::ParseCommandFile(text, &cmd, &why) != S2S::server::kOk) {
    return 0;
  }
  S2S::server::HandlerContext ctx;
  ctx.peer_address = "127.0.0.1";
  ctx.peer_user = size % 2 == 0 ? "even" : "odd";
  ctx.old_server = size % 3 == 0;
  std::string answer;
  S2S::server::HandleCommand(cmd, ctx, &answer);
  std::string share;
  if (const std::string* s = cmd.Get("shareName")) share = *s;
  S2S::server::MayPushShare(share, ctx, &why);
  TrimRegistry();
  return 0;
}
