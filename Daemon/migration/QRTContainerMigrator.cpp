#include "Daemon/migration/QRTContainerMigrator.h"

#include <cerrno>
#include <cstdlib>
#include <optional>

#include "Daemon/QRTCrashPoint.h"
#include "Daemon/QRTProcessWide.h"
#include "Daemon/codesign/QRTCodeSigningMapping.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/store/QRTMigrationStatus.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/store/QRTMetadata.h"
#include "Daemon/store/QRTPerUserConfiguration.h"
#include "Daemon/store/QRTWhitelist.h"
#include "platform/DeviceProperties.h"
#include "platform/DeviceRoot.h"
#include "platform/HostProfile.h"
#include "platform/Log.h"

using platform::kLogError;
using platform::kLogNotice;

namespace {

constexpr const char* kOldBundleContainerPath = "/private/var/mobile/Containers/Bundle";
constexpr uint64_t kMultiUserModeFlag = 0x80000000u;

// The installer's account as files carry it: 33 on a device, the account
// standing for it on a host. Nothing, with a log line, when that is missing.
struct HostOwner {
  uid_t uid;
  gid_t gid;
};
std::optional<HostOwner> bundleOwner() {
  std::optional<uid_t> uid = platform::hostUserId(QRTInstallerUserId);
  std::optional<gid_t> gid = platform::hostGroupId(QRTInstallerUserId);
  if (!uid || !gid) {
    QRTLog(kLogError, "No account stands for the installer (%u): bundle containers left as they are",
           static_cast<unsigned>(QRTInstallerUserId));
    return std::nullopt;
  }
  return HostOwner{*uid, *gid};
}

bool isMissing(const QRTErrorRef& error) {
  return error && error->domain() == QRTPOSIXErrorDomain && error->code() == ENOENT;
}

// A status object that could not be read records nothing and has seen nothing run.
bool occurred(QRTMigrationStatus* status, const char* type) {
  return status && status->hasMigrationOccurredForType(type);
}

// "name.N" gives N; anything else 0.
long numericExtension(const std::string& name, std::string* stem) {
  const size_t dot = name.rfind('.');
  *stem = dot == std::string::npos ? name : name.substr(0, dot);
  if (dot == std::string::npos || dot + 1 == name.size()) return 0;
  char* end = nullptr;
  const long n = strtol(name.c_str() + dot + 1, &end, 10);
  return end && *end == '\0' && n >= 0 ? n : 0;
}

}  // namespace

QRTContainerMigrator& QRTContainerMigrator::sharedInstance() {
  static QRTContainerMigrator* const instance = new QRTContainerMigrator();
  return *instance;
}

void QRTContainerMigrator::_moveOldLogFiles() {
  auto user = QRTGlobalConfiguration::sharedInstance().getPerUserConfigurationForUserId(QRTDefaultMobileUserId);
  QRTFileManager& fm = QRTFileManager::defaultManager();
  if (auto oldLibrary = user->oldLibraryDirectoryPath()) {
    QRTErrorRef error;
    if (!fm.removeItemAtURL(*oldLibrary, &error))
      QRTLog(kLogError, "Failed to remove old Library directory: %@", error);
  }
  auto oldLogs = user->oldLoggingPath();
  if (!oldLogs) return;
  QRTErrorRef listError;
  auto items = fm.urlsForItemsInDirectoryAtURL(*oldLogs, &listError);
  if (items) {
    const QRTURL logDirectory = QRTGlobalConfiguration::sharedInstance().logDirectory();
    for (const QRTURL& item : *items) {
      std::string stem;
      const long next = numericExtension(item.lastPathComponent(), &stem) + 1;
      if (next > static_cast<long>(gQRTLogFileCount)) continue;
      // The old directory is in a user's home: only root's own files go to root's log directory.
      if (!fm.itemIsImportableAtURL(item, *oldLogs, 0)) continue;
      QRTURL target = logDirectory.URLByAppendingPathComponent(stem + "." + std::to_string(next));
      QRTErrorRef moveError;
      if (!fm.moveItemAtURL(item, target, &moveError)) {
        QRTLog(kLogError, "Failed to move to new logging directory from %@ : %@", item, moveError);
      } else if (!fm.itemIsImportableAtURL(target, target, 0) && !fm.removeItemAtURL(target, &moveError)) {
        QRTLog(kLogError, "Failed to remove %@, swapped while it was moved: %@", target, moveError);
      }
    }
    QRTLog(kLogNotice, "Migrated log files on %@", QRTMigrationStatus::currentBuildVersion());
  } else if (!isMissing(listError)) {
    QRTLog(kLogError, "Failed to get items for deletion: %@ : %@", *oldLogs, listError);
  }
  QRTErrorRef removeError;
  if (!fm.removeItemAtURL(*oldLogs, &removeError))
    QRTLog(kLogError, "Failed to remove old Log directory: %@", removeError);
}

