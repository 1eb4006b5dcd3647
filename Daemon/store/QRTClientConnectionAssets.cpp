// Operations inside existing containers: the user-managed assets directory,
// shared content moved within a system group container, the network
// extension's container and the retry test.
#include <fcntl.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <thread>

#include "Daemon/QRTError.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTClientConnectionInternal.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTEntitlementChecks.h"
#include "Daemon/store/QRTLocks.h"
#include "Daemon/store/QRTMetadata.h"
#include "platform/DeviceProperties.h"
#include "platform/Log.h"
#include "platform/SafePath.h"

using platform::kLogError;

namespace {

constexpr const char* kAssetsDirPrefix = "com.norvane.UserManagedAssets.";
constexpr const char* kRetryTestIdentifier = "com.norvane.retryTest";
constexpr const char* kCrashCounterKey = "CrashCounter";

QRTMetadataRef appDataContainer(uint32_t userId, const std::string& identifier, QRTErrorRef* error) {
  QRTErrorRef lookup;
  QRTMetadataRef m =
      QRTContainerCache::sharedInstance().containerForUser({userId, QRTClassAppData, identifier}, &lookup);
  if (!m) {
    *error =
        QRT_ERROR(QRTErrorInvalidParameter, lookup, true,
                  "Failed to create app data container for user managed assets path for %@: %@", identifier, lookup);
  }
  return m;
}

// The fresh directory is root's until given away: it is handed over only when
// the descriptor shows that very directory (a user could swap the name).
bool giveAssetsDirectory(const QRTURL& dir, uint32_t userId, QRTErrorRef* error) {
  platform::UniqueFd fd;
  int err = platform::safeOpen(dir.path(), O_RDONLY | O_DIRECTORY, &fd);
  struct stat st {};
  if (err == 0 && fstat(fd.get(), &st) != 0) {
    err = errno;
  } else if (err == 0 && st.st_uid != 0) {
    err = EPERM;
  }
  if (err == 0) err = platform::chmodOpened(fd.get(), 0755);
  if (err != 0) {
    *error = QRT_ERROR(QRTErrorCreateSubdirectoryFailed, nullptr, true,
                       "Failed to chmod user managed assets dir at %@: %s", dir, strerror(err));
    return false;
  }
  if (int chownErr = platform::chownOpened(fd.get(), userId, userId)) {
    *error = QRT_ERROR(QRTErrorCreateSubdirectoryFailed, nullptr, true,
                       "Failed to chown user managed assets dir at %@: %s", dir, strerror(chownErr));
    return false;
  }
  return true;
}

// Makes the assets directory and records its name; the new metadata.
QRTMetadataRef makeAssetsDirectory(const QRTMetadataRef& m, uint32_t userId, QRTErrorRef* error) {
  QRTErrorRef made;
  QRTURL library = m->url().URLByAppendingPathComponent("Library", true);
  std::optional<QRTURL> dir =
      QRTFileManager::defaultManager().createTemporaryDirectoryInDirectoryURL(library, kAssetsDirPrefix, &made);
  if (!dir) {
    *error = QRT_ERROR(QRTErrorCreateSubdirectoryFailed, made, true,
                       "Failed to create user managed assets dir at %@: %@", library, made);
    return nullptr;
  }
  if (!giveAssetsDirectory(*dir, userId, error)) return nullptr;
  QRTMetadataRef changed = m->withUserManagedAssetsDirName(dir->lastPathComponent());
  if (!changed->writeMetadataToDiskWithError(error)) return nullptr;
  QRTErrorRef cacheError;
  if (!QRTContainerCache::sharedInstance().addContainerMetadata(changed, changed->uid(), changed->url(),
                                                                changed->transient(), false, &cacheError)) {
    *error = QRT_ERROR(QRTErrorCacheAddFailed, cacheError, true, "Failed to add to cache: %@, url: %@, transient: %d",
                       changed, changed->url(), changed->transient());
    return nullptr;
  }
  return changed;
}

// A client that names an absolute path means a place outside the container,
// even though appending it to the container would land inside.
bool isAbsolute(const std::string& relative) { return !relative.empty() && relative.front() == '/'; }

std::optional<QRTURL> containedURL(const QRTURL& container, const std::string& relative) {
  QRTURL url = QRTURL::fileURL(container.path() + "/" + relative);
  return QRTFileManager::defaultManager().realPathForURL(url, container);
}

}  // namespace

