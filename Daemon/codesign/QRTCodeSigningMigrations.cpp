// One-time imports of the stores that predate the code-signing database: the
// legacy mapping file, the legacy entitlements file, and what the installer
// left in containers' info values. Each repeats safely when interrupted: a
// valid stored entry is never overwritten, and the files and the status
// records go only after the entries are in.

#include <fcntl.h>

#include <cerrno>
#include <cstring>

#include "Daemon/QRTCrashPoint.h"
#include "Daemon/codesign/QRTCodeSigningMapping.h"
#include "Daemon/codesign/QRTSQLiteDB.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/groups/QRTGroupManager.h"
#include "Daemon/store/QRTMigrationStatus.h"
#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/store/QRTMetadata.h"
#include "base/PlistCodec.h"
#include "platform/FileIO.h"
#include "platform/Log.h"

using platform::kLogDebug;
using platform::kLogError;
using platform::kLogNotice;

namespace {

constexpr const char* kLegacyMappingFileName = "qrt_code_signing_info.plist";
constexpr const char* kLegacyEntitlementsFileName = "qrt_entitlements.plist";
constexpr const char* kChildPluginBundleIDsKey = "com.norvane.QuarterKit.ChildPluginBundleIDs";
constexpr const char* kRegisteredByCallerKey = "com.norvane.QuarterKit.EntitlementsRegisteredByCaller";
constexpr const char* kPlaceholderEntitlementsKey = "com.norvane.QuarterKit.PlaceholderEntitlements";
constexpr const char* kGroupContainerIDsKey = "com.norvane.Emplacer.GroupContainerIDs";
constexpr const char* kCachedEntitlementsKey = "Entitlements";

QRTURL libraryFile(const char* name) {
  return QRTGlobalConfiguration::sharedInstance().libraryDirectory().URLByAppendingPathComponent(name);
}

bool isMissingFile(const QRTErrorRef& error) {
  return error && error->domain() == QRTPOSIXErrorDomain && error->code() == ENOENT;
}

// The data class of the program whose bundle container is of this class.
uint64_t dataClassForBundleClass(uint64_t bundleClass) {
  switch (bundleClass) {
    case QRTClassAppBundle: return QRTClassAppData;
    case QRTClassAddonBundle: return QRTClassAddonData;
    case QRTClassVPNBundle: return QRTClassVPNData;
    default: return QRTClassUndefined;
  }
}

const plist::Dictionary* dictionaryAt(const plist::Dictionary& dictionary, const char* key) {
  const plist::Value* v = plist::find(dictionary, key);
  return v ? v->dictionaryIf() : nullptr;
}

// The status object, or one that has recorded nothing when the file can't be read.
bool migrationOccurred(const std::unique_ptr<QRTMigrationStatus>& status, const char* type) {
  return status && status->hasMigrationOccurredForType(type);
}

// Removes an info key of a container through the internal client, without
// identifier locks: the migrations run under the all-identifiers lock.
uint64_t clearInfoKey(const QRTMetadataRef& container, const char* key) {
  uint64_t code = QRTErrorNone;
  QRTClientConnection::sharedClientConnection().setInfoValue(std::nullopt, std::string(key), container->uid(),
                                                             container->uuid(), container->identifier(),
                                                             container->containerClass(), false, &code);
  return code;
}

// The group ids in the metadata file of the container at url, when the file
// is root's alone (one link, writable by no one else) and names identifier.
std::optional<plist::Value> groupIdsFromRootsMetadata(const QRTURL& url, const std::string& identifier) {
  const QRTURL file = url.URLByAppendingPathComponent(QRTMetadataFileName);
  platform::Item item;
  if (!QRTFileManager::defaultManager().itemIsImportableAtURL(file, file, 0, &item)) return std::nullopt;
  platform::UniqueFd fd;
  std::string bytes;
  int err = platform::reopenItem(item, O_RDONLY, &fd);
  if (!err) err = platform::readOpened(fd.get(), &bytes, QRTMetadataMaxEncodedBytes);
  const plist::Limits limits{QRTMetadataMaxDepth, QRTMetadataMaxObjects, plist::kMaxFootprint,
                             QRTMetadataMaxEncodedBytes};
  std::optional<plist::Value> value = err ? std::nullopt : plist::parse(bytes.data(), bytes.size(), nullptr, limits);
  const plist::Dictionary* top = value ? value->dictionaryIf() : nullptr;
  const plist::Dictionary* info = top ? dictionaryAt(*top, QRTMetadataInfoKey) : nullptr;
  const plist::Value* named = top ? plist::find(*top, QRTMetadataIdentifierKey) : nullptr;
  const plist::Value* groups = info ? plist::find(*info, kGroupContainerIDsKey) : nullptr;
  if (top && (!named || !named->isString() || named->string() != identifier)) {
    QRTLog(kLogError, "Group ids of %@ not taken from %@: it names another identifier",
           platform::logIdentifier(identifier), file);
    return std::nullopt;
  }
  if (!groups) {
    QRTLog(kLogError, "No group ids readable from %@: %s", file, err ? strerror(err) : "not in the file");
    return std::nullopt;
  }
  return *groups;
}

}  // namespace

