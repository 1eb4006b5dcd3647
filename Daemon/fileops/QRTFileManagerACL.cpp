// System-container rights as POSIX ACLs: every item carries an access list with
// empty owner, group and other entries, a "systemusers" group entry with full
// rights and a mask that leaves it whole; directories add a default list with
// the same entries so that new items inherit them.

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <algorithm>
#include <cstring>
#include <memory>
#include <string>
#include <utility>

#include "base/QRTFormat.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "platform/Acl.h"
#include "platform/Dir.h"
#include "platform/FileIO.h"
#include "platform/Log.h"
#include "platform/SafePath.h"
#include "platform/UserDatabase.h"

using platform::kLogError;
using platform::kLogNotice;

using platform::Acl;
using platform::AclFailure;
using platform::kAclExecute;
using platform::kAclRead;
using platform::kAclWrite;

struct QRTFileManager::SystemContainerACL {
  Acl access;
  // The default list; only directories have one.
  Acl inherited;
};

void QRTFileManager::SystemContainerACLDeleter::operator()(SystemContainerACL* acl) const { delete acl; }

namespace {

constexpr const char* kSystemUsersGroupName = "systemusers";
constexpr const char* kMetadataFileName = ".com.norvane.quarter_kit.metadata.plist";

constexpr uint32_t kAllPermissions = kAclRead | kAclWrite | kAclExecute;
constexpr uint32_t kFullDirectoryPermissions = kAllPermissions;
constexpr uint32_t kFullFilePermissions = kAllPermissions;
// Write and search: the group may add items to the top directory, nothing more.
constexpr uint32_t kTopLevelPermissions = kAclWrite | kAclExecute;

// File or directory inheritance puts an entry into the default list;
// inherit-only keeps it out of the item's own list.
enum : uint32_t {
  kFlagInherited = 0x10,
  kFlagFileInherit = 0x20,
  kFlagDirectoryInherit = 0x40,
  kFlagInheritOnly = 0x100,
};
constexpr uint32_t kAllFlags = kFlagInherited | kFlagFileInherit | kFlagDirectoryInherit | kFlagInheritOnly;
constexpr uint32_t kDirectoryFlags = kFlagFileInherit | kFlagDirectoryInherit;
constexpr uint32_t kDirectoryInheritOnlyFlags = kDirectoryFlags | kFlagInheritOnly;
constexpr uint32_t kFileFlags = kFlagInherited;
constexpr uint32_t kNoFlags = 0;

// Owner, group and other entries.
constexpr int kBaseEntryCount = 3;

// Error 63; the message ends with the text of err, taken before anything
// else can touch errno.
template <typename... Args>
QRTErrorRef aclError(const char* function, int line, int err, const char* format, const Args&... args) {
  return QRTCreateError(function, line, QRTErrorDomain, QRTErrorACLFailed, nullptr, nullptr, false, format, args...,
                        errorText(err));
}
#define QRT_ACL_ERROR(err, ...) aclError(__func__, __LINE__, (err), __VA_ARGS__)

// The library calls that these errors name.
constexpr const char* kAddPermCall = "acl_add_perm";
constexpr const char* kCreateEntryCall = "acl_create_entry";
constexpr const char* kAddFlagCall = "acl_add_flag_np";

// The failed step as the error the caller reports.
QRTErrorRef aclFailureError(const AclFailure& failure, uint32_t permissions) {
  if (strcmp(failure.call, kAddPermCall) == 0)
    return QRT_ACL_ERROR(failure.err, "%s() failed to set perms %x: %s", failure.call, permissions);
  return QRT_ACL_ERROR(failure.err, "%s() failed: %s", failure.call);
}

// A list with owner, group and other entries that grant nothing.
Acl newList(int numACEs, QRTErrorRef* error) {
  Acl list;
  if (AclFailure failure = Acl::makeWithOwnerEntries(numACEs + kBaseEntryCount, &list)) {
    QRTSetError(error, aclFailureError(failure, 0));
    return Acl();
  }
  return list;
}

bool addGroupEntry(Acl& list, gid_t gid, uint32_t permissions, QRTErrorRef* error) {
  if (AclFailure failure = list.addGroup(gid, permissions)) {
    QRTSetError(error, aclFailureError(failure, permissions));
    return false;
  }
  return true;
}

// The entry the walk saw, pinned; ESTALE when its name now holds another item.
int openEntry(const QRTTraversalEntry& entry, platform::Item* item) {
  if (int err = platform::openItemAt(entry.parentFd, entry.name, item)) return err;
  if (item->st.st_dev != entry.st.st_dev || item->st.st_ino != entry.st.st_ino) return ESTALE;
  return 0;
}

// A second name of a file someone else owns may lead outside the tree: such
// a file keeps its owner, mode and list.
bool foreignHardLink(const struct stat& st, uid_t owner, const char* path, const char* function) {
  if (!S_ISREG(st.st_mode) || st.st_nlink <= 1 || st.st_uid == owner) return false;
  QRTLogAs(kLogError, function, "Leaving %s alone: a file with %u links owned by %u", path,
           static_cast<unsigned>(st.st_nlink), static_cast<unsigned>(st.st_uid));
  return true;
}

// 0 or an errno value. keepModeOf, when given, supplies the owner, group and
// other rights in place of the list's empty ones. Set through the item's own
// descriptor entry, which reaches its inode without opening it.
int applyList(const platform::Item& item, const QRTFileManager::SystemContainerACL& list,
              const struct stat* keepModeOf) {
  const Acl* access = &list.access;
  Acl merged;
  if (keepModeOf) {
    if (int err = list.access.duplicate(&merged)) return err;
    if (int err = merged.adoptModeBits(keepModeOf->st_mode)) return err;
    access = &merged;
  }
  if (list.inherited && S_ISDIR(item.st.st_mode)) {
    if (int err = list.inherited.applyTo(item, true)) return err;
  }
  return access->applyTo(item, false);
}

// The entries of a list's text that name a user or group ("g:1001:rwx").
std::string namedEntries(const std::string& text) {
  std::string named;
  for (size_t at = 0; at < text.size();) {
    size_t end = std::min(text.find(',', at), text.size());
    const std::string entry = text.substr(at, end - at);
    if (entry.size() > 2 && entry.find(':') != std::string::npos && entry[entry.find(':') + 1] != ':')
      named += entry + ",";
    at = end + 1;
  }
  return named;
}

bool isMetadataPath(const char* path) { return strstr(path, kMetadataFileName) != nullptr; }

struct StampLists {
  QRTFileManager::SystemContainerACLPtr topLevel, directory, file;
};

// One entry of a stamping walk; failures are logged and the walk goes on.
void stampItem(const QRTTraversalEntry& entry, const StampLists& lists, bool isContainerRoot) {
  platform::Item item;
  if (int err = openEntry(entry, &item)) {
    QRTLogAs(kLogError, "standardizeACLsAtURL", "Failed to set ACL on dir %s: %s", entry.path, errorText(err));
    return;
  }
  const struct stat& st = item.st;
  // Links carry no ACL, and their targets may lie outside the tree.
  if (S_ISLNK(st.st_mode)) return;
  if (!isContainerRoot && foreignHardLink(st, platform::kNobodyUserId, entry.path, "standardizeACLsAtURL")) return;
  bool isDirectory = S_ISDIR(st.st_mode);
  // chmod rewrites an access ACL, so the mode goes before the list is set.
  if (!isContainerRoot) {
    if (int err = platform::chmodItem(item, 0))
      QRTLogAs(kLogError, "standardizeACLsAtURL", "Could not chmod %s: %s", entry.path, errorText(err));
  }
  const auto& list = isDirectory ? (isContainerRoot ? lists.topLevel : lists.directory) : lists.file;
  if (int err = applyList(item, *list, isContainerRoot ? &st : nullptr)) {
    if (isDirectory && isContainerRoot)
      QRTLogAs(kLogError, "standardizeACLsAtURL", "Failed to set top level ACL on dir %s: %s", entry.path,
               errorText(err));
    else
      QRTLogAs(kLogError, "standardizeACLsAtURL", "Failed to set ACL on dir %s: %s", entry.path, errorText(err));
  }
  if (!isContainerRoot) {
    if (int err = platform::chownItem(item, platform::kNobodyUserId, platform::kNobodyUserId))
      QRTLogAs(kLogError, "standardizeACLsAtURL", "Could not chown %s: %s", entry.path, errorText(err));
  }
}

mode_t ownershipMode(mode_t mode) { return S_ISDIR(mode) || (mode & (S_IXUSR | S_IXGRP | S_IXOTH)) ? 0755 : 0644; }

// Sets owner and mode of one item; changeOwner decides whether chown runs.
void resetOwnership(const platform::Item& item, bool changeOwner, uid_t uid, gid_t gid, const char* displayPath) {
  if (foreignHardLink(item.st, uid, displayPath, "standardizeOwnershipAtURL")) return;
  if (changeOwner) {
    if (int err = platform::chownItem(item, uid, gid))
      QRTLogAs(kLogError, "standardizeOwnershipAtURL", "Could not chown %s: %s", displayPath, errorText(err));
  }
  // A link's own mode means nothing on Linux and cannot be changed.
  if (S_ISLNK(item.st.st_mode)) return;
  if (int err = platform::chmodItem(item, ownershipMode(item.st.st_mode)))
    QRTLogAs(kLogError, "standardizeOwnershipAtURL", "Could not chmod %s: %s", displayPath, errorText(err));
}

}  // namespace

