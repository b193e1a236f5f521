// The service's files: a PObject map as lines of text, written atomically.
//
// One line per leaf: a kind letter ('i' integer, 's' string), a space, the
// path of keys and array indices joined with '.', '=', and the value; in a
// string a backslash, a line break and a carriage return are escaped as
// "\\", "\n" and "\r". Arrays hold strings, integers or maps of leaves,
// which is all a task or a run needs. Keys never hold '.', '=' or spaces.
//
//   s name=nightly
//   s share_list.0=docs
//   i runs.0.shares.0.files=12
#ifndef S2S_SERVICE_RECORD_H_
#define S2S_SERVICE_RECORD_H_

#include <string>

#include "S2S/pobject.h"

namespace s2s_service {

// The text of `map`.
std::string EncodeRecord(const S2S::PObject& map);
// Rebuilds the map from `text` into `map` (cleared first). Returns true, or
// false with `error` naming the first bad line.
bool DecodeRecord(const std::string& text, S2S::PObject& map,
                  std::string& error);

// Writes `data` to `path` through a temporary file in the same directory,
// renamed over it, with mode `mode`; missing directories are made (0755).
// With `sync` the data reaches the disk before the rename. Returns true, or
// false with `error` saying what failed.
bool WriteFileAtomic(const std::string& path, const std::string& data,
                     unsigned int mode, std::string& error, bool sync = true);
// Reads the whole of `path` into `data`. True, or false with `error`.
bool ReadWholeFile(const std::string& path, std::string& data,
                   std::string& error);
// Makes `dir` and its missing parents (0755). True, or false with `error`.
bool MakeDirs(const std::string& dir, std::string& error);

}  // namespace s2s_service

#endif  // S2S_SERVICE_RECORD_H_