bool QRTCodeSigningMapping::_addMigratedEntry(const QRTCodeSigningEntry& entry, const std::string& identifier,
                                              QRTErrorRef* error) {
  if (identifier.empty() || identifier.find('\0') != std::string::npos) {
    QRTSetError(error, QRT_ERROR(QRTErrorInvalidArgument, nullptr, false, "Unusable identifier %@", identifier));
    return false;
  }
  // The kept group counts need the entry this one replaces.
  std::optional<QRTCodeSigningEntry> stored;
  if (groupCounts_[QRTGroupTypeApplication] || groupCounts_[QRTGroupTypeSystem]) {
    QRTErrorRef readError;
    stored = _onQueue_storedEntry(identifier, &readError);
    if (readError) {
      groupCounts_[QRTGroupTypeApplication].reset();
      groupCounts_[QRTGroupTypeSystem].reset();
    }
  }
  return _onQueue_writeEntry(identifier, stored, &entry, error);
}

std::optional<plist::Dictionary> QRTCodeSigningMapping::_readCodeSigningMappingFromDiskAtURL(const QRTURL& url,
                                                                                             QRTErrorRef* error) {
  return QRT_dictionaryWithContentsOfURL(url, error);
}

void QRTCodeSigningMapping::_migrateFromMappingFileToDBIfNecessary() {
  const QRTURL url = libraryFile(kLegacyMappingFileName);
  QRTErrorRef readError;
  auto file = _readCodeSigningMappingFromDiskAtURL(url, &readError);
  if (!file) {
    if (!isMissingFile(readError))
      QRTLog(kLogError, "Failed to read code signing mapping file at %@ : %@", url, readError);
    return;
  }
  QRTLog(kLogNotice, "Migrating code signing info from file to DB");
  uint16_t migrated = 0;
  uint16_t failed = 0;
  for (const auto& [identifier, value] : *file) {
    QRTErrorRef error;
    const plist::Dictionary* serialized = value.dictionaryIf();
    bool added = false;
    if (!serialized) {
      error = QRT_ERROR(QRTErrorInvalidArgument, nullptr, false, "Not an entry: %@", value);
    } else {
      added = _addMigratedEntry(QRTCodeSigningEntry::fromSerializedDictionary(*serialized), identifier, &error);
    }
    if (added) {
      ++migrated;
    } else {
      QRTLog(kLogError, "Failed to migrate code signing entry for %@ : %@", identifier, error);
      ++failed;
    }
  }
  QRTLog(kLogNotice, "Successfully migrated %d entries, failed to migrate %d", migrated, failed);
  QRT_CRASH_POINT("codesign-mapping-file-imported");
  if (migrated == 0) return;  // nothing went in: keep the file for the next start
  QRTErrorRef removeError;
  if (!QRTFileManager::defaultManager().removeItemAtURL(url, &removeError)) {
    QRTLog(kLogError, "Failed to remove legacy code signing mapping file: %@", removeError);
  }
}