bool QRTFileManager::_CreateSystemUserACEInACL(SystemContainerACL* acl, uint32_t withPermissions, uint32_t andFlags,
                                               QRTErrorRef* withError) {
  if (!acl || !acl->access) {
    QRTSetError(withError, QRT_ACL_ERROR(EINVAL, "%s() failed: %s", kCreateEntryCall));
    return false;
  }
  if (withPermissions & ~kAllPermissions) {
    QRTSetError(withError, QRT_ACL_ERROR(EINVAL, "%s() failed to set perms %x: %s", kAddPermCall, withPermissions));
    return false;
  }
  if (andFlags & ~kAllFlags) {
    QRTSetError(withError, QRT_ACL_ERROR(EINVAL, "%s() failed to set flags %x: %s", kAddFlagCall, andFlags));
    return false;
  }
  std::optional<platform::GroupAccount> group = platform::groupByName(kSystemUsersGroupName);
  if (!group) {
    QRTSetError(withError, QRT_ACL_ERROR(ENOENT, "resolve_group_guid() failed: %s"));
    return false;
  }
  if (!(andFlags & kFlagInheritOnly) && !addGroupEntry(acl->access, group->gid, withPermissions, withError))
    return false;
  if (andFlags & (kFlagFileInherit | kFlagDirectoryInherit)) {
    if (!acl->inherited && !(acl->inherited = newList(1, withError))) return false;
    if (!addGroupEntry(acl->inherited, group->gid, withPermissions, withError)) return false;
  }
  return true;
}

