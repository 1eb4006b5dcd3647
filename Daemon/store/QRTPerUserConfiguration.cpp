#include "Daemon/store/QRTPerUserConfiguration.h"

#include <string>
#include <string_view>

#include "Daemon/store/QRTContentClass.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "platform/Log.h"
#include "platform/UserDatabase.h"

namespace {

constexpr mode_t kDirectoryMode = 0755;
constexpr size_t kMaxHomePathLength = 1023;

// The home as an absolute path with "." and doubled slashes dropped. Links
// are not resolved: every use goes through the safe resolution, which refuses
// a link anywhere on the way, and a ".." component is refused here already.
std::optional<QRTURL> normalisedHome(const std::string& home) {
  if (home.empty() || home.front() != '/' || home.size() > kMaxHomePathLength) return std::nullopt;
  std::string path;
  for (size_t start = 0; start <= home.size();) {
    size_t slash = home.find('/', start);
    if (slash == std::string::npos) slash = home.size();
    std::string_view component(home.data() + start, slash - start);
    start = slash + 1;
    if (component.empty() || component == ".") continue;
    if (component == "..") return std::nullopt;
    path += '/';
    path += component;
  }
  return QRTURL::fileURL(path.empty() ? "/" : path, true);
}

}  // namespace

QRTPerUserConfiguration::QRTPerUserConfiguration(uint32_t userId) : userId_(userId) {
  std::optional<platform::UserAccount> account = platform::userById(userId);
  if (account) userHomeDirectory_ = normalisedHome(account->homeDirectory);
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
  return cachedDirectory(userBaseDirectory_, "Containers", __func__, "Failed to create user base dir at \"%@\": %@");
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

std::optional<QRTURL> QRTPerUserConfiguration::oldLoggingPath() const {
  return homeRelative("Library/Logs/QuarterKit");
}

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