bool QRTContainerMigrator::performSynchronousBuildUpgradeMigration(QRTMigrationStatus* status, QRTErrorRef* withError) {
  bool ok = false;
  if (QRTErrorRef thrown = QRT_GUARD([&] { ok = _buildUpgradeSteps(status, withError); })) {
    QRTSetError(withError, thrown);
    return false;
  }
  return ok;
}

bool QRTContainerMigrator::_buildUpgradeSteps(QRTMigrationStatus* status, QRTErrorRef* withError) {
  // A multi-user device keeps the old per-user directories.
  if (!(platform::deviceMultiUserFlags() & kMultiUserModeFlag)) _moveOldLogFiles();

  const QRTURL oldBundles = QRTURL::fileURL(platform::hostPath(kOldBundleContainerPath), true);
  QRTFileManager& fm = QRTFileManager::defaultManager();
  // The old place is in a user's home: only a tree of root's or the
  // installer's alone becomes the bundle classes.
  const std::optional<HostOwner> owner = fm.itemExistsAtURL(oldBundles) ? bundleOwner() : std::nullopt;
  if (owner && fm.itemIsImportableAtURL(oldBundles, oldBundles, owner->uid)) {
    QRTLog(kLogNotice, "Moving bundle containers from user to system location");
    const QRTURL bundles = QRTGlobalConfiguration::sharedInstance().bundleDirectory();
    QRTErrorRef error;
    if (!fm.moveItemAtURL(oldBundles, bundles, &error)) {
      QRTLog(kLogError, "Failed to migrate to new bundle containers location : %@.  This is terrible.", error);
      QRTSetError(withError, error);
      return false;
    }
    if (!fm.itemIsImportableAtURL(bundles, bundles, owner->uid)) {
      // Swapped since it was checked: what arrived is not kept.
      const QRTURL removed =
          bundles.URLByDeletingLastPathComponent().URLByAppendingPathComponent("Bundle.refused", true);
      if (!fm.moveItemAtURL(bundles, removed, &error) || !fm.removeItemAtURL(removed, &error)) {
        QRTLog(kLogError, "Failed to remove refused bundle containers : %@", error);
      }
    }
  }
  QRT_CRASH_POINT("migrator-build-upgrade-bundles-moved");
  _checkIfDeviceMayNeedSystemContainerACLMigration(status);
  QRTErrorRef whitelistError;
  if (!_performWhitelistMigrationWithError(&whitelistError)) {
    QRTLog(kLogError, "Failed to migrate whitelisted bundle containers : %@", whitelistError);
    QRTSetError(withError, whitelistError);
    return false;
  }
  return true;
}

void QRTContainerMigrator::_checkIfDeviceMayNeedSystemContainerACLMigration(QRTMigrationStatus* status) {
  if (occurred(status, QRTMigrationTypeACL)) return;
  QRTGlobalConfiguration& config = QRTGlobalConfiguration::sharedInstance();
  QRTFileManager& fm = QRTFileManager::defaultManager();
  for (uint64_t cls : {QRTClassSystemData, QRTClassSystemGroup}) {
    auto base = config.globalContainerBaseURLWithContentClass(cls, false);
    // Undecided counts as present: the ACL migration then runs.
    if (!base || !fm.itemDoesNotExistAtURL(*base)) return;
  }
  QRTLog(kLogNotice, "No system containers requiring ACL migration");
  if (status) status->setMigrationCompleteForType(QRTMigrationTypeACL);
}

bool QRTContainerMigrator::_performWhitelistMigrationWithError(QRTErrorRef* error) {
  QRTContainerCache& cache = QRTContainerCache::sharedInstance();
  const QRTWhitelist& whitelist = QRTWhitelist::sharedWhitelist();
  for (uint64_t cls : {QRTClassSystemData, QRTClassSystemGroup}) {
    auto classDirectory =
        QRTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(QRTSystemContainerUserId, cls, false);
    QRTErrorRef listError;
    auto containers = cache.allContainersForUser(QRTSystemContainerUserId, cls, false, &listError);
    if (!classDirectory || !containers) {
      QRTLog(kLogError, "Failed to get list of system containers for migration: (error= %@ : %lld)",
             listError ? listError->domain() : std::string("(null)"),
             static_cast<long long>(listError ? listError->code() : 0));
      QRTSetError(error, listError ? listError
                                   : QRT_ERROR(QRTErrorInvalidPath, nullptr, true, "No class directory for %llu",
                                               static_cast<unsigned long long>(cls)));
      return false;
    }
    for (const QRTMetadataRef& container : *containers) {
      auto name = whitelist.wellknownContainerForId(container->identifier(), cls);
      if (!name) continue;
      const QRTURL target = classDirectory->URLByAppendingPathComponent(*name, true);
      if (container->url().empty() || container->url().path() == target.path()) continue;
      const std::string& identifier = container->identifier();
      QRTLog(kLogNotice, "Migrating well-known container %@ from %@ to %@", identifier, container->url(), target);
      QRTErrorRef step;
      if (!cache.removeContainerForUser(QRTSystemContainerUserId, cls, identifier, false, &step)) {
        QRTLog(kLogError, "%s: Failed to remove cache for whitelisted container %@: (error= %@: %lld)", __func__,
               identifier, step ? step->domain() : std::string("(null)"),
               static_cast<long long>(step ? step->code() : 0));
        QRTSetError(error, step);
        return false;
      }
      if (!QRTFileManager::defaultManager().moveItemAtURL(container->url(), target, &step)) {
        QRTLog(kLogError,
               "%s: Failed to move system container %@ from %@ to whitelisted location %@: (error= %@: %lld)", __func__,
               identifier, container->url(), target, step ? step->domain() : std::string("(null)"),
               static_cast<long long>(step ? step->code() : 0));
        QRTSetError(error, step);
        return false;
      }
      if (!cache.addContainerMetadata(container->withUrl(target), QRTSystemContainerUserId, target, false, true,
                                      &step)) {
        QRTLog(kLogError, "%s: Failed to update cache for whitelisted container %@: (error= %@: %lld)", __func__,
               identifier, step ? step->domain() : std::string("(null)"),
               static_cast<long long>(step ? step->code() : 0));
        QRTSetError(error, step);
        return false;
      }
    }
  }
  return true;
}

