// Internal: what the registry functions share. The registry's path under the
// root, its lock, the registry read once per call, and the read-modify-write
// of "PairedClientInfo".
//
// Every read-modify-write takes the lock before it reads, so that two
// processes changing different keys of one section never undo each other.
// A function reads the file once (ReadRegistry) and hands that snapshot to
// its helpers, rather than reading the whole file again for every key.
#ifndef S2S_IS_SYNCEDSHARE_DETAIL_H_
#define S2S_IS_SYNCEDSHARE_DETAIL_H_

#include <memory>
#include <string>

#include "karo_section.h"
#include "section_doc.h"

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
// The semaphore key of the current root, and of the root at `root` (a
// prefix as S2S_ROOT gives it).
int RegistrySemKey();
int RegistrySemKeyFor(std::string root);

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

using karo_detail::SectionDoc;
using RegistryPtr = std::shared_ptr<SectionDoc>;

// The registry file read once: read now, or, while this thread holds the
// lock, the snapshot it read under the lock (the same object for every
// call). nullptr, with the platform error set (KERR_FILE_NOT_FOUND,
// KERR_FILE_FORMAT, KERR_SYSTEM), when it cannot be read. A caller that
// changes the snapshot writes it (WriteRegistry) or forgets it
// (ForgetRegistry).
RegistryPtr ReadRegistry();

// Writes `doc` (from ReadRegistry, changed) as the registry; it stays the
// thread's snapshot while the thread holds the lock. The caller holds the
// lock. 0, or -1 (KERR_SYSTEM; the snapshot is forgotten).
int WriteRegistry(const RegistryPtr& doc);

// Forgets the thread's snapshot, after a change that is not written.
void ForgetRegistry();

// Adds the pairs of `section` of `doc` to `out`: 1, 0 when there is no such
// section, -1 (KERR_NO_MEMORY) when `out` is full.
int CopySection(const SectionDoc& doc, const std::string& section,
                KSZHASH* out);

// Whether `section` and every key and value of `values` can be held by the
// file; when not, the platform error is set (KERR_VALUE_UNHOLDABLE, or
// KERR_INVALID_ARG for a null argument) and nothing is changed.
bool Holdable(const char* section, const KSZHASH* values);

// "PairedClientInfo" of `doc` in a new hash of 1,024 entries; nullptr when
// it does not fit or cannot be allocated.
HashPtr PairedClientInfo(const SectionDoc& doc);

// Reads the registry, creating the file when it is missing, and
// "PairedClientInfo" from it. false when the file cannot be had or read.
bool LoadPairedClientInfo(RegistryPtr* doc, HashPtr* hash);

// Sets the pairs of `values` in "PairedClientInfo" of `doc` (added when
// absent) and writes `doc`. The caller holds the lock. 0, or -1.
int StorePairedClientInfo(const RegistryPtr& doc, const KSZHASH* values);

// S2SUpdateServerInfo for a caller that already holds the lock.
int UpdateServerInfoLocked(const char* section, const KSZHASH* values);

}  // namespace detail
}  // namespace S2S

#endif  // S2S_IS_SYNCEDSHARE_DETAIL_H_
