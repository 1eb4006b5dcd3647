#include "platform/SandboxMappings.h"

#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <string_view>
#include <vector>

#include "platform/DeviceRoot.h"

namespace platform {

namespace {

constexpr size_t kMaxLinkLength = 1u << 16;

bool validIdentifier(const std::string& identifier) {
  return !identifier.empty() && identifier != "." && identifier != ".." &&
         identifier.find_first_of(std::string_view("/\0", 2)) == std::string::npos;
}

std::string itemDirectory(uint32_t userId, uint64_t itemType) {
  return hostPath("/run/sandbox/mappings/" + std::to_string(userId) + "/" + std::to_string(itemType));
}

// Creates each missing level from R/run down to the item type's directory.
int ensureItemDirectory(uint32_t userId, uint64_t itemType) {
  std::string path = deviceRoot() == "/" ? std::string() : deviceRoot();
  for (std::string level : {std::string("run"), std::string("sandbox"), std::string("mappings"),
                            std::to_string(userId), std::to_string(itemType)}) {
    path += "/" + level;
    if (mkdir(path.c_str(), 0755) != 0 && errno != EEXIST) return errno;
  }
  return 0;
}

// A fresh hidden name in the link's directory; pid and counter keep
// concurrent writers, in this process or another, apart.
std::string temporaryName(const std::string& directory) {
  static std::atomic<uint64_t> counter{0};
  return directory + "/.mapping-" + std::to_string(getpid()) + "-" + std::to_string(counter.fetch_add(1));
}

int setLink(const std::string& directory, const std::string& link, const char* target) {
  const std::string temporary = temporaryName(directory);
  if (symlink(target, temporary.c_str()) != 0) {
    // A name left behind by a crashed writer with the same pid.
    if (errno != EEXIST || unlink(temporary.c_str()) != 0 || symlink(target, temporary.c_str()) != 0) return errno;
  }
  if (rename(temporary.c_str(), link.c_str()) != 0) {
    int err = errno;
    unlink(temporary.c_str());
    return err;
  }
  return 0;
}

}  // namespace

int sandboxSetStateItem(uint32_t userId, uint64_t itemType, const std::string& identifier, const char* path) {
  if (!validIdentifier(identifier)) return EINVAL;
  const std::string directory = itemDirectory(userId, itemType);
  const std::string link = directory + "/" + identifier;
  if (!path) return unlink(link.c_str()) == 0 || errno == ENOENT ? 0 : errno;
  if (int err = ensureItemDirectory(userId, itemType)) return err;
  return setLink(directory, link, path);
}

std::optional<std::string> sandboxStateItem(uint32_t userId, uint64_t itemType, const std::string& identifier) {
  if (!validIdentifier(identifier)) return std::nullopt;
  const std::string link = itemDirectory(userId, itemType) + "/" + identifier;
  std::vector<char> buffer(4096);
  for (;;) {
    ssize_t n = readlink(link.c_str(), buffer.data(), buffer.size());
    if (n < 0) return std::nullopt;
    if (static_cast<size_t>(n) < buffer.size()) return std::string(buffer.data(), static_cast<size_t>(n));
    if (buffer.size() >= kMaxLinkLength) return std::nullopt;
    buffer.resize(buffer.size() * 2);
  }
}

}  // namespace platform
