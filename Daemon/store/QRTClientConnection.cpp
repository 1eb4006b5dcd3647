#include "Daemon/store/QRTClientConnection.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <map>
#include <iterator>

#include "base/QRTUUID.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTEntitlementChecks.h"
#include "Daemon/QRTCrashPoint.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/store/QRTLocks.h"
#include "Daemon/store/QRTMetadata.h"
#include "Daemon/store/QRTWhitelist.h"
#include "platform/DeviceProperties.h"
#include "platform/DeviceRoot.h"
#include "platform/Dir.h"
#include "platform/Log.h"
#include "platform/UserDatabase.h"

#include "Daemon/store/QRTClientConnectionInternal.h"

QRTClientConnection::QRTClientConnection(std::optional<std::string> bundleId, uint32_t clientUserId,
                                         bool allowOtherIdLookup,
                                         std::optional<std::vector<std::string>> entitledWipeIdentifiers)
    : clientBundleIdentifier_(std::move(bundleId)),
      clientUserId_(clientUserId),
      allowOtherIdLookup_(allowOtherIdLookup),
      entitledWipeIdentifiers_(std::move(entitledWipeIdentifiers)) {
  rights_.systemProcess = clientUserId == 0;
}

QRTClientConnection::QRTClientConnection(std::optional<std::string> bundleId, bool allowOtherIdLookup)
    : QRTClientConnection(std::move(bundleId), 0, allowOtherIdLookup, std::nullopt) {}

QRTClientConnection& QRTClientConnection::sharedClientConnection() {
  static QRTClientConnection* shared = new QRTClientConnection("com.norvane.quarterd.internal", true);
  return *shared;
}

// The first-boot work (upgrade migration, system container installation,
// transient and orphan clean-up) joins with those subsystems.
namespace {

constexpr const char* kDataSubDirectories[] = {"Documents", "Library", "Library/Caches", "Library/Preferences", "tmp"};
constexpr const char* kGroupSubDirectories[] = {"Library", "Library/Caches"};

// The identifier lock creators of one identifier share; apart from the UUID
// strings that other operations lock.
std::string creationLockName(const std::string& identifier) { return "create:" + identifier; }

// One of the user's container slots of a class, held while a container is
// made; given back unless the cache took it over with the new container.
class CreationSlot {
 public:
  CreationSlot(uint32_t userId, uint64_t containerClass) : userId_(userId), containerClass_(containerClass) {}
  ~CreationSlot() {
    if (held_) QRTContainerCache::sharedInstance().abandonCreation(userId_, containerClass_);
  }
  CreationSlot(const CreationSlot&) = delete;
  CreationSlot& operator=(const CreationSlot&) = delete;
  bool reserve(size_t limit, size_t* held, QRTErrorRef* error) {
    held_ = QRTContainerCache::sharedInstance().reserveCreation(userId_, containerClass_, limit, held, error);
    return held_;
  }
  void handedOver() { held_ = false; }

 private:
  uint32_t userId_;
  uint64_t containerClass_;
  bool held_ = false;
};

}  // namespace

bool QRTClientConnection::_createDefaultDirectory(const QRTURL& url, mode_t mode, uint32_t owner, QRTErrorRef* error) {
  return QRTFileManager::defaultManager().createDirectoryAtURL(url, true, mode, owner, -1, error);
}

bool QRTClientConnection::_createTopLevelContainerDirectory(const QRTURL& url, uint64_t containerClass, uint32_t owner,
                                                            const platform::Dir* staging, platform::Dir* out,
                                                            QRTErrorRef* error) {
  uint32_t directoryOwner = owner;
  if (QRTIsBundleClass(containerClass)) directoryOwner = QRTInstallerUserId;
  if (QRTIsSystemClass(containerClass)) directoryOwner = 0;
  const std::string name = staging ? url.lastPathComponent() : url.path();
  return QRTFileManager::defaultManager().createDirectory(staging, name, url, true, 0755, directoryOwner, 0, out,
                                                          error);
}