bool QRTContainerMigrator::_performInternalACLMigrationWithError(QRTErrorRef* error) {
  auto status = QRTMigrationStatus::init();
  if (occurred(status.get(), QRTMigrationTypeACL)) return true;
  QRTGlobalConfiguration& config = QRTGlobalConfiguration::sharedInstance();
  QRTFileManager& fm = QRTFileManager::defaultManager();
  QRTErrorRef last;
  struct Step {
    uint64_t cls;
    const char* failure;
  };
  for (const Step& step : {Step{QRTClassSystemData, "Failed to set ACLs on system containers : %@"},
                           Step{QRTClassSystemGroup, "Failed to set ACLs on system group containers : %@"}}) {
    auto directory = config.globalContainerBaseURLWithContentClass(step.cls, false);
    if (!directory || !fm.itemExistsAtURL(*directory)) continue;
    QRTErrorRef aclError;
    if (!fm.standardizeAllSystemContainerACLsAtURL(*directory, &aclError)) {
      QRTLog(kLogError, step.failure, aclError);
      last = aclError ? aclError : QRT_ERROR(QRTErrorACLFailed, nullptr, false, "ACLs of %@", *directory);
    }
  }
  if (last) {
    QRTSetError(error, last);
    return false;
  }
  if (status) status->setMigrationCompleteForType(QRTMigrationTypeACL);
  return true;
}

bool QRTContainerMigrator::_performBundleContainerOwnershipMigrationWithError(QRTErrorRef* error) {
  auto status = QRTMigrationStatus::init();
  if (occurred(status.get(), QRTMigrationTypeBundle)) return true;
  QRTLog(kLogNotice, "Changing ownership of bundle container content.");
  const QRTURL bundles = QRTGlobalConfiguration::sharedInstance().bundleDirectory();
  const std::optional<HostOwner> owner = bundleOwner();
  QRTErrorRef ownerError;
  if (!owner) {
    ownerError = QRT_POSIX_ERROR(EPERM, "No account stands for user %u", static_cast<unsigned>(QRTInstallerUserId));
  }
  if (!owner ||
      !QRTFileManager::defaultManager().standardizeOwnershipAtURL(bundles, owner->uid, owner->gid, &ownerError)) {
    QRTSetError(error, QRT_ERROR(QRTErrorChangeOwnerFailed, ownerError, true, "Failed to change owner of %@: %@",
                                 bundles, ownerError));
    return false;
  }
  if (status) status->setMigrationCompleteForType(QRTMigrationTypeBundle);
  return true;
}

bool QRTContainerMigrator::performDataMigratorMigrationWithError(QRTErrorRef* error) {
  bool ok = true;
  QRTErrorRef result;
  if (QRTErrorRef thrown = QRT_GUARD([&] {
        QRTLog(kLogNotice, "Performing Data Migration on %@", QRTMigrationStatus::currentBuildVersion());
        QRTErrorRef aclError;
        if (!_performInternalACLMigrationWithError(&aclError)) {
          QRTLog(kLogError, "Failed to migrate ACLs on system containers : %@", aclError);
          ok = false;
          result = aclError;
        }
        QRTErrorRef bundleError;
        if (!_performBundleContainerOwnershipMigrationWithError(&bundleError)) {
          QRTLog(kLogError, "Failed to migrate bundle containers to system location : %@", bundleError);
          ok = false;
          result = bundleError;
        }
        QRT_CRASH_POINT("migrator-data-migration-owned");
        if (QRTCodeSigningMapping* mapping = QRTCodeSigningMapping::sharedInstance())
          mapping->performAllCodeSigningMigrationAndReconciliation();
      })) {
    ok = false;
    result = thrown;
  }
  if (!ok) QRTSetError(error, result);
  return ok;
}
