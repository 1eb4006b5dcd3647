// The device root: every fixed device path of the daemon lives under it.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

namespace platform {

// Set once at start from --root (already resolved with realpath). "/" by default.
void setDeviceRoot(const std::string& root);
const std::string& deviceRoot();
// Host path of a fixed device path: the root prefixed ("/" leaves it as is),
// or where the host profile places it (HostProfile.h).
std::string hostPath(std::string_view devicePath);
// The root prefixed and nothing else: for paths that are already the host's
// once the root is taken away (a client's path below the root).
std::string rootedPath(std::string_view devicePath);

// The whole content of a small file at a host path; nothing when it is
// missing, unreadable or longer than limit (errno tells which). Inside the
// device root it is resolved safely (SafePath.h): a link on the way is ELOOP.
std::optional<std::string> readHostFile(const std::string& path, size_t limit = 16u << 20);

}  // namespace platform
