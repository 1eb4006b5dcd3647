#include "platform/Dir.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <memory>
#include <optional>

#include "base/QRTFormat.h"
#include "platform/DeviceRoot.h"
#include "platform/FlushGroup.h"
#include "platform/HostProfile.h"
#include "platform/Log.h"
#include "platform/Random.h"
#include "platform/SafePath.h"

namespace platform {

namespace {

std::string joined(std::string_view base, std::string_view child) {
  if (base == "." || base.empty()) return std::string(child.empty() ? "." : child);
  std::string path(base);
  if (!child.empty()) (path += '/') += child;
  return path;
}

// The host owner of a protocol user; EPERM with a log line when no account
// stands for it (never a numeric id another account may own).
int hostOwner(std::string_view shownPath, uid_t owner, uid_t* uid, gid_t* gid) {
  *uid = *gid = kAnyOwner;
  if (owner == kAnyOwner) return 0;
  std::optional<uid_t> user = hostUserId(owner);
  std::optional<gid_t> group = hostGroupId(owner);
  if (!user || !group) {
    QRTLogAs(kLogError, "safeMakeDirectory", "Refusing %s: no host account stands for user %u",
             std::string(shownPath).c_str(), static_cast<unsigned>(owner));
    return EPERM;
  }
  *uid = *user;
  *gid = *group;
  return 0;
}

// The checks on an item found where a directory was to be made; owner and
// group are host ids.
int acceptDirectory(int fd, std::string_view shownPath, uid_t owner, gid_t group) {
  struct stat st;
  if (fstat(fd, &st) != 0) return errno;
  if (!S_ISDIR(st.st_mode)) {
    QRTLogAs(kLogError, "safeMakeDirectory", "Refusing %s: not a directory", std::string(shownPath).c_str());
    return ENOTDIR;
  }
  if (owner == kAnyOwner) return 0;
  if (st.st_uid != owner && st.st_uid != 0) {
    QRTLogAs(kLogError, "safeMakeDirectory", "Refusing %s: owned by %u, not by %u", std::string(shownPath).c_str(),
             static_cast<unsigned>(st.st_uid), static_cast<unsigned>(owner));
    return EPERM;
  }
  if (st.st_uid != owner || st.st_gid != group) return chownOpened(fd, owner, group);
  return 0;
}

// mkdirat then an O_NOFOLLOW open of what is there; *made tells whether this
// call made it.
int makeOne(int dirfd, const char* name, mode_t mode, std::string_view shownPath, UniqueFd* out, bool* made) {
  *made = mkdirat(dirfd, name, mode) == 0;
  if (!*made && errno != EEXIST) return errno;
  out->reset(openat(dirfd, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (out->valid()) return 0;
  int err = errno;
  if (err == ELOOP || err == ENOTDIR) {
    QRTLogAs(kLogError, "safeMakeDirectory", "Refusing %s: %s where a directory belongs",
             std::string(shownPath).c_str(), err == ELOOP ? "a symbolic link" : "another kind of item");
  }
  return err;
}

void splitLast(std::string_view relative, std::string* parent, std::string* leaf) {
  size_t slash = relative.rfind('/');
  *parent = slash == std::string_view::npos ? "." : std::string(relative.substr(0, slash));
  *leaf = std::string(slash == std::string_view::npos ? relative : relative.substr(slash + 1));
}

}  // namespace

std::string Dir::hostPath(std::string_view child) const {
  const std::string& root = platform::deviceRoot();
  std::string relative = joined(name_, child);
  if (relative == ".") return root;
  return root == "/" ? "/" + relative : root + "/" + relative;
}

int Dir::deviceRoot(Dir* out) {
  int root = deviceRootDescriptor();
  if (root < 0) return errno;
  out->fd_.reset();
  out->borrowed_ = root;
  out->name_ = ".";
  return 0;
}

int Dir::open(std::string_view hostPath, Dir* out) {
  std::string relative;
  if (int err = pathBelowDeviceRoot(hostPath, &relative)) return err;
  Dir root;
  if (int err = deviceRoot(&root)) return err;
  return root.openDirectory(relative, out);
}

int Dir::openParent(std::string_view hostPath, Dir* out, std::string* leaf) {
  std::string relative, parent;
  if (int err = pathBelowDeviceRoot(hostPath, &relative)) return err;
  if (relative == ".") return EINVAL;
  splitLast(relative, &parent, leaf);
  Dir root;
  if (int err = deviceRoot(&root)) return err;
  return root.openDirectory(parent, out);
}

int Dir::openBeneath(std::string_view relative, int flags, UniqueFd* out) const {
  return platform::openBeneath(fd(), std::string(relative).c_str(), flags, out);
}

int Dir::openDirectory(std::string_view relative, Dir* out) const {
  UniqueFd fd;
  if (int err = openBeneath(relative, O_RDONLY | O_DIRECTORY, &fd)) return err;
  *out = Dir(std::move(fd), joined(name_, relative));
  return 0;
}

int Dir::openItem(std::string_view relative, Item* out) const {
  std::string parent, leaf;
  splitLast(relative, &parent, &leaf);
  if (parent == ".") return openItemAt(fd(), leaf.c_str(), out);
  Dir holder;
  if (int err = openDirectory(parent, &holder)) return err;
  return openItemAt(holder.fd(), leaf.c_str(), out);
}

int Dir::lstat(std::string_view relative, struct stat* st) const {
  std::string parent, leaf;
  splitLast(relative, &parent, &leaf);
  if (parent == ".") return fstatat(fd(), leaf.c_str(), st, AT_SYMLINK_NOFOLLOW) == 0 ? 0 : errno;
  UniqueFd holder;
  if (int err = openBeneath(parent, O_PATH | O_DIRECTORY, &holder)) return err;
  return fstatat(holder.get(), leaf.c_str(), st, AT_SYMLINK_NOFOLLOW) == 0 ? 0 : errno;
}

int Dir::exists(std::string_view relative) const {
  UniqueFd item;
  return openBeneath(relative, O_PATH, &item);
}

int Dir::make(std::string_view hostPath, mode_t mode, bool withParents, uid_t owner, Dir* out, bool* created) {
  if (created) *created = false;
  uid_t hostUid;
  gid_t hostGid;
  if (int err = hostOwner(hostPath, owner, &hostUid, &hostGid)) return err;
  std::string relative;
  if (int err = pathBelowDeviceRoot(hostPath, &relative)) return err;
  Dir root;
  if (int err = deviceRoot(&root)) return err;
  return root.makeResolved(relative, mode, withParents, hostUid, hostGid, out, created, hostPath);
}

int Dir::makeDirectory(std::string_view relative, mode_t mode, bool withParents, uid_t owner, Dir* out, bool* created,
                       std::string_view shownPath) const {
  if (created) *created = false;
  const std::string shown = shownPath.empty() ? hostPath(relative) : std::string(shownPath);
  uid_t hostUid;
  gid_t hostGid;
  if (int err = hostOwner(shown, owner, &hostUid, &hostGid)) return err;
  return makeResolved(relative, mode, withParents, hostUid, hostGid, out, created, shown);
}

int Dir::makeResolved(std::string_view relative, mode_t mode, bool withParents, uid_t hostUid, gid_t hostGid, Dir* out,
                      bool* created, std::string_view shown) const {
  const std::string name = joined(name_, relative);
  // Most calls find the directory there already: one resolution settles it.
  UniqueFd fd;
  int err = openBeneath(relative, O_RDONLY | O_DIRECTORY, &fd);
  if (err == 0) {
    if (int refused = acceptDirectory(fd.get(), shown, hostUid, hostGid)) return refused;
    *out = Dir(std::move(fd), name);
    return 0;
  }
  if (err != ENOENT) {
    if (err == ELOOP || err == ENOTDIR)
      QRTLogAs(kLogError, "safeMakeDirectory", "Refusing %s: %s", std::string(shown).c_str(), errorText(err));
    return err;
  }
  bool made = false;
  if (!withParents) {
    std::string parentName, leaf;
    splitLast(relative, &parentName, &leaf);
    Dir parent;
    if (int perr = openDirectory(parentName, &parent)) return perr;
    if (int merr = makeOne(parent.fd(), leaf.c_str(), mode, shown, &fd, &made)) return merr;
  } else {
    // Level by level; each level is opened without following a link before
    // the next one is made inside it.
    UniqueFd level;
    int base = this->fd();
    std::string_view rest(relative);
    while (!rest.empty()) {
      size_t slash = rest.find('/');
      std::string component(rest.substr(0, slash));
      rest.remove_prefix(slash == std::string_view::npos ? rest.size() : slash + 1);
      if (component.empty() || component == ".") continue;
      UniqueFd next;
      if (int merr = makeOne(base, component.c_str(), mode, shown, &next, &made)) return merr;
      // A level made in an ordinary user's home (~/.local/share on a host)
      // is theirs, or their own programs could not use it.
      if (made && hostProfile() && hostUid != kAnyOwner && hostUid >= hostOrdinaryUserMinimum()) {
        if (int cerr = chownOpened(next.get(), hostUid, hostGid)) return cerr;
      }
      level = std::move(next);
      base = level.get();
    }
    fd = std::move(level);
  }
  if (created) *created = made;
  if (int refused = acceptDirectory(fd.get(), shown, hostUid, hostGid)) return refused;
  *out = Dir(std::move(fd), name);
  return 0;
}

int Dir::makeTemporaryDirectory(std::string_view prefix, mode_t mode, std::string* name) const {
  for (int attempt = 0; attempt < 100; ++attempt) {
    std::string candidate = std::string(prefix) + randomAlphanumeric(6);
    if (mkdirat(fd(), candidate.c_str(), mode) == 0) {
      *name = std::move(candidate);
      return 0;
    }
    if (errno != EEXIST) return errno;
  }
  return EEXIST;
}

int Dir::replaceFile(std::string_view name, const void* data, size_t size, mode_t mode, uid_t ownerUid,
                     gid_t ownerGid) const {
  return replaceFileAt(fd(), name, data, size, mode, ownerUid, ownerGid);
}

int Dir::writeFileInPlace(std::string_view name, const void* data, size_t size, bool clearProtection) const {
  const std::string leaf(name);
  Item item;
  UniqueFd file;
  int err = openItemAt(fd(), leaf.c_str(), &item);
  if (err == ENOENT) {
    file.reset(createFileAt(fd(), leaf.c_str(), O_WRONLY, 0644));
    if (!file.valid()) return errno;
  } else if (err) {
    return err;
  } else {
    if (S_ISLNK(item.st.st_mode)) return ELOOP;
    if (!S_ISREG(item.st.st_mode)) return EINVAL;
    if (item.st.st_nlink != 1) return EMLINK;
    if (int reopenErr = reopenItem(item, O_WRONLY, &file)) return reopenErr;
    if (ftruncate(file.get(), 0) != 0) return errno;
  }
  if (int writeErr = writeAll(file.get(), data, size)) return writeErr;
  if (clearProtection) {
    if (int clearErr = clearProtectionClass(file.get())) return clearErr;
  }
  if (close(file.release()) != 0) return errno;
  return 0;
}

int Dir::renameInto(std::string_view name, const Dir& to, std::string_view toName) const {
  const std::string from(name), target(toName);
  if (renameat(fd(), from.c_str(), to.fd(), target.c_str()) != 0) return errno;
  // Both directories flushed before anyone hears of the move (once when
  // they are one); concurrent movers into a directory share its flushes.
  struct stat fromStat, toStat;
  int err = flushDirectoryShared(to.fd());
  bool same = fstat(fd(), &fromStat) == 0 && fstat(to.fd(), &toStat) == 0 && fromStat.st_dev == toStat.st_dev &&
              fromStat.st_ino == toStat.st_ino;
  if (!err && !same) err = flushDirectoryShared(fd());
  return err;
}

namespace {

// Calls visit(fd, type, name) for each readable record of the directory.
template <typename Visit>
int listDirectory(int dirfd, Visit visit) {
  UniqueFd reader(openDirectoryAt(dirfd, "."));
  if (!reader.valid()) return errno;
  auto batch = std::make_unique<DirectoryBatch>();
  for (ssize_t n; (n = readDirectoryBatch(reader.get(), batch.get())) != 0;) {
    if (n < 0) return static_cast<int>(-n);
    forEachEntry(*batch, static_cast<size_t>(n), [&](uint64_t, unsigned char type, const char* entry) {
      if (entry) visit(reader.get(), type, entry);
    });
  }
  return 0;
}

}  // namespace

int Dir::list(std::vector<std::string>* names) const {
  return listDirectory(fd(), [&](int, unsigned char, const char* name) { names->emplace_back(name); });
}

int Dir::list(std::vector<Entry>* entries) const {
  return listDirectory(fd(), [&](int reader, unsigned char type, const char* name) {
    struct stat st;
    if (type == DT_UNKNOWN && fstatat(reader, name, &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(st.st_mode))
      type = DT_DIR;
    entries->push_back({name, type == DT_DIR});
  });
}

}  // namespace platform
