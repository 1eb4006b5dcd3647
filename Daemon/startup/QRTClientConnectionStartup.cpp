// The start-up work of the store: set-up and clean-up at every start, and
// the work of the first start after a boot (upgrade migrations, system
// container paths made anew, system containers restored from a backup, and
// clearing what no container owns). Nothing here stops the daemon from
// starting: failures are logged and the next step runs.

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include "Daemon/QRTCrashPoint.h"
#include "Daemon/QRTProcessWide.h"
#include "Daemon/dataprotection/QRTDataProtectionManager.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/migration/QRTContainerMigrator.h"
#include "Daemon/store/QRTMigrationStatus.h"
#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/store/QRTMetadata.h"
#include "Daemon/store/QRTPerUserConfiguration.h"
#include "Daemon/store/QRTWhitelist.h"
#include "base/QRTUUID.h"
#include "platform/DeviceProperties.h"
#include "platform/Log.h"
#include "platform/SafePath.h"

using platform::kLogError;

namespace {
// A replace whose old container could not be moved back out of staging keeps
// its journal; staging must then survive until a later start completes it.
bool gReplaceRecoveryIncomplete = false;
}  // namespace

void QRTClientConnection::quarterSetup() {
  // Before quarterCleanup empties staging: a rollback moves a container back out of it.
  QRTErrorRef error;
  if (!_recoverFromReplaceOperationsWithError(&error)) {
    QRTLog(platform::kLogError, "Failed recovering from replace operations: %@", error);
    gReplaceRecoveryIncomplete = true;
  }
  QRTErrorRef protectionError;
  if (!QRTDataProtectionManager::defaultManager().restartPendingDataProtectionOperationsWithError(QRTLockStateQueue(),
                                                                                                  &protectionError)) {
    QRTLog(platform::kLogError, "Failed restarting pending data protection operations: %@", protectionError);
  }
}

void QRTClientConnection::quarterCleanup() {
  QRTGlobalConfiguration& configuration = QRTGlobalConfiguration::sharedInstance();
  configuration.loadUsersWithLeftovers();
  if (gReplaceRecoveryIncomplete) {
    deleteContainersOnDeathRowWithCompletion(nullptr);
    return;
  }
  configuration.getPerUserConfigurationForCurrentMobileUser();  // its base's staging is looked at too
  for (const QRTURL& staging : configuration.allStagingDirectories()) {
    QRTErrorRef error;
    auto items = QRTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(staging, &error);
    if (!items && !(error->domain() == QRTPOSIXErrorDomain && error->code() == ENOENT)) {
      QRTLog(platform::kLogError, "Failed to get items at staging URL%@ : %@", staging, error);
    }
    for (const QRTURL& item : items.value_or(std::vector<QRTURL>{})) {
      _moveItemAtURLToDeathRow(item, true, false, nullptr);
    }
  }
  deleteContainersOnDeathRowWithCompletion(nullptr);
}