std::optional<QRTURL> QRTClientConnection::userManagedAssetsPathForUser(uint32_t userId,
                                                                        const std::optional<std::string>& identifier,
                                                                        bool isRelative, uint64_t* withError) {
  QRTErrorRef error;
  try {
    if (!identifier) {
      reportCode(QRT_ERROR(QRTErrorInvalidParameter, nullptr, true, "Can't act on invalid input: ID: %@", identifier),
                 withError);
      return std::nullopt;
    }
    QRTMetadataRef m = appDataContainer(userId, *identifier, &error);
    if (m && m->url().empty()) {
      error = QRT_ERROR(QRTErrorInvalidParameter, nullptr, true, "No URL in container metadata object: %@", m);
      m = nullptr;
    }
    if (!m) {
      reportCode(error, withError);
      return std::nullopt;
    }
    QRTIdentifierLock lock(m->uuid().UUIDString(), true);
    // Read again under the lock: another request may have made it meanwhile.
    QRTErrorRef ignored;
    if (QRTMetadataRef current =
            QRTContainerCache::sharedInstance().containerForUser({userId, QRTClassAppData, identifier}, &ignored))
      m = current;
    if (!m->userManagedAssetsDirName()) {
      m = makeAssetsDirectory(m, userId, &error);
      if (!m) {
        reportCode(error, withError);
        return std::nullopt;
      }
    } else {
      QRTURL dir = m->url()
                       .URLByAppendingPathComponent("Library", true)
                       .URLByAppendingPathComponent(*m->userManagedAssetsDirName(), true);
      if (!QRTFileManager::defaultManager().itemExistsAtURL(dir)) {
        reportCode(
            QRT_ERROR(QRTErrorInvalidParameter, nullptr, true, "User Managed Assets path does not exist: %@", dir),
            withError);
        return std::nullopt;
      }
    }
    std::string relative = "Library/" + *m->userManagedAssetsDirName();
    if (isRelative) return QRTURL::fileURL(relative, true);
    return m->url().URLByAppendingPathComponent(relative, true);
  } catch (...) {
    reportCode(QRT_EXCEPTION_ERROR(), withError);
    return std::nullopt;
  }
}

void QRTClientConnection::deleteUserManagedAssetForUser(uint32_t userId, const std::optional<std::string>& identifier,
                                                        const std::optional<std::string>& relativePath,
                                                        uint64_t* withError) {
  QRTErrorRef error;
  try {
    if (!identifier || !relativePath) {
      return reportCode(QRT_ERROR(QRTErrorInvalidParameter, nullptr, true,
                                  "Can't act on invalid input: ID: %@, Path: %@", identifier, relativePath),
                        withError);
    }
    QRTMetadataRef m = appDataContainer(userId, *identifier, &error);
    if (!m) return reportCode(error, withError);
    QRTIdentifierLock lock(m->uuid().UUIDString(), true);
    QRTErrorRef ignored;
    if (QRTMetadataRef current =
            QRTContainerCache::sharedInstance().containerForUser({userId, QRTClassAppData, identifier}, &ignored))
      m = current;
    if (m->url().empty() || !m->userManagedAssetsDirName()) {
      return reportCode(QRT_ERROR(QRTErrorInvalidParameter, nullptr, true,
                                  "No userManagedAssetsDirName or URL in container metadata object: %@", m),
                        withError);
    }
    QRTURL assets = m->url()
                        .URLByAppendingPathComponent("Library", true)
                        .URLByAppendingPathComponent(*m->userManagedAssetsDirName(), true);
    // The asset must lie inside the assets directory; the item itself (a
    // link, when it is one) is what goes to death row, never a link's target.
    QRTURL asset = QRTURL::fileURL(assets.path() + "/" + *relativePath);
    if (isAbsolute(*relativePath) || !QRTFileManager::defaultManager().realPathForURL(asset, assets) ||
        asset == assets) {
      return reportCode(QRT_ERROR(QRTErrorInvalidPath, nullptr, true, "Invalid asset path %@ for %@ at %@",
                                  *relativePath, identifier, assets),
                        withError);
    }
    if (!_moveItemAtURLToDeathRow(asset, false, false, &error)) {
      reportCode(QRT_ERROR(QRTErrorDeathRowFailed, error, true, "Failed to remove asset at %@", asset), withError);
    }
  } catch (...) { reportCode(QRT_EXCEPTION_ERROR(), withError); }
}

