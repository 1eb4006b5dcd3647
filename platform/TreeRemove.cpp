#include "platform/TreeRemove.h"

#include <dirent.h>
#include <fcntl.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <thread>
#include <utility>
#include <vector>

#include "base/QRTFormat.h"
#include "platform/FileIO.h"
#include "platform/Log.h"
#include "platform/TreeWalk.h"

namespace platform {

namespace {

constexpr size_t kParallelUnlinkThreshold = 64;
constexpr unsigned kUnlinkThreads = 4;

// Removes a tree on the walk: each directory's files as soon as it is listed,
// the directory itself on the way back up. Entries that cannot be removed are
// reported to entryFailed and the walk goes on; the first such errno is kept.
class TreePruner {
 public:
  // The item name in the directory parentFd; path names it in messages.
  TreePruner(int parentFd, std::string name, std::string path)
      : parentFd_(parentFd), rootName_(std::move(name)), path_(std::move(path)) {}
  // 0 when the walk reached its end, else the errno that stopped it.
  int run();
  int firstError() const { return firstError_.load(); }

 private:
  bool visit(const TreeEntry& entry);
  bool unlinkListed(TreeListing& listing);
  void removeAt(int dirfd, const char* name, int flags, const std::string& path);
  void entryFailed(int dirfd, const char* name, const std::string& path, int err);
  bool unsetImmutable(int dirfd, const char* name, const std::string& path);
  void record(const std::string& path, int err);
  void keepFirst(int err) {
    int expected = 0;
    firstError_.compare_exchange_strong(expected, err);
  }

  int parentFd_;
  std::string rootName_;
  std::string path_;
  std::atomic<int> firstError_{0};  // entryFailed runs on several threads
};

int TreePruner::run() {
  TreeWalkOptions options;
  // Directories are opened and checked on entry anyway, and the rest never
  // reach the visitor but through the listing.
  options.typesFromListing = true;
  options.onListing = [this](TreeListing& listing) { return unlinkListed(listing); };
  return walkTreeAt(
      parentFd_, rootName_.c_str(), path_, [this](TreeEntry& entry) { return visit(entry); }, options);
}

bool TreePruner::visit(const TreeEntry& entry) {
  switch (entry.kind) {
    case TreeEntry::Kind::DirectoryPre:
      // A mount point is seen, never entered: its removal below fails (EBUSY).
      break;
    case TreeEntry::Kind::DirectoryPost: removeAt(entry.parentFd, entry.name, AT_REMOVEDIR, entry.path); break;
    case TreeEntry::Kind::Other:
      if (entry.error && entry.error != ENOTDIR && entry.error != ELOOP) {
        entryFailed(entry.parentFd, entry.name, entry.path, entry.error);
        break;
      }
      [[fallthrough]];  // not a directory, or no longer one
    default: removeAt(entry.parentFd, entry.name, 0, entry.path);
  }
  return true;
}

// Unlinks everything but directories in inode order, which on ext4 is about
// the order of allocation and keeps the inode table and bitmap updates close
// together. Directories stay in the listing for the walk to enter.
//
// An unlink spends most of its time after the directory lock is dropped
// (freeing the inode, and on a disk with online discard waiting for the
// discard), so several threads on one directory overlap that wait. Threads
// take interleaved shares to keep the overall order by inode.
bool TreePruner::unlinkListed(TreeListing& listing) {
  if (listing.error) record(listing.path, listing.error);
  std::vector<TreeListedEntry>& entries = *listing.entries;
  auto firstVictim =
      std::stable_partition(entries.begin(), entries.end(), [](const TreeListedEntry& e) { return e.type == DT_DIR; });
  std::sort(firstVictim, entries.end(),
            [](const TreeListedEntry& a, const TreeListedEntry& b) { return a.inode < b.inode; });
  const TreeListedEntry* victims = entries.data() + (firstVictim - entries.begin());
  const size_t count = static_cast<size_t>(entries.end() - firstVictim);
  const unsigned threads = count >= kParallelUnlinkThreshold ? kUnlinkThreads : 1;
  std::vector<std::vector<std::string>> directories(threads);
  const std::string directoryPath = listing.path;
  auto share = [&](unsigned t) {
    try {
      for (size_t i = t; i < count; i += threads) {
        const char* name = victims[i].name.c_str();
        int err = removeEntryAt(listing.fd, name);
        if (err == 0) continue;
        if (err == EISDIR) {  // the file system gave no type
          directories[t].emplace_back(name);
        } else {
          entryFailed(listing.fd, name, directoryPath + "/" + name, err);
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
  entries.erase(firstVictim, entries.end());
  for (auto& found : directories)
    for (std::string& name : found) entries.push_back({std::move(name), DT_DIR, 0});
  return true;
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

}  // namespace

int removeTree(int parentFd, const std::string& name, const std::string& path) {
  TreePruner pruner(parentFd, name, path);
  int err = pruner.run();
  if (err == 0 || err == ENOENT) err = pruner.firstError();
  return err;
}

}  // namespace platform
