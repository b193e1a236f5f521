// Formatted strings handed out to C callers, released with KLIBCStrPut.
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>

#include "karo_err.h"
#include "karo_section.h"

extern "C" char* KLIBCStrGet(const char* format, ...) {
  if (format == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return nullptr;
  }
  va_list ap;
  va_start(ap, format);
  char* out = nullptr;
  int n = vasprintf(&out, format, ap);
  va_end(ap);
  if (n < 0) {
    KLIBCErrSet(KERR_NO_MEMORY);
    return nullptr;
  }
  return out;
}

extern "C" void KLIBCStrPut(char* s) { free(s); }