bool QRTClientConnection::_createSubDirectories(const QRTURL& url, uint32_t userId, uint64_t containerClass,
                                                QRTErrorRef* error, const platform::Dir* container) {
  const char* const* begin = nullptr;
  size_t count = 0;
  if (containerClass == QRTClassAppGroup || containerClass == QRTClassSystemGroup) {
    begin = kGroupSubDirectories;
    count = std::size(kGroupSubDirectories);
  } else if (QRTIsPerUserClass(containerClass) || containerClass == QRTClassSystemData) {
    begin = kDataSubDirectories;
    count = std::size(kDataSubDirectories);
  }
  const bool system = QRTIsSystemClass(containerClass);
  // A system container's group bits are its ACL mask (owner, group and other
  // entries stay empty): 0000 would cut the systemusers entry down to nothing.
  const mode_t mode = system ? 0070 : 0755;
  const uint32_t owner = system ? platform::kNobodyUserId : userId;
  for (size_t i = 0; i < count; ++i) {
    QRTErrorRef underlying;
    const QRTURL sub = url.URLByAppendingPathComponent(begin[i], true);
    if (container ? !QRTFileManager::defaultManager().createDirectory(container, begin[i], sub, true, mode, owner, -1,
                                                                      nullptr, &underlying)
                  : !_createDefaultDirectory(sub, mode, owner, &underlying)) {
      QRTSetError(error, QRT_ERROR(QRTErrorCreateSubdirectoryFailed, underlying, true,
                                   "Failed to create sub-dir at %@%@", url, std::string("/") + begin[i]));
      return false;
    }
  }
  return true;
}

QRTMetadataRef QRTClientConnection::_buildInStaging(const QRTURL& staging, const platform::Dir& stagingDirectory,
                                                    uint32_t userId, const std::string& identifier,
                                                    uint64_t containerClass, QRTErrorRef* error) {
  QRTErrorRef underlying;
  // Everything below is done relative to the container directory, held.
  platform::Dir container;
  if (!_createTopLevelContainerDirectory(staging, containerClass, userId,
                                         stagingDirectory.valid() ? &stagingDirectory : nullptr, &container,
                                         &underlying)) {
    QRTSetError(error, QRT_ERROR(QRTErrorCreateStagingFailed, underlying, true,
                                 "Failed to create staging dir at %@ : %@", staging, underlying));
    return nullptr;
  }
  auto metadata = std::make_shared<const QRTMetadata>(userId, QRTUUID::random(), containerClass, identifier,
                                                      std::nullopt, staging, std::nullopt);
  if (!metadata->writeMetadataToDiskWithError(error, &container)) return nullptr;
  if (QRTIsSystemClass(containerClass) &&
      !QRTFileManager::defaultManager().setTopLevelSystemContainerACL(container, staging, error)) {
    return nullptr;
  }
  if (!_createSubDirectories(staging, userId, containerClass, error, &container)) return nullptr;
  return metadata;
}

