// Recursive removal: depth first, without following a link or leaving the
// root's file system, the files of a large directory unlinked by a few threads
// at once, and an entry held only by its immutable flag freed of it.
#pragma once

#include <string>

namespace platform {

// Removes the item name in the directory parentFd, a file, a link or a whole
// tree; path names it in log lines. Entries that cannot be removed are logged
// and passed over. Returns 0, or the errno that stopped the walk, or else the
// first errno an entry gave; ENOENT means the item was gone already.
int removeTree(int parentFd, const std::string& name, const std::string& path);

}  // namespace platform
