// The registry file: creating it, reading sections, replacing them under the
// registry lock, switching the service, and whether a share is a sync target.
#include "S2S/is_syncedshare.h"

#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <memory>
#include <vector>

#include "S2S/is_syncedshare_detail.h"
#include "S2S/syslog_sink.h"
#include "karo_err.h"
#include "karo_root.h"

namespace S2S {
namespace detail {
namespace {

// A fresh root has no /usr/karo/etc yet; the registry's directory is made on
// demand so that a relocated appliance starts from an empty tree.
void MakeParents(const std::string& path) {
  for (size_t slash = path.find('/', 1); slash != std::string::npos;
       slash = path.find('/', slash + 1)) {
    mkdir(path.substr(0, slash).c_str(), 0755);
  }
}

// Reads `key` of `section` of `doc` (nullptr: the registry could not be
// read) into `buf`; a missing file, section or key reads as "". false (after
// logging) on any other failure.
bool ReadTolerant(const SectionDoc* doc, const char* section, const char* key,
                  char* buf, int size) {
  buf[0] = '\0';
  if (doc != nullptr && doc->CopyValue(section, key, buf, size) >= 0) {
    return true;
  }
  int err = KLIBCErrGet();
  buf[0] = '\0';
  if (err == KERR_NOT_FOUND || err == KERR_FILE_NOT_FOUND) return true;
  REGISTRY_ERR_PREFIXED(
      "KLIBCFileGetSectionValue error. key:[%s] errno=[0x%04X]", section, err);
  return false;
}

}  // namespace

std::string RegistryPath() { return KaroRootPath(kRegistryFile); }

int RegistrySemKey() { return RegistrySemKeyFor(KaroRootPrefix()); }

int RegistrySemKeyFor(std::string root) {
  while (!root.empty() && root.back() == '/') root.pop_back();
  if (root.empty()) return kRegistrySemKey;
  // One root named by two paths must still share its lock.
  char real[PATH_MAX];
  if (realpath(root.c_str(), real) != nullptr) root = real;
  if (root == "/") return kRegistrySemKey;
  uint32_t h = 2166136261u;  // FNV-1a
  for (unsigned char c : root) {
    h ^= c;
    h *= 16777619u;
  }
  // Positive, never IPC_PRIVATE (0), never the real root's key.
  int key = static_cast<int>((h & 0x7ffffffeu) | 0x40000000u);
  return key == kRegistrySemKey ? key + 2 : key;
}

namespace {
// The lock as this thread holds it: the semaphore's handle and how many
// RegistryLock objects of the thread share it.
thread_local int held_handle = -1;
thread_local int held_depth = 0;

// While the thread holds the lock no other writer changes the registry, so
// what the thread read under it stays true until it gives the lock back: the
// registry is read once for everything done under one lock (a whole
// command), and kept in step with the thread's own writes. The file's
// identity guards against a writer that bypasses the lock.
struct Snapshot {
  RegistryPtr doc;
  std::string path;
  struct stat st;
};
thread_local Snapshot held_snapshot;

bool SameFile(const struct stat& a, const struct stat& b) {
  return a.st_dev == b.st_dev && a.st_ino == b.st_ino &&
         a.st_size == b.st_size && a.st_mtim.tv_sec == b.st_mtim.tv_sec &&
         a.st_mtim.tv_nsec == b.st_mtim.tv_nsec;
}

// Keeps `doc` as the snapshot when the thread holds the lock; forgets the
// snapshot when it does not, or when `doc` is null.
void KeepSnapshot(const RegistryPtr& doc, const std::string& path) {
  held_snapshot = Snapshot{};
  if (held_depth > 0 && doc && stat(path.c_str(), &held_snapshot.st) == 0) {
    held_snapshot.doc = doc;
    held_snapshot.path = path;
  }
}
}  // namespace

RegistryLock::RegistryLock(int timeout_ms) {
  if (held_depth > 0) {
    ++held_depth;
    locked_ = true;
    return;
  }
  int handle = KLIBCSemOpen(RegistrySemKey());
  if (handle < 0) return;
  // The lock belongs to whoever owns the registry's directory (the daemon
  // user of a server in SSH mode), whichever process made it first.
  struct stat dir;
  std::string registry = RegistryPath();
  if (geteuid() == 0 &&
      stat(registry.substr(0, registry.rfind('/')).c_str(), &dir) == 0 &&
      dir.st_uid != 0) {
    KLIBCSemSetOwner(handle, dir.st_uid, dir.st_gid);
  }
  if (KLIBCSemLockTimed(
          handle, timeout_ms < 0 ? kRegistryLockWaitMs : timeout_ms) != 0) {
    KLIBCSemClose(handle);
    return;
  }
  locked_ = true;
  held_handle = handle;
  held_depth = 1;
}

RegistryLock::~RegistryLock() {
  if (!locked_ || --held_depth > 0) return;
  held_snapshot = Snapshot{};
  KLIBCSemUnlock(held_handle);
  KLIBCSemClose(held_handle);
  held_handle = -1;
}

RegistryPtr ReadRegistry() {
  const std::string path = RegistryPath();
  struct stat st;
  if (held_depth > 0 && held_snapshot.doc && held_snapshot.path == path &&
      stat(path.c_str(), &st) == 0 && SameFile(st, held_snapshot.st)) {
    return held_snapshot.doc;
  }
  RegistryPtr doc = std::make_shared<SectionDoc>();
  // Identified before it is read: a change in between makes the snapshot
  // look stale, never the other way round.
  bool known = held_depth > 0 && stat(path.c_str(), &st) == 0;
  held_snapshot = Snapshot{};
  if (doc->Load(path.c_str()) != 0) return nullptr;
  if (known) held_snapshot = Snapshot{doc, path, st};
  return doc;
}

int WriteRegistry(const RegistryPtr& doc) {
  const std::string path = RegistryPath();
  if (doc->Store(path.c_str()) != 0) {
    ForgetRegistry();
    return -1;
  }
  KeepSnapshot(doc, path);
  return 0;
}

void ForgetRegistry() { held_snapshot = Snapshot{}; }

int CopySection(const SectionDoc& doc, const std::string& section,
                KSZHASH* out) {
  const karo_detail::SectionPairs* pairs = doc.Find(section);
  if (pairs == nullptr) return 0;
  for (const auto& p : *pairs) {
    if (KLIBCSzHashSetValue(out, p.first.c_str(), p.second.c_str()) != 0) {
      return -1;
    }
  }
  return 1;
}

bool Holdable(const char* section, const KSZHASH* values) {
  if (section == nullptr || values == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return false;
  }
  bool ok = karo_detail::SectionNameHoldable(section);
  for (int i = 0; ok && i < KLIBCSzHashCount(values); ++i) {
    ok = karo_detail::SectionKeyHoldable(KLIBCSzHashKeyAt(values, i)) &&
         karo_detail::SectionValueHoldable(KLIBCSzHashValueAt(values, i));
  }
  if (!ok) KLIBCErrSet(KERR_VALUE_UNHOLDABLE);
  return ok;
}

HashPtr PairedClientInfo(const SectionDoc& doc) {
  HashPtr hash(KLIBCSzHashAlloc(1024));
  if (!hash || CopySection(doc, kPairedClientInfo, hash.get()) < 0) {
    return nullptr;
  }
  return hash;
}

bool LoadPairedClientInfo(RegistryPtr* doc, HashPtr* hash) {
  if (S2SCheckServerInfo() != 0) return false;
  *doc = ReadRegistry();
  if (!*doc) return false;
  *hash = PairedClientInfo(**doc);
  return *hash != nullptr;
}

int StorePairedClientInfo(const RegistryPtr& doc, const KSZHASH* values) {
  if (S2SCheckServerInfo() != 0 || !Holdable(kPairedClientInfo, values)) {
    // The caller may have changed `doc` already.
    ForgetRegistry();
    return -1;
  }
  karo_detail::SectionPairs* pairs = doc->Add(kPairedClientInfo);
  for (int i = 0; i < KLIBCSzHashCount(values); ++i) {
    SectionDoc::Set(pairs, KLIBCSzHashKeyAt(values, i),
                    KLIBCSzHashValueAt(values, i));
  }
  return WriteRegistry(doc) == 0 ? 0 : -1;
}

int UpdateServerInfoLocked(const char* section, const KSZHASH* values) {
  const std::string file = RegistryPath();
  const char* name = section != nullptr ? section : "";
  RegistryPtr doc = ReadRegistry();
  if (!doc && KLIBCErrGet() == KERR_FILE_NOT_FOUND) {
    doc = std::make_shared<SectionDoc>();
  }
  bool ok = false;
  if (!doc && name[0] != '\0') {
    Syslog(LOG_ERR,
           "KLIBCFileGetSection error. filePath:[%s] szOldSecName:[%s]  "
           "iRet:[%d]",
           file.c_str(), name, -1);
  } else {
    bool exists = doc && name[0] != '\0' && doc->Find(name) != nullptr;
    // An unnamed section is never holdable, so past this check `doc` is
    // there.
    if (Holdable(section, values)) {
      karo_detail::SectionPairs pairs;
      for (int i = 0; i < KLIBCSzHashCount(values); ++i) {
        SectionDoc::Set(&pairs, KLIBCSzHashKeyAt(values, i),
                        KLIBCSzHashValueAt(values, i));
      }
      *doc->Add(name) = std::move(pairs);
      ok = WriteRegistry(doc) == 0;
    }
    if (!ok) {
      Syslog(LOG_ERR,
             exists ? "KLIBCFileSetSection() failed!! szFile=[%s], "
                      "section=[%s], errno=[0x%04X]"
                    : "KLIBCFileAddSection() failed!! szFile=[%s], "
                      "section=[%s], errno=[0x%04X]",
             file.c_str(), name, KLIBCErrGet());
    }
  }
  if (ok) return 0;
  Syslog(LOG_ERR, "Set section [%s ] value into [%s] error.", name,
         file.c_str());
  return -1;
}

}  // namespace detail
}  // namespace S2S

