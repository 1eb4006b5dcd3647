#include "Daemon/fileops/QRTFileManager.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <climits>
#include <cstring>
#include <memory>
#include <new>
#include <thread>
#include <utility>

#include "base/QRTFormat.h"
#include "base/PlistCodec.h"
#include "platform/Dir.h"
#include "platform/FileIO.h"
#include "platform/Log.h"
#include "platform/Random.h"
#include "platform/SafePath.h"
#include "platform/TreeWalk.h"

using platform::kLogError;
using platform::kLogNotice;
using platform::openDirectoryAt;
using platform::SafeParent;
using platform::UniqueFd;

namespace {

constexpr const char* kAccessAclAttribute = "system.posix_acl_access";
constexpr const char* kDefaultAclAttribute = "system.posix_acl_default";
constexpr size_t kParallelUnlinkThreshold = 64;
constexpr unsigned kUnlinkThreads = 4;
// Deeper trees than this are walked with only this many directories open;
// the rest are reopened through ".." on the way back up.
constexpr size_t kMaxOpenDirectories = 64;
// Property-list files are small; anything beyond this is not one of ours.
constexpr size_t kMaxPropertyListFileSize = 64 << 20;

// ---------------------------------------------------------------------------
// Recursive removal.

// Removes a tree depth first without following links or leaving the root's
// device. Entries that cannot be removed are reported to entryFailed and the
// walk goes on; the first such errno is kept. The files of a large directory
// are unlinked by a few threads at once.
class TreePruner {
 public:
  // The item name in the directory parentFd; path names it in messages.
  TreePruner(int parentFd, std::string name, std::string path)
      : parentFd_(parentFd), rootName_(std::move(name)), path_(std::move(path)) {}
  // 0 when the walk reached its end, else the errno that stopped it.
  int run();
  int firstError() const { return firstError_.load(); }

 private:
  struct Frame {
    UniqueFd fd;
    dev_t dev;
    ino_t ino;
    size_t parentPathLength;  // to cut path_ back on the way up
    std::string name;
    std::vector<std::string> subdirectories;
    size_t next = 0;
  };
  struct Victim {
    ino64_t inode;
    size_t nameOffset;  // into names_
  };

  void scan(Frame& frame);
  void enter(const std::string& name);
  int leave();
  int reopen(Frame& frame, int childFd);
  void removeAt(int dirfd, const char* name, int flags, const std::string& path);
  void entryFailed(int dirfd, const char* name, const std::string& path, int err);
  bool unsetImmutable(int dirfd, const char* name, const std::string& path);
  void record(const std::string& path, int err);
  void unlinkVictims(Frame& frame);
  void keepFirst(int err) {
    int expected = 0;
    firstError_.compare_exchange_strong(expected, err);
  }
  std::string childPath(const char* name) const { return path_ + "/" + name; }