void QRTCodeSigningMapping::_onQueue_migrateAppGroupIdsFromDataContainersToFile() {
  auto status = QRTMigrationStatus::init();
  if (migrationOccurred(status, QRTMigrationTypeGroupId)) return;
  QRTLog(kLogNotice, "Performing group ID migration");
  for (uint64_t containerClass : {QRTClassAppData, QRTClassAddonData, QRTClassVPNData}) {
    QRTErrorRef listError;
    auto containers = QRTContainerCache::sharedInstance().allContainersForUser(QRTDefaultMobileUserId, containerClass,
                                                                               false, &listError);
    if (!containers) {
      QRTLog(kLogError, "Failed to fetch list of containers for userId: 501, class %ld : %@",
             static_cast<long>(containerClass), listError);
      return;  // not recorded: runs again next time
    }
    for (const QRTMetadataRef& container : *containers) {
      if (!container->info() || !plist::find(*container->info(), kGroupContainerIDsKey)) continue;
      // Data containers are the user's: their ids count only from a metadata
      // file that root wrote, read from the very file that was checked.
      const std::string& identifier = container->identifier();
      std::optional<plist::Value> groupsRead = groupIdsFromRootsMetadata(container->url(), identifier);
      if (!groupsRead) continue;
      const plist::Value* groups = &*groupsRead;
      QRTLog(kLogDebug, "Data container for userId: 501, identifier %@ references container IDs: %@", identifier,
             *groups);
      QRTErrorRef error;
      std::optional<QRTCodeSigningEntry> stored = _onQueue_storedEntry(identifier, &error);
      if (error) {
        QRTLog(kLogError, "Error retrieving entry from DB with identifier %@ : %@", identifier, error);
      } else if (stored) {
        QRTLog(kLogNotice, "Deleting app group entitlements for %@ because we already have them in mapping",
               identifier);
      } else {
        QRTLog(kLogNotice, "Migrating app group entitlements for %@", identifier);
        plist::Dictionary entitlements{{QRTApplicationGroupsEntitlement, *groups}};
        QRTCodeSigningEntry entry(plist::Dictionary{{QRTCodeSigningEntitlementsKey, std::move(entitlements)}},
                                  containerClass);
        entry.invalid = true;
        QRTErrorRef addError;
        if (!_addMigratedEntry(entry, identifier, &addError)) {
          QRTLog(kLogError, "Failed to write migrated group id info to DB for %@ : %@", identifier, addError);
        }
        QRT_CRASH_POINT("codesign-groupid-entry-added");
      }
      if (uint64_t code = clearInfoKey(container, kGroupContainerIDsKey); code != QRTErrorNone) {
        QRTLog(kLogError, "Failed to clear group id metadata for %@ at %@ : %llu", identifier, container->url(),
               static_cast<unsigned long long>(code));
      }
    }
  }
  if (status) status->setMigrationCompleteForType(QRTMigrationTypeGroupId);
}

void QRTCodeSigningMapping::_onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile() {
  const QRTURL url = libraryFile(kLegacyEntitlementsFileName);
  QRTFileManager& fm = QRTFileManager::defaultManager();
  if (fm.itemDoesNotExistAtURL(url)) return;
  QRTLog(kLogNotice, "Performing legacy entitlement migration");
  QRTErrorRef readError;
  auto file = QRT_dictionaryWithContentsOfURL(url, &readError);
  if (!file) {
    QRTLog(kLogError, "Entitlement File exists at %@, but we unexpectedly cant read it", url);
    return;
  }
  auto takeReserved = [&](const char* key) {
    plist::Dictionary reserved;
    if (const plist::Dictionary* d = dictionaryAt(*file, key)) reserved = *d;
    file->erase(key);
    return reserved;
  };
  const plist::Dictionary children = takeReserved(kChildPluginBundleIDsKey);
  const plist::Dictionary registeredByCaller = takeReserved(kRegisteredByCallerKey);
  const plist::Dictionary placeholders = takeReserved(kPlaceholderEntitlementsKey);

  for (const auto& [identifier, entitlements] : *file) {
    QRTErrorRef error;
    std::optional<QRTCodeSigningEntry> stored = _onQueue_storedEntry(identifier, &error);
    if (stored && !stored->isInvalid()) {
      QRTLog(kLogNotice, "Already have code signing info for %@.  No need to migrate legacy entitlements.", identifier);
      continue;
    }
    if (error && !stored) {
      QRTLog(kLogError, "Error retrieving entry from DB with identifier %@ : %@", identifier, error);
      continue;
    }
    QRTLog(kLogNotice, "Migrating legacy entitlements for %@", identifier);
    QRTCodeSigningEntry entry(plist::Dictionary{{QRTCodeSigningEntitlementsKey, entitlements}}, 0);
    if (const plist::Value* list = plist::find(children, identifier); list && list->isArray()) {
      std::vector<std::string> childIdentifiers;
      for (const plist::Value& child : list->array()) {
        if (const std::string* s = child.stringIf()) childIdentifiers.push_back(*s);
      }
      entry.childBundleIdentifiers = std::move(childIdentifiers);
    }
    entry.placeholder = plist::find(placeholders, identifier) != nullptr;
    const plist::Value* byCaller = plist::find(registeredByCaller, identifier);
    const bool* byCallerFlag = byCaller ? byCaller->booleanIf() : nullptr;
    if (byCallerFlag && *byCallerFlag) {
      entry.registeredByCaller = true;
    } else {
      entry.invalid = true;
    }
    QRTErrorRef addError;
    if (!_addMigratedEntry(entry, identifier, &addError)) {
      QRTLog(kLogError, "Failed to write migrated legacy info to DB for %@ : %@", identifier, addError);
    }
  }
  QRT_CRASH_POINT("codesign-legacy-entitlements-imported");
  QRTErrorRef removeError;
  if (!fm.removeItemAtURL(url, &removeError)) {
    QRTLog(kLogError, "Failed to remove legacy file at %@: %@", url, removeError);
  }
  QRTLog(kLogNotice, "Legacy entitlement migration completed");
}

