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

#include "platform/DeviceRoot.h"
#include "platform/Dir.h"

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
  Dir dir;
  if (int err = Dir::make(hostPath, mode, withParents, owner, &dir, created)) return err;
  *out = UniqueFd(dir.release());
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
