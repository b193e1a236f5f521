// A command file as the server receives it: `key="value"` lines, the first
// two being "command" and "clientID". Parsing refuses anything else, so that
// nothing malformed reaches the registry; the id checks here are the ones
// every name from the network passes before it touches a path or a section.
#ifndef S2S_SERVER_COMMAND_FILE_H_
#define S2S_SERVER_COMMAND_FILE_H_

#include <string>
#include <utility>
#include <vector>

namespace S2S {
namespace server {

struct CommandFile {
  std::string command;
  std::string client_id;
  // The remaining lines in order.
  std::vector<std::pair<std::string, std::string>> params;

  // The value of `key`, or nullptr when the file has no such line.
  const std::string* Get(const std::string& key) const;
};

// Parses `text`. Returns kOk, or kMalformed with `why` set: too large, a
// line that is not key="value", a repeated key, or missing first lines.
int ParseCommandFile(const std::string& text, CommandFile* out,
                     std::string* why);

// 1-64 of [A-Za-z0-9._-], not beginning with '.'.
bool IsValidClientId(const std::string& id);
// 1-64 of [A-Za-z0-9_-]: names a file in the spool and reply directories.
bool IsValidRequestId(const std::string& id);
// A share name the platform accepts, without ':' (the list separator) and
// without a NUL, which would cut the name short at the platform's C calls.
bool IsValidShareName(const std::string& name);
// A task name: 1-128 printable bytes without '/', '\\', '[', ']' or '"',
// no blank at either end (the registry's section names are trimmed).
bool IsValidTaskName(const std::string& name);
// The two rules above in words, for messages to people. The client applies
// the same functions before it sends anything.
extern const char kShareNameRule[];
extern const char kTaskNameRule[];
// A free-text value the registry can hold: 1-255 printable bytes, no '"'.
bool IsValidText(const std::string& text);

}  // namespace server
}  // namespace S2S

#endif  // S2S_SERVER_COMMAND_FILE_H_
