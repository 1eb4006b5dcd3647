#include "Daemon/store/QRTGlobalConfiguration.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "Daemon/store/QRTContentClass.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/store/QRTPerUserConfiguration.h"
#include "platform/DeviceRoot.h"
#include "platform/HostProfile.h"
#include "platform/Log.h"
#include "platform/SafePath.h"
#include "platform/UserDatabase.h"

namespace {

constexpr mode_t kDirectoryMode = 0755;
constexpr size_t kMaxContainersPerClass = 10'000;
constexpr const char* kUserStagingName = ".staging";
constexpr const char* kUserDeathrowName = ".deathrow";

// The user base's own directory of that name: made if missing, and used only
// while it is a real directory of root's that no one else may enter.
std::optional<QRTURL> checkedUserDirectory(const QRTURL& base, const char* name) {
  const QRTURL url = base.URLByAppendingPathComponent(name, true);
  platform::UniqueFd fd;
  int err = platform::safeMakeDirectory(url.path(), 0700, false, platform::kAnyOwner, &fd);
  struct stat st;
  if (!err && fstat(fd.get(), &st) != 0) err = errno;
  if (!err && (st.st_uid != 0 || !S_ISDIR(st.st_mode) || (st.st_mode & 077) != 0)) err = EPERM;
  if (err) {
    QRTLog(platform::kLogError, "Refusing %@ as a directory of the daemon's: %s", url, strerror(err));
    return std::nullopt;
  }
  return url;
}

bool sameFileSystem(const QRTURL& a, const QRTURL& b) {
  struct stat sa, sb;
  return platform::safeStat(a.path(), &sa) == 0 && platform::safeStat(b.path(), &sb) == 0 && sa.st_dev == sb.st_dev;
}

bool isBelow(const QRTURL& url, const QRTURL& base) {
  std::string prefix = base.path();
  if (prefix.empty() || prefix.back() != '/') prefix += '/';
  return url.path().compare(0, prefix.size(), prefix) == 0;
}
constexpr int32_t kLibraryProtectionClass = 4;

using Config = QRTGlobalConfiguration;

}  // namespace

QRTGlobalConfiguration& QRTGlobalConfiguration::sharedInstance() {
  static QRTGlobalConfiguration* instance = new QRTGlobalConfiguration();
  return *instance;
}

QRTGlobalConfiguration::QRTGlobalConfiguration()
    : homeDirectory_(QRTURL::fileURL(platform::hostPath("/private/var/root/"), true)),
      emplacerdHomeDirectory_(QRTURL::fileURL(platform::hostPath("/private/var/emplacerd/"), true)) {
  if (platform::hostProfile()) {
    // The default user is whoever DefaultUser= names (start-up logs which);
    // without one, requests for it are refused rather than served as root's.
    auto user = platform::hostDefaultUser();
    currentMobileUserId_ = user ? user->uid : kNoDefaultUser;
  } else if (auto mobile = platform::userByName("mobile")) {
    currentMobileUserId_ = mobile->uid;
    QRTLog(platform::kLogError, "Current mobile user ID is %u", currentMobileUserId_);
  } else {
    QRTLog(platform::kLogError, "Failed to get mobile uid. This is bad");
  }
}

QRTURL QRTGlobalConfiguration::cachedDirectory(std::optional<QRTURL>& slot, const char* getter,
                                               QRTURL (*compute)(QRTGlobalConfiguration&), int32_t protectionClass,
                                               const char* failureMessage) {
  std::lock_guard<std::recursive_mutex> hold(lock_);
  if (!slot) slot = compute(*this);
  QRTErrorRef error;
  if (!QRTFileManager::defaultManager().createDirectoryAtURL(*slot, true, kDirectoryMode, 0u, protectionClass,
                                                             &error)) {
    QRTLogAs(platform::kLogError, getter, failureMessage, *slot, error);
  }
  return *slot;
}

QRTURL QRTGlobalConfiguration::sharedContainersDirectory() {
  return cachedDirectory(
      sharedContainersDirectory_, __func__,
      [](Config&) { return QRTURL::fileURL(platform::hostPath("/private/var/containers"), true); }, -1,
      "Failed to create shared container dir at \"%@\": %@");
}

QRTURL QRTGlobalConfiguration::bundleDirectory() {
  return cachedDirectory(
      bundleDirectory_, __func__,
      [](Config& c) { return c.sharedContainersDirectory().URLByAppendingPathComponent("Bundle", true); }, -1,
      "Failed to create bundle dir at \"%@\": %@");
}

QRTURL QRTGlobalConfiguration::logDirectory() {
  std::lock_guard<std::recursive_mutex> hold(lock_);
  QRTURL url = homeDirectory_.URLByAppendingPathComponent("Library/Logs/QuarterKit", true);
  QRTErrorRef error;
  if (!QRTFileManager::defaultManager().createDirectoryAtURL(url, true, kDirectoryMode, 0u, kLibraryProtectionClass,
                                                             &error)) {
    QRTLog(platform::kLogError, "Failed to create log directory at \"%@\": %@", url, error);
  }
  return url;
}

