// One daemon per device root: an exclusive lock on a file held for the life
// of the process.
#pragma once

#include <string>

namespace platform {

// Takes an exclusive lock on path (created 0600, never through a symbolic
// link) for the life of the process. The descriptor, or -1 with errno set
// (EWOULDBLOCK: another process holds it).
int acquireInstanceLock(const std::string& path);

}  // namespace platform