  int parentFd_;
  std::string rootName_;
  std::string path_;  // the path of the directory on top of the stack
  std::vector<Frame> stack_;
  std::unique_ptr<platform::DirectoryBatch> batch_;
  std::vector<Victim> victims_;  // scratch of scan()
  std::string names_;
  dev_t rootDevice_ = 0;
  std::atomic<int> firstError_{0};  // entryFailed runs on several threads
};

int TreePruner::run() {
  UniqueFd fd(openDirectoryAt(parentFd_, rootName_.c_str()));
  if (!fd.valid()) {
    int err = errno;
    if (err != ENOTDIR && err != ELOOP) return err;
    removeAt(parentFd_, rootName_.c_str(), 0, path_);  // a file or a link
    return 0;
  }
  struct stat st;
  if (fstat(fd.get(), &st) != 0) return errno;
  rootDevice_ = st.st_dev;
  batch_ = std::make_unique<platform::DirectoryBatch>();
  stack_.push_back(Frame{std::move(fd), st.st_dev, st.st_ino, path_.size(), path_, {}});
  scan(stack_.back());
  while (!stack_.empty()) {
    Frame& top = stack_.back();
    if (top.next < top.subdirectories.size()) {
      std::string name = std::move(top.subdirectories[top.next++]);
      enter(name);
    } else if (int err = leave()) {
      return err;
    }
  }
  return 0;
}

// Reads the whole directory, then unlinks everything but directories in
// inode order, which on ext4 is about the order of allocation and keeps the
// inode table and bitmap updates close together. Directories wait in the
// frame.
void TreePruner::scan(Frame& frame) {
  victims_.clear();
  names_.clear();
  for (bool more = true; more;) {
    ssize_t n = platform::readDirectoryBatch(frame.fd.get(), batch_.get());
    if (n < 0) record(path_, static_cast<int>(-n));
    more = n > 0;
    if (!more) break;
    platform::forEachEntry(*batch_, static_cast<size_t>(n), [&](uint64_t inode, unsigned char type, const char* name) {
      if (!name) return;
      if (type == DT_DIR) {
        frame.subdirectories.emplace_back(name);
      } else {
        victims_.push_back({inode, names_.size()});
        names_.append(name, strlen(name) + 1);
      }
    });
  }
  std::sort(victims_.begin(), victims_.end(), [](const Victim& a, const Victim& b) { return a.inode < b.inode; });
  unlinkVictims(frame);
}

// An unlink spends most of its time after the directory lock is dropped
// (freeing the inode, and on a disk with online discard waiting for the
// discard), so several threads on one directory overlap that wait. Threads
// take interleaved shares to keep the overall order by inode.
void TreePruner::unlinkVictims(Frame& frame) {
  const size_t count = victims_.size();
  const unsigned threads = count >= kParallelUnlinkThreshold ? kUnlinkThreads : 1;
  std::vector<std::vector<std::string>> directories(threads);
  auto share = [&](unsigned t) {
    try {
      for (size_t i = t; i < count; i += threads) {
        const char* name = names_.data() + victims_[i].nameOffset;
        int err = platform::removeEntryAt(frame.fd.get(), name);
        if (err == 0) continue;
        if (err == EISDIR) {  // the file system gave no type
          directories[t].emplace_back(name);
        } else {
          entryFailed(frame.fd.get(), name, childPath(name), err);
        }
      }
    } catch (const std::exception&) { keepFirst(ENOMEM); }
  };
  std::vector<std::thread> helpers;
  unsigned started = 1;
  try {
    for (; started < threads; ++started) helpers.emplace_back(share, started);
  } catch (const std::exception&) {
    // No thread to be had: the rest of the shares run here.
  }
  share(0);
  for (unsigned t = started; t < threads; ++t) share(t);
  for (std::thread& helper : helpers) helper.join();
  for (auto& found : directories)
    for (std::string& name : found) frame.subdirectories.push_back(std::move(name));
}

void TreePruner::enter(const std::string& name) {
  int parentFd = stack_.back().fd.get();
  UniqueFd fd(openDirectoryAt(parentFd, name.c_str()));
  if (!fd.valid()) {
    int err = errno;
    if (err == ENOTDIR || err == ELOOP) {
      removeAt(parentFd, name.c_str(), 0, childPath(name.c_str()));  // replaced meanwhile
    } else {
      entryFailed(parentFd, name.c_str(), childPath(name.c_str()), err);
    }
    return;
  }
  struct stat st;
  if (fstat(fd.get(), &st) != 0) {
    entryFailed(parentFd, name.c_str(), childPath(name.c_str()), errno);
    return;
  }
  if (st.st_dev != rootDevice_) {
    // A mount point: never wipe another file system; its removal fails (EBUSY).
    fd.reset();
    removeAt(parentFd, name.c_str(), AT_REMOVEDIR, childPath(name.c_str()));
    return;
  }
  if (stack_.size() >= kMaxOpenDirectories) stack_[stack_.size() - kMaxOpenDirectories].fd.reset();
  size_t parentLength = path_.size();
  path_ += '/';
  path_ += name;
  stack_.push_back(Frame{std::move(fd), st.st_dev, st.st_ino, parentLength, name, {}});
  scan(stack_.back());
}

// Pops the finished directory and removes it from its parent.
int TreePruner::leave() {
  Frame child = std::move(stack_.back());
  stack_.pop_back();
  if (stack_.empty()) {
    child.fd.reset();
    removeAt(parentFd_, rootName_.c_str(), AT_REMOVEDIR, path_);
    return 0;
  }
  Frame& parent = stack_.back();
  if (!parent.fd.valid()) {
    if (int err = reopen(parent, child.fd.get())) return err;
  }
  child.fd.reset();
  removeAt(parent.fd.get(), child.name.c_str(), AT_REMOVEDIR, path_);
  path_.resize(child.parentPathLength);
  return 0;
}

// Reopens a directory closed for depth through its child's "..", and refuses
// to go on when that is no longer the directory we came from.
int TreePruner::reopen(Frame& frame, int childFd) {
  UniqueFd fd(openDirectoryAt(childFd, ".."));
  if (!fd.valid()) return errno;
  struct stat st;
  if (fstat(fd.get(), &st) != 0) return errno;
  if (st.st_dev != frame.dev || st.st_ino != frame.ino) return ESTALE;
  frame.fd = std::move(fd);
  return 0;
}

void TreePruner::removeAt(int dirfd, const char* name, int flags, const std::string& path) {
  if (int err = platform::removeEntryAt(dirfd, name, flags)) entryFailed(dirfd, name, path, err);
}

// The per-entry error hook: an entry that is only in the way because of its
// immutable flag loses the flag and is unlinked; every other failure is
// logged and the first one kept.
void TreePruner::entryFailed(int dirfd, const char* name, const std::string& path, int err) {
  if (err == ENOENT) return;  // gone already
  QRTLog(kLogError, "prunetree hit error for %s : %s", path.c_str(), errorText(err));
  if (err == EPERM && unsetImmutable(dirfd, name, path)) {
    int unlinkErr = platform::removeEntryAt(dirfd, name);
    if (unlinkErr == 0) return;
    QRTLog(kLogError, "unlink of %s failed: %s", path.c_str(), errorText(unlinkErr));
  }
  keepFirst(err);
}

void TreePruner::record(const std::string& path, int err) {
  QRTLog(kLogError, "prunetree hit error for %s : %s", path.c_str(), errorText(err));
  keepFirst(err);
}

// The flags live behind an open file; links and special files never carry
// the flag we repair, and opening them could block or have side effects.
bool TreePruner::unsetImmutable(int dirfd, const char* name, const std::string& path) {
  platform::Item item;
  if (int err = platform::openItemAt(dirfd, name, &item)) {
    QRTLog(kLogError, "Failed to stat %s before unsetting UF_IMMUTABLE: %s", path.c_str(), errorText(err));
    return false;
  }
  UniqueFd fd;
  if (platform::reopenItem(item, O_RDONLY, &fd) != 0) return false;
  bool immutable = false;
  if (int err = platform::immutableFlag(fd.get(), &immutable)) {
    if (err == ENOTTY || err == EOPNOTSUPP) return false;  // no flags on this file system
    QRTLog(kLogError, "Failed to stat %s before unsetting UF_IMMUTABLE: %s", path.c_str(), errorText(err));
    return false;
  }
  if (!immutable) return false;
  if (int err = platform::clearImmutableFlag(fd.get())) {
    QRTLog(kLogError, "Failed to lchflags %s: %s", path.c_str(), errorText(err));
    return false;
  }
  QRTLog(kLogNotice, "Unset UF_IMMUTABLE on %s", path.c_str());
  return true;
}

// ---------------------------------------------------------------------------
// Recursive copy.

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
  struct Child {
    std::string name;
    unsigned char type;
  };
  struct Frame {
    UniqueFd src;
    UniqueFd dst;
    struct stat st;
    std::vector<Child> children;
    size_t next = 0;
  };

