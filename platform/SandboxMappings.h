// The sandbox's per-user container mappings: one symbolic link
// R/run/sandbox/mappings/UID/ITEMTYPE/IDENTIFIER per (user, item type,
// identifier), whose target is the container's host path.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace platform {

// Sets the mapping to path, replacing any earlier one atomically, or removes
// it when path is null (already gone is success). Returns 0 or an errno
// value; an identifier that is empty, ".", ".." or holds '/' gives EINVAL.
int sandboxSetStateItem(uint32_t userId, uint64_t itemType, const std::string& identifier, const char* path);

// The path the mapping points to; nothing when there is none.
std::optional<std::string> sandboxStateItem(uint32_t userId, uint64_t itemType, const std::string& identifier);
// The identifiers that have a mapping of the user and item type.
std::vector<std::string> sandboxStateItems(uint32_t userId, uint64_t itemType);

}  // namespace platform
