#include <stdlib.h>
#include <string.h>
#include <strings.h>

#include <string>

#include "karo_err.h"
#include "karo_root.h"
#include "karo_share.h"
#include "share_conf.h"

namespace karo_detail {

std::string ShareConfPath() { return KaroRootPath(KARO_SHARE_CONF); }

int ReadShareSection(const char* name, KSZHASH** out) {
  *out = nullptr;
  KSZHASH* hash = KLIBCSzHashAlloc(64);
  if (hash == nullptr) return -1;
  int rc = KLIBCFileGetSection(ShareConfPath().c_str(), name, hash);
  if (rc < 0) {
    KLIBCSzHashFree(hash);
    return -1;
  }
  if (rc == 0) {
    KLIBCSzHashFree(hash);
    KLIBCErrSet(KERR_NOT_FOUND);
    return -1;
  }
  *out = hash;
  return 0;
}

int FindShareByPath(const std::string& path, KSZHASH** out) {
  *out = nullptr;
  std::string file = ShareConfPath();
  if (!KLIBCFileExist(file.c_str())) return 0;
  KSZLIST* names = KLIBCSzListAlloc();
  if (names == nullptr) return -1;
  int count = KLIBCFileEnumSection(file.c_str(), names);
  int rc = count < 0 ? -1 : 0;
  for (int i = 0; i < count && *out == nullptr; ++i) {
    KSZHASH* hash = nullptr;
    if (ReadShareSection(KLIBCSzListGet(names, i), &hash) < 0) continue;
    std::string candidate = KLIBCSzHashGetValue(hash, "path") != nullptr
                                ? KLIBCSzHashGetValue(hash, "path")
                                : "";
    while (candidate.size() > 1 && candidate.back() == '/')
      candidate.pop_back();
    if (!candidate.empty() && candidate == path) {
      *out = hash;
    } else {
      KLIBCSzHashFree(hash);
    }
  }
  KLIBCSzListFree(names);
  return rc;
}

}  // namespace karo_detail

namespace {

bool IsYes(const KSZHASH* hash, const char* key) {
  const char* v = KLIBCSzHashGetValue(hash, key);
  return v != nullptr && strcasecmp(v, "yes") == 0;
}

// A copy of the key's value, or NULL when the key is absent. `failed` is set
// when the copy cannot be made.
char* DupValue(const KSZHASH* hash, const char* key, bool* failed) {
  const char* v = KLIBCSzHashGetValue(hash, key);
  if (v == nullptr) return nullptr;
  char* copy = strdup(v);
  if (copy == nullptr) *failed = true;
  return copy;
}

unsigned int Number(const KSZHASH* hash, const char* key) {
  const char* v = KLIBCSzHashGetValue(hash, key);
  return v == nullptr ? 0 : static_cast<unsigned int>(strtoul(v, nullptr, 10));
}

int CopyOut(const std::string& value, char* buf, int size) {
  if (value.size() + 1 > static_cast<size_t>(size)) {
    KLIBCErrSet(KERR_BUFFER_TOO_SMALL);
    return -1;
  }
  memcpy(buf, value.c_str(), value.size() + 1);
  return static_cast<int>(value.size());
}

// Key-file path: the configured one, else the default in the key directory.
int KeyFile(const KARO_SHARE* share, const char* configured, const char* suffix,
            char* buf, int size) {
  if (share == nullptr || share->name == nullptr || buf == nullptr ||
      size < 1) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  if ((share->status & KARO_SHARE_ENCRYPTED) == 0) {
    KLIBCErrSet(KERR_NOT_FOUND);
    return -1;
  }
  std::string path = configured != nullptr
                         ? std::string(configured)
                         : KaroRootPath(std::string(KARO_SHARE_KEY_DIR) + "/" +
                                        share->name + suffix);
  return CopyOut(path, buf, size);
}

}  // namespace

extern "C" int KaroShareNameValid(const char* name) {
  size_t len = name == nullptr ? 0 : strlen(name);
  bool ok = len > 0 && len <= 255 && strcmp(name, ".") != 0 &&
            strcmp(name, "..") != 0 && name[0] != ' ' && name[len - 1] != ' ';
  for (size_t i = 0; ok && i < len; ++i) {
    unsigned char c = static_cast<unsigned char>(name[i]);
    ok = c >= 0x20 && c != 0x7f && strchr("/\\[]\"=@", c) == nullptr;
  }
  if (!ok) KLIBCErrSet(KERR_INVALID_ARG);
  return ok ? 1 : 0;
}