  int copyEntry(int sdir, const char* sname, int ddir, const char* dname, unsigned char type);
  int enterDirectory(int sdir, const char* sname, int ddir, const char* dname);
  int readChildren(Frame& frame);
  int walk();
  int finishDirectory(Frame& frame);
  int copyFile(int sdir, const char* sname, int ddir, const char* dname);
  int copyData(int sfd, int dfd, off_t size);
  int copySymlink(int sdir, const char* sname, int ddir, const char* dname);
  int copySpecial(int sdir, const char* sname, int ddir, const char* dname);
  int finishItem(int sfd, int dfd, const struct stat& st, bool isDirectory);
  int copyXattrs(int sfd, int dfd, bool isDirectory);
  ssize_t readXattrList(int sfd);
  ssize_t readXattr(int sfd, const char* name);

  bool durable_;
  std::vector<Frame> stack_;
  std::vector<char> names_ = std::vector<char>(4096);
  std::vector<char> value_ = std::vector<char>(4096);
  std::unique_ptr<char[]> dataBuffer_;
  std::unique_ptr<platform::DirectoryBatch> batch_;
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
  if (int err = enterDirectory(sparent, sname, dparent, dname)) return err;
  struct stat dstStat;
  if (fstat(stack_.back().dst.get(), &dstStat) != 0) return errno;
  dstRootDevice_ = dstStat.st_dev;
  dstRootInode_ = dstStat.st_ino;
  dropInheritedAcls_ = fgetxattr(stack_.back().dst.get(), kDefaultAclAttribute, nullptr, 0) >= 0;
  if (int err = walk()) return err;
  return durable_ ? platform::syncDirectory(dparent) : 0;
}

