// Who is calling: the peer's credentials from the socket, and its signing
// identifier and entitlements from the identity registry (R/etc/quarterd/identities).
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <memory>
#include <optional>
#include <string>

#include "base/PlistValue.h"

namespace platform {

struct PeerCredentials {
  pid_t pid = 0;
  uid_t uid = 0;
  gid_t gid = 0;
  std::string executable;  // /proc/PID/exe, empty when unreadable
  bool verified = false;   // the pidfd showed the same process still alive
  // The file the process runs, whatever path its mount namespace shows;
  // zero when it could not be opened.
  dev_t executableDevice = 0;
  ino_t executableInode = 0;
};

// SO_PEERCRED, SO_PEERPIDFD (falls back to SO_PEERCRED alone on older
// kernels, logging that once) and /proc/PID/exe. Nothing when the credentials
// cannot be read.
std::optional<PeerCredentials> peerCredentials(int socketFd);

// The one entitlement whose effect stays inside the caller's own user's
// containers; every other one is system-level.
inline constexpr const char* kUserLevelEntitlement = "com.norvane.security.application-groups";

struct CodeIdentity {
  std::optional<std::string> signingIdentifier;
  std::optional<plist::Dictionary> entitlements;  // nothing: no entitlements at all
  // The entitlements include system-level ones (the peer's uid may hold them).
  bool systemLevel = false;
  // For a peer that holds only the user-level part: the program's whole
  // identity, which is what the code-signing database records.
  std::shared_ptr<const CodeIdentity> program;
};

// The registry entry whose Executable equals the path (the file whose name
// sorts last wins) with all its entitlements; an empty identity when none
// does, never null. Entries are immutable and shared, so a request holds its
// caller's identity without a copy. The registry is re-read when its
// directory's modification time changes.
std::shared_ptr<const CodeIdentity> identityForExecutable(const std::string& executablePath);

// A connected peer's identity: the entry whose Executable is the same file
// (device and inode) as the one the peer runs, with its system-level
// entitlements only when the peer's uid is in the entry's Users (root when
// there is none). Anyone may run any program, with a preloaded library or
// under a debugger, but no one can fake the uid the socket recorded.
std::shared_ptr<const CodeIdentity> identityForPeer(const PeerCredentials& peer);

// The registry's entries and the files it skipped (unreadable, not root's,
// refused) at its last read, brought up to date first.
struct IdentityRegistryStats {
  size_t entries = 0;
  size_t refusedFiles = 0;
};
IdentityRegistryStats identityRegistryStats();

}  // namespace platform
