// A directory held open: the daemon resolves a directory once (from the
// device root, never following a link) and then does everything inside it
// relative to this descriptor, so that what it checked is what it acts on
// however the names above are swapped meanwhile. Every operation is the
// FileIO.h or SafePath.h primitive taken relative to the held descriptor; no
// link is followed at any component. Results are 0 or an errno value.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <string>
#include <string_view>
#include <vector>

#include "platform/Acl.h"
#include "platform/FileIO.h"

namespace platform {

class Dir {
 public:
  Dir() = default;
  // Takes fd, a directory open for reading, named relative (to the device
  // root, "." for the root itself).
  Dir(UniqueFd fd, std::string relative) : fd_(std::move(fd)), name_(std::move(relative)) {}
  Dir(Dir&&) noexcept = default;
  Dir& operator=(Dir&&) noexcept = default;

  bool valid() const { return fd_.valid() || borrowed_ >= 0; }
  int fd() const { return borrowed_ >= 0 ? borrowed_ : fd_.get(); }
  // Hands the descriptor over (-1 for the borrowed device root).
  int release() { return fd_.release(); }
  // The name below the device root ("." for the root).
  const std::string& name() const { return name_; }
  // The host path of the directory, or of a child's relative path.
  std::string hostPath(std::string_view child = {}) const;

  // The device root itself, borrowed (it stays open for the process); an
  // O_PATH descriptor, so that it is only ever resolved from.
  static int deviceRoot(Dir* out);
  // A host path below the device root, opened for reading (SafePath.h's
  // rules: EXDEV outside it, ELOOP for a link at any component).
  static int open(std::string_view hostPath, Dir* out);
  // The parent of a host path, open for reading, and the last component.
  static int openParent(std::string_view hostPath, Dir* out, std::string* leaf);

  // openBeneath relative to this directory.
  int openBeneath(std::string_view relative, int flags, UniqueFd* out) const;
  int openDirectory(std::string_view relative, Dir* out) const;
  // The item relative, pinned (FileIO.h's Item); "." is this directory.
  int openItem(std::string_view relative, Item* out) const;
  // lstat of the item relative: every level above it opened beneath this
  // directory without following a link, the item itself not followed.
  int lstat(std::string_view relative, struct stat* st) const;
  // 0 when an entry of any kind (a link included, not followed) is at
  // relative, reached without following a link: one open of a path handle.
  int exists(std::string_view relative) const;

  // safeMakeDirectory relative to this directory (SafePath.h): with
  // withParents every missing level of relative, each opened without
  // following a link before the next is made in it; an existing directory is
  // accepted under the same owner rule, with the same log lines naming
  // shownPath (the host path when empty).
  int makeDirectory(std::string_view relative, mode_t mode, bool withParents, uid_t owner, Dir* out,
                    bool* created = nullptr, std::string_view shownPath = {}) const;
  // The same for a host path, from the device root.
  static int make(std::string_view hostPath, mode_t mode, bool withParents, uid_t owner, Dir* out,
                  bool* created = nullptr);
  // A new directory prefix plus six random letters and digits; a name taken
  // is retried. EEXIST when a hundred are.
  int makeTemporaryDirectory(std::string_view prefix, mode_t mode, std::string* name) const;

  // replaceFileAt (FileIO.h) of a child.
  int replaceFile(std::string_view name, const void* data, size_t size, mode_t mode,
                  uid_t ownerUid = static_cast<uid_t>(-1), gid_t ownerGid = static_cast<gid_t>(-1)) const;
  // Writes a child in place: only a new file or a regular file with one link
  // (ELOOP for a link, EINVAL for another kind of item, EMLINK for more
  // links), never through a second name; clearProtection drops the file's
  // protection class.
  int writeFileInPlace(std::string_view name, const void* data, size_t size, bool clearProtection) const;

  // renameat of the child name to toName in to, then both directories
  // flushed (once when they are one; movers into one directory at the same
  // time share its flushes, FlushGroup.h): 0 means the move is durable. A failed
  // flush leaves the item at the destination. EXDEV across file systems.
  int renameInto(std::string_view name, const Dir& to, std::string_view toName) const;

  // The names in directory order ("." and ".." left out; a malformed record
  // is skipped).
  int list(std::vector<std::string>* names) const;
  struct Entry {
    std::string name;
    bool directory;
  };
  // The same with whether each entry is a directory (looked up, without
  // following a link, where the listing gave no type; one gone meanwhile
  // counts as no directory).
  int list(std::vector<Entry>* entries) const;

  // Changes on an opened child (FileIO.h, Acl.h).
  static int setOwner(const Item& item, uid_t uid, gid_t gid) { return chownItem(item, uid, gid); }
  static int setMode(const Item& item, mode_t mode) { return chmodItem(item, mode); }
  static int setAcl(const Item& item, const Acl& acl, bool asDefault) { return acl.applyTo(item, asDefault); }
  static int setExtendedAttribute(int fd, const char* attribute, const void* value, size_t size) {
    return platform::setExtendedAttribute(fd, attribute, value, size);
  }
  static int clearImmutable(int fd) { return clearImmutableFlag(fd); }

 private:
  // makeDirectory with the owner's host ids already looked up.
  int makeResolved(std::string_view relative, mode_t mode, bool withParents, uid_t hostUid, gid_t hostGid, Dir* out,
                   bool* created, std::string_view shown) const;

  UniqueFd fd_;
  int borrowed_ = -1;
  std::string name_;
};

}  // namespace platform