int TreeCloner::walk() {
  while (!stack_.empty()) {
    Frame& top = stack_.back();
    if (top.next == top.children.size()) {
      int err = finishDirectory(top);
      stack_.pop_back();
      if (err) return err;
      continue;
    }
    // copyEntry may push a frame: nothing of top is used after it.
    const Child child = top.children[top.next++];
    if (int err = copyEntry(top.src.get(), child.name.c_str(), top.dst.get(), child.name.c_str(), child.type))
      return err;
  }
  return 0;
}

int TreeCloner::copyEntry(int sdir, const char* sname, int ddir, const char* dname, unsigned char type) {
  if (type == DT_UNKNOWN) {
    struct stat st;
    if (fstatat(sdir, sname, &st, AT_SYMLINK_NOFOLLOW) != 0) return errno;
    type = typeOfMode(st.st_mode);
  }
  switch (type) {
    case DT_DIR: return enterDirectory(sdir, sname, ddir, dname);
    case DT_REG: return copyFile(sdir, sname, ddir, dname);
    case DT_LNK: return copySymlink(sdir, sname, ddir, dname);
    default: return copySpecial(sdir, sname, ddir, dname);
  }
}

// An existing directory at the destination is copied into; a link there is
// refused (ELOOP).
int TreeCloner::enterDirectory(int sdir, const char* sname, int ddir, const char* dname) {
  UniqueFd sfd(openDirectoryAt(sdir, sname));
  if (!sfd.valid()) return errno;
  struct stat st;
  if (fstat(sfd.get(), &st) != 0) return errno;
  if (st.st_dev == dstRootDevice_ && st.st_ino == dstRootInode_) return EINVAL;  // a copy into itself
  if (mkdirat(ddir, dname, S_IRWXU) != 0 && errno != EEXIST) return errno;
  UniqueFd dfd(openDirectoryAt(ddir, dname));
  if (!dfd.valid()) return errno;
  stack_.push_back(Frame{std::move(sfd), std::move(dfd), st, {}, 0});
  return readChildren(stack_.back());
}

// The whole listing up front, so that the source descriptor serves only to
// open children.
int TreeCloner::readChildren(Frame& frame) {
  if (!batch_) batch_ = std::make_unique<platform::DirectoryBatch>();
  for (;;) {
    ssize_t n = platform::readDirectoryBatch(frame.src.get(), batch_.get());
    if (n < 0) return static_cast<int>(-n);
    if (n == 0) return 0;
    int err = 0;
    platform::forEachEntry(*batch_, static_cast<size_t>(n), [&](uint64_t, unsigned char type, const char* name) {
      if (name)
        frame.children.push_back(Child{name, type});
      else
        err = EIO;
    });
    if (err) return err;
  }
}

int TreeCloner::finishDirectory(Frame& frame) {
  if (int err = finishItem(frame.src.get(), frame.dst.get(), frame.st, true)) return err;
  return durable_ ? platform::syncDirectory(frame.dst.get()) : 0;
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

// ---------------------------------------------------------------------------

}  // namespace

// ---------------------------------------------------------------------------

QRTFileManager& QRTFileManager::defaultManager() {
  static QRTFileManager manager;
  return manager;
}

bool QRTFileManager::removeItemAtURL(const QRTURL& url, QRTErrorRef* error) {
  if (url.empty()) {
    QRTSetError(error, QRT_POSIX_ERROR(EFAULT, "nil url passed to -removeItemAtURL:error:"));
    return false;
  }
  SafeParent parent;
  int err = platform::safeOpenParent(url.path(), &parent);
  if (err == 0) {
    TreePruner pruner(parent.fd.get(), parent.name, url.path());
    err = pruner.run();
    if (err == 0 || err == ENOENT) err = pruner.firstError();
  }
  if (err != 0 && err != ENOENT) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "prunetree of %@ failed: %s", url, errorText(err)));
    return false;
  }
  return true;
}

bool QRTFileManager::createDirectoryAtURL(const QRTURL& url, bool withIntermediateDirectories, mode_t mode,
                                          uint32_t owner, int32_t protectionClass, QRTErrorRef* error) {
  return createDirectory(nullptr, url.path(), url, withIntermediateDirectories, mode, owner, protectionClass, nullptr,
                         error);
}