using S2S::detail::HashPtr;
using S2S::detail::kPairedClientInfo;
using S2S::detail::RegistryLock;
using S2S::detail::RegistryPath;

namespace {
// The locks of S2SRegistryLock, innermost last.
thread_local std::vector<std::unique_ptr<RegistryLock>> explicit_locks;
}  // namespace

extern "C" int S2SRegistryLock(int timeoutMs) {
  std::unique_ptr<RegistryLock> lock(new RegistryLock(timeoutMs));
  if (!lock->Held()) {
    S2S::detail::Syslog(
        LOG_ERR, "registry lock not had within %d ms",
        timeoutMs < 0 ? S2S::detail::kRegistryLockWaitMs : timeoutMs);
    return -1;
  }
  explicit_locks.push_back(std::move(lock));
  return 0;
}

extern "C" int S2SRegistryUnlock(void) {
  if (explicit_locks.empty()) return -1;
  explicit_locks.pop_back();
  return 0;
}

extern "C" int S2SCheckServerInfo(void) {
  const std::string file = RegistryPath();
  if (KLIBCFileExist(file.c_str())) return 0;
  S2S::detail::MakeParents(file);
  int fd = open(file.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
  if (fd < 0) return -1;
  close(fd);
  return 0;
}

extern "C" int S2SGetServerInfo(const char* section, KSZHASH* out) {
  S2SCheckServerInfo();
  if (section == nullptr || out == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  S2S::detail::RegistryPtr doc = S2S::detail::ReadRegistry();
  if (!doc) return -1;
  return S2S::detail::CopySection(*doc, section, out);
}

extern "C" int S2SUpdateServerInfo(const char* section, const KSZHASH* values) {
  S2SCheckServerInfo();
  RegistryLock lock;
  if (!lock.Held()) {
    S2S::detail::Syslog(LOG_ERR, "S2SUpdateServerInfo() lock failed");
    return -1;
  }
  return S2S::detail::UpdateServerInfoLocked(section, values);
}

extern "C" int KAROUISetS2S(int enable, const char* clientID,
                            const char* serverName) {
  if (S2SCheckServerInfo() != 0) return -1;
  // Loaded under the lock, so that a pairing stored meanwhile by another
  // process is not written back over with the old one.
  RegistryLock lock;
  if (!lock.Held()) return -1;
  S2S::detail::RegistryPtr doc;
  HashPtr hash;
  if (!S2S::detail::LoadPairedClientInfo(&doc, &hash)) return -1;
  if (clientID != nullptr && serverName != nullptr &&
      (KLIBCSzHashSetValue(hash.get(), "clientID", clientID) != 0 ||
       KLIBCSzHashSetValue(hash.get(), "serverName", serverName) != 0)) {
    return -1;
  }
  if (KLIBCSzHashSetValue(hash.get(), "s2sEnabled", enable ? "yes" : "no") !=
      0) {
    return -1;
  }
  return S2S::detail::StorePairedClientInfo(doc, hash.get());
}

extern "C" int KAROS2SIsSyncedShare(const char* shareName) {
  if (shareName == nullptr || shareName[0] == '\0') {
    KLIBCErrSetEx(KERR_INVALID_ARG, S2S_REGISTRY_SOURCE, __LINE__);
    return 0;
  }
  S2S::detail::StrPtr section(KLIBCStrGet("SHARE_%s", shareName));
  if (!section) {
    REGISTRY_ERR_PREFIXED("Fail to KLIBCStrGet shareName:[%s] errno=[0x%04X]",
                          shareName, KLIBCErrGet());
    return 0;
  }
  S2S::detail::RegistryPtr doc = S2S::detail::ReadRegistry();
  char value[256];
  if (!S2S::detail::ReadTolerant(doc.get(), kPairedClientInfo, "s2sEnabled",
                                 value, sizeof value)) {
    return 0;
  }
  if (strcmp(value, "no") == 0) return 0;
  if (!S2S::detail::ReadTolerant(doc.get(), section.get(), "RunningID", value,
                                 sizeof value)) {
    return 0;
  }
  return value[0] != '\0' ? 1 : 0;
}
