// Small descriptor-level I/O shared by the platform adapters and the file
// manager: an owning descriptor, whole writes and reads, atomic replacement,
// bulk directory reads, item attributes, file flags and protection classes.
// Every call that takes a name acts relative to a directory descriptor and
// never follows a final symbolic link. Results are 0 or an errno value.
#pragma once

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>
#include <string_view>
#include <utility>

namespace platform {

class UniqueFd {
 public:
  explicit UniqueFd(int fd = -1) : fd_(fd) {}
  UniqueFd(UniqueFd&& o) noexcept : fd_(o.release()) {}
  UniqueFd& operator=(UniqueFd&& o) noexcept {
    reset(o.release());
    return *this;
  }
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;
  ~UniqueFd() { reset(); }
  int get() const { return fd_; }
  bool valid() const { return fd_ >= 0; }
  int release() { return std::exchange(fd_, -1); }
  void reset(int fd = -1);

 private:
  int fd_;
};

int writeAll(int fd, const void* data, size_t size);
inline int writeAll(int fd, std::string_view text) { return writeAll(fd, text.data(), text.size()); }
// Reads to the end; EFBIG past limit.
int readAll(int fd, std::string* out, size_t limit);
// fsync of a directory; file systems that cannot (EINVAL) count as done.
int syncDirectory(int fd);

// The regular file dirfd/name whole. A link (ELOOP), a directory (EISDIR) or
// a special file (EINVAL) is refused before anything is read.
int readFileAt(int dirfd, const char* name, std::string* out, size_t limit);
// The same for a descriptor already open for reading.
int readOpened(int fd, std::string* out, size_t limit);

// Replaces dirfd/name atomically: a hidden temporary in the same directory
// (exclusive, no link followed), written, flushed, renamed over the name, the
// directory flushed. Whatever was at the name, a planted link included, is
// replaced, never written through. ownerUid/ownerGid -1 keep root's.
int replaceFileAt(int dirfd, std::string_view name, const void* data, size_t size, mode_t mode,
                  uid_t ownerUid = static_cast<uid_t>(-1), gid_t ownerGid = static_cast<gid_t>(-1));

// openat with O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK (and O_NOATIME where the
// caller may have it); -1 with errno on failure.
int openNoFollowAt(int dirfd, const char* name, int flags);
inline int openDirectoryAt(int dirfd, const char* name) { return openNoFollowAt(dirfd, name, O_RDONLY | O_DIRECTORY); }
// A new file dirfd/name (O_CREAT | O_EXCL, no link followed, close-on-exec)
// opened with flags; -1 with errno on failure.
int createFileAt(int dirfd, const char* name, int flags, mode_t mode);
// unlinkat (flags 0 or AT_REMOVEDIR); 0 or an errno value.
int removeEntryAt(int dirfd, const char* name, int flags = 0);
// fsetxattr of an open file; 0 or an errno value.
int setExtendedAttribute(int fd, const char* name, const void* value, size_t size);
// The target of the link dirfd/name, cut at limit bytes; 0 or an errno value.
int readLinkAt(int dirfd, const char* name, std::string* target, size_t limit);
// An O_PATH descriptor of dirfd/name with a final link followed: for root's
// own system directories only, never for anything inside the device root.
// -1 with errno on failure.
int openSystemPathAt(int dirfd, const char* name);
// fstatat of a system directory's entry, a final link followed or not; 0 or
// errno. Like openSystemPathAt, for root's own system directories only.
int statSystemPathAt(int dirfd, const char* name, struct stat* st, bool followLink);
// fchown and fchmod of an open descriptor; 0 or an errno value.
int chownOpened(int fd, uid_t uid, gid_t gid);
int chmodOpened(int fd, mode_t mode);

// A directory as its change time tells it apart: adding, removing or
// renaming an entry moves the change time, as does any change to the
// directory's own attributes, and no user can set it back; another directory
// at the name has another inode.
struct ChangeStamp {
  dev_t device = 0;
  ino_t inode = 0;
  struct timespec changed = {};