QRTURL QRTGlobalConfiguration::cachesDirectory() {
  return cachedDirectory(
      cachesDirectory_, __func__,
      [](Config& c) {
        return c.homeDirectory().URLByAppendingPathComponent("Library/Caches/com.norvane.quarterd", true);
      },
      kLibraryProtectionClass, "Failed to create cache dir at \"%@\": %@");
}

QRTURL QRTGlobalConfiguration::libraryDirectory() {
  return cachedDirectory(
      libraryDirectory_, __func__,
      [](Config& c) { return c.homeDirectory().URLByAppendingPathComponent("Library/QuarterKit", true); },
      kLibraryProtectionClass, "Failed to create library dir at \"%@\": %@");
}

QRTURL QRTGlobalConfiguration::transientDirectory() {
  return cachedDirectory(
      transientDirectory_, __func__,
      [](Config& c) { return c.cachesDirectory().URLByAppendingPathComponent("Temp", true); }, -1,
      "Failed to create transient dir at \"%@\": %@");
}

QRTURL QRTGlobalConfiguration::stagingDirectory() {
  return cachedDirectory(
      stagingDirectory_, __func__,
      [](Config& c) { return c.cachesDirectory().URLByAppendingPathComponent("Staging", true); }, -1,
      "Failed to create staging dir at \"%@\": %@");
}

QRTURL QRTGlobalConfiguration::deathrowDirectory() {
  return cachedDirectory(
      deathrowDirectory_, __func__,
      [](Config& c) { return c.cachesDirectory().URLByAppendingPathComponent("Dead", true); }, -1,
      "Failed to create deathrow dir at \"%@\": %@");
}

std::optional<QRTURL> QRTGlobalConfiguration::directoryOnFileSystemOf(const QRTURL& url, const QRTURL& daemonDirectory,
                                                                      const char* name) {
  // The parent: url itself may not exist yet, or be on its way out.
  const QRTURL parent = url.URLByDeletingLastPathComponent();
  if (sameFileSystem(parent, daemonDirectory)) return daemonDirectory;
  std::lock_guard<std::recursive_mutex> hold(lock_);
  for (const auto& [uid, user] : perUserConfigurations_) {
    // The home rather than the base: the user's transient directory lies outside the base.
    auto base = user->userBaseDirectoryPath();
    const auto& home = user->userHomeDirectory();
    if (base && home && isBelow(url, *home) && sameFileSystem(parent, *base)) return checkedUserDirectory(*base, name);
  }
  QRTLog(platform::kLogError, "No %s directory on the file system of %@", name, url);
  return std::nullopt;
}

std::optional<QRTURL> QRTGlobalConfiguration::stagingDirectoryForURL(const QRTURL& url) {
  return directoryOnFileSystemOf(url, stagingDirectory(), kUserStagingName);
}

std::optional<QRTURL> QRTGlobalConfiguration::deathrowDirectoryForURL(const QRTURL& url) {
  return directoryOnFileSystemOf(url, deathrowDirectory(), kUserDeathrowName);
}

std::vector<QRTURL> QRTGlobalConfiguration::allDirectories(const QRTURL& daemonDirectory, const char* name) {
  std::vector<QRTURL> all{daemonDirectory};
  std::lock_guard<std::recursive_mutex> hold(lock_);
  for (const auto& [uid, user] : perUserConfigurations_) {
    auto base = user->userBaseDirectoryPath();
    struct stat st;
    if (!base || platform::safeStat(base->URLByAppendingPathComponent(name).path(), &st) != 0) continue;
    if (auto checked = checkedUserDirectory(*base, name)) all.push_back(*checked);
  }
  return all;
}

std::vector<QRTURL> QRTGlobalConfiguration::allStagingDirectories() {
  return allDirectories(stagingDirectory(), kUserStagingName);
}

std::vector<QRTURL> QRTGlobalConfiguration::allDeathrowDirectories() {
  return allDirectories(deathrowDirectory(), kUserDeathrowName);
}

void QRTGlobalConfiguration::loadUsersWithLeftovers() {
  for (uint32_t uid : platform::allUserIds()) {
    auto user = std::make_shared<QRTPerUserConfiguration>(uid);
    auto base = user->userBaseDirectoryPath();
    struct stat st;
    if (base && (platform::safeStat(base->URLByAppendingPathComponent(kUserStagingName).path(), &st) == 0 ||
                 platform::safeStat(base->URLByAppendingPathComponent(kUserDeathrowName).path(), &st) == 0))
      getPerUserConfigurationForUserId(uid);
  }
}

