#include "platform/Identity.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <climits>
#include <cstring>
#include <mutex>
#include <shared_mutex>
#include <unordered_map>
#include <vector>

#include "base/PlistCodec.h"
#include "platform/DeviceRoot.h"
#include "platform/HostProfile.h"
#include "platform/FileIO.h"
#include "platform/Log.h"
#include "platform/SafePath.h"

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77  // Linux 6.5; older C library headers lack it
#endif

namespace platform {

namespace {

// ---- peer credentials ----

std::string executableOf(pid_t pid) {
  if (pid <= 0) return {};
  std::string link = "/proc/" + std::to_string(pid) + "/exe";
  char target[PATH_MAX];
  ssize_t length = readlink(link.c_str(), target, sizeof target);
  if (length <= 0 || static_cast<size_t>(length) >= sizeof target) return {};
  return std::string(target, static_cast<size_t>(length));
}

// A pidfd polls readable once its process has exited.
bool stillRunning(int pidfd) {
  pollfd watch{pidfd, POLLIN, 0};
  int ready;
  do {
    ready = poll(&watch, 1, 0);
  } while (ready < 0 && errno == EINTR);
  return ready == 0;
}

void notePidfdUnavailable() {
  static std::atomic<bool> logged{false};
  if (!logged.exchange(true))
    QRTLog(kLogError, "SO_PEERPIDFD unavailable; pid reuse cannot be excluded for peer processes");
}

// ---- the identity registry ----

// What tells a changed registry directory from the one last read.
struct DirectoryStamp {
  std::string path;
  bool present = false;
  dev_t device = 0;
  ino_t inode = 0;
  off_t size = 0;  // grows with the entries on most file systems
  timespec modified{};
  timespec changed{};

  bool operator==(const DirectoryStamp& o) const {
    return path == o.path && present == o.present && device == o.device && inode == o.inode && size == o.size &&
           modified.tv_sec == o.modified.tv_sec && modified.tv_nsec == o.modified.tv_nsec &&
           changed.tv_sec == o.changed.tv_sec && changed.tv_nsec == o.changed.tv_nsec;
  }
};

DirectoryStamp stampOf(const std::string& path) {
  DirectoryStamp stamp;
  stamp.path = path;
  struct stat st;
  if (safeStat(path, &st) != 0 || !S_ISDIR(st.st_mode)) return stamp;
  stamp.present = true;
  stamp.device = st.st_dev;
  stamp.inode = st.st_ino;
  stamp.size = st.st_size;
  stamp.modified = st.st_mtim;
  stamp.changed = st.st_ctim;
  return stamp;
}

using IdentityMap = std::unordered_map<std::string, std::shared_ptr<const CodeIdentity>>;

struct Registry {
  std::shared_mutex mutex;
  bool loaded = false;
  DirectoryStamp stamp;
  IdentityMap byExecutable;
};

Registry& registry() {
  static Registry* instance = new Registry;  // request threads may outlive static destruction
  return *instance;
}

std::vector<std::string> registryFileNames(int dirfd) {
  std::vector<std::string> names;
  auto batch = std::make_unique<DirectoryBatch>();
  for (ssize_t n; (n = readDirectoryBatch(dirfd, batch.get())) > 0;) {
    forEachEntry(*batch, static_cast<size_t>(n), [&](uint64_t, unsigned char, const char* entry) {
      std::string_view name = entry ? entry : "";
      if (name.size() > 6 && name.front() != '.' && name.ends_with(".plist")) names.emplace_back(name);
    });
  }
  std::sort(names.begin(), names.end());
  return names;
}

// Adds one file's entry; a later file replaces an earlier one's whole entry.
void addRegistryFile(int dirfd, const std::string& directory, const std::string& name, IdentityMap& identities) {
  const std::string path = directory + "/" + name;
  std::string bytes;
  if (int err = readFileAt(dirfd, name.c_str(), &bytes, 16u << 20)) {
    QRTLog(kLogError, "Cannot read identity file %s: %s", path.c_str(), strerror(err));
    return;
  }
  std::string error;
  std::optional<plist::Value> value = plist::parse(bytes.data(), bytes.size(), &error);
  const plist::Dictionary* entry = value ? value->dictionaryIf() : nullptr;
  const plist::Value* executable = entry ? plist::find(*entry, "Executable") : nullptr;
  if (!executable || !executable->stringIf()) {
    QRTLog(kLogError, "Skipping identity file %s: %s", path.c_str(),
           !value ? error.c_str() : !entry ? "not a dictionary" : "no Executable string");
    return;
  }
  auto identity = std::make_shared<CodeIdentity>();
  if (const plist::Value* signing = plist::find(*entry, "SigningIdentifier"); signing && signing->stringIf())
    identity->signingIdentifier = signing->string();
  if (const plist::Value* entitlements = plist::find(*entry, "Entitlements"); entitlements && entitlements->dictionaryIf())
    identity->entitlements = entitlements->dictionary();
  identities[executable->string()] = std::move(identity);
}

IdentityMap loadRegistry(const std::string& directory) {
  IdentityMap identities;
  UniqueFd fd;
  if (safeOpen(directory, O_RDONLY | O_DIRECTORY, &fd) != 0) return identities;
  for (const std::string& name : registryFileNames(fd.get())) addRegistryFile(fd.get(), directory, name, identities);
  return identities;
}

std::shared_ptr<const CodeIdentity> noIdentity() {
  static const auto* none = new std::shared_ptr<const CodeIdentity>(std::make_shared<CodeIdentity>());
  return *none;
}

std::shared_ptr<const CodeIdentity> lookUp(const IdentityMap& identities, const std::string& executablePath) {
  auto found = identities.find(executablePath);
  return found == identities.end() ? noIdentity() : found->second;
}

}  // namespace

std::optional<PeerCredentials> peerCredentials(int socketFd) {
  ucred credentials{};
  socklen_t length = sizeof credentials;
  if (getsockopt(socketFd, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0 || length != sizeof credentials)
    return std::nullopt;
  PeerCredentials peer;
  peer.pid = credentials.pid;
  peer.uid = protocolUserId(credentials.uid);
  peer.gid = credentials.gid;

  int pidfd = -1;
  length = sizeof pidfd;
  if (getsockopt(socketFd, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &length) != 0) {
    if (errno == ENOPROTOOPT) {
      notePidfdUnavailable();
      peer.executable = executableOf(peer.pid);
    }
    return peer;  // otherwise the peer is gone: nothing about it can be trusted
  }
  peer.executable = executableOf(peer.pid);
  peer.verified = stillRunning(pidfd);
  if (!peer.verified) peer.executable.clear();
  close(pidfd);
  return peer;
}

std::shared_ptr<const CodeIdentity> identityForExecutable(const std::string& executablePath) {
  if (executablePath.empty()) return noIdentity();
  Registry& reg = registry();
  DirectoryStamp now = stampOf(hostPath("/etc/quarterd/identities"));
  {
    std::shared_lock lock(reg.mutex);
    if (reg.loaded && reg.stamp == now) return lookUp(reg.byExecutable, executablePath);
  }
  std::unique_lock lock(reg.mutex);
  if (!reg.loaded || !(reg.stamp == now)) {
    // The stamp was taken before reading, so a change made meanwhile shows
    // up as a new stamp on the next call.
    reg.byExecutable = now.present ? loadRegistry(now.path) : IdentityMap{};
    reg.stamp = std::move(now);
    reg.loaded = true;
  }
  return lookUp(reg.byExecutable, executablePath);
}

}  // namespace platform