QRTFileManager::SystemContainerACLPtr QRTFileManager::_CopySystemContainerACLWithNumACEs(int numACEs, bool isDir,
                                                                                         bool inheritOnly,
                                                                                         QRTErrorRef* withError) {
  SystemContainerACLPtr list(new SystemContainerACL);
  list->access = newList(numACEs, withError);
  if (!list->access) return nullptr;
  uint32_t permissions = isDir ? kFullDirectoryPermissions : kFullFilePermissions;
  uint32_t flags = !isDir ? kFileFlags : inheritOnly ? kDirectoryInheritOnlyFlags : kDirectoryFlags;
  if (!_CreateSystemUserACEInACL(list.get(), permissions, flags, withError)) return nullptr;
  return list;
}

QRTFileManager::SystemContainerACLPtr QRTFileManager::_CopyTopLevelSystemContainerACLWithError(QRTErrorRef* error) {
  SystemContainerACLPtr list = _CopySystemContainerACLWithNumACEs(2, true, true, error);
  if (!list || !_CreateSystemUserACEInACL(list.get(), kTopLevelPermissions, kNoFlags, error)) return nullptr;
  return list;
}

bool QRTFileManager::setTopLevelSystemContainerACLAtURL(const QRTURL& url, QRTErrorRef* error) {
  return setTopLevelACL(nullptr, url, error);
}

bool QRTFileManager::setTopLevelSystemContainerACL(const platform::Dir& directory, const QRTURL& url,
                                                   QRTErrorRef* error) {
  return setTopLevelACL(&directory, url, error);
}

bool QRTFileManager::setTopLevelACL(const platform::Dir* directory, const QRTURL& url, QRTErrorRef* error) {
  QRTErrorRef listError;
  SystemContainerACLPtr list = _CopyTopLevelSystemContainerACLWithError(&listError);
  int err = 0;
  if (!list) {
    err = EINVAL;
  } else {
    platform::Item item;
    err = directory ? directory->openItem(".", &item) : platform::safeOpenItem(url.path(), &item);
    if (!err && S_ISLNK(item.st.st_mode)) err = ELOOP;
    if (!err) err = applyList(item, *list, &item.st);
  }
  if (err == 0) return true;
  QRTSetError(error,
              QRT_ERROR(QRTErrorACLFailed, listError, false, "Failed to set ACL on %@: %s", url, errorText(err)));
  return false;
}

