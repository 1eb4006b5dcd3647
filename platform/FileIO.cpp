#include "platform/FileIO.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>

#include "base/Frame.h"
#include "platform/LockState.h"
#include "platform/Random.h"

#ifndef SYS_fchmodat2
#define SYS_fchmodat2 452  // Linux 6.6; the same number on every architecture
#endif

namespace platform {

const char* const kProtectionClassAttribute = "trusted.com.norvane.protection-class";

void UniqueFd::reset(int fd) {
  if (fd_ >= 0) close(fd_);
  fd_ = fd;
}

int writeAll(int fd, const void* data, size_t size) { return frame::writeAll(fd, data, size, false); }

int readAll(int fd, std::string* out, size_t limit) {
  out->clear();
  char buffer[8192];
  for (;;) {
    ssize_t n = read(fd, buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return errno;
    if (n == 0) return 0;
    if (out->size() + static_cast<size_t>(n) > limit) return EFBIG;
    out->append(buffer, static_cast<size_t>(n));
  }
}

int syncDirectory(int fd) { return fsync(fd) == 0 || errno == EINVAL ? 0 : errno; }

int openNoFollowAt(int dirfd, const char* name, int flags) {
  flags |= O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY;
  if (!(flags & (O_WRONLY | O_RDWR | O_CREAT))) {
    // O_NOATIME spares an inode write but needs ownership or CAP_FOWNER.
    int fd = openat(dirfd, name, flags | O_NOATIME);
    if (fd >= 0 || errno != EPERM) return fd;
  }
  return openat(dirfd, name, flags);
}

int createFileAt(int dirfd, const char* name, int flags, mode_t mode) {
  return openat(dirfd, name, flags | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode);
}

int removeEntryAt(int dirfd, const char* name, int flags) { return unlinkat(dirfd, name, flags) == 0 ? 0 : errno; }

int setExtendedAttribute(int fd, const char* name, const void* value, size_t size) {
  return fsetxattr(fd, name, value, size, 0) == 0 ? 0 : errno;
}

int readLinkAt(int dirfd, const char* name, std::string* target, size_t limit) {
  target->resize(limit);
  ssize_t length = readlinkat(dirfd, name, target->data(), limit);
  if (length < 0) return errno;
  target->resize(static_cast<size_t>(length));
  return 0;
}

int openSystemPathAt(int dirfd, const char* name) { return openat(dirfd, name, O_PATH | O_CLOEXEC); }

int statSystemPathAt(int dirfd, const char* name, struct stat* st, bool followLink) {
  return fstatat(dirfd, name, st, followLink ? 0 : AT_SYMLINK_NOFOLLOW) == 0 ? 0 : errno;
}

int chownOpened(int fd, uid_t uid, gid_t gid) { return fchown(fd, uid, gid) == 0 ? 0 : errno; }

int chmodOpened(int fd, mode_t mode) { return fchmod(fd, mode) == 0 ? 0 : errno; }

int openItemAt(int dirfd, const char* name, Item* item) {
  item->fd.reset(openat(dirfd, name, O_PATH | O_NOFOLLOW | O_CLOEXEC));
  if (!item->fd.valid()) return errno;
  if (fstat(item->fd.get(), &item->st) != 0) return errno;
  return 0;
}

std::string itemProcPath(const Item& item) { return "/proc/self/fd/" + std::to_string(item.fd.get()); }

int reopenItem(const Item& item, int flags, UniqueFd* out) {
  if (!S_ISREG(item.st.st_mode) && !S_ISDIR(item.st.st_mode)) return EINVAL;
  out->reset(open(itemProcPath(item).c_str(), flags | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
  if (!out->valid()) return errno;
  struct stat st;
  if (fstat(out->get(), &st) != 0) return errno;
  if (st.st_dev != item.st.st_dev || st.st_ino != item.st.st_ino) return ESTALE;
  return 0;
}

int chownItem(const Item& item, uid_t uid, gid_t gid) {
  return fchownat(item.fd.get(), "", uid, gid, AT_EMPTY_PATH | AT_SYMLINK_NOFOLLOW) == 0 ? 0 : errno;
}

int chmodItem(const Item& item, mode_t mode) {
  if (S_ISLNK(item.st.st_mode)) return EOPNOTSUPP;
  if (syscall(SYS_fchmodat2, item.fd.get(), "", mode, AT_EMPTY_PATH) == 0) return 0;
  if (errno != ENOSYS && errno != EINVAL) return errno;
  // Older kernels: the descriptor's own entry names exactly this inode.
  return chmod(itemProcPath(item).c_str(), mode) == 0 ? 0 : errno;
}

// Opened for reading at once: no link is followed, and O_NONBLOCK keeps a
// FIFO put in a file's place from holding the open; anything but a regular
// file is refused before a byte is read. (Users cannot make device nodes.)
int readOpened(int fd, std::string* out, size_t limit) {
  struct stat st;
  if (fstat(fd, &st) != 0) return errno;
  if (S_ISDIR(st.st_mode)) return EISDIR;
  if (!S_ISREG(st.st_mode)) return EINVAL;
  if (static_cast<uint64_t>(st.st_size) > limit) return EFBIG;
  return readAll(fd, out, limit);
}

int readFileAt(int dirfd, const char* name, std::string* out, size_t limit) {
  UniqueFd fd(openat(dirfd, name, O_RDONLY | O_NONBLOCK | O_NOCTTY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd.valid()) return errno;
  return readOpened(fd.get(), out, limit);
}

int replaceFileAt(int dirfd, std::string_view name, const void* data, size_t size, mode_t mode, uid_t ownerUid,
                  gid_t ownerGid) {
  std::string temp = temporaryName(name);
  UniqueFd fd(openat(dirfd, temp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode));
  if (!fd.valid()) return errno;
  int err = fchmod(fd.get(), mode) != 0 ? errno : 0;  // past the umask
  if (!err && (ownerUid != static_cast<uid_t>(-1) || ownerGid != static_cast<gid_t>(-1)) &&
      fchown(fd.get(), ownerUid, ownerGid) != 0)
    err = errno;
  if (!err) err = writeAll(fd.get(), data, size);
  if (!err && fsync(fd.get()) != 0) err = errno;
  if (!err && close(fd.release()) != 0) err = errno;
  const std::string target(name);
  if (!err && renameat(dirfd, temp.c_str(), dirfd, target.c_str()) != 0) err = errno;
  if (err) {
    unlinkat(dirfd, temp.c_str(), 0);
    return err;
  }
  return syncDirectory(dirfd);
}

ssize_t readDirectoryBatch(int fd, DirectoryBatch* batch) {
  for (;;) {
    ssize_t n = getdents64(fd, batch->bytes, DirectoryBatch::kSize);
    if (n >= 0) return n;
    if (errno != EINTR) return -errno;
  }
}

int entryAttributesAt(int dirfd, const char* name, EntryAttributes* out) {
  struct statx attributes {};
  constexpr unsigned mask = STATX_TYPE | STATX_BLOCKS | STATX_NLINK | STATX_INO;
  if (statx(dirfd, name, AT_SYMLINK_NOFOLLOW | AT_STATX_DONT_SYNC, mask, &attributes) != 0) return errno;
  *out = EntryAttributes{};
  out->hasType = attributes.stx_mask & STATX_TYPE;
  out->mode = out->hasType ? attributes.stx_mode : 0;
  out->allocated = (attributes.stx_mask & STATX_BLOCKS) ? attributes.stx_blocks * 512 : 0;
  out->links = (attributes.stx_mask & STATX_NLINK) ? attributes.stx_nlink : 0;
  out->inode = (attributes.stx_mask & STATX_INO) ? attributes.stx_ino : 0;
  out->device = makedev(attributes.stx_dev_major, attributes.stx_dev_minor);
  return 0;
}

int immutableFlag(int fd, bool* set) {
  int flags = 0;
  if (ioctl(fd, FS_IOC_GETFLAGS, &flags) != 0) return errno;
  *set = flags & FS_IMMUTABLE_FL;
  return 0;
}

int clearImmutableFlag(int fd) {
  int flags = 0;
  if (ioctl(fd, FS_IOC_GETFLAGS, &flags) != 0) return errno;
  flags &= ~FS_IMMUTABLE_FL;
  return ioctl(fd, FS_IOC_SETFLAGS, &flags) == 0 ? 0 : errno;
}

namespace {

// The attribute of an open file, or (fd -1) of an item through its pinned
// descriptor's entry, which reaches the inode without opening it.
struct ClassTarget {
  int fd = -1;
  std::string path;
  ssize_t get(void* value, size_t size) const {
    return fd >= 0 ? fgetxattr(fd, kProtectionClassAttribute, value, size)
                   : getxattr(path.c_str(), kProtectionClassAttribute, value, size);
  }
  int set(const void* value, size_t size) const {
    int r = fd >= 0 ? fsetxattr(fd, kProtectionClassAttribute, value, size, 0)
                    : setxattr(path.c_str(), kProtectionClassAttribute, value, size, 0);
    return r == 0 ? 0 : errno;
  }
};

int getClass(const ClassTarget& target, int32_t* cls) {
  if (!cls) return EFAULT;
  uint8_t b[4];
  ssize_t n = target.get(b, sizeof b);
  if (n < 0) {
    if (errno != ENODATA) return errno;
    *cls = 0;
    return 0;
  }
  if (n != sizeof b) return EINVAL;
  *cls = static_cast<int32_t>(static_cast<uint32_t>(b[0]) | static_cast<uint32_t>(b[1]) << 8 |
                              static_cast<uint32_t>(b[2]) << 16 | static_cast<uint32_t>(b[3]) << 24);
  return 0;
}

int writeClass(const ClassTarget& target, int32_t cls) {
  const uint32_t v = static_cast<uint32_t>(cls);
  const uint8_t b[4] = {static_cast<uint8_t>(v), static_cast<uint8_t>(v >> 8), static_cast<uint8_t>(v >> 16),
                        static_cast<uint8_t>(v >> 24)};
  return target.set(b, sizeof b);
}

int setClass(const ClassTarget& target, int32_t cls) {
  if (deviceLockState() == 1) {
    if (cls == 1) return EPERM;
    int32_t current = 0;
    if (int err = getClass(target, &current)) return err;
    if (current == 1) return EPERM;
  }
  return writeClass(target, cls);
}

// Files and directories are reopened for reading; other items never are.
int classTarget(const Item& item, UniqueFd* keep, ClassTarget* target) {
  if (S_ISLNK(item.st.st_mode)) return ELOOP;
  if (S_ISREG(item.st.st_mode) || S_ISDIR(item.st.st_mode)) {
    if (int err = reopenItem(item, O_RDONLY | (S_ISDIR(item.st.st_mode) ? O_DIRECTORY : 0), keep)) return err;
    target->fd = keep->get();
  } else {
    target->path = itemProcPath(item);
  }
  return 0;
}

}  // namespace

int getProtectionClass(int fd, int32_t* cls) { return getClass(ClassTarget{fd, {}}, cls); }

int setProtectionClass(int fd, int32_t cls) { return setClass(ClassTarget{fd, {}}, cls); }

int setProtectionClass(int fd, int32_t cls, int32_t current) {
  if ((cls == 1 || current == 1) && deviceLockState() == 1) return EPERM;
  return writeClass(ClassTarget{fd, {}}, cls);
}

int itemProtectionClass(const Item& item, int32_t* cls) {
  UniqueFd keep;
  ClassTarget target;
  if (int err = classTarget(item, &keep, &target)) return err;
  return getClass(target, cls);
}

int setItemProtectionClass(const Item& item, int32_t cls) {
  UniqueFd keep;
  ClassTarget target;
  if (int err = classTarget(item, &keep, &target)) return err;
  return setClass(target, cls);
}

int clearProtectionClass(int fd) {
  if (fremovexattr(fd, kProtectionClassAttribute) == 0 || errno == ENODATA || errno == EOPNOTSUPP) return 0;
  return errno;
}

}  // namespace platform
