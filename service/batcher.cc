#include "service/batcher.h"

#include <algorithm>

namespace s2s_service {

namespace {

bool Inside(const std::string& path, const std::string& dir) {
  return path.size() > dir.size() && path[dir.size()] == '/' &&
         path.compare(0, dir.size(), dir) == 0;
}

size_t Depth(const std::string& path) {
  return static_cast<size_t>(std::count(path.begin(), path.end(), '/'));
}

}  // namespace

std::string ParentOf(const std::string& path) {
  size_t slash = path.rfind('/');
  if (slash == std::string::npos || slash == 0) return "/";
  return path.substr(0, slash);
}

S2S::Event MakeEvent(const std::string& share, const std::string& path,
                     EventKind kind) {
  S2S::Event e;
  e.SetShareName(share);
  e.SetRelativePath(path);
  e.SetStatus(static_cast<S2S::EVENT_STATUS>(kind));
  return e;
}

void Batcher::Insert(Share& share, const std::string& path) {
  if (share.whole) return;
  if (path == "/" || share.paths.size() >= settings_.pending_limit) {
    share.whole = true;
    share.paths.clear();
    share.per_dir.clear();
    return;
  }
  // Covered by itself or by a queued ancestor.
  for (size_t slash = path.find('/', 1);; slash = path.find('/', slash + 1)) {
    if (share.paths.count(path.substr(0, slash)) != 0) return;
    if (slash == std::string::npos) break;
  }
  // What it holds goes: in sorted order that is one run after "path/".
  auto it = share.paths.lower_bound(path + "/");
  while (it != share.paths.end() && Inside(*it, path)) {
    auto dir = share.per_dir.find(ParentOf(*it));
    if (dir != share.per_dir.end() && --dir->second == 0) {
      share.per_dir.erase(dir);
    }
    it = share.paths.erase(it);
  }
  share.paths.insert(path);
  std::string parent = ParentOf(path);
  if (++share.per_dir[parent] > settings_.crowd) Insert(share, parent);
}

void Batcher::Add(const S2S::Event& change, double now) {
  if (shares_.empty()) first_ = now;
  Share& share = shares_[change.GetShareName()];
  std::string path = change.GetRelativePath();
  switch (KindOf(change)) {
    case kEventGone:
      path = ParentOf(path);
      break;
    case kEventWhole:
      path = "/";
      break;
    default:
      break;
  }
  Insert(share, path);
  last_ = now;
}

double Batcher::Due() const {
  if (shares_.empty()) return 0;
  return std::min(last_ + settings_.settle, first_ + settings_.max_delay);
}

size_t Batcher::Pending() const {
  size_t n = 0;
  for (const auto& it : shares_)
    n += it.second.whole ? 1 : it.second.paths.size();
  return n;
}

void Batcher::Fold(Share& share) {
  // Each pass lifts the deepest paths one level; at the top that is the
  // whole share.
  while (!share.whole && share.paths.size() > settings_.max_paths) {
    size_t deepest = 0;
    for (const std::string& p : share.paths)
      deepest = std::max(deepest, Depth(p));
    std::vector<std::string> lifted;
    for (const std::string& p : share.paths) {
      if (Depth(p) == deepest) lifted.push_back(ParentOf(p));
    }
    for (const std::string& p : lifted) Insert(share, p);
  }
}

std::vector<S2S::Event> Batcher::Take() {
  std::vector<S2S::Event> batch;
  for (auto& it : shares_) {
    Share& share = it.second;
    Fold(share);
    if (share.whole) {
      batch.push_back(MakeEvent(it.first, "/", kEventWhole));
      continue;
    }
    for (const std::string& p : share.paths)
      batch.push_back(MakeEvent(it.first, p));
  }
  shares_.clear();
  first_ = last_ = 0;
  return batch;
}

void Batcher::Restore(const std::vector<S2S::Event>& batch, double now) {
  for (const S2S::Event& e : batch) Add(e, now);
}

}  // namespace s2s_service