size_t QRTGlobalConfiguration::maxContainersPerClass() const {
#ifdef QRT_TEST_HOOKS
  // Tests lower the bound rather than make ten thousand containers.
  if (auto text = platform::readHostFile(platform::hostPath("/run/quarterd.maxcontainers"), 32)) {
    char* end = nullptr;
    const unsigned long n = strtoul(text->c_str(), &end, 10);
    if (end != text->c_str()) return n;
  }
#endif
  return platform::configuredMaxContainersPerClass().value_or(kMaxContainersPerClass);
}

QRTURL QRTGlobalConfiguration::replaceDirectory() {
  return cachedDirectory(
      replaceDirectory_, __func__,
      [](Config& c) { return c.libraryDirectory().URLByAppendingPathComponent("Replace", true); }, -1,
      "Failed to create replace dir at \"%@\": %@");
}

QRTURL QRTGlobalConfiguration::pendingUpdatesDirectory() {
  return cachedDirectory(
      pendingUpdatesDirectory_, __func__,
      [](Config& c) { return c.libraryDirectory().URLByAppendingPathComponent("PendingUpdates", true); }, -1,
      "Failed to create updates dir at \"%@\": %@");
}

// The installer's home may lack any of the three levels, and each must end
// up owned by the installer, so each is made by itself rather than with parents.
QRTURL QRTGlobalConfiguration::transientBundleDirectory() {
  std::lock_guard<std::recursive_mutex> hold(lock_);
  static const char* const kLevels[] = {"Library", "Caches", "com.norvane.quarterd"};
  QRTURL url = emplacerdHomeDirectory_;
  for (const char* level : kLevels) {
    url = url.URLByAppendingPathComponent(level, true);
    QRTErrorRef error;
    if (!QRTFileManager::defaultManager().createDirectoryAtURL(url, false, kDirectoryMode, QRTInstallerUserId, -1,
                                                               &error)) {
      QRTLog(platform::kLogError, "Failed to create transient bundle dir at \"%@\": %@", url, error);
    }
  }
  return url;
}

std::optional<QRTURL> QRTGlobalConfiguration::globalContainerBaseURLWithContentClass(uint64_t contentClass,
                                                                                     bool transient) {
  if (!QRTIsGlobalClass(contentClass)) return std::nullopt;
  QRTURL base;
  if (!transient)
    base = sharedContainersDirectory();
  else if (QRTIsBundleClass(contentClass))
    base = transientBundleDirectory();
  else
    base = transientDirectory();
  return base.URLByAppendingPathComponent(QRTContentClassPathName(contentClass), true);
}

std::optional<QRTURL> QRTGlobalConfiguration::containerDirectoryURLForUser(uint32_t userId, uint64_t contentClass,
                                                                           bool transient) {
  std::lock_guard<std::recursive_mutex> hold(lock_);
  if (!QRTIsGlobalClass(contentClass))
    return getPerUserConfigurationForUserId(userId)->containerDirectoryURLForContentClass(contentClass, transient);
  std::optional<QRTURL> url = globalContainerBaseURLWithContentClass(contentClass, transient);
  const uint32_t owner = QRTIsBundleClass(contentClass) ? QRTInstallerUserId : 0u;
  QRTErrorRef error;
  if (!QRTFileManager::defaultManager().createDirectoryAtURL(*url, true, kDirectoryMode, owner, -1, &error)) {
    QRTLog(platform::kLogError, "Failed to create container dir at \"%@\": %@", *url, error);
  }
  return url;
}

std::shared_ptr<QRTPerUserConfiguration> QRTGlobalConfiguration::getPerUserConfigurationForUserId(uint32_t userId) {
  std::lock_guard<std::recursive_mutex> hold(lock_);
  auto found = perUserConfigurations_.find(userId);
  if (found != perUserConfigurations_.end()) return found->second;
  auto configuration = std::make_shared<QRTPerUserConfiguration>(userId);
  if (configuration->userHomeDirectory()) perUserConfigurations_.emplace(userId, configuration);
  return configuration;
}

std::shared_ptr<QRTPerUserConfiguration> QRTGlobalConfiguration::getPerUserConfigurationForCurrentMobileUser() {
  return getPerUserConfigurationForUserId(currentMobileUserId_);
}

const std::vector<std::string>& QRTGlobalConfiguration::appUserDataItemNames() {
  static const std::vector<std::string> names{"Documents", "Library", "tmp", "Purchases"};
  return names;
}

bool QRTGlobalConfiguration::migrationFileExistsWithName(const std::string& name) {
  // Only a plain name can lie directly in the library directory.
  if (name.empty() || name == "." || name == ".." || name.find('/') != std::string::npos ||
      name.find('\0') != std::string::npos)
    return false;
  return QRTFileManager::defaultManager().itemExistsAtURL(libraryDirectory().URLByAppendingPathComponent(name));
}
