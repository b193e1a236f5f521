#include "secret.h"

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

namespace s2s_tools {

const char kPasswordEnv[] = "S2S_PASSWORD";

namespace {

const size_t kMaxPassword = 1024;

bool ReadFile(const std::string& path, std::string& password,
              std::string& error) {
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
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

}  // namespace

bool ReadPassword(const std::string& path, std::string& password,
                  std::string& error) {
  std::string value;
  const char* env = getenv(kPasswordEnv);
  if (path.empty() && env != nullptr) value = env;
  unsetenv(kPasswordEnv);
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
