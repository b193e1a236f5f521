#include "command_file.h"

#include "karo_share.h"
#include "protocol.h"

namespace S2S {
namespace server {

namespace {

bool AllOf(const std::string& s, const char* extra) {
  for (unsigned char c : s) {
    if (isalnum(c)) continue;
    bool ok = false;
    for (const char* e = extra; *e != '\0'; ++e) ok = ok || c == *e;
    if (!ok) return false;
  }
  return true;
}

bool Printable(const std::string& s, const char* forbidden) {
  for (unsigned char c : s) {
    if (c < 0x20 || c == 0x7f) return false;
    for (const char* f = forbidden; *f != '\0'; ++f) {
      if (c == static_cast<unsigned char>(*f)) return false;
    }
  }
  return true;
}

bool IsKey(const std::string& key) {
  return !key.empty() && key.size() <= 64 && AllOf(key, "_");
}

}  // namespace

const std::string* CommandFile::Get(const std::string& key) const {
  for (const auto& p : params) {
    if (p.first == key) return &p.second;
  }
  return nullptr;
}

int ParseCommandFile(const std::string& text, CommandFile* out,
                     std::string* why) {
  *out = CommandFile();
  if (text.size() > kMaxCommandFile) {
    *why = "command file larger than " + std::to_string(kMaxCommandFile);
    return kMalformed;
  }
  std::vector<std::pair<std::string, std::string>> lines;
  size_t start = 0;
  while (start < text.size()) {
    size_t end = text.find('\n', start);
    if (end == std::string::npos) end = text.size();
    std::string line = text.substr(start, end - start);
    start = end + 1;
    size_t eq = line.find("=\"");
    if (eq == std::string::npos || line.size() < eq + 3 || line.back() != '"') {
      *why =
          "line " + std::to_string(lines.size() + 1) + " is not key=\"value\"";
      return kMalformed;
    }
    std::string key = line.substr(0, eq);
    std::string value = line.substr(eq + 2, line.size() - eq - 3);
    if (!IsKey(key)) {
      *why = "bad key on line " + std::to_string(lines.size() + 1);
      return kMalformed;
    }
    for (const auto& l : lines) {
      if (l.first == key) {
        *why = "repeated key " + key;
        return kMalformed;
      }
    }
    lines.emplace_back(key, value);
  }
  if (lines.size() < 2 || lines[0].first != "command" ||
      lines[1].first != "clientID") {
    *why = "command file does not begin with command and clientID";
    return kMalformed;
  }
  out->command = lines[0].second;
  out->client_id = lines[1].second;
  out->params.assign(lines.begin() + 2, lines.end());
  return kOk;
}

bool IsValidClientId(const std::string& id) {
  return !id.empty() && id.size() <= 64 && id[0] != '.' && AllOf(id, "._-");
}

bool IsValidRequestId(const std::string& id) {
  return !id.empty() && id.size() <= 64 && AllOf(id, "_-");
}

const char kShareNameRule[] =
    "1-255 printable characters, none of / \\ [ ] \" = @ :, no blank at "
    "either end, not . or ..";
const char kTaskNameRule[] =
    "1-128 printable characters, none of / \\ [ ] \", no blank at either "
    "end, not . or ..";

bool IsValidShareName(const std::string& name) {
  return name.find_first_of(std::string(":\0", 2)) == std::string::npos &&
         KaroShareNameValid(name.c_str()) == 1;
}

bool IsValidTaskName(const std::string& name) {
  // The registry's section names lose outer blanks: refused, not trimmed.
  return !name.empty() && name.size() <= 128 && name != "." && name != ".." &&
         name.front() != ' ' && name.back() != ' ' &&
         Printable(name, "/\\[]\"");
}

bool IsValidText(const std::string& text) {
  return !text.empty() && text.size() <= 255 && Printable(text, "\"");
}

}  // namespace server
}  // namespace S2S
