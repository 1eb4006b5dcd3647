// The one door through which the daemon changes the file system. Each operation
// has a single meaning (already there, already gone count as success), reports
// failures as POSIX-domain errors with fixed messages and never follows a
// symbolic link: every path is resolved from the device root's descriptor
// (platform/SafePath.h), so a link at any component fails with ELOOP and a
// path outside the device root or with a ".." component with EXDEV.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "Daemon/QRTError.h"
#include "base/PlistCodec.h"
#include "base/PlistValue.h"
#include "base/QRTURL.h"
#include "platform/TreeWalk.h"

// One entry of _traverseDirectory (platform/TreeWalk.h).
using QRTTraversalEntry = platform::TreeEntry;

// Returns false to stop the walk, after storing an error in the slot if it has one.
// Paths are resolved from the device root (platform/SafePath.h): a symbolic
// link at any component is refused, never followed.
using QRTTraversalVisitor = std::function<bool(QRTTraversalEntry& entry, QRTErrorRef* error)>;

namespace platform {
class Dir;
struct Item;
}  // namespace platform

class QRTFileManager {
 public:
  static QRTFileManager& defaultManager();

  bool removeItemAtURL(const QRTURL& url, QRTErrorRef* error);

  // Creates the directory (with withIntermediateDirectories every missing
  // level, one at a time, each opened without following a link before the
  // next is made in it) with mode, then sets the class on the directory's
  // descriptor. An existing item is accepted only if it is a real directory
  // and, when an owner is asked for, owned by that owner or by root (a root
  // directory is then given to owner:owner); otherwise the call fails (ELOOP,
  // ENOTDIR, EPERM) with a log line. The mode is applied only by creation;
  // levels made on the way stay root's. Not flushed: publish with a move.
  // owner 0 leaves the owner alone, protectionClass -1 the class. Of the two
  // overloads that take only one of them, an int argument picks the class
  // form and a uint32_t the owner form.
  bool createDirectoryAtURL(const QRTURL& url, bool withIntermediateDirectories, mode_t mode, uint32_t owner,
                            int32_t protectionClass, QRTErrorRef* error);
  bool createDirectoryAtURL(const QRTURL& url, bool withIntermediateDirectories, mode_t mode, uint32_t owner,
                            QRTErrorRef* error);
  bool createDirectoryAtURL(const QRTURL& url, bool withIntermediateDirectories, mode_t mode, int32_t protectionClass,
                            QRTErrorRef* error);
  bool createDirectoryAtURL(const QRTURL& url, bool withIntermediateDirectories, mode_t mode, QRTErrorRef* error);

  // The same relative to a directory already held (in null: from the device
  // root, relative then being the host path); url names the directory in
  // errors and log lines. *out, when given, receives the directory, open.
  bool createDirectory(const platform::Dir* in, std::string_view relative, const QRTURL& url,
                       bool withIntermediateDirectories, mode_t mode, uint32_t owner, int32_t protectionClass,
                       platform::Dir* out, QRTErrorRef* error);

  bool _copyItemAtURL(const QRTURL& src, const QRTURL& toURL, bool failIfSrcMissing, QRTErrorRef* error);
  bool copyItemAtURL(const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error);
  bool copyItemIfExistsAtURL(const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error);

  // renameat between the two safely opened parent directories, both of which
  // are flushed before true is returned: true means the move is durable. A
  // false after the rename itself succeeded (a failed flush) leaves the item
  // at the destination. Across file systems the move fails with EXDEV: a
  // container is never copied on its way.
  bool _moveItemAtURL(const QRTURL& src, const QRTURL& toURL, bool failIfSrcMissing, QRTErrorRef* error);
  bool moveItemAtURL(const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error);
  // The same between two directories already held; src and toURL name the
  // two ends in errors.
  bool moveItem(const platform::Dir& from, std::string_view name, const platform::Dir& to, std::string_view toName,
                const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error);
  bool moveItemIfExistsAtURL(const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error);

  // mkdirat of prefix plus six random letters and digits, mode 0700 (owned
  // by root), relative to the safely opened parent; a name taken is retried.
  std::optional<QRTURL> createTemporaryDirectoryInDirectoryURL(const QRTURL& parent, std::string_view withNamePrefix,
                                                               QRTErrorRef* error);
  std::optional<QRTURL> createTemporaryDirectoryInDirectoryURL(const QRTURL& parent, QRTErrorRef* error);