bool QRTFileManager::createDirectory(const platform::Dir* in, std::string_view relative, const QRTURL& url,
                                     bool withIntermediateDirectories, mode_t mode, uint32_t owner,
                                     int32_t protectionClass, platform::Dir* out, QRTErrorRef* error) {
  const char* path = url.fileSystemRepresentation();
  platform::Dir made;
  const uid_t wanted = owner == 0 ? platform::kAnyOwner : owner;
  if (int err = in ? in->makeDirectory(relative, mode, withIntermediateDirectories, wanted, &made, nullptr, url.path())
                   : platform::Dir::make(relative, mode, withIntermediateDirectories, wanted, &made)) {
    if (withIntermediateDirectories)
      QRTSetError(error, QRT_POSIX_ERROR(err, "ensuredirs of %s failed: %s", path, errorText(err)));
    else
      QRTSetError(error, QRT_POSIX_ERROR(err, "mkdir of %s failed: %s", path, errorText(err)));
    return false;
  }
  if (protectionClass != -1) {
    if (int err = platform::setProtectionClass(made.fd(), protectionClass)) {
      QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to setclass(%d) on directory %s: %s", protectionClass, path,
                                         errorText(err)));
      return false;
    }
  }
  if (out) *out = std::move(made);
  return true;
}

bool QRTFileManager::createDirectoryAtURL(const QRTURL& url, bool withIntermediateDirectories, mode_t mode,
                                          uint32_t owner, QRTErrorRef* error) {
  return createDirectoryAtURL(url, withIntermediateDirectories, mode, owner, -1, error);
}

bool QRTFileManager::createDirectoryAtURL(const QRTURL& url, bool withIntermediateDirectories, mode_t mode,
                                          int32_t protectionClass, QRTErrorRef* error) {
  return createDirectoryAtURL(url, withIntermediateDirectories, mode, 0u, protectionClass, error);
}

bool QRTFileManager::createDirectoryAtURL(const QRTURL& url, bool withIntermediateDirectories, mode_t mode,
                                          QRTErrorRef* error) {
  return createDirectoryAtURL(url, withIntermediateDirectories, mode, 0u, -1, error);
}

// Reports a failed look at a copy or move source; always false.
static bool statFailed(const char* function, const QRTURL& src, int err, QRTErrorRef* error) {
  QRTSetError(error, QRTCreatePOSIXError(function, __LINE__, err, "stat of %@ failed: %s", src, errorText(err)));
  return false;
}

// The parents of a copy's or move's two ends. With failIfSrcMissing false a
// missing source is reported as *missing (and true); *resolveError holds what
// stopped the opening of either parent.
static bool openEnds(const char* function, const QRTURL& src, const QRTURL& toURL, bool failIfSrcMissing,
                     SafeParent* from, SafeParent* to, bool* missing, int* resolveError, QRTErrorRef* error) {
  *missing = false;
  int err = *resolveError = platform::safeOpenParent(src.path(), from);
  if (!failIfSrcMissing) {
    struct stat st;
    if (!err && fstatat(from->fd.get(), from->name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) err = errno;
    if (err == ENOENT) *missing = true;
    if (err != 0 && err != ENOENT) return statFailed(function, src, err, error);
  }
  if (!*resolveError && !*missing) *resolveError = platform::safeOpenParent(toURL.path(), to);
  return true;
}

bool QRTFileManager::_copyItemAtURL(const QRTURL& src, const QRTURL& toURL, bool failIfSrcMissing, QRTErrorRef* error) {
  SafeParent from, to;
  bool missing;
  int err;
  if (!openEnds(__func__, src, toURL, failIfSrcMissing, &from, &to, &missing, &err, error)) return false;
  if (missing) return true;
  if (!err) {
    TreeCloner cloner(false);
    err = cloner.run(from.fd.get(), from.name.c_str(), to.fd.get(), to.name.c_str());
  }
  if (err) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "clonetree of %@ to %@ failed: %s", src, toURL, errorText(err)));
    return false;
  }
  return true;
}

bool QRTFileManager::copyItemAtURL(const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error) {
  return _copyItemAtURL(src, toURL, true, error);
}

bool QRTFileManager::copyItemIfExistsAtURL(const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error) {
  return _copyItemAtURL(src, toURL, false, error);
}

// Reports a failed move; always false.
static bool moveFailed(int err, const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error) {
  QRTSetError(error, QRT_POSIX_ERROR(err, "rename of %@ to %@ failed: %s", src, toURL, errorText(err)));
  return false;
}