bool QRTFileManager::topLevelSystemContainerACLMatchesAtURL(const QRTURL& url, bool* matches, QRTErrorRef* error) {
  QRTErrorRef listError;
  SystemContainerACLPtr list = _CopyTopLevelSystemContainerACLWithError(&listError);
  platform::Item item;
  Acl found;
  int err = list ? platform::safeOpenItem(url.path(), &item) : EINVAL;
  if (!err && S_ISLNK(item.st.st_mode)) err = ELOOP;
  if (!err) err = Acl::readFrom(item, false, &found);
  if (err) {
    QRTSetError(error,
                QRT_ERROR(QRTErrorACLFailed, listError, false, "Failed to read ACL of %@: %s", url, errorText(err)));
    return false;
  }
  // The owner, group and other entries follow the mode, and the mask with
  // them; what the stamp adds are the named entries.
  *matches = namedEntries(found.text()) == namedEntries(list->access.text());
  if (*matches && list->inherited && S_ISDIR(item.st.st_mode)) {
    Acl inherited;
    *matches = Acl::readFrom(item, true, &inherited) == 0 && inherited.text() == list->inherited.text();
  }
  return true;
}

bool QRTFileManager::standardizeACLsAtURL(const QRTURL& url, bool isSystemContainer, QRTErrorRef* error) {
  StampLists lists;
  if (!(lists.topLevel = _CopyTopLevelSystemContainerACLWithError(error)) ||
      !(lists.directory = _CopySystemContainerACLWithNumACEs(1, true, false, error)) ||
      !(lists.file = _CopySystemContainerACLWithNumACEs(1, false, false, error)))
    return false;
  return _traverseDirectory(url, error, [&](QRTTraversalEntry& entry, QRTErrorRef*) {
    if (entry.kind != QRTTraversalEntry::Kind::DirectoryPost && !isMetadataPath(entry.path))
      stampItem(entry, lists, isSystemContainer && entry.level == 0);
    return true;
  });
}

bool QRTFileManager::standardizeACLsForSystemContainerAtURL(const QRTURL& url, QRTErrorRef* error) {
  return standardizeACLsAtURL(url, true, error);
}

bool QRTFileManager::standardizeAllSystemContainerACLsAtURL(const QRTURL& url, QRTErrorRef* error) {
  QRTErrorRef listError;
  std::optional<std::vector<QRTURL>> containers = urlsForItemsInDirectoryAtURL(url, &listError);
  if (!containers) {
    if (listError && listError->domain() == QRTPOSIXErrorDomain && listError->code() == ENOENT) return true;
    QRTLog(kLogError, "Failed to get items at URL%@ : %@", url, listError);
    QRTSetError(error, listError);
    return false;
  }
  if (containers->empty()) return true;
  plist::Array paths;
  for (const QRTURL& container : *containers) paths.emplace_back(container.path());
  QRTLog(kLogNotice, "Potential containers requiring ACL migration: %@", plist::Value(std::move(paths)));
  bool ok = true;
  for (const QRTURL& container : *containers) {
    QRTErrorRef containerError;
    if (standardizeACLsForSystemContainerAtURL(container, &containerError)) continue;
    QRTLog(kLogError, "Failed to set system container ACL at %@: %@", container, containerError);
    QRTSetError(error, containerError);
    ok = false;
  }
  return ok;
}

bool QRTFileManager::standardizeOwnershipAtURL(const QRTURL& url, uid_t toUID, gid_t GID, QRTErrorRef* error) {
  bool walked = _traverseDirectory(url, error, [&](QRTTraversalEntry& entry, QRTErrorRef*) {
    if (entry.kind == QRTTraversalEntry::Kind::DirectoryPost || isMetadataPath(entry.path)) return true;
    platform::Item item;
    if (int err = openEntry(entry, &item)) {
      QRTLogAs(kLogError, "standardizeOwnershipAtURL", "Could not chown %s: %s", entry.path, errorText(err));
      return true;
    }
    resetOwnership(item, item.st.st_uid != toUID || item.st.st_gid != GID, toUID, GID, entry.path);
    return true;
  });
  // The root once more, in case the walk could not reach it.
  platform::Item root;
  if (int err = platform::safeOpenItem(url.path(), &root)) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "Could not stat %s: %s", url.fileSystemRepresentation(), errorText(err)));
    return false;
  }
  resetOwnership(root, root.st.st_uid != toUID, toUID, GID, url.fileSystemRepresentation());
  return walked;
}
