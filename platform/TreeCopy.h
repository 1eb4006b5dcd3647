// Recursive copy: data, owner, mode, times and every extended attribute, links
// as links, never following one at either end; no device nodes and no
// set-id bits are made.
#pragma once

namespace platform {

// Copies the item sourceName in sourceParent to destinationName in
// destinationParent; an existing directory there is copied into, a link there
// refused (ELOOP), a copy into itself too (EINVAL). A durable copy flushes
// every file and directory it made. Returns 0 or the errno that stopped it.
int copyTree(int sourceParent, const char* sourceName, int destinationParent, const char* destinationName,
             bool durable = false);

}  // namespace platform
