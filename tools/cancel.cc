#include "cancel.h"

#include <signal.h>

#include "service/cancel.h"

namespace s2s_tools {

namespace {

s2s_service::CancelFlag g_signalled;

void OnSignal(int) { g_signalled.Set(); }

}  // namespace

bool InstallCancelSignals() {
  s2s_service::BindCancelFlag(&g_signalled);
  struct sigaction sa = {};
  sa.sa_handler = OnSignal;
  sigemptyset(&sa.sa_mask);
  // No SA_RESTART: a blocking call returns EINTR, so that every wait ends
  // and its loop gets to look at the flag.
  sa.sa_flags = 0;
  return sigaction(SIGINT, &sa, nullptr) == 0 &&
         sigaction(SIGTERM, &sa, nullptr) == 0;
}

}  // namespace s2s_tools
