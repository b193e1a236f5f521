#include <cstdio>

#include "karo_err.h"

namespace {
thread_local int last_error = KERR_NONE;
thread_local char last_source[128];
}  // namespace

extern "C" int KLIBCErrGet(void) { return last_error; }

extern "C" void KLIBCErrSetEx(int err, const char* source, int line) {
  last_error = err;
  std::snprintf(last_source, sizeof last_source, "%s:%d", source ? source : "",
                line);
}

extern "C" const char* KLIBCErrSource(void) { return last_source; }
