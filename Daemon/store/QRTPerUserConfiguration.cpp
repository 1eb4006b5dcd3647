#include "Daemon/store/QRTPerUserConfiguration.h"

#include <cstring>
#include <cstdlib>
#include <memory>

#include "Daemon/store/QRTContentClass.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "platform/Log.h"
#include "platform/UserDatabase.h"

namespace {

constexpr mode_t kDirectoryMode = 0755;
constexpr size_t kMaxHomePathLength = 1023;

// The home with its links resolved; as given when it cannot be resolved (a
// home that does not exist yet), so that its absence can still be observed.
std::optional<QRTURL> resolvedHome(const std::string& home) {
  if (home.empty() || home.front() != '/') return std::nullopt;
  std::unique_ptr<char, decltype(&free)> resolved(realpath(home.c_str(), nullptr), &free);
  if (resolved && strlen(resolved.get()) <= kMaxHomePathLength) return QRTURL::fileURL(resolved.get(), true);
  return QRTURL::fileURL(home, true);
}

}  // namespace

QRTPerUserConfiguration::QRTPerUserConfiguration(uint32_t userId) : userId_(userId) {
  std::optional<platform::UserAccount> account = platform::userById(userId);
  if (account) userHomeDirectory_ = resolvedHome(account->homeDirectory);
  if (!userHomeDirectory_) QRTLog(platform::kLogError, "Failed to getpwuid for uid: %u", userId);
}

bool QRTPerUserConfiguration::existsUserBaseDirectory() {
  return userHomeDirectory_ && QRTFileManager::defaultManager().itemExistsAtURL(*userHomeDirectory_);
}

std::optional<QRTURL> QRTPerUserConfiguration::homeRelative(const char* path) const {
  if (!userHomeDirectory_) return std::nullopt;
  return userHomeDirectory_->URLByAppendingPathComponent(path, true);
}

std::optional<QRTURL> QRTPerUserConfiguration::cachedDirectory(std::optional<QRTURL>& slot, const char* path,
                                                               const char* getter, const char* failureMessage) {
  std::lock_guard<std::recursive_mutex> hold(lock_);
  if (!slot) slot = homeRelative(path);
  if (!slot) return std::nullopt;
  QRTErrorRef error;
  if (!QRTFileManager::defaultManager().createDirectoryAtURL(*slot, true, kDirectoryMode, userId_, -1, &error)) {
    QRTLogAs(platform::kLogError, getter, failureMessage, *slot, error);
  }
  return slot;
}

std::optional<QRTURL> QRTPerUserConfiguration::userBaseDirectory() {
  return cachedDirectory(userBaseDirectory_, "Containers", __func__,
                         "Failed to create user base dir at \"%@\": %@");
}

std::optional<QRTURL> QRTPerUserConfiguration::transientDirectory() {
  return cachedDirectory(transientDirectory_, "Library/Caches/com.norvane.quarterd/Temp", __func__,
                         "Failed to create transient dir at \"%@\": %@");
}

std::optional<QRTURL> QRTPerUserConfiguration::systemContainerBackupBaseDirectory() const {
  return homeRelative("Library/Backup/SystemContainers");
}

std::optional<QRTURL> QRTPerUserConfiguration::systemContainerBackupDirectory() const {
  return homeRelative("Library/Backup/SystemContainers/Data");
}

std::optional<QRTURL> QRTPerUserConfiguration::systemGroupContainerBackupDirectory() const {
  return homeRelative("Library/Backup/SystemContainers/Shared");
}

std::optional<QRTURL> QRTPerUserConfiguration::oldLibraryDirectoryPath() const {
  return homeRelative("Library/QuarterKit");
}

std::optional<QRTURL> QRTPerUserConfiguration::oldLoggingPath() const { return homeRelative("Library/Logs/QuarterKit"); }

std::optional<QRTURL> QRTPerUserConfiguration::containerDirectoryURLForContentClass(uint64_t contentClass,
                                                                                   bool transient) {
  std::lock_guard<std::recursive_mutex> hold(lock_);
  if (!QRTIsPerUserClass(contentClass)) {
    QRTLog(platform::kLogError, "Invalid class for a per user container directory: %llu",
           static_cast<unsigned long long>(contentClass));
    return std::nullopt;
  }
  std::optional<QRTURL> base = transient ? transientDirectory() : userBaseDirectory();
  if (!base) return std::nullopt;
  QRTURL url = base->URLByAppendingPathComponent(QRTContentClassPathName(contentClass), true);
  QRTErrorRef error;
  if (!QRTFileManager::defaultManager().createDirectoryAtURL(url, true, kDirectoryMode, userId_, -1, &error)) {
    QRTLog(platform::kLogError, "Failed to create container dir at \"%@\": %@", url, error);
  }
  return url;
}
