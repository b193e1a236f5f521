#include "S2S/sync_obj_share.h"

namespace S2S {

Share::Share() : id_(0) {}

Event::Event() : status_(EVENT_STATUS(0)), id_(0) {}

void Event::SetRelativePath(const std::string& path) {
  if (!path.empty() && path[0] == '/') {
    relative_path_ = path;
  } else {
    relative_path_ = "/" + path;
  }
}

}  // namespace S2S