  // Physical walk on the root's device through descriptors; directories are
  // seen before and after their contents. An entry that vanishes meanwhile is
  // passed over; a directory swapped since the listing is an Other entry with
  // error ESTALE and is not entered.
  bool _traverseDirectory(const QRTURL& root, QRTErrorRef* error, const QRTTraversalVisitor& withBlock);

  // The one check before anything is taken from a tree a user can write into
  // a place they cannot (a global class, a system container, the daemon's
  // home, the code-signing database): every directory from base down to url,
  // and every item of url's tree, is owned by root or by owner and writable
  // by no one else, each regular file has one link, and nothing else but
  // directories and links is there. Checked on the descriptors of one walk
  // that follows no link; a refusal gets a log line naming the item and why.
  // *top, when given, receives url's item, pinned. Callers check the
  // destination again after the move, with base equal to url there.
  bool itemIsImportableAtURL(const QRTURL& url, const QRTURL& fromBase, uid_t owner, platform::Item* top = nullptr);

  // Items of the directory in directory order, hidden names left out.
  std::optional<std::vector<QRTURL>> urlsForItemsInDirectoryAtURL(const QRTURL& url, QRTErrorRef* error);

  // Both answer false when the question cannot be settled.
  bool itemExistsAtURL(const QRTURL& url);
  bool itemDoesNotExistAtURL(const QRTURL& url);

  // ---- ACLs and ownership of system containers (QRTFileManagerACL.cpp) ----
  // Access lists grant the group "systemusers" its rights; the inherited
  // list, which directories carry, is what new items inside receive.
  struct SystemContainerACL;
  struct SystemContainerACLDeleter {
    void operator()(SystemContainerACL* acl) const;
  };
  using SystemContainerACLPtr = std::unique_ptr<SystemContainerACL, SystemContainerACLDeleter>;

  // Adds the group's entry with the given rights (ACL_READ, ACL_WRITE,
  // ACL_EXECUTE) to the lists the inheritance flags pick. Error 63.
  bool _CreateSystemUserACEInACL(SystemContainerACL* acl, uint32_t withPermissions, uint32_t andFlags,
                                 QRTErrorRef* withError);
  SystemContainerACLPtr _CopySystemContainerACLWithNumACEs(int numACEs, bool isDir, bool inheritOnly,
                                                           QRTErrorRef* withError);
  SystemContainerACLPtr _CopyTopLevelSystemContainerACLWithError(QRTErrorRef* error);
  // The top directory keeps its owner and mode bits; error 63.
  bool setTopLevelSystemContainerACLAtURL(const QRTURL& url, QRTErrorRef* error);
  // The same on a directory already held (url names it in errors).
  bool setTopLevelSystemContainerACL(const platform::Dir& directory, const QRTURL& url, QRTErrorRef* error);
  // Whether the top directory carries the lists setTopLevelSystemContainerACL
  // gives it (its own mode bits in the owner, group and other entries); false
  // with error 63 when they cannot be read or built.
  bool topLevelSystemContainerACLMatchesAtURL(const QRTURL& url, bool* matches, QRTErrorRef* error);
  // Stamps the tree; single entries that cannot be changed are only logged.
  bool standardizeACLsAtURL(const QRTURL& url, bool isSystemContainer, QRTErrorRef* error);
  bool standardizeACLsForSystemContainerAtURL(const QRTURL& url, QRTErrorRef* error);
  // Every container directory of a system class directory.
  bool standardizeAllSystemContainerACLsAtURL(const QRTURL& url, QRTErrorRef* error);
  // Owner and group as given, mode 0755 or 0644; symbolic links are changed
  // themselves, never their targets. Both walks leave alone a regular file
  // with more than one link that is not already the target owner's.
  bool standardizeOwnershipAtURL(const QRTURL& url, uid_t toUID, gid_t GID, QRTErrorRef* error);

  // Disk usage and protection classes (QRTFileManagerUsage.cpp)
  // Allocated bytes of every non-directory below the directory, each
  // multiply-linked file once; unreadable parts are logged and left out.
  uint64_t diskUsageForURL(const QRTURL& url);
  // Neither follows a final symbolic link. An empty predicate means always;
  // one that answers false (given the current class) leaves the item alone
  // and still succeeds.
  bool dataProtectionClassOfItemAtURL(const QRTURL& url, int32_t* cls, QRTErrorRef* error);
  bool setDataProtectionClassOfItemAtURL(const QRTURL& url, int32_t toClass,
                                         const std::function<bool(int32_t)>& ifPredicate, QRTErrorRef* error);
  // Logs every item of the tree, for diagnosing orphaned containers.
  void printDirectoryStructureAtURL(const QRTURL& url);