namespace {

bool isMissing(const QRTErrorRef& error) {
  return error && error->domain() == QRTPOSIXErrorDomain && error->code() == ENOENT;
}

QRTURL withExtension(const QRTURL& url, const char* extension) {
  return url.URLByDeletingLastPathComponent().URLByAppendingPathComponent(url.lastPathComponent() + "." + extension,
                                                                          true);
}

// Keeps an item that could not be restored, rather than losing it.
void _moveFailedPathAside(const QRTURL& item, const QRTURL& directory, const std::string& name) {
  QRTFileManager& fm = QRTFileManager::defaultManager();
  QRTErrorRef error;
  if (!fm.createDirectoryAtURL(directory, true, 0777, &error)) {
    QRTLog(kLogError, "Failed to create %@: %@", directory, error);
  }
  const QRTURL target = directory.URLByAppendingPathComponent(name);
  if (!fm.moveItemAtURL(item, target, &error)) QRTLog(kLogError, "Failed to move %@ to %@: %@", item, target, error);
}

void _moveSystemContainerIntoPlace(const QRTURL& restored, uint64_t containerClass, QRTClientConnection& client) {
  const std::string identifier = restored.lastPathComponent();
  const QRTURL failedDirectory =
      withExtension(restored.URLByDeletingLastPathComponent(), "failed").URLByAppendingPathComponent(identifier, true);
  uint64_t code = QRTErrorNone;
  QRTMetadataRef container =
      client.createOrLookupContainerForUser({QRTSystemContainerUserId, containerClass, identifier},
                                            QRTCreateMode::CreateIfMissing, QRTLocking::TakeLocks, &code);
  if (code != QRTErrorNone || !container) {
    QRTLog(kLogError, "Failed to create system container %@: %llu", identifier, static_cast<unsigned long long>(code));
    return;
  }
  QRTLog(kLogError, "Restoring container for %@ at %@ to %@", identifier, restored, container->url());
  QRTFileManager& fm = QRTFileManager::defaultManager();
  struct stat owner;
  if (int err = platform::safeStat(container->url().path(), &owner)) {
    QRTLog(kLogError, "Failed to find the owner of system container %@: %s", identifier, strerror(err));
    return;
  }
  QRTErrorRef error;
  auto items = fm.urlsForItemsInDirectoryAtURL(restored, &error);
  if (!items) {
    QRTLog(kLogError, "Failed to enumerate contents of restored system container %@ at %@: %@", identifier, restored,
           error);
    return;
  }
  for (const QRTURL& item : *items) {
    const std::string name = item.lastPathComponent();
    const QRTURL destination = container->url().URLByAppendingPathComponent(name);
    QRTErrorRef step;
    if (!fm.removeItemAtURL(destination, &step)) {
      QRTLog(kLogError, "Failed to remove destination %@:%@: %@", identifier, destination, step);
      _moveFailedPathAside(item, failedDirectory, name);
    } else if (!fm.moveItemAtURL(item, destination, &step)) {
      QRTLog(kLogError, "Failed to move file in restored system container %@:%@ to destination %@: %@", identifier,
             item, destination, step);
      _moveFailedPathAside(item, failedDirectory, name);
    } else if (!fm.itemIsImportableAtURL(destination, destination, 0)) {
      // Swapped since the backup was checked: what arrived is not kept.
      client._moveItemAtURLToDeathRow(destination, true, false, nullptr);
    } else if (!fm.standardizeOwnershipAtURL(destination, owner.st_uid, owner.st_gid, &step)) {
      QRTLog(kLogError, "Failed to give %@ the owner of system container %@: %@", destination, identifier, step);
    }
  }
  client.recreateDefaultStructureForUser(container->uid(), container->uuid(), identifier, containerClass, &code);
  if (code != QRTErrorNone) {
    QRTLog(kLogError, "Error processing restored system container %@: %llu", identifier,
           static_cast<unsigned long long>(code));
  }
}

// Moves the backup's subdirectory to ".inprogress"; only what this start
// moved there is installed, so an interrupted install is never repeated.
bool takeBackupDirectory(const std::optional<QRTURL>& directory, const std::optional<QRTURL>& base,
                         const char* moveFailure) {
  QRTFileManager& fm = QRTFileManager::defaultManager();
  if (!directory || !base || !fm.itemExistsAtURL(*directory)) return false;
  // The backup lies in a user's home: only a tree of root's alone is installed.
  if (!fm.itemIsImportableAtURL(*directory, *base, 0)) return false;
  const QRTURL inProgress = withExtension(*directory, "inprogress");
  QRTErrorRef error;
  if (!fm.removeItemAtURL(inProgress, &error)) {
    QRTLogAs(kLogError, "QRTMoveSystemContainersIntoPlace",
             "Failed to remove existing inprogress system containers: %@", error);
  }
  if (!fm.moveItemAtURL(*directory, inProgress, &error)) {
    QRTLogAs(kLogError, "QRTMoveSystemContainersIntoPlace", moveFailure, error);
    return false;
  }
  // A home swapped between the check and the move brings the user's tree here.
  return fm.itemIsImportableAtURL(inProgress, *base, 0);
}

void installBackupDirectory(const QRTURL& directory, uint64_t containerClass, const char* listFailure,
                            QRTClientConnection& client) {
  const QRTURL inProgress = withExtension(directory, "inprogress");
  QRTErrorRef error;
  auto entries = QRTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(inProgress, &error);
  if (!entries) {
    QRTLogAs(kLogError, "QRTMoveSystemContainersIntoPlace", listFailure, inProgress, error);
    return;
  }
  for (const QRTURL& entry : *entries) _moveSystemContainerIntoPlace(entry, containerClass, client);
}

void QRTMoveSystemContainersIntoPlace(QRTClientConnection& client) {
  auto user = QRTGlobalConfiguration::sharedInstance().getPerUserConfigurationForCurrentMobileUser();
  const auto data = user->systemContainerBackupDirectory();
  const auto shared = user->systemGroupContainerBackupDirectory();
  const auto base = user->systemContainerBackupBaseDirectory();
  const bool dataMoved = takeBackupDirectory(data, base, "Failed to move system containers to inprogress: %@");
  const bool sharedMoved =
      takeBackupDirectory(shared, base, "Failed to move shared system containers to inprogress: %@");
  if (dataMoved) {
    QRTLogAs(kLogError, "QRTMoveSystemContainersIntoPlace", "Installing system containers");
    installBackupDirectory(*data, QRTClassSystemData, "Couldn't find any system containers at %@: %@", client);
  }
  if (sharedMoved) {
    QRTLogAs(kLogError, "QRTMoveSystemContainersIntoPlace", "Installing system group containers");
    installBackupDirectory(*shared, QRTClassSystemGroup, "Couldn't find any system shared containers at %@: %@",
                           client);
  }
  // Internal builds keep the backup, ".inprogress" and ".failed" included,
  // for diagnosis; a refused tree stays the user's, untouched.
  if (platform::deviceIsInternalBuild() || (!dataMoved && !sharedMoved)) return;
  QRTErrorRef error;
  if (base && !QRTFileManager::defaultManager().removeItemAtURL(*base, &error)) {
    QRTLogAs(kLogError, "QRTMoveSystemContainersIntoPlace", "Failed to remove system container base dir %@: %@", *base,
             error);
  }
}

}  // namespace

