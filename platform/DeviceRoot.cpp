#include "platform/DeviceRoot.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>

#include "platform/FileIO.h"
#include "platform/HostProfile.h"
#include "platform/SafePath.h"

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
  resetDeviceRootDescriptor();
}

const std::string& deviceRoot() { return rootStorage(); }

std::string hostPath(std::string_view devicePath) {
  if (std::optional<std::string> placed = hostProfilePath(devicePath)) return *placed;
  return rootedPath(devicePath);
}

std::string rootedPath(std::string_view devicePath) {
  const std::string& root = deviceRoot();
  if (root == "/") return std::string(devicePath);
  std::string path = root;
  if (devicePath.empty() || devicePath.front() != '/') path += '/';
  path += devicePath;
  return path;
}

std::optional<std::string> readHostFile(const std::string& path, size_t limit) {
  std::string content;
  int err = safeReadFile(path, &content, limit);
  if (err == EXDEV && !path.empty() && path.front() == '/') {
    // A system file outside the device root (the kernel's boot id under a
    // test root): nothing a user of the device can plant.
    UniqueFd fd(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY));
    struct stat st;
    if (!fd.valid() || fstat(fd.get(), &st) != 0)
      err = errno;
    else
      err = S_ISREG(st.st_mode) ? readAll(fd.get(), &content, limit) : S_ISDIR(st.st_mode) ? EISDIR : EINVAL;
  }
  if (err != 0) {
    errno = err;
    return std::nullopt;
  }
  return content;
}

}  // namespace platform