QRTMetadataRef QRTClientConnection::_createNewContainer(uint32_t userId, const std::string& identifier,
                                                        uint64_t containerClass, bool transient, QRTErrorRef* error) {
  QRTGlobalConfiguration& configuration = QRTGlobalConfiguration::sharedInstance();
  const std::string directoryName = QRTUUID::random().UUIDString();
  std::optional<QRTURL> classDirectory = configuration.containerDirectoryURLForUser(userId, containerClass, transient);
  std::string finalName = directoryName;
  if (auto wellKnown = QRTWhitelist::sharedWhitelist().wellknownContainerForId(identifier, containerClass)) {
    finalName = *wellKnown;
  }
  // Built on the class directory's own file system, so that it is only ever renamed.
  std::optional<QRTURL> stagingDirectory =
      classDirectory
          ? configuration.stagingDirectoryForURL(classDirectory->URLByAppendingPathComponent(finalName, true))
          : std::nullopt;
  if (!stagingDirectory) {
    QRTSetError(error, QRT_ERROR(classDirectory ? QRTErrorCreateStagingFailed : QRTErrorMoveStagingToLiveFailed,
                                 nullptr, true, "No staging directory for %@ in %@", identifier, classDirectory));
    return nullptr;
  }
  const QRTURL staging = stagingDirectory->URLByAppendingPathComponent(directoryName, true);
  // Staging is opened once and the container built and moved relative to
  // it. When it cannot be opened, the path from the device root is made and
  // resolved instead, which makes missing levels or reports what stops it.
  platform::Dir held;
  if (platform::Dir::open(stagingDirectory->path(), &held) != 0) held = platform::Dir();

  QRTMetadataRef metadata = _buildInStaging(staging, held, userId, identifier, containerClass, error);
  QRT_CRASH_POINT("create-after-build");
  if (metadata) {
    QRTURL finalURL = classDirectory ? classDirectory->URLByAppendingPathComponent(finalName, true) : QRTURL();
    QRTErrorRef moveError;
    platform::Dir classHeld;
    const bool moved =
        classDirectory && (held.valid() && platform::Dir::open(classDirectory->path(), &classHeld) == 0
                               ? QRTFileManager::defaultManager().moveItem(held, directoryName, classHeld, finalName,
                                                                           staging, finalURL, &moveError)
                               : QRTFileManager::defaultManager().moveItemAtURL(staging, finalURL, &moveError));
    if (!moved) {
      QRTSetError(error, QRT_ERROR(QRTErrorMoveStagingToLiveFailed, moveError, true,
                                   "Failed to move staging dir: %@ to live dir: %@", staging, finalURL));
    } else {
      QRT_CRASH_POINT("create-after-move");
      QRTMetadataRef stored;
      QRTErrorRef cacheError;
      if (QRTContainerCache::sharedInstance().addCreatedContainer(metadata, userId, finalURL, transient, &cacheError,
                                                                  &stored)) {
        return stored;
      }
      QRTSetError(error, QRT_ERROR(QRTErrorCacheAddFailed, cacheError, true,
                                   "Failed to add to cache for %u : %@, url: %@, transient: %d", userId, metadata,
                                   finalURL, transient));
      // No client learns of it, and a container the cache does not know
      // would be found by nobody until a restart: it goes to death row too.
      QRTErrorRef cleanupError;
      if (!_moveItemAtURLToDeathRow(finalURL, true, true, &cleanupError)) {
        QRTLog(platform::kLogError, "Failed to remove uncached container at %@ : %@", finalURL, cleanupError);
      }
      return nullptr;
    }
  }
  // Nothing half-made stays behind: the staging directory goes to death row.
  QRTErrorRef cleanupError;
  if (!_moveItemAtURLToDeathRow(staging, true, true, &cleanupError)) {
    QRTSetError(
        error, QRT_ERROR(QRTErrorRemoveStagingFailed, cleanupError, true, "Failed to remove staging dir: %@", staging));
  }
  return nullptr;
}

QRTMetadataRef QRTClientConnection::createOrLookupContainerForUser(const QRTContainerKey& key, QRTCreateMode mode,
                                                                   QRTLocking locking, uint64_t* withError) {
  const uint32_t userId = key.userId;
  const uint64_t containerClass = key.containerClass;
  const std::optional<std::string>& identifier = key.identifier;
  if (!identifier || containerClass < QRTClassAppBundle || containerClass > QRTClassSystemGroup) {
    reportCode(QRT_ERROR(QRTErrorInvalidParameter, nullptr, true,
                         "Can't act on an invalid object: userId: %u, ID: %@, class: %ld", userId, identifier,
                         static_cast<long>(containerClass)),
               withError);
    return nullptr;
  }
  if (!user_id_valid_for_class(containerClass, userId)) {
    reportCode(QRT_ERROR(QRTErrorInvalidParameter, nullptr, true, "Invalid userId %u for class %ld, ID: %@", userId,
                         static_cast<long>(containerClass), identifier),
               withError);
    return nullptr;
  }
  const bool foreign = identifier != clientBundleIdentifier_;
  if (foreign && !allowOtherIdLookup_ &&
      !((containerClass == QRTClassAppGroup || containerClass == QRTClassSystemGroup) && allowGroupIdLookup_) &&
      platform::deviceIsInternalBuild()) {
    QRTLog(platform::kLogDebug,
           "%@ trying to retrieve container class %ld for identifier: %@. WARNING: Soon you will need an entitlement "
           "to do this. File a Bugline in \"QuarterKit | all\"",
           clientBundleIdentifier_, static_cast<long>(containerClass), identifier);
  }
  if (containerClass == QRTClassSystemData && !allowOtherIdLookup_ &&
      (!QRTEntitlementsGrantSystemContainer(*identifier) || foreign)) {
    reportCode(QRT_ERROR(QRTErrorNotEntitled, nullptr, true, "%@ not entitled for system container with identifier %@",
                         clientBundleIdentifier_, identifier),
               withError);
    return nullptr;
  }

  QRTErrorRef error;
  QRTMetadataRef result;
  try {
    result = _lookupOrCreate(key, mode, locking, &error);
  } catch (...) { error = QRT_EXCEPTION_ERROR(); }
  if (!result) reportCode(error, withError);
  return result;
}

