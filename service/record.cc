#include "service/record.h"

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <vector>

namespace s2s_service {

namespace {

using S2S::PObject;

void Escape(const std::string& in, std::string& out) {
  for (char c : in) {
    if (c == '\\') {
      out += "\\\\";
    } else if (c == '\n') {
      out += "\\n";
    } else if (c == '\r') {
      out += "\\r";
    } else {
      out += c;
    }
  }
}

bool Unescape(const std::string& in, std::string& out) {
  out.clear();
  for (size_t i = 0; i < in.size(); ++i) {
    if (in[i] != '\\') {
      out += in[i];
      continue;
    }
    if (++i == in.size()) return false;
    char c = in[i];
    if (c == '\\') {
      out += '\\';
    } else if (c == 'n') {
      out += '\n';
    } else if (c == 'r') {
      out += '\r';
    } else {
      return false;
    }
  }
  return true;
}

void EncodeLeaf(const std::string& path, const PObject& value,
                std::string& out) {
  if (value.isMap()) {
    for (const auto& m : value.asMap()) {
      EncodeLeaf(path.empty() ? m.first : path + "." + m.first, m.second, out);
    }
  } else if (value.isArray()) {
    const PObject::Array& a = value.asArray();
    // An empty array still names its key, so that it reads back as one.
    if (a.empty()) out += "a " + path + "=\n";
    for (size_t i = 0; i < a.size(); ++i) {
      EncodeLeaf(path + "." + std::to_string(i), a[i], out);
    }
  } else if (value.isInteger()) {
    out += "i " + path + "=" + std::to_string(value.asUInt64()) + "\n";
  } else if (value.isString()) {
    out += "s " + path + "=";
    Escape(value.asStringRef(), out);
    out += "\n";
  }
}

bool IsIndex(const std::string& part) {
  if (part.empty() || part.size() > 6) return false;
  for (char c : part) {
    if (c < '0' || c > '9') return false;
  }
  return true;
}

// The element at `path` under `root`, made on the way: a numeric part
// indexes an array (the next index or an existing one), any other a map.
PObject* Walk(PObject& root, const std::string& path) {
  PObject* at = &root;
  size_t pos = 0;
  while (pos <= path.size()) {
    size_t dot = path.find('.', pos);
    std::string part = path.substr(
        pos, dot == std::string::npos ? std::string::npos : dot - pos);
    if (part.empty()) return nullptr;
    if (IsIndex(part)) {
      if (at->isNull()) *at = PObject::Array();
      if (!at->isArray()) return nullptr;
      size_t index = strtoul(part.c_str(), nullptr, 10);
      PObject::Array& a = at->asArray();
      if (index > a.size()) return nullptr;
      if (index == a.size()) a.emplace_back();
      at = &a[index];
    } else {
      if (at->isNull()) *at = PObject::Map();
      if (!at->isMap()) return nullptr;
      at = &at->asMap()[part];
    }
    if (dot == std::string::npos) break;
    pos = dot + 1;
  }
  return at;
}

}  // namespace

std::string EncodeRecord(const PObject& map) {
  std::string out;
  EncodeLeaf("", map, out);
  return out;
}

bool DecodeRecord(const std::string& text, PObject& map, std::string& error) {
  map = PObject::Map();
  size_t line_no = 0;
  for (size_t pos = 0; pos < text.size();) {
    size_t end = text.find('\n', pos);
    if (end == std::string::npos) end = text.size();
    std::string line = text.substr(pos, end - pos);
    pos = end + 1;
    ++line_no;
    size_t eq = line.find('=');
    PObject* at = nullptr;
    if (line.size() >= 3 && line[1] == ' ' && eq != std::string::npos) {
      at = Walk(map, line.substr(2, eq - 2));
    }
    std::string value = line.substr(eq == std::string::npos ? 0 : eq + 1);
    std::string text_value;
    bool ok = at != nullptr && at->isNull();
    if (ok && line[0] == 'i') {
      char* stop = nullptr;
      errno = 0;
      unsigned long long v = strtoull(value.c_str(), &stop, 10);
      ok = !value.empty() && *stop == '\0' && errno == 0;
      if (ok) *at = v;
    } else if (ok && line[0] == 's') {
      ok = Unescape(value, text_value);
      if (ok) *at = text_value;
    } else if (ok && line[0] == 'a') {
      ok = value.empty();
      if (ok) *at = PObject::Array();
    } else {
      ok = false;
    }
    if (!ok) {
      error = "line " + std::to_string(line_no) + " is malformed";
      return false;
    }
  }
  return true;
}

bool MakeDirs(const std::string& dir, std::string& error) {
  for (size_t pos = 1; pos <= dir.size(); ++pos) {
    if (pos < dir.size() && dir[pos] != '/') continue;
    std::string part = dir.substr(0, pos);
    if (mkdir(part.c_str(), 0755) != 0 && errno != EEXIST) {
      error = "cannot create " + part + ": " + strerror(errno);
      return false;
    }
  }
  return true;
}

bool WriteFileAtomic(const std::string& path, const std::string& data,
                     unsigned int mode, std::string& error, bool sync) {
  size_t slash = path.rfind('/');
  if (slash != std::string::npos && slash > 0 &&
      !MakeDirs(path.substr(0, slash), error)) {
    return false;
  }
  std::string tmp = path + ".new";
  int fd = open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
  if (fd < 0) {
    error = "cannot write " + tmp + ": " + strerror(errno);
    return false;
  }
  bool ok = fchmod(fd, mode) == 0;
  for (size_t done = 0; ok && done < data.size();) {
    ssize_t n = write(fd, data.data() + done, data.size() - done);
    if (n < 0 && errno == EINTR) continue;
    ok = n > 0;
    if (ok) done += static_cast<size_t>(n);
  }
  ok = ok && (!sync || fsync(fd) == 0);
  int saved = errno;
  ok = close(fd) == 0 && ok;
  if (ok && rename(tmp.c_str(), path.c_str()) != 0) {
    saved = errno;
    ok = false;
  }
  if (!ok) {
    error = "cannot write " + path + ": " + strerror(saved);
    unlink(tmp.c_str());
  }
  return ok;
}

bool ReadWholeFile(const std::string& path, std::string& data,
                   std::string& error) {
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    error = "cannot read " + path + ": " + strerror(errno);
    return false;
  }
  data.clear();
  char buf[65536];
  ssize_t n;
  while ((n = read(fd, buf, sizeof buf)) != 0) {
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      error = "cannot read " + path + ": " + strerror(errno);
      close(fd);
      return false;
    }
    data.append(buf, static_cast<size_t>(n));
  }
  close(fd);
  return true;
}

}  // namespace s2s_service
