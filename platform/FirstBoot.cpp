#include "platform/FirstBoot.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <optional>

#include "platform/DeviceRoot.h"

namespace platform {

namespace {

std::string trimmed(const std::string& text) {
  const char* space = " \t\r\n";
  size_t first = text.find_first_not_of(space);
  if (first == std::string::npos) return {};
  return text.substr(first, text.find_last_not_of(space) - first + 1);
}

std::optional<std::string> currentBootId() {
  std::optional<std::string> id = readHostFile("/proc/sys/kernel/random/boot_id", 256);
  if (!id) return std::nullopt;
  std::string value = trimmed(*id);
  if (value.empty()) {
    errno = ENODATA;
    return std::nullopt;
  }
  return value;
}

bool writeAll(int fd, const std::string& text) {
  size_t done = 0;
  while (done < text.size()) {
    ssize_t n = write(fd, text.data() + done, text.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

}  // namespace

std::string firstBootMarkerPath() { return hostPath("/run/quarterd.fb_check"); }

bool firstBootMarkerExists() {
  std::optional<std::string> bootId = currentBootId();
  std::optional<std::string> marker = readHostFile(firstBootMarkerPath(), 256);
  return bootId && marker && trimmed(*marker) == *bootId;
}

bool createFirstBootMarker() {
  std::optional<std::string> bootId = currentBootId();
  if (!bootId) return false;
  std::string runDirectory = hostPath("/run");
  if (mkdir(runDirectory.c_str(), 0755) != 0 && errno != EEXIST) return false;
  std::string temporary = runDirectory + "/.quarterd.fb_check.XXXXXX";
  int fd = mkostemp(temporary.data(), O_CLOEXEC);
  if (fd < 0) return false;
  bool written = writeAll(fd, *bootId + "\n") && fchmod(fd, 0400) == 0;
  int error = errno;
  if (close(fd) != 0 && written) {
    written = false;
    error = errno;
  }
  if (written && rename(temporary.c_str(), firstBootMarkerPath().c_str()) == 0) return true;
  if (written) error = errno;
  unlink(temporary.c_str());
  errno = error;
  return false;
}

}  // namespace platform