  static ChangeStamp of(const struct stat& st) { return {st.st_dev, st.st_ino, st.st_ctim}; }
  bool operator==(const ChangeStamp& o) const {
    return device == o.device && inode == o.inode && changed.tv_sec == o.changed.tv_sec &&
           changed.tv_nsec == o.changed.tv_nsec;
  }
  // Whether the change time lies more than a second before now (a clock
  // reading taken before the directory was looked at): any change from then
  // on stamps it with another, whatever the file system's time granularity,
  // so the stamp may stand for what the look found.
  bool settledBefore(const struct timespec& now) const {
    return (now.tv_sec - changed.tv_sec) * 1000000000LL + (now.tv_nsec - changed.tv_nsec) > 1000000000LL;
  }
};

// An item pinned by an O_PATH descriptor and checked with fstat: whatever
// happens to its name afterwards, changes reach this inode and no other.
// Special files are never opened for reading; links are never followed.
struct Item {
  UniqueFd fd;
  struct stat st {};
};
int openItemAt(int dirfd, const char* name, Item* item);
// A readable descriptor of a regular file or directory item (EINVAL for
// anything else).
int reopenItem(const Item& item, int flags, UniqueFd* out);
int chownItem(const Item& item, uid_t uid, gid_t gid);
// Links have no mode of their own here (EOPNOTSUPP).
int chmodItem(const Item& item, mode_t mode);
// The item as a path that reaches exactly its inode (for libacl).
std::string itemProcPath(const Item& item);

// Bulk directory reads (getdents64). Calls visit(inode, type, name) for each
// entry but "." and ".."; name is null for a malformed record. Returns the
// bytes read (0 at the end) or -errno.
struct DirectoryBatch {
  static constexpr size_t kSize = 32 * 1024;
  alignas(8) char bytes[kSize];
};
ssize_t readDirectoryBatch(int fd, DirectoryBatch* batch);
template <typename Visit>
void forEachEntry(const DirectoryBatch& batch, size_t length, Visit&& visit);

// Attributes of dirfd/name (statx, not following a link, no sync). A field
// the file system did not return is 0.
struct EntryAttributes {
  mode_t mode = 0;  // type bits only when returned
  bool hasType = false;
  uint64_t allocated = 0;
  uint32_t links = 0;
  uint64_t inode = 0;
  dev_t device = 0;
};
int entryAttributesAt(int dirfd, const char* name, EntryAttributes* out);

// The user-immutable flag (FS_IMMUTABLE_FL) of an open regular file or
// directory. ENOTTY/EOPNOTSUPP: the file system has no flags.
int immutableFlag(int fd, bool* set);
int clearImmutableFlag(int fd);

// Protection class: the 4-byte little-endian attribute
// trusted.com.norvane.protection-class of an open file (0 when absent).
// While the device is locked, setting fails with EPERM when the current or
// the new class is 1.
int getProtectionClass(int fd, int32_t* cls);
int setProtectionClass(int fd, int32_t cls);
// The same when the caller has just read the current class from fd: the lock
// state is read only when the current or the new class is 1, which saves a
// file read per item in tree walks.
int setProtectionClass(int fd, int32_t cls, int32_t current);
// The same on a pinned item (a link is ELOOP); FIFOs and sockets are
// reached without being opened.
int itemProtectionClass(const Item& item, int32_t* cls);
int setItemProtectionClass(const Item& item, int32_t cls);
// Removes the attribute (already absent, or no attributes there, is done).
int clearProtectionClass(int fd);
extern const char* const kProtectionClassAttribute;

// ---------------------------------------------------------------------------

struct KernelDirent {
  uint64_t d_ino;
  int64_t d_off;
  unsigned short d_reclen;
  unsigned char d_type;
  char d_name[1];
};

template <typename Visit>
void forEachEntry(const DirectoryBatch& batch, size_t length, Visit&& visit) {
  constexpr size_t header = offsetof(KernelDirent, d_name);
  for (size_t offset = 0; offset + header <= length;) {
    const auto* entry = reinterpret_cast<const KernelDirent*>(batch.bytes + offset);
    const size_t recordLength = entry->d_reclen;
    if (recordLength <= header || recordLength > length - offset) return;
    offset += recordLength;
    const char* name = entry->d_name;
    const size_t room = recordLength - header;
    const size_t nameLength = strnlen(name, room);
    if (name[0] == '.' && (nameLength == 1 || (nameLength == 2 && name[1] == '.'))) continue;
    // A name that fills its record unterminated is no name at all.
    visit(entry->d_ino, entry->d_type, nameLength < room && nameLength > 0 ? name : nullptr);
  }
}

}  // namespace platform
