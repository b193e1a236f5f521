#include <cstdlib>
#include <cstring>

#include "karo_err.h"
#include "karo_root.h"

namespace {
// Trailing slashes are dropped so that prefix + "/abs/path" never doubles one.
thread_local char prefix_buf[4096];
}  // namespace

extern "C" const char* KaroRootPrefix(void) {
  const char* env = std::getenv(KARO_ROOT_ENV);
  if (env == nullptr) return "";
  size_t len = std::strlen(env);
  while (len > 0 && env[len - 1] == '/') --len;
  if (len >= sizeof prefix_buf) len = sizeof prefix_buf - 1;
  std::memcpy(prefix_buf, env, len);
  prefix_buf[len] = '\0';
  return prefix_buf;
}

extern "C" int KaroRootResolve(const char* path, char* out, size_t size) {
  if (path == nullptr || path[0] != '/' || out == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  const char* prefix = KaroRootPrefix();
  size_t need = std::strlen(prefix) + std::strlen(path) + 1;
  if (need > size) {
    KLIBCErrSet(KERR_BUFFER_TOO_SMALL);
    return -1;
  }
  std::strcpy(out, prefix);
  std::strcat(out, path);
  return 0;
}
