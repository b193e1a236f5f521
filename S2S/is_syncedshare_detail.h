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
// The lock of the real root. A relocated root has a key of its own
// (RegistrySemKey), so that unrelated roots on one machine never wait for
// each other.
const int kRegistrySemKey = 0x2980298;
// How long a registry function waits for the lock before it fails.
const int kRegistryLockWaitMs = 30000;
const char kPairedClientInfo[] = "PairedClientInfo";
const char kMultiSrcMarker[] = "S2SMULTI-SRC-SUPPORT";

// The registry file resolved under the root.
std::string RegistryPath();
// The semaphore key of the current root.
int RegistrySemKey();

struct HashFree {
  void operator()(KSZHASH* hash) const { KLIBCSzHashFree(hash); }
};
using HashPtr = std::unique_ptr<KSZHASH, HashFree>;

struct StrPut {
  void operator()(char* s) const { KLIBCStrPut(s); }
};
using StrPtr = std::unique_ptr<char, StrPut>;

// Holds the registry semaphore for its lifetime. Held() is false when it
// could not be opened or taken within `timeout_ms` (negative: the default
// wait). A thread that already holds it takes it again without waiting, so
// that a caller can hold it across several registry functions.
class RegistryLock {
 public:
  explicit RegistryLock(int timeout_ms = -1);
  ~RegistryLock();
  RegistryLock(const RegistryLock&) = delete;
  RegistryLock& operator=(const RegistryLock&) = delete;
  bool Held() const { return locked_; }

 private:
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