std::optional<QRTURL> QRTClientConnection::stageSharedContentForIdentifier(
    const std::optional<std::string>& identifier, const std::optional<std::string>& sourceRelativePath,
    const std::optional<std::string>& destRelativePath, uint64_t* withError) {
  QRTErrorRef error;
  auto fail = [&](QRTErrorRef e) -> std::optional<QRTURL> {
    reportCode(e, withError);
    return std::nullopt;
  };
  try {
    if (!identifier || !sourceRelativePath || !destRelativePath) {
      return fail(QRT_ERROR(QRTErrorInvalidParameter, nullptr, true,
                            "Can't act on invalid input: ID: %@, source: %@, dest: %@", identifier, sourceRelativePath,
                            destRelativePath));
    }
    if (containsDotDotPathComponents(*sourceRelativePath) || containsDotDotPathComponents(*destRelativePath)) {
      return fail(QRT_ERROR(QRTErrorInvalidArgument, nullptr, true, "Paths can't contain dots. source: %@, dest: %@",
                            sourceRelativePath, destRelativePath));
    }
    std::optional<std::vector<std::string>> groups;
    if (clientBundleIdentifier_) groups = QRTEntitledSystemGroups(*clientBundleIdentifier_);
    if (!groups || std::find(groups->begin(), groups->end(), *identifier) == groups->end()) {
      return fail(QRT_ERROR(QRTErrorNotEntitled, nullptr, true, "%@ not entitled for system group container %@",
                            clientBundleIdentifier_, identifier));
    }
    QRTErrorRef lookup;
    QRTMetadataRef m = QRTContainerCache::sharedInstance().containerForUser(
        {QRTSystemContainerUserId, QRTClassSystemGroup, identifier}, &lookup);
    if (!m) {
      return fail(QRT_ERROR(QRTErrorNotFound, lookup, true, "System group container with identifier %@ not found: %@",
                            identifier, lookup));
    }
    QRTIdentifierLock lock(m->uuid().UUIDString(), true);
    QRTURL source = QRTURL::fileURL(m->url().path() + "/" + *sourceRelativePath);
    QRTURL dest = QRTURL::fileURL(m->url().path() + "/" + *destRelativePath);
    // The items themselves are moved (a rename never follows a link), once
    // both names are known to lie inside the container.
    if (isAbsolute(*sourceRelativePath) || !containedURL(m->url(), *sourceRelativePath) || source == m->url()) {
      return fail(QRT_ERROR(QRTErrorInvalidPath, nullptr, true, "Invalid source URL %@ for %@ at %@", source,
                            identifier, m->url()));
    }
    if (isAbsolute(*destRelativePath) || !containedURL(m->url(), *destRelativePath) || dest == m->url()) {
      return fail(QRT_ERROR(QRTErrorInvalidPath, nullptr, true, "Invalid dest URL %@ for %@ at %@", dest, identifier,
                            m->url()));
    }
    QRTFileManager& fm = QRTFileManager::defaultManager();
    if (!fm.standardizeACLsAtURL(source, false, &error)) {
      return fail(QRT_ERROR(QRTErrorACLFailed, error, true, "Failed to standardize ACLs for %@ at %@: %@", identifier,
                            source, error));
    }
    if (!fm.moveItemAtURL(source, dest, &error)) {
      return fail(QRT_ERROR(QRTErrorStageSharedMoveFailed, error, true, "Failed move for %@ from %@ to: %@: %@",
                            identifier, source, dest, error));
    }
    return dest;
  } catch (...) { return fail(QRT_EXCEPTION_ERROR()); }
}

