#include "service/task_store.h"

#include <dirent.h>
#include <errno.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>

#include "S2S/logger.h"
#include "service/record.h"

namespace s2s_service {

namespace {

const char kSuffix[] = ".task";

bool LoadOne(const std::string& path, const std::string& file, StoredTask& task,
             std::string& error) {
  std::string text;
  S2S::PObject map;
  if (!ReadWholeFile(path, text, error)) return false;
  if (!DecodeRecord(text, map, error)) return false;
  if (!map["id"].isInteger()) {
    error = "no task id";
    return false;
  }
  if (!ApplyTaskMap(map, task, error) || !CheckTask(task, error)) return false;
  if (file != std::to_string(task.task.GetID()) + kSuffix) {
    error = "the file name does not match the task id " +
            std::to_string(task.task.GetID());
    return false;
  }
  return true;
}

}  // namespace

std::string TaskStore::PathOf(unsigned long long id) const {
  return dir_ + "/" + std::to_string(id) + kSuffix;
}

bool TaskStore::Load(std::map<unsigned long long, StoredTask>& tasks,
                     std::vector<std::string>& errors) const {
  tasks.clear();
  DIR* d = opendir(dir_.c_str());
  if (d == nullptr) {
    if (errno == ENOENT) return true;
    errors.push_back(dir_ + ": " + strerror(errno));
    S2S::Logger::LogMsg(S2S::Logger::Error, "[ERROR] task store %s: %s\n",
                        dir_.c_str(), strerror(errno));
    return false;
  }
  std::vector<std::string> files;
  while (dirent* e = readdir(d)) {
    std::string name = e->d_name;
    if (name.size() > sizeof kSuffix - 1 &&
        name.compare(name.size() - (sizeof kSuffix - 1), std::string::npos,
                     kSuffix) == 0) {
      files.push_back(name);
    }
  }
  closedir(d);
  std::sort(files.begin(), files.end());
  for (const std::string& file : files) {
    StoredTask task;
    std::string error;
    if (!LoadOne(dir_ + "/" + file, file, task, error)) {
      errors.push_back(file + ": " + error);
      S2S::Logger::LogMsg(S2S::Logger::Error,
                          "[ERROR] task file %s/%s refused: %s\n", dir_.c_str(),
                          file.c_str(), error.c_str());
      continue;
    }
    tasks[task.task.GetID()] = task;
  }
  return true;
}

bool TaskStore::Save(const StoredTask& task, std::string& error) const {
  return WriteFileAtomic(PathOf(task.task.GetID()),
                         EncodeRecord(TaskToMap(task, true)), 0600, error);
}

bool TaskStore::Remove(unsigned long long id, std::string& error) const {
  std::string path = PathOf(id);
  if (unlink(path.c_str()) != 0 && errno != ENOENT) {
    error = "cannot remove " + path + ": " + strerror(errno);
    return false;
  }
  return true;
}

}  // namespace s2s_service
