// The import check: a tree is taken from where a user can write only if
// nothing in it can change under the daemon once it is taken.
#include <sys/stat.h>

#include <string>
#include <utility>

#include "Daemon/fileops/QRTFileManager.h"
#include "base/QRTFormat.h"
#include "platform/FileIO.h"
#include "platform/Log.h"
#include "platform/SafePath.h"
#include "platform/TreeWalk.h"

using platform::kLogError;

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

// The tree below the directory item top (its path in path, already checked);
// false (with the item's path and the reason) at the first refusal.
bool importableTree(const platform::Item& top, std::string& path, uid_t owner, const char** why) {
  platform::TreeWalkOptions options;
  options.sameFileSystem = false;
  options.onListing = [&](platform::TreeListing& listing) {
    if (listing.error) *why = errorText(listing.error);
    if (listing.malformed) *why = "an unreadable entry";
    if (*why) path = listing.path;
    return !*why;
  };
  const std::string base = path;
  int err = platform::walkTreeAt(
      top.fd.get(), ".", base,
      [&](platform::TreeEntry& entry) {
        if (entry.kind == platform::TreeEntry::Kind::DirectoryPost) return true;
        path = entry.path;
        if (entry.error)
          *why = errorText(entry.error);  // the top itself too
        else if (entry.level > 0 && !(*why = importRefusal(entry.st, owner)) &&
                 entry.kind == platform::TreeEntry::Kind::DirectoryPre && entry.level > kMaxImportDepth)
          *why = "nested too deep";
        return !*why;
      },
      options);
  if (err && !*why) *why = errorText(err);
  return !*why;
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
    if (!why && S_ISDIR(item.st.st_mode)) importableTree(item, path, owner, &why);
  }
  if (why) {
    QRTLog(kLogError, "Not taking %@ from a tree a user can write: %@: %s", url, path, why);
    return false;
  }
  if (top) *top = std::move(item);
  return true;
}
