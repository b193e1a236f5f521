// Internal: what the registry functions share. The registry's path under the
// root, its lock, and the read-modify-write of "PairedClientInfo".
//
// Every read-modify-write takes the lock before it reads, so that two
// processes changing different keys of one section never undo each other.
#ifndef S2S_IS_SYNCEDSHARE_DETAIL_H_
#define S2S_IS_SYNCEDSHARE_DETAIL_H_

#include <memory>
#include <string>

#include "karo_section.h"

// Source name of the messages that carry a "%s:%d " prefix.
#define S2S_REGISTRY_SOURCE "is_syncedshare"
#define REGISTRY_ERR_PREFIXED(fmt, ...)                                       \
  ::S2S::detail::Syslog(LOG_ERR, "%s:%d " fmt, S2S_REGISTRY_SOURCE, __LINE__, \
                        ##__VA_ARGS__)

namespace S2S {
namespace detail {

const char kRegistryFile[] = "/usr/karo/etc/karoS2S.info";
const int kRegistrySemKey = 0x2980298;
const char kPairedClientInfo[] = "PairedClientInfo";
const char kMultiSrcMarker[] = "S2SMULTI-SRC-SUPPORT";

// The registry file resolved under the root.
std::string RegistryPath();

struct HashFree {
  void operator()(KSZHASH* hash) const { KLIBCSzHashFree(hash); }
};
using HashPtr = std::unique_ptr<KSZHASH, HashFree>;

struct StrPut {
  void operator()(char* s) const { KLIBCStrPut(s); }
};
using StrPtr = std::unique_ptr<char, StrPut>;

// Holds the registry semaphore for its lifetime. Held() is false when it
// could not be opened or taken.
class RegistryLock {
 public:
  RegistryLock();
  ~RegistryLock();
  RegistryLock(const RegistryLock&) = delete;
  RegistryLock& operator=(const RegistryLock&) = delete;
  bool Held() const { return locked_; }

 private:
  int handle_ = -1;
  bool locked_ = false;
};

// Reads "PairedClientInfo" into a new hash of 1,024 entries, creating the
// file when it is missing. nullptr when the file cannot be had or read.
HashPtr LoadPairedClientInfo();

// Writes `values` into "PairedClientInfo" (modified, or added when absent).
// The caller holds the lock. 0, or -1.
int StorePairedClientInfo(const KSZHASH* values);

// S2SUpdateServerInfo for a caller that already holds the lock.
int UpdateServerInfoLocked(const char* section, const KSZHASH* values);

}  // namespace detail
}  // namespace S2S

#endif  // S2S_IS_SYNCEDSHARE_DETAIL_H_