void QRTClientConnection::_regenerateAllSystemContainerPaths() {
  QRTLog(platform::kLogNotice, "Rolling system container directory UUIDs on disk");
  for (uint64_t containerClass : {uint64_t{QRTClassSystemData}, uint64_t{QRTClassSystemGroup}}) {
    QRTErrorRef error;
    auto list = QRTContainerCache::sharedInstance().allContainersForUser(QRTSystemContainerUserId, containerClass,
                                                                         false, false, &error);
    if (!list) {
      QRTLog(platform::kLogError, "Failed to get list of system containers for migration: %@", error);
      continue;
    }
    for (const auto& metadata : *list) {
      const std::string& identifier = metadata->identifier();
      if (QRTWhitelist::sharedWhitelist().containerIdIsWellknown(identifier, containerClass) ||
          identifier == "systemgroup.com.norvane.diagvault") {
        continue;
      }
      uint64_t code = QRTErrorNone;
      regenerateDirectoryUUIDForUser(QRTSystemContainerUserId, metadata->uuid(), identifier, containerClass, &code);
      if (code != QRTErrorNone) {
        QRTLog(platform::kLogError, "Failed to regenerate directory UUID for identifier: %@, class: %llu", identifier,
               static_cast<unsigned long long>(containerClass));
      }
    }
  }
}

void QRTClientConnection::rebootQuarterSetup() {
  if (auto status = QRTMigrationStatus::init(); status && status->isBuildUpgrade()) {
    _regenerateAllSystemContainerPaths();
    QRTErrorRef error;
    if (!QRTContainerMigrator::sharedInstance().performSynchronousBuildUpgradeMigration(status.get(), &error)) {
      QRTLog(kLogError, "Failed to perform build upgrade migration : %@", error);
    }
    QRT_CRASH_POINT("startup-build-upgrade-migrated");
    // Recorded whatever the result: a failing step must not run at every boot.
    status->writeCurrentBuildInfoToDisk();
  }
  QRTMoveSystemContainersIntoPlace(*this);
}

