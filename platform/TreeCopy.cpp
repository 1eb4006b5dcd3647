#include "platform/TreeCopy.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstring>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "base/QRTFormat.h"
#include "platform/FileIO.h"
#include "platform/Log.h"
#include "platform/TreeWalk.h"

namespace platform {

namespace {

constexpr const char* kAccessAclAttribute = "system.posix_acl_access";
constexpr const char* kDefaultAclAttribute = "system.posix_acl_default";

// Copies a tree with data, owner, mode, times and every extended attribute
// (ACLs included), links as links, never following one at either end. A
// directory's own attributes are set after its contents, so that neither its
// mode nor its default ACL can get in the way of the copy below it. Running as
// root over trees that users filled, it makes no device nodes and drops the
// set-user-id and set-group-id bits. A durable copy flushes every file and
// directory it made.
class TreeCloner {
 public:
  explicit TreeCloner(bool durable) : durable_(durable) {}
  int run(int sparent, const char* sname, int dparent, const char* dname);

 private:
  bool visit(TreeEntry& entry);
  int copyEntry(int sdir, const char* sname, int ddir, const char* dname, unsigned char type);
  int enterDirectory(const TreeEntry& entry);
  int finishDirectory(const TreeEntry& entry);
  int copyFile(int sdir, const char* sname, int ddir, const char* dname);
  int copyData(int sfd, int dfd, off_t size);
  int copySymlink(int sdir, const char* sname, int ddir, const char* dname);
  int copySpecial(int sdir, const char* sname, int ddir, const char* dname);
  int finishItem(int sfd, int dfd, const struct stat& st, bool isDirectory);
  int copyXattrs(int sfd, int dfd, bool isDirectory);
  ssize_t readXattrList(int sfd);
  ssize_t readXattr(int sfd, const char* name);