QRTMetadataRef QRTClientConnection::_lookupOrCreate(const QRTContainerKey& key, QRTCreateMode mode, QRTLocking locking,
                                                    QRTErrorRef* error) {
  const uint32_t userId = key.userId;
  const uint64_t containerClass = key.containerClass;
  const std::string& identifier = *key.identifier;
  const bool transient = key.transient;
  const bool useLocking = locking == QRTLocking::TakeLocks;
  // Creators of one identifier take its own lock: as an identifier writer it
  // keeps every all-identifiers locker out until the container is durable and
  // cached, while creators of other identifiers build theirs alongside.
  QRTIdentifierLock lock(creationLockName(identifier), true, useLocking);
  QRTErrorRef lookupError;
  QRTMetadataRef found = QRTContainerCache::sharedInstance().containerForUser(key, &lookupError);
  // Whether it existed belongs to this call: the cached object is shared.
  if (found && !transient) return found->withExisted(true);
  if (found) {
    // A transient container is never reused. Whoever works on it by its
    // UUID is waited for.
    QRTIdentifierLock victim(found->uuid().UUIDString(), true, useLocking);
    QRTErrorRef moveError;
    if (!_moveItemAtURLToDeathRow(found->url(), true, true, &moveError)) {
      QRTSetError(error, QRT_ERROR(QRTErrorRemoveTransientFailed, moveError, true,
                                   "Failed to remove transient container at %@", found->url()));
      return nullptr;
    }
    // Forget it too, so that a look-up without creation answers "not found"
    // rather than finding a container that is gone.
    QRTContainerCache::sharedInstance().removeContainerForUser(userId, containerClass, identifier, true, nullptr);
  } else if (!(lookupError->domain() == QRTErrorDomain && lookupError->code() == QRTErrorNotFound)) {
    QRTSetError(error, lookupError);
    return nullptr;
  }
  if (mode != QRTCreateMode::CreateIfMissing) {
    QRTSetError(error,
                QRT_ERROR(QRTErrorNotFound, nullptr, false, "Container with identifier: \"%@\" Not Found", identifier));
    return nullptr;
  }
  // A user's containers, and so the cache's memory for them, stay bounded;
  // a slot is held from here until the container is cached.
  CreationSlot slot(userId, containerClass);
  if (userId != 0) {
    const size_t limit = QRTGlobalConfiguration::sharedInstance().maxContainersPerClass();
    QRTErrorRef countError;
    size_t held = 0;
    if (!slot.reserve(limit, &held, &countError)) {
      if (countError) {
        QRTSetError(error, countError);
        return nullptr;
      }
      QRTSetError(error, QRT_ERROR(QRTErrorInvalidArgument, nullptr, true,
                                   "User %u holds %llu containers of class %llu, the most allowed: not creating %@",
                                   userId, static_cast<unsigned long long>(held),
                                   static_cast<unsigned long long>(containerClass), identifier));
      return nullptr;
    }
  }
  QRTMetadataRef made = _createNewContainer(userId, identifier, containerClass, transient, error);
  if (made) slot.handedOver();
  return made;
}
