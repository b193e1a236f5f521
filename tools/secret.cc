#include "secret.h"

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

extern char** environ;

namespace s2s_tools {

const char kPasswordEnv[] = "S2S_PASSWORD";

namespace {

const size_t kMaxPassword = 1024;

bool ReadFile(const std::string& path, std::string& password,
              std::string& error) {
  // O_NONBLOCK: opening a FIFO (or a device) must not wait for a writer;
  // anything but a regular file is refused below, before it is read.
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK);
  if (fd < 0) {
    error = "cannot open password file " + path + ": " + strerror(errno);
    return false;
  }
  struct stat st;
  if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
    close(fd);
    error = "password file " + path + " is not a regular file";
    return false;
  }
  if ((st.st_mode & 077) != 0 || st.st_uid != geteuid()) {
    close(fd);
    error = "password file " + path +
            " must be owned by this user and have mode 0600";
    return false;
  }
  char buf[kMaxPassword + 1];
  ssize_t n;
  do {
    n = read(fd, buf, sizeof buf);
  } while (n < 0 && errno == EINTR);
  close(fd);
  if (n < 0) {
    error = "cannot read password file " + path;
    return false;
  }
  std::string text(buf, static_cast<size_t>(n));
  text = text.substr(0, text.find_first_of("\r\n"));
  explicit_bzero(buf, sizeof buf);
  if (text.size() > kMaxPassword - 1) {
    error = "password in " + path + " is too long";
    return false;
  }
  password = text;
  return true;
}

// Overwrites the value of every kPasswordEnv entry where it lies. unsetenv
// only drops the pointer: the bytes of the block the program started with
// stay readable in /proc/PID/environ for the whole run.
void WipeFromEnvironment() {
  const size_t name_len = strlen(kPasswordEnv);
  for (char** e = environ; e != nullptr && *e != nullptr; ++e) {
    if (strncmp(*e, kPasswordEnv, name_len) == 0 && (*e)[name_len] == '=') {
      char* value = *e + name_len + 1;
      explicit_bzero(value, strlen(value));
    }
  }
  unsetenv(kPasswordEnv);
}

}  // namespace

bool ReadPassword(const std::string& path, std::string& password,
                  std::string& error) {
  std::string value;
  const char* env = getenv(kPasswordEnv);
  if (path.empty() && env != nullptr) value = env;
  WipeFromEnvironment();
  if (!path.empty() && !ReadFile(path, value, error)) return false;
  if (value.empty()) {
    error = path.empty() ? std::string(
                               "no password: give --password-file or "
                               "set ") +
                               kPasswordEnv
                         : "password file " + path + " holds no password";
    return false;
  }
  password = value;
  return true;
}

}  // namespace s2s_tools
