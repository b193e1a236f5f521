#include "cancel.h"

#include <signal.h>
#include <time.h>

namespace s2s_tools {

namespace {

volatile sig_atomic_t g_cancel = 0;

struct Beacon {
  std::function<void()> hook;
  unsigned int interval = 0;
  timespec last = {0, 0};
  bool inside = false;
};

Beacon& TheBeacon() {
  static Beacon* beacon = new Beacon;
  return *beacon;
}

double Now() {
  timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<double>(ts.tv_sec) + ts.tv_nsec / 1e9;
}

double Seconds(const timespec& ts) {
  return static_cast<double>(ts.tv_sec) + ts.tv_nsec / 1e9;
}

void OnSignal(int) { g_cancel = 1; }

}  // namespace

bool InstallCancelSignals() {
  struct sigaction sa = {};
  sa.sa_handler = OnSignal;
  sigemptyset(&sa.sa_mask);
  sa.sa_flags = SA_RESTART;
  return sigaction(SIGINT, &sa, nullptr) == 0 &&
         sigaction(SIGTERM, &sa, nullptr) == 0;
}

bool CancelRequested() { return g_cancel != 0; }

void SetCancelRequested(bool on) { g_cancel = on ? 1 : 0; }

bool CancelChecker() {
  if (g_cancel != 0) return true;
  Beacon& b = TheBeacon();
  if (b.hook && !b.inside && Now() - Seconds(b.last) >= b.interval) {
    b.inside = true;
    b.hook();
    BeaconSent();
    b.inside = false;
  }
  return g_cancel != 0;
}

void SetBeaconHook(std::function<void()> hook, unsigned int interval_s) {
  Beacon& b = TheBeacon();
  b.hook = std::move(hook);
  b.interval = interval_s;
  BeaconSent();
}

void BeaconSent() { clock_gettime(CLOCK_MONOTONIC, &TheBeacon().last); }

void WaitForCancel() {
  sigset_t block, old;
  sigemptyset(&block);
  sigaddset(&block, SIGINT);
  sigaddset(&block, SIGTERM);
  sigprocmask(SIG_BLOCK, &block, &old);
  while (g_cancel == 0) sigsuspend(&old);
  sigprocmask(SIG_SETMASK, &old, nullptr);
}

}  // namespace s2s_tools
