#include "platform/SandboxMappings.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <string_view>
#include <vector>

#include "platform/DeviceRoot.h"
#include "platform/Dir.h"
#include "platform/FileIO.h"
#include "platform/Random.h"
#include "platform/SafePath.h"

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

// The link is made and renamed relative to its directory's descriptor.
int setLink(int dirfd, const std::string& identifier, const char* target) {
  const std::string temporary = temporaryName("mapping");
  if (symlinkat(target, dirfd, temporary.c_str()) != 0) {
    // A name left behind by a crashed writer with the same pid.
    if (errno != EEXIST || unlinkat(dirfd, temporary.c_str(), 0) != 0 ||
        symlinkat(target, dirfd, temporary.c_str()) != 0)
      return errno;
  }
  if (renameat(dirfd, temporary.c_str(), dirfd, identifier.c_str()) != 0) {
    int err = errno;
    unlinkat(dirfd, temporary.c_str(), 0);
    return err;
  }
  return 0;
}

}  // namespace

int sandboxSetStateItem(uint32_t userId, uint64_t itemType, const std::string& identifier, const char* path) {
  if (!validIdentifier(identifier)) return EINVAL;
  UniqueFd directory;
  if (!path) {
    int err = safeOpen(itemDirectory(userId, itemType), O_RDONLY | O_DIRECTORY, &directory);
    if (err) return err == ENOENT ? 0 : err;
    return unlinkat(directory.get(), identifier.c_str(), 0) == 0 || errno == ENOENT ? 0 : errno;
  }
  if (int err = safeMakeDirectory(itemDirectory(userId, itemType), 0755, true, kAnyOwner, &directory)) return err;
  return setLink(directory.get(), identifier, path);
}

std::optional<std::string> sandboxStateItem(uint32_t userId, uint64_t itemType, const std::string& identifier) {
  if (!validIdentifier(identifier)) return std::nullopt;
  UniqueFd directory;
  if (safeOpen(itemDirectory(userId, itemType), O_RDONLY | O_DIRECTORY, &directory) != 0) return std::nullopt;
  std::vector<char> buffer(4096);
  for (;;) {
    ssize_t n = readlinkat(directory.get(), identifier.c_str(), buffer.data(), buffer.size());
    if (n < 0) return std::nullopt;
    if (static_cast<size_t>(n) < buffer.size()) return std::string(buffer.data(), static_cast<size_t>(n));
    if (buffer.size() >= kMaxLinkLength) return std::nullopt;
    buffer.resize(buffer.size() * 2);
  }
}

std::vector<std::string> sandboxStateItems(uint32_t userId, uint64_t itemType) {
  std::vector<std::string> names;
  Dir directory;
  if (Dir::open(itemDirectory(userId, itemType), &directory) != 0) return names;
  directory.list(&names);
  return names;
}

}  // namespace platform
