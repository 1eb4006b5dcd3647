// Who is calling: the peer's credentials from the socket, and its signing
// identifier and entitlements from the identity registry (R/etc/quarterd/identities).
#pragma once

#include <sys/types.h>

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
};

// SO_PEERCRED, SO_PEERPIDFD (falls back to SO_PEERCRED alone on older
// kernels, logging that once) and /proc/PID/exe. Nothing when the credentials
// cannot be read.
std::optional<PeerCredentials> peerCredentials(int socketFd);

struct CodeIdentity {
  std::optional<std::string> signingIdentifier;
  std::optional<plist::Dictionary> entitlements;  // nothing: no entitlements at all
};

// The registry entry whose Executable equals the path (the file whose name
// sorts last wins); an empty identity when none does, never null. Entries are
// immutable and shared, so a request holds its caller's identity without a
// copy. The registry is re-read when its directory's modification time changes.
std::shared_ptr<const CodeIdentity> identityForExecutable(const std::string& executablePath);

}  // namespace platform