bool QRTFileManager::_moveItemAtURL(const QRTURL& src, const QRTURL& toURL, bool failIfSrcMissing, QRTErrorRef* error) {
  SafeParent from, to;
  bool missing;
  int err;
  if (!openEnds(__func__, src, toURL, failIfSrcMissing, &from, &to, &missing, &err, error)) return false;
  if (missing) return true;
  if (err) return moveFailed(err, src, toURL, error);
  const platform::Dir fromDir(std::move(from.fd), {}), toDir(std::move(to.fd), {});
  return moveItem(fromDir, from.name, toDir, to.name, src, toURL, error);
}

bool QRTFileManager::moveItem(const platform::Dir& from, std::string_view name, const platform::Dir& to,
                              std::string_view toName, const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error) {
  // EXDEV stays an error: a copy would turn hard links into separate files
  // and write sparse files out in full, as root.
  if (int err = from.renameInto(name, to, toName)) return moveFailed(err, src, toURL, error);
  return true;
}

bool QRTFileManager::moveItemAtURL(const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error) {
  return _moveItemAtURL(src, toURL, true, error);
}

bool QRTFileManager::moveItemIfExistsAtURL(const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error) {
  return _moveItemAtURL(src, toURL, false, error);
}

namespace {

constexpr int kMaxImportDepth = 128;

// Why the item may not be imported, or nullptr.
const char* importRefusal(const struct stat& st, uid_t owner) {
  if (st.st_uid != 0 && st.st_uid != owner) return "owned by another user";
  if (S_ISLNK(st.st_mode)) return nullptr;
  if (!S_ISDIR(st.st_mode) && !S_ISREG(st.st_mode)) return "neither a directory, a file nor a link";
  if (st.st_mode & (S_IWGRP | S_IWOTH)) return "writable by others";
  if (S_ISREG(st.st_mode) && st.st_nlink != 1) return "a file with more than one link";
  return nullptr;
}

// The tree below the directory; false (with the item's path and the reason) at the first refusal.
bool importableTree(int dirfd, std::string& path, uid_t owner, int depth, const char** why) {
  if (depth > kMaxImportDepth) return (*why = "nested too deep"), false;
  UniqueFd dir(platform::openDirectoryAt(dirfd, "."));
  if (!dir.valid()) return (*why = errorText(errno)), false;
  std::vector<std::string> names;
  platform::DirectoryBatch batch;
  for (ssize_t n; (n = platform::readDirectoryBatch(dir.get(), &batch)) != 0;) {
    if (n < 0) return (*why = errorText(static_cast<int>(-n))), false;
    bool malformed = false;
    platform::forEachEntry(batch, static_cast<size_t>(n), [&](uint64_t, unsigned char, const char* name) {
      if (name)
        names.emplace_back(name);
      else
        malformed = true;
    });
    if (malformed) return (*why = "an unreadable entry"), false;
  }
  for (const std::string& name : names) {
    const size_t length = path.size();
    path += "/" + name;
    platform::Item item;
    if (int err = platform::openItemAt(dir.get(), name.c_str(), &item)) return (*why = errorText(err)), false;
    if ((*why = importRefusal(item.st, owner))) return false;
    if (S_ISDIR(item.st.st_mode)) {
      UniqueFd sub;
      if (int err = platform::reopenItem(item, O_RDONLY | O_DIRECTORY, &sub)) return (*why = errorText(err)), false;
      if (!importableTree(sub.get(), path, owner, depth + 1, why)) return false;
    }
    path.resize(length);
  }
  return true;
}

}  // namespace

bool QRTFileManager::itemIsImportableAtURL(const QRTURL& url, const QRTURL& fromBase, uid_t owner,
                                           platform::Item* top) {
  std::string base = fromBase.path(), target = url.path();
  while (base.size() > 1 && base.back() == '/') base.pop_back();
  while (target.size() > 1 && target.back() == '/') target.pop_back();
  std::string path = base;
  const char* why = nullptr;
  platform::Item item;
  if (target != base && target.compare(0, base.size() + 1, base + "/") != 0) {
    why = "not inside the tree it is taken from";
  } else if (int err = platform::safeOpenItem(base, &item)) {
    why = errorText(err);
  } else if (!(why = importRefusal(item.st, owner))) {
    // Down to url one component at a time, each checked on the descriptor of the one before.
    for (size_t start = base.size() + 1; start < target.size() + 1 && !why;) {
      size_t slash = target.find('/', start);
      if (slash == std::string::npos) slash = target.size();
      const std::string name = target.substr(start, slash - start);
      start = slash + 1;
      if (name.empty()) continue;
      path += "/" + name;
      platform::Item next;
      if (!S_ISDIR(item.st.st_mode))
        why = "below something that is not a directory";
      else if (int err = platform::openItemAt(item.fd.get(), name.c_str(), &next))
        why = errorText(err);
      else if (!(why = importRefusal(next.st, owner)))
        item = std::move(next);
    }
    if (!why && S_ISDIR(item.st.st_mode)) {
      UniqueFd dir;
      if (int err = platform::reopenItem(item, O_RDONLY | O_DIRECTORY, &dir))
        why = errorText(err);
      else
        importableTree(dir.get(), path, owner, 0, &why);
    }
  }
  if (why) {
    QRTLog(kLogError, "Not taking %@ from a tree a user can write: %@: %s", url, path, why);
    return false;
  }
  if (top) *top = std::move(item);
  return true;
}