  // Path containment (QRTFileManagerContainment.cpp). The path a client named
  // inside base, resolved, or nothing (with a log line) when it could lead
  // out of base: a ".." component, a link at any component on the way, an
  // absolute link, or a relative link that climbs out. A relative link as the
  // last component is followed (lexically, a few hops at most) and its target
  // judged again. "/var" and "/private/var" name the same place. Nothing on
  // disk changes.
  std::optional<QRTURL> realPathForURL(const std::optional<QRTURL>& url, const std::optional<QRTURL>& ifChildOfURL);
  // The path with no link at any component (ELOOP otherwise); with
  // allowNonExistentPathComponents a missing tail is appended to what exists.
  std::optional<QRTURL> _realPathForURL(const QRTURL& url, bool allowNonExistentPathComponents);
  std::optional<QRTURL> _realPathWhatExistsInPath(const std::string& path);
  // ".." lowers the depth, any other named component raises it; false as soon
  // as it falls below the starting depth.
  bool _validateSymlink(const std::optional<std::string>& path, int32_t withStartingDepth, int32_t* andEndingDepth);

 private:
  QRTFileManager() = default;
  bool setTopLevelACL(const platform::Dir* directory, const QRTURL& url, QRTErrorRef* error);
};

enum QRTWriteOptions : uint32_t {
  QRTWriteOptionsNone = 0,
  // Temporary file in the same directory, flushed, renamed into place, the
  // directory flushed.
  QRTWriteAtomic = 1u << 0,
  // The written file carries no protection class.
  QRTWriteFileProtectionNone = 1u << 1,
};
constexpr QRTWriteOptions operator|(QRTWriteOptions a, QRTWriteOptions b) {
  return static_cast<QRTWriteOptions>(static_cast<uint32_t>(a) | static_cast<uint32_t>(b));
}

// ---- Property-list files (QRTFileManagerPlist.cpp) ----
// Writes the dictionary as a binary property list. Atomic: a hidden
// temporary (mode 0644, exclusive, no link followed) in the safely opened
// directory, written, fsync'd, renameat over the name, the directory fsync'd;
// a link or hard link at the name is replaced, never written through, and
// the new file has no protection class. In place: only a new file or a
// regular file with one link is written (ELOOP, EINVAL, EMLINK otherwise).
bool QRT_writeToURL(const plist::Dictionary& dictionary, const QRTURL& url, QRTWriteOptions withOptions,
                    QRTErrorRef* error);
// The same for the child name of a directory already held; url names the
// file in errors.
bool QRT_writeToDirectory(const plist::Dictionary& dictionary, const platform::Dir& directory, std::string_view name,
                          const QRTURL& url, QRTWriteOptions withOptions, QRTErrorRef* error);
// Reads a property list of any supported format whose top level is a
// dictionary. Unparsable bytes fail in QRTPropertyListErrorDomain with 3840, another
// top-level type with 2048, a read failure with a POSIX error.
std::optional<plist::Dictionary> QRT_dictionaryWithContentsOfURL(const QRTURL& url, QRTErrorRef* error);
// The same for a file of at most maxBytes (EFBIG past it) whose value stays
// within limits; for files whose values are kept for long.
std::optional<plist::Dictionary> QRT_dictionaryWithContentsOfURL(const QRTURL& url, size_t maxBytes,
                                                                 const plist::Limits& limits, QRTErrorRef* error);

inline constexpr int32_t QRTPropertyListReadCorruptError = 3840;
inline constexpr int32_t QRTFormattingError = 2048;

// True when a component of the path is exactly "..".
bool containsDotDotPathComponents(std::string_view path);
std::string stringWithFileSystemRepresentation(const char* bytes, size_t length);
std::string stringWithFileSystemRepresentation(const char* bytes);

// Protection class of an open file (an item without the attribute has class
// 0). Both return 0 or an errno value; while the device is locked, setting
// fails with EPERM when the current or the new class is 1.
int QRTGetProtectionClass(int fd, int32_t* cls);
int QRTSetProtectionClass(int fd, int32_t cls);
