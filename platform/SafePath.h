// The one way the daemon reaches a host path inside the device root. Users
// own directories in there and may swap components for links, rename them or
// hard-link files at any moment, so every path is resolved from the device
// root's directory descriptor with openat2 and never follows a link at any
// component; callers then act on the descriptors they got, never on the path
// again.
//
// Results are 0 or an errno value. Two of them mean "refused":
//   EXDEV  the path is not an absolute path below the device root, or has a
//          ".." component (nothing is resolved upwards),
//   ELOOP  a symbolic link sits at some component.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/FileIO.h"

namespace platform {

// The device root's directory, opened when setDeviceRoot is called (lazily
// for the default "/"); -1 with errno when it cannot be opened.
int deviceRootDescriptor();
// Reopens it; setDeviceRoot calls this.
void resetDeviceRootDescriptor();

// The path relative to the device root, lexically normalised ("//" and "."
// dropped); "." for the root itself.
int pathBelowDeviceRoot(std::string_view hostPath, std::string* relative);

// openat2 beneath dirfd with no link and no magic link followed; walk adds
// RESOLVE_NO_XDEV. O_NOFOLLOW and O_CLOEXEC are always added.
int openBeneath(int dirfd, const char* relative, int flags, UniqueFd* out, bool walk = false);
// The same from the device root for a host path.
int safeOpen(std::string_view hostPath, int flags, UniqueFd* out, bool walk = false);

// The directory that holds the item (open for reading, so that it can be
// listed and flushed) and the item's name in it. The root itself has no
// parent here (EINVAL).
struct SafeParent {
  UniqueFd fd;
  std::string name;
};
int safeOpenParent(std::string_view hostPath, SafeParent* out);

// The item itself, pinned and checked (see Item).
int safeOpenItem(std::string_view hostPath, Item* item);
// lstat through the safe resolution (the root itself included).
int safeStat(std::string_view hostPath, struct stat* st);

inline constexpr uid_t kAnyOwner = static_cast<uid_t>(-1);

// Creates the directory (and with withParents every missing level, one
// mkdirat and one O_NOFOLLOW open at a time) with mode, and hands it back
// open for reading. An existing item is accepted only when it is a real
// directory; when owner (a protocol user, HostProfile.h) is given it must
// also be owned by owner's host account or by root, and is then given to it
// (user and group). Otherwise: ELOOP for a link, ENOTDIR for a non-directory,
// EPERM for a directory of another user or an owner without a host account,
// each with a log line. Levels made on the way keep root as their owner,
// except an ordinary user's in the host profile.
int safeMakeDirectory(std::string_view hostPath, mode_t mode, bool withParents, uid_t owner, UniqueFd* out,
                      bool* created = nullptr);

// readFileAt and replaceFileAt (FileIO.h) for a host path.
int safeReadFile(std::string_view hostPath, std::string* out, size_t limit);
int safeReplaceFile(std::string_view hostPath, std::string_view content, mode_t mode);

// A listening Unix stream socket at a host path: bound under NAME.new (a
// stale one removed first), given its mode, listening, then renamed to NAME,
// so that a client never finds a socket that refuses it. Every step is made
// relative to the parent's descriptor.
int safeListenUnixSocket(std::string_view hostPath, mode_t mode, int socketFlags, UniqueFd* out);
// Removes a non-directory; a missing item is success.
int safeUnlink(std::string_view hostPath);

}  // namespace platform
