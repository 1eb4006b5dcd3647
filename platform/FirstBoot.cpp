#include "platform/FirstBoot.h"

#include <cerrno>
#include <optional>

#include "platform/DeviceRoot.h"
#include "platform/FileIO.h"
#include "platform/SafePath.h"

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
  const std::string path = firstBootMarkerPath();
  const size_t slash = path.rfind('/');
  UniqueFd run;
  int err = safeMakeDirectory(path.substr(0, slash), 0755, false, kAnyOwner, &run);
  if (!err) err = replaceFileAt(run.get(), path.substr(slash + 1), (*bootId + "\n").data(), bootId->size() + 1, 0400);
  if (err) errno = err;
  return err == 0;
}

}  // namespace platform