std::optional<QRTURL> QRTFileManager::createTemporaryDirectoryInDirectoryURL(const QRTURL& parent,
                                                                             std::string_view withNamePrefix,
                                                                             QRTErrorRef* error) {
  if (error) *error = nullptr;
  const std::string prefix(withNamePrefix);
  platform::Dir directory;
  std::string name;
  int err = platform::Dir::open(parent.path(), &directory);
  if (!err) err = directory.makeTemporaryDirectory(prefix, S_IRWXU, &name);
  if (!err) return parent.URLByAppendingPathComponent(name, true);
  std::string path = parent.URLByAppendingPathComponent(prefix + "XXXXXX", true).path();
  QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to create temp dir at path %s : %s", path, errorText(err)));
  return std::nullopt;
}

std::optional<QRTURL> QRTFileManager::createTemporaryDirectoryInDirectoryURL(const QRTURL& parent, QRTErrorRef* error) {
  return createTemporaryDirectoryInDirectoryURL(parent, "temp.", error);
}

bool QRTFileManager::_traverseDirectory(const QRTURL& root, QRTErrorRef* error, const QRTTraversalVisitor& withBlock) {
  QRTErrorRef stopError;
  int err = platform::walkTree(root.path(), [&](QRTTraversalEntry& entry) {
    QRTErrorRef visitorError;
    if (withBlock(entry, &visitorError)) return true;
    stopError = std::move(visitorError);
    return false;
  });
  if (err == 0) return true;
  if (err != platform::kTreeWalkStopped)
    stopError = QRT_POSIX_ERROR(err, "Error for path %s: %s", root.fileSystemRepresentation(), errorText(err));
  if (stopError) QRTSetError(error, stopError);
  return false;
}

namespace {

// Calls visit(name, isDirectory) for every visible entry of the directory.
template <typename Visit>
bool iterateDirectory(const QRTURL& url, QRTErrorRef* error, Visit visit) {
  UniqueFd fd;
  int err = platform::safeOpen(url.path(), O_RDONLY | O_DIRECTORY, &fd);
  if (err) {
    if (err != ENOENT)
      QRTLogAs(kLogError, "_IterateDirectory", "opendir of %s failed: %s", url.fileSystemRepresentation(),
               errorText(err));
    QRTSetError(error, QRT_POSIX_ERROR(err, "_IterateDirectory for %@ returned %s", url, errorText(err)));
    return false;
  }
  auto batch = std::make_unique<platform::DirectoryBatch>();
  for (;;) {
    ssize_t n = platform::readDirectoryBatch(fd.get(), batch.get());
    if (n == 0) return true;
    if (n < 0) {
      err = static_cast<int>(-n);
      QRTSetError(error, QRT_POSIX_ERROR(err, "_IterateDirectory for %@ returned %s", url, errorText(err)));
      return false;
    }
    platform::forEachEntry(*batch, static_cast<size_t>(n), [&](uint64_t, unsigned char type, const char* name) {
      if (!name || name[0] == '.') return;
      struct stat st;
      if (type == DT_UNKNOWN && fstatat(fd.get(), name, &st, AT_SYMLINK_NOFOLLOW) == 0) type = typeOfMode(st.st_mode);
      visit(name, type == DT_DIR);
    });
  }
}

}  // namespace

std::optional<std::vector<QRTURL>> QRTFileManager::urlsForItemsInDirectoryAtURL(const QRTURL& url, QRTErrorRef* error) {
  std::vector<QRTURL> urls;
  bool ok = iterateDirectory(url, error, [&](const char* name, bool isDirectory) {
    urls.push_back(url.URLByAppendingPathComponent(name, isDirectory));
  });
  if (!ok) return std::nullopt;
  return urls;
}

bool QRTFileManager::itemExistsAtURL(const QRTURL& url) {
  struct stat st;
  int err = platform::safeStat(url.path(), &st);
  if (err == 0) return true;
  if (err != ENOENT) QRTLog(kLogError, "Failed to determine if %@ exists: %s", url, errorText(err));
  return false;
}

