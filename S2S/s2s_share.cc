#include "S2S/s2s_share.h"

#include <string>

#include "karo_host.h"
#include "karo_share.h"

#define S2S_LOG_AREA "s2s"
#include "S2S/log.h"

namespace S2S {

ShareInfo::ShareInfo() : status_(0), encryptKeyLen_(0) {}

ShareInfo::ShareInfo(uint32_t status, uint32_t encryptKeyLen,
                     const std::string& name, const std::string& path,
                     const std::string& modulePath,
                     const std::string& moduleName)
    : status_(status),
      encryptKeyLen_(encryptKeyLen),
      name_(name),
      path_(path),
      modulePath_(modulePath),
      moduleName_(moduleName) {}

bool ShareInfo::IsEncrypted() const { return status_ & KARO_SHARE_ENCRYPTED; }
bool ShareInfo::IsAutoMount() const { return status_ & KARO_SHARE_AUTO_MOUNT; }
bool ShareInfo::IsACL() const {
  return (status_ & KARO_SHARE_ACL) || IsWinShare();
}
bool ShareInfo::IsWinShare() const { return status_ & KARO_SHARE_WIN_SHARE; }
bool ShareInfo::IsCluster() const { return status_ & KARO_SHARE_CLUSTER; }

VolumeInfo::VolumeInfo() : type_(0) {}
VolumeInfo::VolumeInfo(int type, const std::string& path)
    : type_(type), path_(path) {}

int GetShareInfo(const std::string& name, ShareInfo& info) {
  if (name.empty()) return -1;
  KARO_SHARE* share = nullptr;
  if (KAROShareGet(name.c_str(), &share) < 0) {
    LOG_ERROR("Fail to get share '%s'", name.c_str());
    return -1;
  }
  int rc = -1;
  if (share->path == nullptr) {
    LOG_ERROR("Fail to get the path of share '%s'", name.c_str());
  } else if (share->status & KARO_SHARE_ENCRYPTED) {
    char buffer[4096] = {0};
    if (KLIBShareEncryptPathGet(share->path, buffer, 4095) < 0) {
      LOG_ERROR("Fail to get encrypted path of share '%s'", name.c_str());
    } else {
      info = ShareInfo(share->status, share->key_length, name, share->path,
                       buffer, "@" + name + "@");
      rc = 0;
    }
  } else {
    info = ShareInfo(share->status, share->key_length, name, share->path,
                     share->path, name);
    rc = 0;
  }
  KAROShareFree(share);
  return rc;
}

int GetVolumeInfo(const std::string& shareName, VolumeInfo& info) {
  ShareInfo share;
  if (GetShareInfo(shareName, share) != 0) {
    LOG_ERROR("Fail to get share info");
    return -1;
  }
  KARO_VOLUME volume;
  if (VolumePathParseEx(share.GetPath().c_str(), &volume) < 0) {
    LOG_ERROR("Fail to get volume info of share '%s'", shareName.c_str());
    return -1;
  }
  info = VolumeInfo(volume.type, volume.path);
  return 0;
}

int IsValidShare(const std::string& name, bool& valid) {
  if (KLIBCIsPlugUnit()) {
    valid = KAROShareIsInSharebin(name.c_str()) == 1;
    return 0;
  }
  VolumeInfo volume;
  if (GetVolumeInfo(name, volume) != 0) {
    LOG_ERROR("Fail to get volume info");
    return -1;
  }
  valid = volume.IsInternal();
  return 0;
}

}  // namespace S2S
