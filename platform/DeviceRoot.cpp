#include "platform/DeviceRoot.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

namespace platform {

namespace {

std::string& rootStorage() {
  static std::string root = "/";
  return root;
}

}  // namespace

void setDeviceRoot(const std::string& root) {
  std::string value = root;
  while (value.size() > 1 && value.back() == '/') value.pop_back();
  rootStorage() = value.empty() ? "/" : value;
}

const std::string& deviceRoot() { return rootStorage(); }

std::string hostPath(std::string_view devicePath) {
  const std::string& root = deviceRoot();
  if (root == "/") return std::string(devicePath);
  std::string path = root;
  if (devicePath.empty() || devicePath.front() != '/') path += '/';
  path += devicePath;
  return path;
}

std::optional<std::string> readHostFile(const std::string& path, size_t limit) {
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
  if (fd < 0) return std::nullopt;
  struct stat st;
  int failure = 0;
  if (fstat(fd, &st) != 0)
    failure = errno;
  else if (S_ISDIR(st.st_mode))
    failure = EISDIR;
  else if (!S_ISREG(st.st_mode))
    failure = EINVAL;
  else if (static_cast<uint64_t>(st.st_size) > limit)
    failure = EFBIG;
  if (failure != 0) {
    close(fd);
    errno = failure;
    return std::nullopt;
  }
  std::string content;
  char buffer[8192];
  for (;;) {
    ssize_t n = read(fd, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 || content.size() + static_cast<size_t>(n) > limit) {
      int saved = n < 0 ? errno : EFBIG;
      close(fd);
      errno = saved;
      return std::nullopt;
    }
    if (n == 0) break;
    content.append(buffer, static_cast<size_t>(n));
  }
  close(fd);
  return content;
}

}  // namespace platform
