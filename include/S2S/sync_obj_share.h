// Share and Event: the two smallest values of the sync data model.
//
// A Share names one shared folder by a numeric id and its name. An Event
// records one change waiting to be synced: the share, the path inside it and
// a status number. Both are plain copyable values that own their strings;
// nothing in them validates. Thread-safety: none, like any value type.
#ifndef S2S_SYNC_OBJ_SHARE_H_
#define S2S_SYNC_OBJ_SHARE_H_

#include <stdint.h>

#include <string>

#include "S2S/export.h"

namespace S2S {

// Status of an event. The service gives the numbers their meaning; here
// they are only stored, copied and printed.
enum EVENT_STATUS : int32_t {};

class S2S_EXPORT Share {
 public:
  Share();

  unsigned long long GetID() const { return id_; }
  std::string GetName() const { return name_; }

  void SetID(unsigned long long id) { id_ = id; }
  void SetName(const std::string& name) { name_ = name; }

 private:
  unsigned long long id_;
  std::string name_;
};

class S2S_EXPORT Event {
 public:
  // Status 0, id 0, empty share name and empty path (not "/").
  Event();

  unsigned long long GetID() const { return id_; }
  std::string GetShareName() const { return share_name_; }
  std::string GetRelativePath() const { return relative_path_; }
  EVENT_STATUS GetStatus() const { return status_; }

  void SetID(unsigned long long id) { id_ = id; }
  void SetShareName(const std::string& name) { share_name_ = name; }
  // Stores `path` with a leading '/' added when it lacks one ("" becomes
  // "/"). Nothing else is normalised.
  void SetRelativePath(const std::string& path);
  void SetStatus(EVENT_STATUS status) { status_ = status; }

 private:
  EVENT_STATUS status_;
  unsigned long long id_;
  std::string share_name_;
  std::string relative_path_;
};

}  // namespace S2S

#endif  // S2S_SYNC_OBJ_SHARE_H_