  bool durable_;
  const char* rootName_ = nullptr;  // of the destination
  int rootParent_ = -1;
  std::vector<UniqueFd> destinations_;  // the directories on the walk's path
  int error_ = 0;
  std::vector<char> names_ = std::vector<char>(4096);
  std::vector<char> value_ = std::vector<char>(4096);
  std::unique_ptr<char[]> dataBuffer_;
  dev_t dstRootDevice_ = 0;
  ino_t dstRootInode_ = 0;
  // Items created under a directory with a default ACL inherit ACLs the
  // source may not have; those are then taken away again.
  bool dropInheritedAcls_ = true;
};

constexpr size_t kCopyBufferSize = 128 * 1024;
constexpr mode_t kCopiedModeBits = 01777;  // no set-id bits

unsigned char typeOfMode(mode_t mode) {
  if (S_ISDIR(mode)) return DT_DIR;
  if (S_ISREG(mode)) return DT_REG;
  if (S_ISLNK(mode)) return DT_LNK;
  return DT_UNKNOWN;
}

int TreeCloner::run(int sparent, const char* sname, int dparent, const char* dname) {
  struct stat st;
  if (fstatat(sparent, sname, &st, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  if (!S_ISDIR(st.st_mode)) {
    int err = copyEntry(sparent, sname, dparent, dname, typeOfMode(st.st_mode));
    return err ? err : durable_ ? platform::syncDirectory(dparent) : 0;
  }
  rootName_ = dname;
  rootParent_ = dparent;
  // Every file system the source spans is copied; the listing's types save
  // a stat per entry, as each is opened and checked anyway.
  TreeWalkOptions options;
  options.sameFileSystem = false;
  options.typesFromListing = true;
  int err = walkTreeAt(
      sparent, sname, sname, [this](TreeEntry& entry) { return visit(entry); }, options);
  if (err == kTreeWalkStopped) err = error_;
  if (err) return err;
  return durable_ ? platform::syncDirectory(dparent) : 0;
}

bool TreeCloner::visit(TreeEntry& entry) {
  const int ddir = destinations_.empty() ? -1 : destinations_.back().get();
  int err;
  switch (entry.kind) {
    case TreeEntry::Kind::DirectoryPre: err = enterDirectory(entry); break;
    case TreeEntry::Kind::DirectoryPost: err = finishDirectory(entry); break;
    case TreeEntry::Kind::File: err = copyFile(entry.parentFd, entry.name, ddir, entry.name); break;
    case TreeEntry::Kind::Symlink: err = copySymlink(entry.parentFd, entry.name, ddir, entry.name); break;
    default: err = entry.error ? entry.error : copySpecial(entry.parentFd, entry.name, ddir, entry.name); break;
  }
  error_ = err;
  return err == 0;
}

int TreeCloner::copyEntry(int sdir, const char* sname, int ddir, const char* dname, unsigned char type) {
  switch (type) {
    case DT_REG: return copyFile(sdir, sname, ddir, dname);
    case DT_LNK: return copySymlink(sdir, sname, ddir, dname);
    default: return copySpecial(sdir, sname, ddir, dname);
  }
}

// An existing directory at the destination is copied into; a link there is
// refused (ELOOP).
int TreeCloner::enterDirectory(const TreeEntry& entry) {
  const bool root = entry.level == 0;
  if (entry.st.st_dev == dstRootDevice_ && entry.st.st_ino == dstRootInode_) return EINVAL;  // a copy into itself
  const int ddir = root ? rootParent_ : destinations_.back().get();
  const char* dname = root ? rootName_ : entry.name;
  if (mkdirat(ddir, dname, S_IRWXU) != 0 && errno != EEXIST) return errno;
  UniqueFd dfd(openDirectoryAt(ddir, dname));
  if (!dfd.valid()) return errno;
  if (root) {
    struct stat dstStat;
    if (fstat(dfd.get(), &dstStat) != 0) return errno;
    dstRootDevice_ = dstStat.st_dev;
    dstRootInode_ = dstStat.st_ino;
    dropInheritedAcls_ = fgetxattr(dfd.get(), kDefaultAclAttribute, nullptr, 0) >= 0;
  }
  destinations_.push_back(std::move(dfd));
  return 0;
}

int TreeCloner::finishDirectory(const TreeEntry& entry) {
  UniqueFd dfd = std::move(destinations_.back());
  destinations_.pop_back();
  if (int err = finishItem(entry.fd, dfd.get(), entry.st, true)) return err;
  return durable_ ? platform::syncDirectory(dfd.get()) : 0;
}

int TreeCloner::copyFile(int sdir, const char* sname, int ddir, const char* dname) {
  // Non-blocking and checked at once: a name swapped for a FIFO is refused
  // below without ever being read.
  UniqueFd sfd(platform::openNoFollowAt(sdir, sname, O_RDONLY));
  if (!sfd.valid()) return errno;
  struct stat st;
  if (fstat(sfd.get(), &st) != 0) return errno;
  if (!S_ISREG(st.st_mode)) return ESTALE;  // replaced during the copy
  UniqueFd dfd(platform::createFileAt(ddir, dname, O_WRONLY, S_IRUSR | S_IWUSR));
  if (!dfd.valid() && errno == EEXIST) {
    if (int err = platform::removeEntryAt(ddir, dname)) return err;
    dfd.reset(platform::createFileAt(ddir, dname, O_WRONLY, S_IRUSR | S_IWUSR));
  }
  if (!dfd.valid()) return errno;
  if (int err = copyData(sfd.get(), dfd.get(), st.st_size)) return err;
  if (int err = finishItem(sfd.get(), dfd.get(), st, false)) return err;
  if (durable_ && fsync(dfd.get()) != 0) return errno;
  if (close(dfd.release()) != 0) return errno;
  return 0;
}

// In-kernel copy where the file systems allow it, plain reads and writes
// where they do not. Copies the size the file had when it was opened.
int TreeCloner::copyData(int sfd, int dfd, off_t size) {
  while (size > 0) {
    ssize_t n = copy_file_range(sfd, nullptr, dfd, nullptr, static_cast<size_t>(size), 0);
    if (n > 0) {
      size -= n;
      continue;
    }
    if (n == 0) return 0;
    if (errno == EINTR) continue;
    if (errno != EXDEV && errno != EINVAL && errno != ENOSYS && errno != EOPNOTSUPP) return errno;
    break;
  }
  if (size <= 0) return 0;
  if (!dataBuffer_) dataBuffer_ = std::make_unique<char[]>(kCopyBufferSize);
  while (size > 0) {
    ssize_t n = read(sfd, dataBuffer_.get(), kCopyBufferSize);
    if (n == 0) return 0;
    if (n < 0) {
      if (errno == EINTR) continue;
      return errno;
    }
    if (int err = platform::writeAll(dfd, dataBuffer_.get(), static_cast<size_t>(n))) return err;
    size -= n;
  }
  return 0;
}

// Links carry no mode and no extended attributes here, only owner and times.
int TreeCloner::copySymlink(int sdir, const char* sname, int ddir, const char* dname) {
  struct stat st;
  if (fstatat(sdir, sname, &st, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  if (!S_ISLNK(st.st_mode)) return ESTALE;
  char target[PATH_MAX + 1];
  ssize_t n = readlinkat(sdir, sname, target, sizeof target);
  if (n < 0) return errno;
  if (static_cast<size_t>(n) >= sizeof target) return ENAMETOOLONG;
  target[n] = '\0';
  if (symlinkat(target, ddir, dname) != 0) {
    if (errno != EEXIST || platform::removeEntryAt(ddir, dname) != 0 || symlinkat(target, ddir, dname) != 0)
      return errno;
  }
  if (fchownat(ddir, dname, st.st_uid, st.st_gid, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  const struct timespec times[2] = {st.st_atim, st.st_mtim};
  if (utimensat(ddir, dname, times, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  return 0;
}

// FIFOs and sockets are made anew with owner, mode and times; device nodes
// are left out.
int TreeCloner::copySpecial(int sdir, const char* sname, int ddir, const char* dname) {
  struct stat st;
  if (fstatat(sdir, sname, &st, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  if (S_ISCHR(st.st_mode) || S_ISBLK(st.st_mode)) {
    QRTLogAs(kLogNotice, "clonetree", "Not copying device node %s", sname);
    return 0;
  }
  const mode_t mode = st.st_mode & (S_IFMT | S_IRWXU);
  if (mknodat(ddir, dname, mode, 0) != 0) {
    if (errno != EEXIST || platform::removeEntryAt(ddir, dname) != 0 || mknodat(ddir, dname, mode, 0) != 0)
      return errno;
  }
  // What was just made, pinned: a name swapped meanwhile is not followed.
  platform::Item made;
  if (int err = platform::openItemAt(ddir, dname, &made)) return err;
  if ((made.st.st_mode & S_IFMT) != (st.st_mode & S_IFMT)) return ESTALE;
  if (int err = platform::chownItem(made, st.st_uid, st.st_gid)) return err;
  if (int err = platform::chmodItem(made, st.st_mode & kCopiedModeBits)) return err;
  const struct timespec times[2] = {st.st_atim, st.st_mtim};
  if (utimensat(ddir, dname, times, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  return 0;
}

// Owner before mode, the ACL before the mode (both set the group class bits
// and agree), times last.
int TreeCloner::finishItem(int sfd, int dfd, const struct stat& st, bool isDirectory) {
  if (fchown(dfd, st.st_uid, st.st_gid) != 0) return errno;
  if (int err = copyXattrs(sfd, dfd, isDirectory)) return err;
  if (fchmod(dfd, st.st_mode & kCopiedModeBits) != 0) return errno;
  const struct timespec times[2] = {st.st_atim, st.st_mtim};
  if (futimens(dfd, times) != 0) return errno;
  return 0;
}

// Most files have few short attributes; the buffers grow on demand only.
ssize_t TreeCloner::readXattrList(int sfd) {
  for (;;) {
    ssize_t n = flistxattr(sfd, names_.data(), names_.size());
    if (n >= 0 || errno != ERANGE) return n;
    ssize_t needed = flistxattr(sfd, nullptr, 0);
    if (needed < 0) return needed;
    names_.resize(static_cast<size_t>(needed) + 1);
  }
}

ssize_t TreeCloner::readXattr(int sfd, const char* name) {
  for (;;) {
    ssize_t n = fgetxattr(sfd, name, value_.data(), value_.size());
    if (n >= 0 || errno != ERANGE) return n;
    ssize_t needed = fgetxattr(sfd, name, nullptr, 0);
    if (needed < 0) return needed;
    value_.resize(static_cast<size_t>(needed) + 1);
  }
}

bool startsWith(const char* s, const char* prefix) { return strncmp(s, prefix, strlen(prefix)) == 0; }

int TreeCloner::copyXattrs(int sfd, int dfd, bool isDirectory) {
  ssize_t length = readXattrList(sfd);
  if (length < 0) {
    if (errno != EOPNOTSUPP) return errno;
    length = 0;
  }
  bool hasAccessAcl = false, hasDefaultAcl = false;
  for (const char* name = names_.data(); name < names_.data() + length; name += strlen(name) + 1) {
    ssize_t size = readXattr(sfd, name);
    if (size < 0) {
      if (errno == ENODATA) continue;  // removed meanwhile
      return errno;
    }
    if (int err = platform::setExtendedAttribute(dfd, name, value_.data(), static_cast<size_t>(size))) {
      // Labels and user data a target cannot hold are left behind; ACLs and
      // trusted attributes (the protection class) never are.
      bool optional = startsWith(name, "user.") || startsWith(name, "security.");
      if (err != EOPNOTSUPP || !optional) return err;
    }
    hasAccessAcl |= strcmp(name, kAccessAclAttribute) == 0;
    hasDefaultAcl |= strcmp(name, kDefaultAclAttribute) == 0;
  }
  if (!dropInheritedAcls_) return 0;
  if (!hasAccessAcl && fremovexattr(dfd, kAccessAclAttribute) != 0 && errno != ENODATA && errno != EOPNOTSUPP)
    return errno;
  if (isDirectory && !hasDefaultAcl && fremovexattr(dfd, kDefaultAclAttribute) != 0 && errno != ENODATA &&
      errno != EOPNOTSUPP)
    return errno;
  return 0;
}

}  // namespace

int copyTree(int sourceParent, const char* sourceName, int destinationParent, const char* destinationName,
             bool durable) {
  return TreeCloner(durable).run(sourceParent, sourceName, destinationParent, destinationName);
}

}  // namespace platform
