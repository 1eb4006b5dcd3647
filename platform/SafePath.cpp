#include "platform/SafePath.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <mutex>
#include <vector>

#include "base/QRTFormat.h"
#include "platform/DeviceRoot.h"
#include "platform/HostProfile.h"
#include "platform/Log.h"

namespace platform {

namespace {

std::atomic<int> gRootFd{-1};
std::mutex gRootMutex;

int openRoot(const std::string& root) { return open(root.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC); }

// Kernels without openat2: one O_NOFOLLOW open per component, which refuses
// links just the same (mounts are not told apart).
int openComponentwise(int dirfd, const char* relative, int flags, mode_t mode) {
  std::string_view rest(relative);
  UniqueFd current;
  int base = dirfd;
  for (;;) {
    size_t slash = rest.find('/');
    std::string component(rest.substr(0, slash));
    if (slash == std::string_view::npos) {
      int fd = openat(base, component.c_str(), flags | O_NOFOLLOW | O_CLOEXEC, mode);
      return fd;
    }
    rest.remove_prefix(slash + 1);
    if (component.empty() || component == ".") continue;
    if (component == "..") {
      errno = EXDEV;
      return -1;
    }
    int next = openat(base, component.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (next < 0) return -1;
    current.reset(next);
    base = next;
  }
}

int openBeneathWithMode(int dirfd, const char* relative, int flags, mode_t mode, UniqueFd* out, bool walk) {
  struct open_how how {};
  how.flags = static_cast<uint64_t>(flags | O_NOFOLLOW | O_CLOEXEC);
  how.mode = (flags & (O_CREAT | O_TMPFILE)) ? mode : 0;
  how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS | (walk ? RESOLVE_NO_XDEV : 0);
  long fd;
  // EAGAIN: a rename raced the lookup; a few retries, not an endless loop.
  int tries = 0;
  do {
    fd = syscall(SYS_openat2, dirfd, relative, &how, sizeof how);
  } while (fd < 0 && (errno == EAGAIN || errno == EINTR) && ++tries < 16);
  if (fd < 0 && errno == ENOSYS) fd = openComponentwise(dirfd, relative, flags, mode);
  if (fd < 0 && errno == ENOTDIR && (flags & O_DIRECTORY)) {
    // A link at the last component reads as "not a directory"; say link.
    UniqueFd item;
    struct stat st;
    if (openBeneathWithMode(dirfd, relative, O_PATH, 0, &item, walk) == 0 && fstat(item.get(), &st) == 0 &&
        S_ISLNK(st.st_mode))
      return ELOOP;
    errno = ENOTDIR;
  }
  if (fd < 0) return errno;
  out->reset(static_cast<int>(fd));
  return 0;
}

void splitParent(const std::string& relative, std::string* parent, std::string* name) {
  size_t slash = relative.rfind('/');
  if (slash == std::string::npos) {
    *parent = ".";
    *name = relative;
  } else {
    *parent = relative.substr(0, slash);
    *name = relative.substr(slash + 1);
  }
}

// The host owner of a protocol user; EPERM with a log line when no account
// stands for it (never a numeric id another account may own).
int hostOwner(std::string_view hostPath, uid_t owner, uid_t* uid, gid_t* gid) {
  *uid = *gid = kAnyOwner;
  if (owner == kAnyOwner) return 0;
  std::optional<uid_t> user = hostUserId(owner);
  std::optional<gid_t> group = hostGroupId(owner);
  if (!user || !group) {
    QRTLogAs(kLogError, "safeMakeDirectory", "Refusing %s: no host account stands for user %u",
             std::string(hostPath).c_str(), static_cast<unsigned>(owner));
    return EPERM;
  }
  *uid = *user;
  *gid = *group;
  return 0;
}

// The checks on an item found where a directory was to be made; owner and
// group are host ids.
int acceptDirectory(int fd, std::string_view hostPath, uid_t owner, gid_t group) {
  struct stat st;
  if (fstat(fd, &st) != 0) return errno;
  if (!S_ISDIR(st.st_mode)) {
    QRTLogAs(kLogError, "safeMakeDirectory", "Refusing %s: not a directory", std::string(hostPath).c_str());
    return ENOTDIR;
  }
  if (owner == kAnyOwner) return 0;
  if (st.st_uid != owner && st.st_uid != 0) {
    QRTLogAs(kLogError, "safeMakeDirectory", "Refusing %s: owned by %u, not by %u", std::string(hostPath).c_str(),
             static_cast<unsigned>(st.st_uid), static_cast<unsigned>(owner));
    return EPERM;
  }
  if ((st.st_uid != owner || st.st_gid != group) && fchown(fd, owner, group) != 0) return errno;
  return 0;
}

// mkdirat then an O_NOFOLLOW open of what is there; *made tells whether this
// call made it.
int makeOne(int dirfd, const char* name, mode_t mode, std::string_view hostPath, UniqueFd* out, bool* made) {
  *made = mkdirat(dirfd, name, mode) == 0;
  if (!*made && errno != EEXIST) return errno;
  out->reset(openat(dirfd, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (out->valid()) return 0;
  int err = errno;
  if (err == ELOOP || err == ENOTDIR) {
    QRTLogAs(kLogError, "safeMakeDirectory", "Refusing %s: %s where a directory belongs", std::string(hostPath).c_str(),
             err == ELOOP ? "a symbolic link" : "another kind of item");
  }
  return err;
}

}  // namespace

void resetDeviceRootDescriptor() {
  std::lock_guard<std::mutex> hold(gRootMutex);
  int fd = openRoot(deviceRoot());
  int old = gRootFd.exchange(fd);
  if (old >= 0) close(old);
}

int deviceRootDescriptor() {
  int fd = gRootFd.load(std::memory_order_acquire);
  if (fd >= 0) return fd;
  std::lock_guard<std::mutex> hold(gRootMutex);
  fd = gRootFd.load();
  if (fd >= 0) return fd;
  fd = openRoot(deviceRoot());
  if (fd < 0) return -1;
  gRootFd.store(fd, std::memory_order_release);
  return fd;
}

int pathBelowDeviceRoot(std::string_view hostPath, std::string* relative) {
  if (hostPath.empty() || hostPath.front() != '/') return EXDEV;
  std::string normal;
  normal.reserve(hostPath.size());
  while (!hostPath.empty()) {
    size_t slash = hostPath.find('/');
    std::string_view component = hostPath.substr(0, slash);
    hostPath.remove_prefix(slash == std::string_view::npos ? hostPath.size() : slash + 1);
    if (component.empty() || component == ".") continue;
    if (component == "..") return EXDEV;
    normal += '/';
    normal += component;
  }
  const std::string& root = deviceRoot();
  if (root == "/") {
    *relative = normal.empty() ? "." : normal.substr(1);
    return 0;
  }
  if (normal.compare(0, root.size(), root) != 0) return EXDEV;
  if (normal.size() == root.size()) {
    *relative = ".";
    return 0;
  }
  if (normal[root.size()] != '/') return EXDEV;
  *relative = normal.substr(root.size() + 1);
  return 0;
}

int openBeneath(int dirfd, const char* relative, int flags, UniqueFd* out, bool walk) {
  return openBeneathWithMode(dirfd, relative, flags, 0, out, walk);
}

int safeOpen(std::string_view hostPath, int flags, UniqueFd* out, bool walk) {
  std::string relative;
  if (int err = pathBelowDeviceRoot(hostPath, &relative)) return err;
  int root = deviceRootDescriptor();
  if (root < 0) return errno;
  return openBeneath(root, relative.c_str(), flags, out, walk);
}

int safeOpenParent(std::string_view hostPath, SafeParent* out) {
  std::string relative, parent;
  if (int err = pathBelowDeviceRoot(hostPath, &relative)) return err;
  if (relative == ".") return EINVAL;
  splitParent(relative, &parent, &out->name);
  int root = deviceRootDescriptor();
  if (root < 0) return errno;
  return openBeneath(root, parent.c_str(), O_RDONLY | O_DIRECTORY, &out->fd);
}

int safeOpenItem(std::string_view hostPath, Item* item) {
  SafeParent parent;
  if (int err = safeOpenParent(hostPath, &parent)) return err;
  return openItemAt(parent.fd.get(), parent.name.c_str(), item);
}

int safeStat(std::string_view hostPath, struct stat* st) {
  std::string relative;
  if (int err = pathBelowDeviceRoot(hostPath, &relative)) return err;
  if (relative == ".") {
    int root = deviceRootDescriptor();
    if (root < 0) return errno;
    return fstat(root, st) == 0 ? 0 : errno;
  }
  SafeParent parent;
  if (int err = safeOpenParent(hostPath, &parent)) return err;
  return fstatat(parent.fd.get(), parent.name.c_str(), st, AT_SYMLINK_NOFOLLOW) == 0 ? 0 : errno;
}

int safeMakeDirectory(std::string_view hostPath, mode_t mode, bool withParents, uid_t owner, UniqueFd* out,
                      bool* created) {
  if (created) *created = false;
  uid_t hostUid;
  gid_t hostGid;
  if (int err = hostOwner(hostPath, owner, &hostUid, &hostGid)) return err;
  std::string relative;
  if (int err = pathBelowDeviceRoot(hostPath, &relative)) return err;
  int root = deviceRootDescriptor();
  if (root < 0) return errno;
  // Most calls find the directory there already: one resolution settles it.
  UniqueFd fd;
  int err = openBeneath(root, relative.c_str(), O_RDONLY | O_DIRECTORY, &fd);
  if (err == 0) {
    if (int refused = acceptDirectory(fd.get(), hostPath, hostUid, hostGid)) return refused;
    *out = std::move(fd);
    return 0;
  }
  if (err != ENOENT) {
    if (err == ELOOP || err == ENOTDIR)
      QRTLogAs(kLogError, "safeMakeDirectory", "Refusing %s: %s", std::string(hostPath).c_str(), errorText(err));
    return err;
  }
  bool made = false;
  if (!withParents) {
    SafeParent parent;
    if (int perr = safeOpenParent(hostPath, &parent)) return perr;
    if (int merr = makeOne(parent.fd.get(), parent.name.c_str(), mode, hostPath, &fd, &made)) return merr;
  } else {
    // Level by level from the root; each level is opened without following
    // a link before the next one is made inside it.
    UniqueFd level;
    int base = root;
    std::string_view rest(relative);
    while (!rest.empty()) {
      size_t slash = rest.find('/');
      std::string name(rest.substr(0, slash));
      rest.remove_prefix(slash == std::string_view::npos ? rest.size() : slash + 1);
      UniqueFd next;
      if (int merr = makeOne(base, name.c_str(), mode, hostPath, &next, &made)) return merr;
      // A level made in an ordinary user's home (~/.local/share on a host)
      // is theirs, or their own programs could not use it.
      if (made && hostProfile() && hostUid != kAnyOwner && hostUid >= hostOrdinaryUserMinimum() &&
          fchown(next.get(), hostUid, hostGid) != 0)
        return errno;
      level = std::move(next);
      base = level.get();
    }
    fd = std::move(level);
  }
  if (created) *created = made;
  if (int refused = acceptDirectory(fd.get(), hostPath, hostUid, hostGid)) return refused;
  *out = std::move(fd);
  return 0;
}

int safeReadFile(std::string_view hostPath, std::string* out, size_t limit) {
  UniqueFd fd;
  if (int err = safeOpen(hostPath, O_RDONLY | O_NONBLOCK | O_NOCTTY, &fd)) return err;
  return readOpened(fd.get(), out, limit);
}

int safeReplaceFile(std::string_view hostPath, std::string_view content, mode_t mode) {
  SafeParent parent;
  if (int err = safeOpenParent(hostPath, &parent)) return err;
  return replaceFileAt(parent.fd.get(), parent.name, content.data(), content.size(), mode);
}

int safeListenUnixSocket(std::string_view hostPath, mode_t mode, int socketFlags, UniqueFd* out) {
  SafeParent parent;
  if (int err = safeOpenParent(hostPath, &parent)) return err;
  const std::string staging = parent.name + ".new";
  // bind takes a path: the parent is reached through its descriptor's
  // /proc entry, and bind never follows a link at the name it creates.
  const std::string bindPath = "/proc/self/fd/" + std::to_string(parent.fd.get()) + "/" + staging;
  sockaddr_un addr{};
  if (bindPath.size() >= sizeof addr.sun_path) return ENAMETOOLONG;
  addr.sun_family = AF_UNIX;
  memcpy(addr.sun_path, bindPath.c_str(), bindPath.size() + 1);
  UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | socketFlags, 0));
  if (!fd.valid()) return errno;
  if (unlinkat(parent.fd.get(), staging.c_str(), 0) != 0 && errno != ENOENT) return errno;
  if (::bind(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) return errno;
  if (fchmodat(parent.fd.get(), staging.c_str(), mode, 0) != 0 || ::listen(fd.get(), SOMAXCONN) != 0 ||
      renameat(parent.fd.get(), staging.c_str(), parent.fd.get(), parent.name.c_str()) != 0) {
    const int err = errno;
    unlinkat(parent.fd.get(), staging.c_str(), 0);
    return err;
  }
  *out = std::move(fd);
  return 0;
}

int safeUnlink(std::string_view hostPath) {
  SafeParent parent;
  if (int err = safeOpenParent(hostPath, &parent)) return err == ENOENT ? 0 : err;
  if (unlinkat(parent.fd.get(), parent.name.c_str(), 0) != 0 && errno != ENOENT) return errno;
  return 0;
}

}  // namespace platform
