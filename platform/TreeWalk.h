// The tree walk: every entry reached through its parent's descriptor, no link
// ever followed, at most a bounded number of directories held open. Each
// directory is opened by name and checked against what its listing said, so
// a swap during the walk ends in an entry that cannot be read, never in a walk
// of something else. Entries that vanish meanwhile are passed over.
#pragma once

#include <sys/stat.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

namespace platform {

// One entry of a walk. Valid only during the visitor's call.
struct TreeEntry {
  enum class Kind { DirectoryPre, DirectoryPost, File, Symlink, Other };
  const char* path = nullptr;
  int level = 0;  // 0 for the root
  Kind kind = Kind::Other;
  struct stat st {};
  int error = 0;  // errno of a directory that could not be read (kind Other)
  // A directory's own descriptor on DirectoryPre and DirectoryPost, -1 when
  // it is not entered.
  int fd = -1;
  // The directory that holds the entry and its name there: act on the entry
  // only through these (openItemAt), never through path, and check that what
  // is opened is still st.
  int parentFd = -1;
  const char* name = nullptr;
  // Set by the visitor on a DirectoryPre entry to pass over its contents.
  bool skipDescendants = false;
};

// One name of a directory's listing, with the type and inode it gave
// (DT_UNKNOWN where it gave none).
struct TreeListedEntry {
  std::string name;
  unsigned char type;
  uint64_t inode;
};

// A directory's listing, read whole before any of its entries is visited.
struct TreeListing {
  const char* path = nullptr;
  int level = 0;  // of the directory
  int fd = -1;    // the directory's own descriptor
  // errno of a listing that broke off; entries then holds what was read.
  int error = 0;
  // Records of the listing that named nothing readable, left out of entries.
  size_t malformed = 0;
  // The entries still to visit: the hook may deal with some itself and take
  // them out, or reorder the rest.
  std::vector<TreeListedEntry>* entries = nullptr;
};

// False stops the walk.
using TreeListingHook = std::function<bool(TreeListing& listing)>;

struct TreeWalkOptions {
  // Deeper trees are walked with only this many directories open; the rest
  // are reopened through ".." on the way back up, and only if still the
  // directory the walk came from (ESTALE otherwise).
  size_t maxOpenDirectories = 64;
  // A directory on another file system than the root's is visited, never
  // entered.
  bool sameFileSystem = true;
  // Entries other than directories carry only their type in st.st_mode, as
  // the listing gave it (an fstatat only where it gave none), so that a walk
  // that opens and checks each entry anyway pays no stat for it.
  bool typesFromListing = false;
  // Called with each entered directory's listing, after its DirectoryPre
  // visit. A listing that breaks off goes to it with its error; without it,
  // such a listing ends the walk.
  TreeListingHook onListing;
};

// False stops the walk.
using TreeVisitor = std::function<bool(TreeEntry& entry)>;

// The visitor is called for the root (a directory or not) and for each entry
// below it: directories before (DirectoryPre) and after (DirectoryPost) their
// children. A directory that cannot be opened or was swapped since the
// listing is an Other entry with its error and is not entered. Returns 0 when
// the walk reached its end, kTreeWalkStopped when the visitor stopped it, or
// an errno value when the walk could not go on (the root unreachable
// (SafePath.h), a listing that failed).
inline constexpr int kTreeWalkStopped = -1;
int walkTree(std::string_view hostPath, const TreeVisitor& visitor, const TreeWalkOptions& options = {});
// The same from the item name in the directory parentFd; path is the root
// entry's path.
int walkTreeAt(int parentFd, const char* name, std::string_view path, const TreeVisitor& visitor,
               const TreeWalkOptions& options = {});

}  // namespace platform
