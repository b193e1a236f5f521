// Facts about local shares and the volumes they lie on.
//
// ShareInfo and VolumeInfo are plain values that own their strings. The
// functions hold no state (nothing is cached), may be called from any
// thread, and log each failure once, at ERROR.
#ifndef S2S_S2S_SHARE_H_
#define S2S_S2S_SHARE_H_

#include <stdint.h>

#include <string>

#include "S2S/export.h"

namespace S2S {

// What the library knows of a local share.
class S2S_EXPORT ShareInfo {
 public:
  ShareInfo();
  ShareInfo(uint32_t status, uint32_t encryptKeyLen, const std::string& name,
            const std::string& path, const std::string& modulePath,
            const std::string& moduleName);

  bool IsEncrypted() const;
  bool IsAutoMount() const;
  bool IsACL() const;  // also true for a Windows share
  bool IsWinShare() const;
  bool IsCluster() const;
  uint32_t GetStatus() const { return status_; }
  uint32_t GetEncryptKeyLen() const { return encryptKeyLen_; }
  std::string GetName() const { return name_; }
  std::string GetPath() const { return path_; }
  // The directory rsync serves: the path, or an encrypted share's lower path.
  std::string GetModulePath() const { return modulePath_; }
  // The rsync module: the name, or "@name@" for an encrypted share.
  std::string GetModuleName() const { return moduleName_; }

 private:
  uint32_t status_;
  uint32_t encryptKeyLen_;
  std::string name_;
  std::string path_;
  std::string modulePath_;
  std::string moduleName_;
};

// The volume a share lies on.
class S2S_EXPORT VolumeInfo {
 public:
  VolumeInfo();
  VolumeInfo(int type, const std::string& path);

  int GetType() const { return type_; }
  std::string GetPath() const { return path_; }
  // The path without its first character ("/volume1" gives "volume1").
  // REQUIRES: a non-empty path; throws std::out_of_range otherwise.
  std::string GetName() const { return path_.substr(1); }
  bool IsInternal() const { return type_ == 1; }

 private:
  int type_;
  std::string path_;
};

// Fills `info` for share `name`. 0, or -1 (an empty name fails silently).
S2S_EXPORT int GetShareInfo(const std::string& name, ShareInfo& info);

// Fills `info` with the volume of share `shareName`. 0 or -1.
S2S_EXPORT int GetVolumeInfo(const std::string& shareName, VolumeInfo& info);

// Sets `valid` to whether share `name` may be synced (on an internal volume,
// or on a reduced appliance, in its share bin). 0, or -1 when unknown.
S2S_EXPORT int IsValidShare(const std::string& name, bool& valid);

}  // namespace S2S

#endif  // S2S_S2S_SHARE_H_