void QRTCodeSigningMapping::_onQueue_migrateCachedCodeSigningInfoFromBundleContainersToMapping() {
  auto status = QRTMigrationStatus::init();
  if (migrationOccurred(status, QRTMigrationTypeCodeSigning)) return;
  QRTLog(kLogNotice, "Performing code signing migration");
  for (uint64_t bundleClass : {QRTClassAppBundle, QRTClassAddonBundle, QRTClassVPNBundle, QRTClassFrameworkBundle}) {
    QRTErrorRef listError;
    auto containers =
        QRTContainerCache::sharedInstance().allContainersForUser(QRTInstallerUserId, bundleClass, false, &listError);
    if (!containers) {
      QRTLog(kLogError, "Failed to fetch list of containers for class %llu : %@",
             static_cast<unsigned long long>(bundleClass), listError);
      continue;
    }
    for (const QRTMetadataRef& container : *containers) {
      const plist::Dictionary* cached =
          container->info() ? dictionaryAt(*container->info(), QRTCachedCodeSigningInfoKey) : nullptr;
      if (!cached) continue;
      const std::string& identifier = container->identifier();
      QRTErrorRef error;
      std::optional<QRTCodeSigningEntry> stored = _onQueue_storedEntry(identifier, &error);
      if (error) {
        QRTLog(kLogError, "Error retrieving entry from DB with identifier %@ : %@", identifier, error);
      } else if (stored && !stored->isInvalid()) {
        QRTLog(kLogNotice, "Deleting cached code signing info for %@ because we already have it in mapping",
               identifier);
      } else {
        QRTLog(kLogNotice, "Migrating code signing info for %@", identifier);
        plist::Dictionary info = *cached;
        if (const plist::Value* entitlements = plist::find(*cached, kCachedEntitlementsKey)) {
          info[QRTCodeSigningEntitlementsKey] = *entitlements;
        } else {
          info.erase(QRTCodeSigningEntitlementsKey);
        }
        QRTCodeSigningEntry entry(std::move(info), dataClassForBundleClass(bundleClass));
        QRTErrorRef addError;
        if (!_addMigratedEntry(entry, identifier, &addError)) {
          QRTLog(kLogError, "Failed to write migrated cached cs info from bundle container to DB for %@ : %@",
                 identifier, addError);
        }
        QRT_CRASH_POINT("codesign-cached-info-entry-added");
      }
      if (uint64_t code = clearInfoKey(container, QRTCachedCodeSigningInfoKey); code != QRTErrorNone) {
        QRTLog(kLogError, "Error setting info value for identifier: %@, Class: %llu: %llu", identifier,
               static_cast<unsigned long long>(bundleClass), static_cast<unsigned long long>(code));
      }
    }
  }
  if (status) status->setMigrationCompleteForType(QRTMigrationTypeCodeSigning);
}

// Before the database, the installer cached the information in the bundle
// container: an entry missing from the database is taken from there, once,
// when first asked for.
std::optional<plist::Dictionary> QRTCodeSigningMapping::_onQueue_migrateCachedCodeSigningInfoFromBundleContainer(
    const std::string& identifier) {
  QRTErrorRef lookupError;
  QRTMetadataRef bundle = QRTContainerCache::sharedInstance().containerForUser(
      {QRTInstallerUserId, QRTClassAppBundle, identifier}, &lookupError);
  const plist::Value* cached =
      bundle && bundle->info() ? plist::find(*bundle->info(), QRTCachedCodeSigningInfoKey) : nullptr;
  if (!cached || !cached->dictionaryIf()) return std::nullopt;
  plist::Dictionary info = cached->dictionary();
  QRTLog(kLogNotice, "Migrating code signing info from bundle container upon request for %@", identifier);
  if (const plist::Value* entitlements = plist::find(cached->dictionary(), kCachedEntitlementsKey)) {
    info[QRTCodeSigningEntitlementsKey] = *entitlements;
  } else {
    info.erase(QRTCodeSigningEntitlementsKey);
  }
  QRTCodeSigningEntry migrated(info, QRTClassAppData);
  QRTErrorRef addError;
  if (!_onQueue_writeEntry(identifier, std::nullopt, &migrated, &addError)) {
    QRTLog(kLogError, "Failed to write code signing info to DB for %@ : %@", identifier, addError);
  }
  return info;
}