void QRTClientConnection::_cleanupOrphanedDataForUser(uint32_t userId, uint64_t containerClass) {
  auto directory = QRTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(userId, containerClass, false);
  if (!directory) return;
  QRTFileManager& fm = QRTFileManager::defaultManager();
  QRTErrorRef error;
  auto entries = fm.urlsForItemsInDirectoryAtURL(*directory, &error);
  if (!entries) {
    if (!isMissing(error)) QRTLog(kLogError, "Failed to get items at %@ : %@", *directory, error);
    return;
  }
  // One resolution of the class directory for all its entries: a start-up
  // after a reboot looks at every container of the store.
  platform::UniqueFd classFd;
  const int openError = platform::safeOpen(directory->path(), O_RDONLY | O_DIRECTORY, &classFd);
  auto metadataMissing = [&](const QRTURL& entry) {
    if (openError) return fm.itemDoesNotExistAtURL(entry.URLByAppendingPathComponent(QRTMetadataFileName));
    platform::UniqueFd file;
    const std::string relative = entry.lastPathComponent() + "/" + QRTMetadataFileName;
    const int err = platform::openBeneath(classFd.get(), relative.c_str(), O_PATH, &file);
    if (err == 0) return false;
    if (err == ENOENT) return true;
    QRTLog(kLogError, "Failed to determine if %@ exists: %s", entry.URLByAppendingPathComponent(QRTMetadataFileName),
           strerror(err));
    return false;
  };
  const QRTWhitelist& whitelist = QRTWhitelist::sharedWhitelist();
  for (const QRTURL& entry : *entries) {
    const std::string name = entry.lastPathComponent();
    const bool wellFormed =
        QRTUUID::fromString(name).has_value() || whitelist.containerIdIsWellknown(name, containerClass);
    if (wellFormed) {
      // Only a metadata file known to be missing orphans a well-named container.
      if (!metadataMissing(entry)) continue;
      QRTLog(kLogError, "Deleting orphaned data missing a metadata file at: %@", entry);
    }
    if (platform::deviceIsInternalBuild()) {
      QRTLog(kLogError,
             "***INTERNAL BUILD REQUEST: If you see this, file a Bugline in \"QuarterKit | all\" with the following "
             "data:");
      QRTLog(kLogError,
             "\tSomeone is writing invalid data to a container, which has now been orphaned. Here are the "
             "invalid files:");
      fm.printDirectoryStructureAtURL(entry);
      QRTLog(kLogError, "***END INTERNAL BUILD REQUEST");
    }
    _moveItemAtURLToDeathRow(QRTURL::fileURL(entry.path(), true), true, false, nullptr);
  }
}

void QRTClientConnection::rebootQuarterCleanup() {
  QRTGlobalConfiguration& config = QRTGlobalConfiguration::sharedInstance();
  QRTErrorRef error;
  // Handed over whole; the getters make them again, empty, when next needed.
  const QRTURL transient = config.transientDirectory();
  if (!_moveItemAtURLToDeathRow(transient, true, false, &error)) {
    QRTLog(kLogError, "Failed to delete shared transient URL %@ : %@", transient, error);
  }
  const QRTURL transientBundles = config.transientBundleDirectory();
  if (!_moveItemAtURLToDeathRow(transientBundles, true, false, &error)) {
    QRTLog(kLogError, "Failed to delete shared transient bundle URL %@ : %@", transientBundles, error);
  }
  auto user = config.getPerUserConfigurationForCurrentMobileUser();
  if (user->existsUserBaseDirectory()) {
    if (auto userTransient = user->transientDirectory();
        userTransient && !_moveItemAtURLToDeathRow(*userTransient, true, false, &error)) {
      QRTLog(kLogError, "Failed to delete per-user transient URL %@ : %@", *userTransient, error);
    }
    for (uint64_t cls : {QRTClassAppData, QRTClassAddonData, QRTClassVPNData, QRTClassAppGroup,
                         QRTClassRelayServiceData, QRTClassInternalDaemonData, QRTClassTempDirData}) {
      _cleanupOrphanedDataForUser(user->userId(), cls);
    }
  }
  for (uint64_t cls : {QRTClassAppBundle, QRTClassAddonBundle, QRTClassVPNBundle, QRTClassFrameworkBundle}) {
    _cleanupOrphanedDataForUser(QRTInstallerUserId, cls);
  }
  for (uint64_t cls : {QRTClassSystemData, QRTClassSystemGroup})
    _cleanupOrphanedDataForUser(QRTSystemContainerUserId, cls);
}
