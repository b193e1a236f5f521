#include "cancel.h"

#include <time.h>

namespace s2s_service {

namespace {

struct Beacon {
  std::function<void()> hook;
  unsigned int interval = 0;
  double last = 0;
  bool inside = false;
};

thread_local const CancelFlag* t_flag = nullptr;
thread_local Beacon t_beacon;

double Now() {
  timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<double>(ts.tv_sec) + ts.tv_nsec / 1e9;
}

}  // namespace

void BindCancelFlag(const CancelFlag* flag) { t_flag = flag; }

const CancelFlag* BoundCancelFlag() { return t_flag; }

bool CancelRequested() { return t_flag != nullptr && t_flag->IsSet(); }

bool CancelChecker() {
  if (CancelRequested()) return true;
  Beacon& b = t_beacon;
  if (!b.inside && BeaconDue()) {
    b.inside = true;
    b.hook();
    BeaconSent();
    b.inside = false;
  }
  return CancelRequested();
}

void SetBeaconHook(std::function<void()> hook, unsigned int interval_s) {
  t_beacon.hook = std::move(hook);
  t_beacon.interval = interval_s;
  BeaconSent();
}

bool BeaconDue() {
  const Beacon& b = t_beacon;
  return b.hook && Now() - b.last >= b.interval;
}

void BeaconSent() { t_beacon.last = Now(); }

}  // namespace s2s_service