void QRTClientConnection::setNetworkExtensionForUser(uint32_t userId, const std::optional<std::string>& identifier,
                                                     uint64_t containerClass, uint64_t* withError) {
  try {
    if (!identifier) {
      return reportCode(
          QRT_ERROR(QRTErrorInvalidParameter, nullptr, true, "Can't act on invalid input: ID: %@", identifier),
          withError);
    }
    if (containerClass != QRTClassAppData && containerClass != QRTClassVPNData) {
      return reportCode(QRT_ERROR(QRTErrorInvalidParameter, nullptr, true,
                                  "Can't set network extension on container of type: %llu, identifier: %@",
                                  static_cast<unsigned long long>(containerClass), identifier),
                        withError);
    }
    const bool broker = clientBundleIdentifier_ == "com.norvane.tunnelbroker" ||
                        (clientBundleIdentifier_ == "com.norvane.QuarterProbe" && platform::deviceIsInternalBuild());
    if (!broker) {
      return reportCode(QRT_ERROR(QRTErrorInvalidRequest, nullptr, true, "Only tunnelbroker can make this call"),
                        withError);
    }
    uint64_t code = QRTErrorNone;
    QRTMetadataRef m = createOrLookupContainerForUser({userId, containerClass, identifier},
                                                      QRTCreateMode::CreateIfMissing, QRTLocking::TakeLocks, &code);
    if (!m) {
      QRTLog(kLogError, "Failed to create VPN Plugin container for tunnelbroker: %llu, ID: %@, class: %llu",
             static_cast<unsigned long long>(code), identifier, static_cast<unsigned long long>(containerClass));
      if (withError) *withError = code;
      return;
    }
    if (!QRTContainerCache::sharedInstance().setSandboxContainerMappingForUser(userId, "com.norvane.tunnelworker",
                                                                               containerClass, m->url())) {
      reportCode(QRT_ERROR(QRTErrorInvalidRequest, nullptr, true,
                           "Failed to set sandbox mapping for tunnelworker to %@", m->url()),
                 withError);
    }
  } catch (...) { reportCode(QRT_EXCEPTION_ERROR(), withError); }
}

void QRTClientConnection::retryTestForUser(uint32_t userId, uint64_t withNumCrashes, uint64_t* withError) {
  try {
    uint64_t code = QRTErrorNone;
    QRTMetadataRef m = createOrLookupContainerForUser({userId, QRTClassAppData, std::string(kRetryTestIdentifier)},
                                                      QRTCreateMode::CreateIfMissing, QRTLocking::TakeLocks, &code);
    if (!m) {
      QRTLog(kLogError, "Failed to create or lookup lookup existing container for retry test: %@",
             std::to_string(code));
      if (withError) *withError = code;
      return;
    }
    uint64_t remaining = withNumCrashes;
    if (m->info()) {
      const plist::Value* counter = plist::find(*m->info(), kCrashCounterKey);
      if (const plist::Integer* i = counter ? counter->integerIf() : nullptr) remaining = i->asUnsigned() - 1;
    }
    QRTLog(kLogError, "Crashes Remaining in retry test: %llu", static_cast<unsigned long long>(remaining));
    setInfoValue(plist::Value(static_cast<unsigned long long>(remaining)), std::string(kCrashCounterKey), userId,
                 m->uuid(), m->identifier(), 2, true, &code);
    if (remaining != 0) {
      QRTLog(kLogError, "Crashing");
      std::this_thread::sleep_for(std::chrono::seconds(2));
      // No reply and no clean-up: the client sees the daemon die mid-request.
      fflush(nullptr);
      _exit(0);
    }
    code = QRTErrorNone;
    stageForDeleteContainersWithUsers({userId}, {m->uuid()}, {m->identifier()}, {uint64_t{2}}, true, &code);
    if (code == QRTErrorNone) {
      QRTLog(kLogError, "Returning Successfully");
    } else {
      QRTLog(kLogError, "Failed to delete retry container at : %@", m->url());
      if (withError) *withError = code;
    }
  } catch (...) { reportCode(QRT_EXCEPTION_ERROR(), withError); }
}