extern "C" int KAROShareGet(const char* name, KARO_SHARE** out) {
  if (out == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  *out = nullptr;
  if (!KaroShareNameValid(name)) return -1;
  KSZHASH* hash = nullptr;
  if (karo_detail::ReadShareSection(name, &hash) < 0) return -1;

  auto* share = static_cast<KARO_SHARE*>(calloc(1, sizeof(KARO_SHARE)));
  bool failed = share == nullptr;
  if (share != nullptr) {
    share->name = strdup(name);
    failed = share->name == nullptr;
    share->path = DupValue(hash, "path", &failed);
    share->enc_path = DupValue(hash, "enc_path", &failed);
    share->key_file = DupValue(hash, "key_file", &failed);
    share->auto_key_file = DupValue(hash, "auto_key_file", &failed);
    share->volume = DupValue(hash, "volume", &failed);
    share->key_length = Number(hash, "key_length");
    share->volume_type = static_cast<int>(Number(hash, "volume_type"));
    share->in_sharebin = IsYes(hash, "sharebin");
    share->status = (IsYes(hash, "encrypted") ? KARO_SHARE_ENCRYPTED : 0) |
                    (IsYes(hash, "auto_mount") ? KARO_SHARE_AUTO_MOUNT : 0) |
                    (IsYes(hash, "acl") ? KARO_SHARE_ACL : 0) |
                    (IsYes(hash, "win_share") ? KARO_SHARE_WIN_SHARE : 0) |
                    (IsYes(hash, "cluster") ? KARO_SHARE_CLUSTER : 0);
  }
  KLIBCSzHashFree(hash);
  if (failed) {
    KAROShareFree(share);
    KLIBCErrSet(KERR_NO_MEMORY);
    return -1;
  }
  *out = share;
  return 0;
}

extern "C" void KAROShareFree(KARO_SHARE* share) {
  if (share == nullptr) return;
  free(share->name);
  free(share->path);
  free(share->enc_path);
  free(share->key_file);
  free(share->auto_key_file);
  free(share->volume);
  free(share);
}

extern "C" int KAROShareEnum(KSZLIST* out) {
  if (out == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  std::string file = karo_detail::ShareConfPath();
  if (!KLIBCFileExist(file.c_str())) return 0;
  return KLIBCFileEnumSection(file.c_str(), out);
}

extern "C" int KLIBShareEncryptPathGet(const char* share_path, char* buf,
                                       int size) {
  if (share_path == nullptr || share_path[0] != '/' || buf == nullptr ||
      size < 1) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  std::string path = share_path;
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  KSZHASH* hash = nullptr;
  if (karo_detail::FindShareByPath(path, &hash) < 0) return -1;
  const char* configured =
      hash == nullptr ? nullptr : KLIBCSzHashGetValue(hash, "enc_path");
  std::string enc;
  if (configured != nullptr) {
    enc = configured;
  } else {
    size_t slash = path.rfind('/');
    enc = path.substr(0, slash + 1) + "@" + path.substr(slash + 1) + "@";
  }
  KLIBCSzHashFree(hash);
  return CopyOut(enc, buf, size);
}

extern "C" int KLIBShareIsEncryptionGet(const KARO_SHARE* share, int* value) {
  if (share == nullptr || value == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  *value = (share->status & KARO_SHARE_ENCRYPTED) != 0;
  return 0;
}

extern "C" int KLIBShareIsAutoDecryptGet(const KARO_SHARE* share, int* value) {
  if (share == nullptr || value == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  const unsigned int both = KARO_SHARE_ENCRYPTED | KARO_SHARE_AUTO_MOUNT;
  *value = (share->status & both) == both;
  return 0;
}

extern "C" int KAROShareEncKeyFileGet(const KARO_SHARE* share, char* buf,
                                      int size) {
  return KeyFile(share, share ? share->key_file : nullptr, ".key", buf, size);
}

extern "C" int KAROShareEncAutoKeyFileGet(const KARO_SHARE* share, char* buf,
                                          int size) {
  return KeyFile(share, share ? share->auto_key_file : nullptr, ".auto.key",
                 buf, size);
}

extern "C" int KAROShareIsInSharebin(const char* name) {
  KARO_SHARE* share = nullptr;
  if (KAROShareGet(name, &share) < 0) return -1;
  int in = share->in_sharebin;
  KAROShareFree(share);
  return in;
}