bool QRTFileManager::itemDoesNotExistAtURL(const QRTURL& url) {
  struct stat st;
  int err = platform::safeStat(url.path(), &st);
  if (err == 0) return false;
  if (err == ENOENT) return true;
  QRTLog(kLogError, "Failed to determine if %@ exists: %s", url, errorText(err));
  return false;
}

// ---------------------------------------------------------------------------

namespace {

int writeEncoded(const plist::Data& bytes, const platform::Dir& directory, std::string_view name,
                 QRTWriteOptions withOptions) {
  // A fresh temporary carries no protection class, so an atomic write needs
  // nothing more for QRTWriteFileProtectionNone.
  if (withOptions & QRTWriteAtomic) return directory.replaceFile(name, bytes.data(), bytes.size(), 0644);
  return directory.writeFileInPlace(name, bytes.data(), bytes.size(), (withOptions & QRTWriteFileProtectionNone) != 0);
}

}  // namespace

bool QRT_writeToURL(const plist::Dictionary& dictionary, const QRTURL& url, QRTWriteOptions withOptions,
                    QRTErrorRef* error) {
  plist::Data bytes;
  int err = 0;
  try {
    bytes = plist::writeBinary(plist::Value(dictionary));
  } catch (const std::bad_alloc&) { err = ENOMEM; }
  platform::Dir parent;
  std::string name;
  if (!err) err = platform::Dir::openParent(url.path(), &parent, &name);
  if (!err) err = writeEncoded(bytes, parent, name, withOptions);
  if (err) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to write property list to %@: %s", url, errorText(err)));
    return false;
  }
  return true;
}

bool QRT_writeToDirectory(const plist::Dictionary& dictionary, const platform::Dir& directory, std::string_view name,
                          const QRTURL& url, QRTWriteOptions withOptions, QRTErrorRef* error) {
  plist::Data bytes;
  int err = 0;
  try {
    bytes = plist::writeBinary(plist::Value(dictionary));
  } catch (const std::bad_alloc&) { err = ENOMEM; }
  if (!err) err = writeEncoded(bytes, directory, name, withOptions);
  if (err) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to write property list to %@: %s", url, errorText(err)));
    return false;
  }
  return true;
}

std::optional<plist::Dictionary> QRT_dictionaryWithContentsOfURL(const QRTURL& url, QRTErrorRef* error) {
  return QRT_dictionaryWithContentsOfURL(url, kMaxPropertyListFileSize, plist::Limits{}, error);
}

std::optional<plist::Dictionary> QRT_dictionaryWithContentsOfURL(const QRTURL& url, size_t maxBytes,
                                                                 const plist::Limits& limits, QRTErrorRef* error) {
  std::string bytes;
  if (int err = platform::safeReadFile(url.path(), &bytes, maxBytes)) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to read property list at %@: %s", url, errorText(err)));
    return std::nullopt;
  }
  std::string reason;
  std::optional<plist::Value> value =
      plist::parse(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size(), &reason, limits);
  if (!value) {
    QRTSetError(error,
                QRTCreateError(__func__, __LINE__, QRTPropertyListErrorDomain, QRTPropertyListReadCorruptError, nullptr,
                               nullptr, false, "Failed to parse property list at %@: %s", url, reason.c_str()));
    return std::nullopt;
  }
  if (!value->isDictionary()) {
    QRTSetError(error, QRTCreateError(__func__, __LINE__, QRTPropertyListErrorDomain, QRTFormattingError, nullptr,
                                      nullptr, false, "Property list at %@ is not a dictionary", url));
    return std::nullopt;
  }
  return std::move(value->dictionary());
}

bool containsDotDotPathComponents(std::string_view path) {
  while (!path.empty()) {
    size_t slash = path.find('/');
    if (path.substr(0, slash) == "..") return true;
    if (slash == std::string_view::npos) break;
    path.remove_prefix(slash + 1);
  }
  return false;
}

std::string stringWithFileSystemRepresentation(const char* bytes, size_t length) {
  return bytes ? std::string(bytes, length) : std::string();
}

std::string stringWithFileSystemRepresentation(const char* bytes) { return bytes ? std::string(bytes) : std::string(); }

int QRTGetProtectionClass(int fd, int32_t* cls) { return platform::getProtectionClass(fd, cls); }

int QRTSetProtectionClass(int fd, int32_t cls) { return platform::setProtectionClass(fd, cls); }
