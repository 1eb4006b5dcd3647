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
#include <optional>
#include <shared_mutex>
#include <unordered_map>
#include <vector>

#include "base/PlistCodec.h"
#include "platform/DeviceRoot.h"
#include "platform/Dir.h"
#include "platform/HostProfile.h"
#include "platform/FileIO.h"
#include "platform/Log.h"
#include "platform/SafePath.h"
#include "platform/UserDatabase.h"

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77  // Linux 6.5; older C library headers lack it
#endif

namespace platform {

namespace {

// ---- peer credentials ----

// The path is only the key that finds a registry entry; the file itself,
// reached through the magic link whatever the peer's mount namespace shows,
// is what must match it.
void readExecutable(PeerCredentials* peer) {
  if (peer->pid <= 0) return;
  std::string link = "/proc/" + std::to_string(peer->pid) + "/exe";
  char target[PATH_MAX];
  ssize_t length = readlink(link.c_str(), target, sizeof target);
  if (length <= 0 || static_cast<size_t>(length) >= sizeof target) return;
  UniqueFd file(open(link.c_str(), O_PATH | O_CLOEXEC));
  struct stat st;
  if (!file.valid() || fstat(file.get(), &st) != 0) return;
  peer->executable.assign(target, static_cast<size_t>(length));
  peer->executableDevice = st.st_dev;
  peer->executableInode = st.st_ino;
}

// A pidfd polls readable once its process has exited.
bool stillRunning(int pidfd) {
  pollfd watch{pidfd, POLLIN, 0};
  int ready;
  do { ready = poll(&watch, 1, 0); } while (ready < 0 && errno == EINTR);
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

DirectoryStamp stampFrom(const std::string& path, int err, const struct stat& st) {
  DirectoryStamp stamp;
  stamp.path = path;
  if (err != 0 || !S_ISDIR(st.st_mode)) return stamp;
  stamp.present = true;
  stamp.device = st.st_dev;
  stamp.inode = st.st_ino;
  stamp.size = st.st_size;
  stamp.modified = st.st_mtim;
  stamp.changed = st.st_ctim;
  return stamp;
}

// From the root, no link followed at any level.
DirectoryStamp stampOf(const std::string& path) {
  struct stat st;
  const int err = safeStat(path, &st);
  return stampFrom(path, err, st);
}

// The registry's parent directory, held so that every request looks at the
// registry beneath it (one component, not followed) rather than walking from
// the root. It is held while its own change time stays put: renaming or
// removing it changes that, and it is then opened afresh.
struct HeldParent {
  Dir directory;
  std::string leaf;
  timespec changed{};
};

std::optional<HeldParent> holdParent(const std::string& path) {
  HeldParent held;
  struct stat st;
  if (Dir::openParent(path, &held.directory, &held.leaf) != 0 || fstat(held.directory.fd(), &st) != 0)
    return std::nullopt;
  held.changed = st.st_ctim;
  return held;
}

// Nothing when the parent is no longer the one at its path.
std::optional<DirectoryStamp> stampBeneath(const HeldParent& held, const std::string& path) {
  struct stat st;
  if (fstat(held.directory.fd(), &st) != 0 || st.st_nlink == 0 || st.st_ctim.tv_sec != held.changed.tv_sec ||
      st.st_ctim.tv_nsec != held.changed.tv_nsec)
    return std::nullopt;
  const int err = held.directory.lstat(held.leaf, &st);
  if (err != 0 && err != ENOENT) return std::nullopt;
  return stampFrom(path, err, st);
}

// One registry file's entry: the whole identity, and the part that any
// peer running the program holds.
struct Entry {
  std::shared_ptr<const CodeIdentity> whole;
  std::shared_ptr<const CodeIdentity> userPart;
  std::vector<uid_t> users;  // who may hold the system-level entitlements
};

// The file an Executable path names, as the daemon sees it.
struct FileId {
  dev_t device = 0;
  ino_t inode = 0;
  bool operator==(const FileId&) const = default;
};

using IdentityMap = std::unordered_map<std::string, Entry>;

struct Registry {
  std::shared_mutex mutex;
  bool loaded = false;
  DirectoryStamp stamp;
  std::optional<HeldParent> parent;  // opened afresh whenever the stamp is read from the root
  IdentityMap byExecutable;
  size_t refusedFiles = 0;  // registry files skipped at the last read
  // Kept from the last look; looked at again on a mismatch.
  std::unordered_map<std::string, FileId> files;
};

Registry& registry() {
  static Registry* instance = new Registry;  // request threads may outlive static destruction
  return *instance;
}

// Root's, and writable by no one else: anyone who can write the registry
// can give themselves any entitlement.
bool ownedByRootOnly(const struct stat& st) { return st.st_uid == 0 && (st.st_mode & (S_IWGRP | S_IWOTH)) == 0; }

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

// The accounts of a Users value; nothing when it is not an array of names and ids.
std::optional<std::vector<uid_t>> usersOf(const plist::Value& value, const std::string& path) {
  const plist::Array* array = value.arrayIf();
  if (!array) return std::nullopt;
  std::vector<uid_t> users;
  for (const plist::Value& item : *array) {
    if (const plist::Integer* id = item.integerIf(); id && id->asUnsigned() < UINT32_MAX) {
      // Written as the host knows it; compared as peers are, in protocol ids.
      users.push_back(protocolUserId(static_cast<uid_t>(id->asUnsigned())));
    } else if (const std::string* name = item.stringIf()) {
      if (std::optional<UserAccount> account = userByName(*name))
        users.push_back(account->uid);
      else
        QRTLog(kLogError, "Identity file %s: no account named %s; left out of Users", path.c_str(), name->c_str());
    } else {
      return std::nullopt;
    }
  }
  return users;
}

// The entry of one parsed file, or nothing (with the reason) when it is refused.
std::optional<Entry> entryOf(const plist::Dictionary& file, const std::string& path, std::string* why) {
  auto whole = std::make_shared<CodeIdentity>();
  if (const plist::Value* signing = plist::find(file, "SigningIdentifier"); signing && signing->stringIf())
    whole->signingIdentifier = signing->string();
  plist::Dictionary userLevel;
  if (const plist::Value* entitlements = plist::find(file, "Entitlements");
      entitlements && entitlements->dictionaryIf()) {
    whole->entitlements = entitlements->dictionary();
    for (const auto& [name, value] : *whole->entitlements) {
      if (name == kUserLevelEntitlement)
        userLevel.emplace(name, value);
      else
        whole->systemLevel = true;
    }
  }
  Entry entry;
  entry.users = {0};
  if (const plist::Value* users = plist::find(file, "Users")) {
    std::optional<std::vector<uid_t>> listed = usersOf(*users, path);
    if (!listed) return *why = "Users is not an array of account names and ids", std::nullopt;
    entry.users = std::move(*listed);
  }
  const uint32_t ordinary = ordinaryUserMinimum();
  for (uid_t uid : entry.users) {
    if (whole->systemLevel && uid >= ordinary)
      return *why = "Users lists the ordinary user " + std::to_string(uid) + " next to system-level entitlements",
             std::nullopt;
  }
  entry.whole = whole;
  if (!whole->systemLevel) {
    entry.userPart = whole;
  } else {
    auto part = std::make_shared<CodeIdentity>();
    part->signingIdentifier = whole->signingIdentifier;
    part->entitlements = std::move(userLevel);
    part->program = whole;
    entry.userPart = std::move(part);
  }
  return entry;
}

// Adds one file's entry; a later file replaces an earlier one's whole entry.
// False when the file is skipped.
bool addRegistryFile(int dirfd, const std::string& directory, const std::string& name, IdentityMap& identities) {
  const std::string path = directory + "/" + name;
  std::string bytes;
  UniqueFd fd(openNoFollowAt(dirfd, name.c_str(), O_RDONLY));
  struct stat st;
  int err = !fd.valid() ? errno : fstat(fd.get(), &st) != 0 ? errno : 0;
  if (err == 0 && S_ISREG(st.st_mode) && !ownedByRootOnly(st)) {
    QRTLog(kLogError,
           "Skipping identity file %s: owned by %u with mode %o; it must be root's and writable by no one else",
           path.c_str(), static_cast<unsigned>(st.st_uid), static_cast<unsigned>(st.st_mode & 07777));
    return false;
  }
  if (err == 0) err = readOpened(fd.get(), &bytes, 16u << 20);
  if (err != 0) {
    QRTLog(kLogError, "Cannot read identity file %s: %s", path.c_str(), strerror(err));
    return false;
  }
  std::string error;
  std::optional<plist::Value> value = plist::parse(bytes.data(), bytes.size(), &error);
  const plist::Dictionary* file = value ? value->dictionaryIf() : nullptr;
  const plist::Value* executable = file ? plist::find(*file, "Executable") : nullptr;
  if (!executable || !executable->stringIf()) {
    QRTLog(kLogError, "Skipping identity file %s: %s", path.c_str(),
           !value  ? error.c_str()
           : !file ? "not a dictionary"
                   : "no Executable string");
    return false;
  }
  std::optional<Entry> entry = entryOf(*file, path, &error);
  if (!entry) {
    QRTLog(kLogError, "Refusing identity file %s: %s", path.c_str(), error.c_str());
    return false;
  }
  identities[executable->string()] = std::move(*entry);
  return true;
}

IdentityMap loadRegistry(const std::string& directory, size_t* refused) {
  IdentityMap identities;
  UniqueFd fd;
  struct stat st;
  if (safeOpen(directory, O_RDONLY | O_DIRECTORY, &fd) != 0 || fstat(fd.get(), &st) != 0) return identities;
  if (!ownedByRootOnly(st)) {
    QRTLog(kLogError,
           "Skipping the identity registry %s: owned by %u with mode %o; it must be root's and writable by no one else",
           directory.c_str(), static_cast<unsigned>(st.st_uid), static_cast<unsigned>(st.st_mode & 07777));
    return identities;
  }
  for (const std::string& name : registryFileNames(fd.get()))
    if (!addRegistryFile(fd.get(), directory, name, identities)) ++*refused;
  return identities;
}

// Resolved from "/" without following a link anywhere: the path is the one
// /proc/PID/exe shows, which has none.
std::optional<FileId> fileIdOf(const std::string& path) {
  if (path.empty() || path.front() != '/') return std::nullopt;
  UniqueFd top(open("/", O_PATH | O_DIRECTORY | O_CLOEXEC));
  UniqueFd fd;
  struct stat st;
  const char* relative = path.size() > 1 ? path.c_str() + 1 : ".";
  if (!top.valid() || openBeneath(top.get(), relative, O_PATH, &fd) != 0 || fstat(fd.get(), &st) != 0)
    return std::nullopt;
  return FileId{st.st_dev, st.st_ino};
}

std::shared_ptr<const CodeIdentity> noIdentity() {
  static const auto* none = new std::shared_ptr<const CodeIdentity>(std::make_shared<CodeIdentity>());
  return *none;
}

// The entry for a path and the file last seen there, read under the lock
// after bringing the registry up to date.
std::optional<std::pair<Entry, std::optional<FileId>>> currentEntry(const std::string& executablePath) {
  Registry& reg = registry();
  const std::string path = hostPath("/etc/quarterd/identities");
  auto find = [&]() -> std::optional<std::pair<Entry, std::optional<FileId>>> {
    auto found = reg.byExecutable.find(executablePath);
    if (found == reg.byExecutable.end()) return std::nullopt;
    auto file = reg.files.find(executablePath);
    return std::pair{found->second, file == reg.files.end() ? std::nullopt : std::optional<FileId>(file->second)};
  };
  {
    std::shared_lock lock(reg.mutex);
    if (reg.loaded) {
      std::optional<DirectoryStamp> now = reg.parent ? stampBeneath(*reg.parent, path) : stampOf(path);
      if (now && reg.stamp == *now) return find();
    }
  }
  std::unique_lock lock(reg.mutex);
  reg.parent = holdParent(path);
  DirectoryStamp now = stampOf(path);
  if (!reg.loaded || !(reg.stamp == now)) {
    // The stamp was taken before reading, so a change made meanwhile shows
    // up as a new stamp on the next call.
    reg.refusedFiles = 0;
    reg.byExecutable = now.present ? loadRegistry(now.path, &reg.refusedFiles) : IdentityMap{};
    reg.files.clear();
    reg.stamp = std::move(now);
    reg.loaded = true;
  }
  return find();
}

void rememberFile(const std::string& executablePath, const FileId& id) {
  Registry& reg = registry();
  std::unique_lock lock(reg.mutex);
  if (reg.byExecutable.count(executablePath)) reg.files[executablePath] = id;
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
      readExecutable(&peer);
    }
    return peer;  // otherwise the peer is gone: nothing about it can be trusted
  }
  readExecutable(&peer);
  peer.verified = stillRunning(pidfd);
  if (!peer.verified) {
    peer.executable.clear();
    peer.executableInode = 0;
  }
  close(pidfd);
  return peer;
}

std::shared_ptr<const CodeIdentity> identityForExecutable(const std::string& executablePath) {
  if (executablePath.empty()) return noIdentity();
  auto current = currentEntry(executablePath);
  return current ? current->first.whole : noIdentity();
}

std::shared_ptr<const CodeIdentity> identityForPeer(const PeerCredentials& peer) {
  if (peer.executable.empty() || peer.executableInode == 0) return noIdentity();
  auto current = currentEntry(peer.executable);
  if (!current) return noIdentity();
  const FileId running{peer.executableDevice, peer.executableInode};
  if (current->second != running) {
    // Not the file last seen there: an upgraded program, or another file
    // mounted over the path in the peer's own namespace.
    std::optional<FileId> there = fileIdOf(peer.executable);
    if (there) rememberFile(peer.executable, *there);
    if (there != running) {
      QRTLogRefusal(peer.uid, "pid %d runs another file than %s; no identity", static_cast<int>(peer.pid),
                    peer.executable.c_str());
      return noIdentity();
    }
  }
  const Entry& entry = current->first;
  const bool listed = std::find(entry.users.begin(), entry.users.end(), peer.uid) != entry.users.end();
  return listed ? entry.whole : entry.userPart;
}

IdentityRegistryStats identityRegistryStats() {
  currentEntry("");  // brings the registry up to date
  Registry& reg = registry();
  std::shared_lock lock(reg.mutex);
  return IdentityRegistryStats{reg.byExecutable.size(), reg.refusedFiles};
}

}  // namespace platform
