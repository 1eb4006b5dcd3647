#include "Daemon/store/QRTMigrationStatus.h"

#include <cerrno>
#include <ctime>
#include <mutex>

#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "platform/DeviceProperties.h"
#include "platform/Log.h"

using platform::kLogError;
using platform::kLogNotice;

namespace {

constexpr const char* kBuildVersionKey = "BuildVersion";
constexpr const char* kReleaseTypeKey = "ReleaseType";

struct MarkerFile {
  const char* name;
  const char* type;
};
// Earlier daemons kept one file per migration; converted in this order.
constexpr MarkerFile kMarkerFiles[] = {
    {"qrt_bundle_migration_complete.plist", QRTMigrationTypeBundle},
    {"qrt_acl2_migration_complete.plist", QRTMigrationTypeACL},
    {"qrt_group_id_migration_complete.plist", QRTMigrationTypeGroupId},
    {"qrt_code_signing_migration_complete.plist", QRTMigrationTypeCodeSigning},
};

bool isMissingFile(const QRTErrorRef& error) {
  return error && error->domain() == QRTPOSIXErrorDomain && error->code() == ENOENT;
}

std::optional<std::string> stringAt(const plist::Dictionary* dictionary, const char* key) {
  const plist::Value* v = dictionary ? plist::find(*dictionary, key) : nullptr;
  const std::string* s = v ? v->stringIf() : nullptr;
  return s ? std::optional<std::string>(*s) : std::nullopt;
}

std::string nowDescription() {
  time_t now = time(nullptr);
  struct tm utc {};
  gmtime_r(&now, &utc);
  char text[64];
  strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S +0000", &utc);
  return text;
}

}  // namespace

std::optional<std::string> QRTMigrationStatus::currentBuildVersion() {
  static const std::optional<std::string> version = [] {
    auto record = platform::systemVersionRecord();
    return stringAt(record ? &*record : nullptr, kBuildVersionKey);
  }();
  return version;
}

std::unique_ptr<QRTMigrationStatus> QRTMigrationStatus::init() {
  std::unique_ptr<QRTMigrationStatus> status(new QRTMigrationStatus());
  status->fileURL_ = QRTGlobalConfiguration::sharedInstance().libraryDirectory().URLByAppendingPathComponent(
      QRTMigrationStatusFileName);
  if (!status->_readMigrationStatusFromDisk()) {
    QRTLog(kLogError, "Error reading migration file from disk.  This is bad");
    return nullptr;
  }
  return status;
}

bool QRTMigrationStatus::_readMigrationStatusFromDisk() {
  QRTErrorRef error;
  auto dictionary = QRT_dictionaryWithContentsOfURL(fileURL_, &error);
  if (dictionary) {
    migrationInfo_ = std::move(*dictionary);
  } else if (!isMissingFile(error)) {
    QRTLog(kLogError, "Failed to read migration status file at %@ : %@", fileURL_, error);
    return false;
  }
  if (migrationInfo_.empty()) _migrateFromManyMarkerFilesToOne();
  return true;
}

void QRTMigrationStatus::_migrateFromManyMarkerFilesToOne() {
  QRTLog(kLogNotice, "Migrating from many marker files down to one");
  const QRTURL library = fileURL_.URLByDeletingLastPathComponent();
  for (const MarkerFile& marker : kMarkerFiles) {
    QRTURL url = library.URLByAppendingPathComponent(marker.name);
    QRTErrorRef error;
    if (auto record = QRT_dictionaryWithContentsOfURL(url, &error)) {
      migrationInfo_[marker.type] = std::move(*record);
    } else if (!isMissingFile(error)) {
      QRTLog(kLogError, "Failed to read migration marker file at %@ : %@", url, error);
    }
  }
  if (!_writeMigrationStatusToDisk()) return;
  for (const MarkerFile& marker : kMarkerFiles) {
    QRTURL url = library.URLByAppendingPathComponent(marker.name);
    // removeItemAtURL takes a missing file as removed; a missing marker is
    // reported the same way as a failed removal.
    QRTErrorRef error;
    if (!QRTFileManager::defaultManager().itemExistsAtURL(url)) {
      error = QRT_POSIX_ERROR(ENOENT, "No such file: %@", url);
    } else if (QRTFileManager::defaultManager().removeItemAtURL(url, &error)) {
      continue;
    }
    QRTLog(kLogError, "Failed to remove marker file at %@: %@", url, error);
  }
}

bool QRTMigrationStatus::_writeMigrationStatusToDisk() {
  QRTErrorRef error;
  if (!QRT_writeToURL(migrationInfo_, fileURL_, QRTWriteAtomic | QRTWriteFileProtectionNone, &error)) {
    QRTLog(kLogError, "Failed to write migration status on %@ for %@ : %@", currentBuildVersion(), fileURL_, error);
    return false;
  }
  return true;
}

bool QRTMigrationStatus::hasMigrationOccurredForType(const std::string& type) const {
  return plist::find(migrationInfo_, type) != nullptr;
}

void QRTMigrationStatus::setMigrationCompleteForType(const std::string& type) {
  // Without a readable build the record still marks the type as done.
  migrationInfo_[type] = plist::Dictionary{{"QRTMigrationVersionNumber", currentBuildVersion().value_or("unknown")},
                                           {"QRTMigrationTime", nowDescription()}};
  if (_writeMigrationStatusToDisk())
    QRTLog(kLogNotice, "Migration completed on %@ for %@", currentBuildVersion(), type);
}

void QRTMigrationStatus::writeCurrentBuildInfoToDisk() {
  auto record = platform::systemVersionRecord();
  if (!record) return;  // nothing to record; the next start asks again
  migrationInfo_[QRTLastBuildInfoKey] = std::move(*record);
  if (_writeMigrationStatusToDisk()) QRTLog(kLogNotice, "Saved last build version of %@", currentBuildVersion());
}

bool QRTMigrationStatus::isBuildUpgrade() const {
  const plist::Value* last = plist::find(migrationInfo_, QRTLastBuildInfoKey);
  const plist::Dictionary* lastInfo = last ? last->dictionaryIf() : nullptr;
  if (!lastInfo) {
    QRTLog(kLogNotice,
           "Did not find last build info; we must be upgrading from pre-9.3.1 or this is an erase install.");
    return true;
  }
  auto lastBuild = stringAt(lastInfo, kBuildVersionKey);
  if (!lastBuild) {
    QRTLog(kLogNotice, "Could not get build version from last build info dictionary; assuming this is an upgrade");
    return true;
  }
  auto current = platform::systemVersionRecord();
  if (!current) {
    QRTLog(kLogNotice, "Could not get current build info; assuming this is an upgrade");
    return true;
  }
  auto currentBuild = stringAt(&*current, kBuildVersionKey);
  if (!currentBuild) {
    QRTLog(kLogNotice, "Could not get current build string; assuming this is an upgrade");
    return true;
  }
  auto lastRelease = stringAt(lastInfo, kReleaseTypeKey);
  auto currentRelease = stringAt(&*current, kReleaseTypeKey);
  if (*currentBuild == *lastBuild) {
    QRTLog(kLogNotice, "Current build version (%@ / %@) equal to last version recorded (%@ / %@); skipping upgrade",
           currentBuild, currentRelease, lastBuild, lastRelease);
    return false;
  }
  QRTLog(kLogNotice, "Detected upgrade from %@ (%@) to %@ (%@)", lastBuild, lastRelease, currentBuild, currentRelease);
  return true;
}
