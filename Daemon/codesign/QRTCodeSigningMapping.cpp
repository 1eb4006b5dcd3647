#include "Daemon/codesign/QRTCodeSigningMapping.h"

#include <algorithm>
#include <set>
#include <utility>

#include "Daemon/QRTCrashPoint.h"
#include "Daemon/codesign/QRTSQLiteDB.h"
#include "Daemon/groups/QRTGroupManager.h"
#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTEntitlementChecks.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/store/QRTLocks.h"
#include "Daemon/store/QRTMetadata.h"
#include "platform/Log.h"

using platform::kLogDebug;
using platform::kLogError;
using platform::kLogNotice;

namespace {

// Without its database no program is known to hold a system container.
bool mappingGrantsSystemContainer(const std::string& identifier) {
  QRTCodeSigningMapping* mapping = QRTCodeSigningMapping::sharedInstance();
  return mapping && mapping->identifierHasSystemContainer(identifier);
}

QRTGroupList mappingSystemGroups(const std::string& identifier) {
  QRTCodeSigningMapping* mapping = QRTCodeSigningMapping::sharedInstance();
  return mapping ? mapping->systemGroupIdentifiersForIdentifier(identifier) : std::nullopt;
}

// The store's entitlement checks are answered by the mapping from the start.
[[maybe_unused]] const bool kEntitlementChecksInstalled = [] {
  QRTInstallEntitlementChecks({&mappingGrantsSystemContainer, &mappingSystemGroups});
  return true;
}();

constexpr const char* kSystemGroupPrefix = "systemgroup.";
// Every registration of a child reads its parent's whole child list, so the
// list is bounded; no real program comes near it.
constexpr size_t kMaxChildBundles = 1024;

const plist::Value* option(const plist::Dictionary* options, const char* key) {
  return options ? plist::find(*options, key) : nullptr;
}

bool optionTrue(const plist::Dictionary* options, const char* key) {
  const plist::Value* v = option(options, key);
  const bool* b = v ? v->booleanIf() : nullptr;
  return b && *b;
}

plist::Value listValue(const std::vector<std::string>& list) {
  plist::Array array(list.begin(), list.end());
  return array;
}

// SQLite takes text up to its first zero byte: such a name would act on another program's entry.
bool usableIdentifier(const std::string& identifier) { return identifier.find('\0') == std::string::npos; }

// A stored entry's entitlements, read in place.
const plist::Value* entitlementsOf(const QRTCodeSigningEntry& entry) {
  return entry.codeSigningInfo ? plist::find(*entry.codeSigningInfo, QRTCodeSigningEntitlementsKey) : nullptr;
}

bool grantsSystemContainer(const plist::Value* entitlements) {
  const plist::Dictionary* dictionary = entitlements ? entitlements->dictionaryIf() : nullptr;
  const plist::Value* v = dictionary ? plist::find(*dictionary, QRTSystemContainerEntitlement) : nullptr;
  const bool* b = v ? v->booleanIf() : nullptr;
  return b && *b;
}

bool grantsSystemContainer(const std::optional<plist::Value>& entitlements) {
  return grantsSystemContainer(entitlements ? &*entitlements : nullptr);
}

}  // namespace

template <typename F>
auto QRTCodeSigningMapping::onQueue(F&& body) -> decltype(body()) {
  using Result = decltype(body());
  if constexpr (std::is_void_v<Result>) {
    codeSignQueue->sync([&] { body(); });
  } else {
    std::optional<Result> result;
    codeSignQueue->sync([&] { result.emplace(body()); });
    return std::move(*result);
  }
}

QRTCodeSigningMapping* QRTCodeSigningMapping::sharedInstance() {
  static QRTCodeSigningMapping* const instance = []() -> QRTCodeSigningMapping* {
    auto db = QRTSQLiteDB::initWithParentDirectoryURL(QRTGlobalConfiguration::sharedInstance().libraryDirectory());
    if (!db) {
      QRTLog(kLogError, "Failed to initialize database.");
      return nullptr;
    }
    return new QRTCodeSigningMapping(std::move(db));
  }();
  return instance;
}

QRTCodeSigningMapping::QRTCodeSigningMapping(std::unique_ptr<QRTSQLiteDB> db) : codeSigningMappingDB(std::move(db)) {
  // Before the queue exists: nothing else can reach the database yet. The
  // import's writes are read back once the snapshot is in.
  readingFirstSnapshot_ = true;
  _migrateFromMappingFileToDBIfNecessary();
  codeSignQueue = platform::makeSerialQueue("com.norvane.QuarterKit.EntitlementQueue");
  // Ten thousand programs take tens of milliseconds to read: the request
  // that made the mapping goes on meanwhile. Under the lock: the install
  // that ends the read joins it.
  std::lock_guard<std::mutex> hold(firstSnapshotReaderLock_);
  firstSnapshotReader_ = std::thread([this] {
    std::optional<QRTCodeSigningMappingSnapshot::Entries> entries = _readWholeSnapshot();
    QRT_PAUSE_POINT("first-snapshot-read");
    codeSignQueue->async(
        [this, entries = std::move(entries)]() mutable { _onQueue_installSnapshot(std::move(entries)); });
  });
}

QRTCodeSigningMapping::~QRTCodeSigningMapping() { _waitForFirstSnapshot(); }

void QRTCodeSigningMapping::_waitForFirstSnapshot() {
  {
    std::lock_guard<std::mutex> hold(firstSnapshotReaderLock_);
    if (firstSnapshotReader_.joinable()) firstSnapshotReader_.join();
  }
  codeSignQueue->sync([] {});  // the install the reader left on the queue
}

// ---- public operations ----

uint64_t QRTCodeSigningMapping::processCodeSigningInfo(const plist::Dictionary* codeSigningInfo,
                                                       const std::optional<std::string>& forIdentifier,
                                                       const plist::Dictionary* withOptions) {
  QRTAllIdentifiersLock lock(true);
  return onQueue([&] { return _onQueue_processCodeSigningInfo(codeSigningInfo, forIdentifier, withOptions); });
}

uint64_t QRTCodeSigningMapping::processCallerRegisteredEntitlements(const plist::Dictionary& entitlements,
                                                                    const std::string& forIdentifier) {
  const plist::Dictionary info{{QRTCodeSigningEntitlementsKey, entitlements}};
  const plist::Dictionary options{{QRTCodeSigningRegByCallerKey, true}};
  return processCodeSigningInfo(&info, forIdentifier, &options);
}

std::optional<plist::Dictionary> QRTCodeSigningMapping::getCodeSigningInfoForIdentifier(
    const std::optional<std::string>& identifier) {
  if (!identifier) return std::nullopt;
  QRTCodeSigningMappingSnapshot::EntryRef entry;
  if (_snapshotEntry(*identifier, &entry) == QRTCodeSigningMappingSnapshot::Lookup::Found) {
    if (entry->isPlaceholder() || entry->isInvalid()) return std::nullopt;
    return entry->codeSigningInfo;
  }
  // Not held: the installer's cached copy may be imported, a write.
  QRTAllIdentifiersLock lock(true);
  return onQueue([&] { return _onQueue_codeSigningInfoForIdentifier(*identifier, true); });
}

uint64_t QRTCodeSigningMapping::invalidateCodeSigningInfoForAppsWithoutBundleContainer() {
  QRTAllIdentifiersLock lock(true);
  return onQueue([&] { return _onQueue_invalidateCodeSigningInfoForAppsWithoutBundleContainer(); });
}

void QRTCodeSigningMapping::performAllCodeSigningMigrationAndReconciliation() {
  QRTAllIdentifiersLock lock(true);
  onQueue([&] {
    // Each step is guarded on its own, so that one that throws leaves the others to run.
    for (void (QRTCodeSigningMapping::*step)() :
         {&QRTCodeSigningMapping::_onQueue_migrateAppGroupIdsFromDataContainersToFile,
          &QRTCodeSigningMapping::_onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile,
          &QRTCodeSigningMapping::_onQueue_migrateCachedCodeSigningInfoFromBundleContainersToMapping}) {
      if (QRTErrorRef error = QRT_GUARD([&] { (this->*step)(); })) {
        QRTLog(kLogError, "Code signing migration failed: %@", error);
      }
    }
    QRTGroupManager::defaultManager().reconcileGroupContainersOfType(
        QRTGroupTypeApplication, _onQueue_groupReferenceCounts(QRTGroupTypeApplication));
  });
}

bool QRTCodeSigningMapping::invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier,
                                                                                 QRTErrorRef* withError) {
  return onQueue([&] { return _onQueue_invalidateCodeSigningInfoForIdentifierAndItsChildren(identifier, withError); });
}

void QRTCodeSigningMapping::removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string& identifier) {
  onQueue([&] { _onQueue_removeCodeSigningDictionariesForIdentifierAndItsChildren(identifier); });
}

bool QRTCodeSigningMapping::codeSigningInfoExistForIdentifier(const std::string& identifier) {
  QRTCodeSigningMappingSnapshot::EntryRef entry;
  if (_snapshotEntry(identifier, &entry) == QRTCodeSigningMappingSnapshot::Lookup::Found) {
    return entry->codeSigningInfo.has_value();
  }
  return onQueue([&] { return _onQueue_codeSigningInfoExistForIdentifier(identifier); });
}

bool QRTCodeSigningMapping::identifierHasCallerRegisteredEntitlements(const std::string& identifier) {
  QRTCodeSigningMappingSnapshot::EntryRef entry;
  switch (_snapshotEntry(identifier, &entry)) {
    case QRTCodeSigningMappingSnapshot::Lookup::Found: return entry->isRegisteredByCaller();
    case QRTCodeSigningMappingSnapshot::Lookup::Absent: return false;
    case QRTCodeSigningMappingSnapshot::Lookup::Unknown: break;
  }
  return onQueue([&] { return _onQueue_identifierHasCallerRegisteredEntitlements(identifier); });
}

bool QRTCodeSigningMapping::identifierHasSystemContainer(const std::string& identifier) {
  QRTCodeSigningMappingSnapshot::EntryRef entry;
  if (_snapshotEntry(identifier, &entry) == QRTCodeSigningMappingSnapshot::Lookup::Found) {
    return grantsSystemContainer(entitlementsOf(*entry));
  }
  return onQueue([&] { return _onQueue_identifierHasSystemContainer(identifier); });
}

uint64_t QRTCodeSigningMapping::dataContainerTypeForIdentifier(const std::string& identifier) {
  QRTCodeSigningMappingSnapshot::EntryRef entry;
  switch (_snapshotEntry(identifier, &entry)) {
    case QRTCodeSigningMappingSnapshot::Lookup::Found: return entry->dataContainerClass;
    case QRTCodeSigningMappingSnapshot::Lookup::Absent: return 0;
    case QRTCodeSigningMappingSnapshot::Lookup::Unknown: break;
  }
  return onQueue([&] { return _onQueue_dataContainerTypeForIdentifier(identifier); });
}

QRTGroupList QRTCodeSigningMapping::appGroupIdentifiersForIdentifier(const std::string& identifier) {
  QRTCodeSigningMappingSnapshot::EntryRef entry;
  if (_snapshotEntry(identifier, &entry) == QRTCodeSigningMappingSnapshot::Lookup::Found) {
    return _copyApplicationGroupEntitlementForIdentifier(identifier, entitlementsOf(*entry),
                                                         QRTApplicationGroupsEntitlement);
  }
  return onQueue([&] { return _onQueue_appGroupIdentifiersForIdentifier(identifier); });
}

QRTGroupList QRTCodeSigningMapping::systemGroupIdentifiersForIdentifier(const std::string& identifier) {
  QRTCodeSigningMappingSnapshot::EntryRef entry;
  if (_snapshotEntry(identifier, &entry) == QRTCodeSigningMappingSnapshot::Lookup::Found) {
    return _withSystemGroupPrefix(_systemGroupList(identifier, entitlementsOf(*entry)));
  }
  return onQueue([&] { return _onQueue_systemGroupIdentifiersForIdentifier(identifier); });
}

void QRTCodeSigningMapping::iterateGroupIdsWithKey(
    const std::string& key, const std::optional<std::string>& fallBackKey,
    const std::function<void(const std::string& identifier, const QRTGroupList& groups)>& block) {
  QRTErrorRef error = codeSigningMappingDB->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
      [&](const std::string& identifier, const QRTCodeSigningEntry& entry) {
        std::optional<plist::Value> entitlements = _onQueue_entitlementsCodeSigningEntry(entry, identifier);
        QRTGroupList groups = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, key);
        if (fallBackKey && (!groups || groups->empty())) {
          groups = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, *fallBackKey);
        }
        block(identifier, groups);
      });
  if (error) QRTLog(kLogError, "Failed to enumerate code signing info: %@", error);
}

// ---- group reference counts ----

bool QRTCodeSigningMapping::_onQueue_writeEntry(const std::string& identifier,
                                                const std::optional<QRTCodeSigningEntry>& stored,
                                                const QRTCodeSigningEntry* wanted, QRTErrorRef* error) {
  generation_.fetch_add(1, std::memory_order_acq_rel);
  const bool written = wanted ? codeSigningMappingDB->addCodeSigningEntry(wanted, identifier, error)
                              : codeSigningMappingDB->deleteCodeSigningEntryWithIdentifier(identifier, error);
  for (QRTGroupType type : {QRTGroupTypeApplication, QRTGroupTypeSystem}) {
    std::optional<QRTGroupReferenceCounts>& counts = groupCounts_[type];
    if (!counts) continue;
    if (!written) {
      counts.reset();  // what the database holds now is not known: count it again at the next need
      continue;
    }
    auto add = [&](const QRTCodeSigningEntry& entry, int64_t delta) {
      for (const std::string& group : _groupsOfEntry(entry, identifier, type).value_or(std::vector<std::string>{})) {
        if ((((*counts)[group] += delta)) == 0) counts->erase(group);
      }
    };
    if (stored) add(*stored, -1);
    if (wanted) add(*wanted, 1);
  }
  // Whether written or not, the rows now say what the snapshot must.
  _onQueue_readBack({identifier}, wanted && wanted->childBundleIdentifiers ? *wanted->childBundleIdentifiers
                                                                           : std::vector<std::string>{});
  return written;
}

QRTGroupList QRTCodeSigningMapping::_groupsOfEntry(const QRTCodeSigningEntry& entry, const std::string& identifier,
                                                   QRTGroupType type) {
  std::optional<plist::Value> entitlements = _onQueue_entitlementsCodeSigningEntry(entry, identifier);
  if (type == QRTGroupTypeApplication) {
    return _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, QRTApplicationGroupsEntitlement);
  }
  QRTGroupList groups =
      _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, QRTSystemGroupsEntitlement);
  if (groups && !groups->empty()) return groups;
  return _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, QRTSystemGroupContainersEntitlement);
}

std::optional<QRTGroupReferenceCounts> QRTCodeSigningMapping::_onQueue_countGroupReferences(QRTGroupType type) {
  QRTGroupReferenceCounts counts;
  const bool system = type == QRTGroupTypeSystem;
  iterateGroupIdsWithKey(system ? QRTSystemGroupsEntitlement : QRTApplicationGroupsEntitlement,
                         system ? std::optional<std::string>(QRTSystemGroupContainersEntitlement) : std::nullopt,
                         [&](const std::string& identifier, const QRTGroupList& groups) {
                           if (!groups) return;
                           QRTLog(kLogDebug, "Entitlements for identifier %@ references container IDs: %@", identifier,
                                  listValue(*groups));
                           for (const std::string& group : *groups) ++counts[group];
                         });
  return counts;
}

std::optional<QRTGroupReferenceCounts> QRTCodeSigningMapping::_onQueue_groupReferenceCounts(QRTGroupType type) {
  std::optional<QRTGroupReferenceCounts>& counts = groupCounts_[type];
  if (!counts) counts = _onQueue_countGroupReferences(type);
  return counts;
}

std::optional<QRTGroupReferenceCounts> QRTCodeSigningMapping::groupReferenceCounts(QRTGroupType type) {
  return onQueue([&] { return _onQueue_groupReferenceCounts(type); });
}

bool QRTCodeSigningMapping::groupReferenceCountsMatchDatabase() {
  return onQueue([&] {
    for (QRTGroupType type : {QRTGroupTypeApplication, QRTGroupTypeSystem}) {
      if (_onQueue_groupReferenceCounts(type) != _onQueue_countGroupReferences(type)) return false;
    }
    return true;
  });
}

// ---- the snapshot ----

std::optional<QRTCodeSigningMappingSnapshot::Entries> QRTCodeSigningMapping::_readWholeSnapshot() {
  QRTCodeSigningMappingSnapshot::Entries entries;
  QRTErrorRef error = codeSigningMappingDB->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
      [&](const std::string& identifier, QRTCodeSigningEntry&& entry) {
        entries.emplace(identifier, std::make_shared<const QRTCodeSigningEntry>(std::move(entry)));
      });
  if (!error) return entries;
  // A row left out would answer "none": look-ups go to the database instead.
  QRTLog(kLogError, "Cannot read the code signing database whole; look-ups read it row by row: %@", error);
  return std::nullopt;
}

void QRTCodeSigningMapping::_onQueue_loadSnapshot() {
  if (std::optional<QRTCodeSigningMappingSnapshot::Entries> entries = _readWholeSnapshot())
    snapshot_.replaceAll(std::move(*entries));
  else
    snapshot_.invalidate();
}

void QRTCodeSigningMapping::_onQueue_installSnapshot(std::optional<QRTCodeSigningMappingSnapshot::Entries> entries) {
  {
    // The reader has nothing left to do but return.
    std::lock_guard<std::mutex> hold(firstSnapshotReaderLock_);
    if (firstSnapshotReader_.joinable()) firstSnapshotReader_.join();
  }
  readingFirstSnapshot_ = false;
  if (entries) snapshot_.replaceAll(std::move(*entries));
  // The rows written while it was read may be older there than in the
  // database (and a failed read is made again here).
  _onQueue_readBack(std::exchange(writtenWhileReading_, {}), std::exchange(childrenWrittenWhileReading_, {}));
}

void QRTCodeSigningMapping::_onQueue_readBack(std::vector<std::string> identifiers,
                                              const std::vector<std::string>& children) {
  if (readingFirstSnapshot_) {
    writtenWhileReading_.insert(writtenWhileReading_.end(), identifiers.begin(), identifiers.end());
    childrenWrittenWhileReading_.insert(childrenWrittenWhileReading_.end(), children.begin(), children.end());
  } else if (!snapshot_.loaded()) {
    _onQueue_loadSnapshot();
  } else {
    // A child row names one parent: writing it under another takes it from the first.
    for (std::string& parent : snapshot_.parentsOf(children)) identifiers.push_back(std::move(parent));
    for (const std::string& identifier : identifiers) {
      QRTErrorRef error;
      std::optional<QRTCodeSigningEntry> entry = _onQueue_storedEntry(identifier, &error);
      if (error) {
        QRTLog(kLogError, "Cannot read back %@ after a write: %@; reading the database whole", identifier, error);
        _onQueue_loadSnapshot();
        break;
      }
      snapshot_.set(identifier, std::move(entry));
    }
  }
  // Counted again once the snapshot says it: who read the count before a
  // write and the answer after sees a count that has moved since.
  generation_.fetch_add(1, std::memory_order_acq_rel);
}

QRTCodeSigningMappingSnapshot::Lookup QRTCodeSigningMapping::_snapshotEntry(
    const std::string& identifier, QRTCodeSigningMappingSnapshot::EntryRef* entry) const {
  return snapshot_.find(identifier, entry);
}

bool QRTCodeSigningMapping::snapshotMatchesDatabase() {
  _waitForFirstSnapshot();
  return onQueue([&] {
    std::optional<QRTCodeSigningMappingSnapshot::Entries> held = snapshot_.copy();
    if (!held) return false;
    size_t rows = 0;
    bool same = true;
    QRTErrorRef error = codeSigningMappingDB->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [&](const std::string& identifier, const QRTCodeSigningEntry& entry) {
          ++rows;
          auto it = held->find(identifier);
          if (it == held->end() || !(*it->second == entry)) {
            QRTLog(kLogError, "The snapshot of %@ differs from the database", identifier);
            same = false;
          }
        });
    return !error && same && rows == held->size();
  });
}

QRTCodeSigningMapping::DatabaseCheck QRTCodeSigningMapping::checkDatabase(bool recount) {
  return onQueue([&] {
    DatabaseCheck check;
    check.problems = codeSigningMappingDB->integrityProblems();
    QRTContainerCache& cache = QRTContainerCache::sharedInstance();
    QRTErrorRef error = codeSigningMappingDB->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [&](const std::string& identifier, const QRTCodeSigningEntry& entry) {
          if (entry.isRegisteredByCaller() || entry.isInvalid()) return;
          for (uint64_t bundleClass : {QRTClassAppBundle, QRTClassAddonBundle, QRTClassVPNBundle}) {
            QRTErrorRef lookupError;
            if (cache.containerForUser(QRTContainerKey{QRTInstallerUserId, bundleClass, identifier}, &lookupError))
              return;
          }
          check.withoutBundle.push_back(identifier);
        });
    if (error) check.problems.push_back("reading the entries: " + error->description());
    for (QRTGroupType type : {QRTGroupTypeApplication, QRTGroupTypeSystem}) {
      std::optional<QRTGroupReferenceCounts> fresh = _onQueue_countGroupReferences(type);
      if (_onQueue_groupReferenceCounts(type) == fresh) continue;
      check.driftedCounts.push_back(type);
      if (recount) groupCounts_[type] = std::move(fresh);
    }
    return check;
  });
}

// ---- reading ----

std::optional<QRTCodeSigningEntry> QRTCodeSigningMapping::_onQueue_storedEntry(const std::string& identifier,
                                                                               QRTErrorRef* error) {
  if (!usableIdentifier(identifier)) return std::nullopt;
  QRTErrorRef readError;
  std::optional<QRTCodeSigningEntry> entry =
      codeSigningMappingDB->codeSigningEntryWithIdentifier(identifier, &readError);
  if (!entry && readError && !(readError->domain() == QRTErrorDomain && readError->code() == QRTErrorNotInDatabase)) {
    QRTSetError(error, readError);
  }
  return entry;
}

std::optional<plist::Dictionary> QRTCodeSigningMapping::_onQueue_codeSigningInfoForIdentifier(
    const std::string& identifier, bool externalRequest) {
  QRTErrorRef error;
  std::optional<QRTCodeSigningEntry> entry = _onQueue_storedEntry(identifier, &error);
  if (error) {
    QRTLog(kLogError, "Error retrieving entry from DB with identifier %@ : %@", identifier, error);
    return std::nullopt;
  }
  return _onQueue_codeSigningInfoForCodeSigningEntry(entry, identifier, externalRequest);
}

std::optional<plist::Dictionary> QRTCodeSigningMapping::_onQueue_codeSigningInfoForCodeSigningEntry(
    const std::optional<QRTCodeSigningEntry>& entry, const std::string& identifier, bool externalRequest) {
  if (entry) {
    if (externalRequest && (entry->isPlaceholder() || entry->isInvalid())) return std::nullopt;
    return entry->codeSigningInfo;
  }
  return _onQueue_migrateCachedCodeSigningInfoFromBundleContainer(identifier);
}

std::optional<plist::Value> QRTCodeSigningMapping::_onQueue_entitlementsForIdentifier(const std::string& identifier) {
  std::optional<plist::Dictionary> info = _onQueue_codeSigningInfoForIdentifier(identifier, false);
  const plist::Value* v = info ? plist::find(*info, QRTCodeSigningEntitlementsKey) : nullptr;
  return v ? std::optional<plist::Value>(*v) : std::nullopt;
}

std::optional<plist::Value> QRTCodeSigningMapping::_onQueue_entitlementsCodeSigningEntry(
    const std::optional<QRTCodeSigningEntry>& entry, const std::string& identifier) {
  std::optional<plist::Dictionary> info = _onQueue_codeSigningInfoForCodeSigningEntry(entry, identifier, false);
  const plist::Value* v = info ? plist::find(*info, QRTCodeSigningEntitlementsKey) : nullptr;
  return v ? std::optional<plist::Value>(*v) : std::nullopt;
}

bool QRTCodeSigningMapping::_onQueue_codeSigningInfoExistForIdentifier(const std::string& identifier) {
  return _onQueue_codeSigningInfoForIdentifier(identifier, false).has_value();
}

bool QRTCodeSigningMapping::_onQueue_identifierHasCallerRegisteredEntitlements(const std::string& identifier) {
  QRTErrorRef error;
  std::optional<QRTCodeSigningEntry> entry = _onQueue_storedEntry(identifier, &error);
  if (error) QRTLog(kLogError, "Error retrieving entry from DB with identifier %@ : %@", identifier, error);
  return entry && entry->isRegisteredByCaller();
}

bool QRTCodeSigningMapping::_onQueue_identifierHasSystemContainer(const std::string& identifier) {
  return grantsSystemContainer(_onQueue_entitlementsForIdentifier(identifier));
}

uint64_t QRTCodeSigningMapping::_onQueue_dataContainerTypeForIdentifier(const std::string& identifier) {
  QRTErrorRef error;
  std::optional<QRTCodeSigningEntry> entry = _onQueue_storedEntry(identifier, &error);
  if (error) QRTLog(kLogError, "Error retrieving entry from DB with identifier %@ : %@", identifier, error);
  return entry ? entry->dataContainerClass : 0;
}

QRTGroupList QRTCodeSigningMapping::_onQueue_appGroupIdentifiersForIdentifier(const std::string& identifier) {
  return _copyApplicationGroupEntitlementForIdentifier(identifier, _onQueue_entitlementsForIdentifier(identifier),
                                                       QRTApplicationGroupsEntitlement);
}

QRTGroupList QRTCodeSigningMapping::_onQueue_systemGroupIdentifiersForIdentifier(const std::string& identifier) {
  return _withSystemGroupPrefix(_systemGroupList(identifier, _onQueue_entitlementsForIdentifier(identifier)));
}

QRTGroupList QRTCodeSigningMapping::_withSystemGroupPrefix(QRTGroupList groups) {
  if (!groups) return groups;
  std::vector<std::string> prefixed;
  for (std::string& group : *groups) {
    if (group.rfind(kSystemGroupPrefix, 0) == 0) {
      prefixed.push_back(std::move(group));
    } else {
      QRTLog(kLogError, "System group ID %@ does not have proper prefix, ignoring.", group);
    }
  }
  return prefixed;
}

QRTGroupList QRTCodeSigningMapping::_systemGroupList(const std::string& identifier, const plist::Value* entitlements) {
  QRTGroupList groups =
      _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, QRTSystemGroupsEntitlement);
  if (!groups || groups->empty()) {
    groups =
        _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, QRTSystemGroupContainersEntitlement);
  }
  return groups;
}

QRTGroupList QRTCodeSigningMapping::_copyApplicationGroupEntitlementForIdentifier(const std::string& identifier,
                                                                                  const plist::Value* entitlements,
                                                                                  const std::string& groupKey) {
  const plist::Dictionary* dictionary = entitlements ? entitlements->dictionaryIf() : nullptr;
  const plist::Value* value = dictionary ? plist::find(*dictionary, groupKey) : nullptr;
  if (!value) return std::nullopt;
  std::vector<std::string> groups;
  if (const plist::Array* array = value->arrayIf()) {
    for (const plist::Value& item : *array) {
      const std::string* s = item.stringIf();
      if (!s) {
        QRTLog(kLogError, "Entitlement %@ for %@ contains non-string values; ignoring.", groupKey, identifier);
        return std::nullopt;
      }
      groups.push_back(*s);
    }
  } else if (const std::string* s = value->stringIf()) {
    groups.push_back(*s);
  } else {
    QRTLog(kLogError, "Entitlement %@ for %@ does not contain supported types; ignoring.", groupKey, identifier);
    return std::nullopt;
  }
  std::sort(groups.begin(), groups.end());
  groups.erase(std::unique(groups.begin(), groups.end()), groups.end());
  return groups;
}

// ---- processing ----

uint64_t QRTCodeSigningMapping::_onQueue_processCodeSigningInfo(const plist::Dictionary* codeSigningInfo,
                                                                const std::optional<std::string>& forIdentifier,
                                                                const plist::Dictionary* withOptions) {
  if (!forIdentifier) return QRTErrorNilIdentifier;
  const std::string& identifier = *forIdentifier;
  const plist::Value* parentValue = option(withOptions, QRTCodeSigningParentBundleIDKey);
  const std::string* parent = parentValue ? parentValue->stringIf() : nullptr;
  if (!usableIdentifier(identifier) || (parent && !usableIdentifier(*parent))) {
    QRTLog(kLogError, "Identifier %@ (parent %@) holds a zero byte; refusing it", identifier,
           parent ? *parent : std::string("(null)"));
    return QRTErrorInvalidArgument;
  }
  uint64_t result = QRTErrorNone;
  QRTErrorRef failure = QRT_GUARD([&] {
    QRTErrorRef error;
    std::optional<QRTCodeSigningEntry> stored = _onQueue_storedEntry(identifier, &error);
    if (error) {
      QRTLog(kLogError, "Error retrieving entry from DB with identifier %@ : %@", identifier, error);
      result = error->resultCode();
      return;
    }
    QRTCodeSigningEntry entry;
    const plist::Value* dataClass = option(withOptions, QRTCodeSigningDataContainerClassKey);
    if (const plist::Integer* i = dataClass ? dataClass->integerIf() : nullptr)
      entry.dataContainerClass = i->asUnsigned();
    // Adding an entry never drops child rows, so the stored children are the
    // entry's children whatever is written; carrying them keeps a repeated
    // registration equal to the stored entry.
    if (stored) entry.childBundleIdentifiers = stored->childBundleIdentifiers;

    std::vector<QRTCodeSigningEntry> values;
    std::vector<std::string> identifiers;
    if (parent) {
      std::optional<QRTCodeSigningEntry> parentEntry = _onQueue_storedEntry(*parent, &error);
      if (error) {
        QRTLog(kLogError, "Error retrieving entry from DB with identifier %@ : %@", *parent, error);
        result = error->resultCode();
        return;
      }
      std::vector<std::string> children = parentEntry && parentEntry->childBundleIdentifiers
                                              ? *parentEntry->childBundleIdentifiers
                                              : std::vector<std::string>{};
      if (std::find(children.begin(), children.end(), identifier) == children.end()) {
        if (children.size() >= kMaxChildBundles) {
          QRTLog(kLogError, "Parent %@ already has %lu child bundles; not adding %@", *parent,
                 static_cast<unsigned long>(children.size()), identifier);
          result = QRTErrorInvalidArgument;
          return;
        }
        children.push_back(identifier);
        QRTLog(kLogDebug, "Staging Child Bundles: %@ for parent ID: %@ by appending: %@", listValue(children), *parent,
               identifier);
        // Adding keeps the children already stored, so the write names only
        // the new one: rewriting the whole list made each registration cost
        // as much as the family is large.
        if (!parentEntry) parentEntry.emplace();
        parentEntry->childBundleIdentifiers = std::vector<std::string>{identifier};
        values.push_back(std::move(*parentEntry));
        identifiers.push_back(*parent);
      }
    }
    entry.registeredByCaller = optionTrue(withOptions, QRTCodeSigningRegByCallerKey);
    entry.placeholder = optionTrue(withOptions, QRTCodeSigningPlaceholderKey);
    if (codeSigningInfo) entry.codeSigningInfo = *codeSigningInfo;

    if (!stored || !(entry == *stored)) {
      std::optional<plist::Value> newEntitlements;
      if (entry.codeSigningInfo) {
        if (const plist::Value* v = plist::find(*entry.codeSigningInfo, QRTCodeSigningEntitlementsKey)) {
          newEntitlements = *v;
        }
      }
      std::optional<plist::Value> oldEntitlements = _onQueue_entitlementsCodeSigningEntry(stored, identifier);
      _onQueue_deleteSystemContainerIfWithdrawn(oldEntitlements, newEntitlements, identifier);
      // The counts as they stand before the new entry is written.
      auto dropGroups = [this](const QRTGroupList& before, const QRTGroupList& after, QRTGroupType type) {
        const std::vector<std::string> dropped = QRTGroupManager::droppedGroups(before, after);
        if (dropped.empty()) return;
        QRTGroupManager::defaultManager().removeReferencesForGroupIdentifiers(dropped, type,
                                                                              _onQueue_groupReferenceCounts(type));
      };
      QRTGroupList newApp =
          _copyApplicationGroupEntitlementForIdentifier(identifier, newEntitlements, QRTApplicationGroupsEntitlement);
      QRTGroupList oldApp =
          _copyApplicationGroupEntitlementForIdentifier(identifier, oldEntitlements, QRTApplicationGroupsEntitlement);
      dropGroups(oldApp, newApp, QRTGroupTypeApplication);
      QRTGroupList newSystem = _systemGroupList(identifier, newEntitlements);
      QRTGroupList oldSystem = _withSystemGroupPrefix(_systemGroupList(identifier, oldEntitlements));
      dropGroups(oldSystem, newSystem, QRTGroupTypeSystem);
      values.push_back(codeSigningInfo ? std::move(entry) : QRTCodeSigningEntry());
      identifiers.push_back(identifier);
    }
    if (!values.empty()) {
      if (QRTErrorRef writeError = _setCodeSigningDictionaryValues(values, identifiers)) {
        result = writeError->resultCode();
      }
    }
  });
  if (failure) result = failure->resultCode();
  return result;
}

void QRTCodeSigningMapping::_onQueue_deleteSystemContainerIfWithdrawn(
    const std::optional<plist::Value>& oldEntitlements, const std::optional<plist::Value>& newEntitlements,
    const std::string& identifier) {
  if (!grantsSystemContainer(oldEntitlements) || grantsSystemContainer(newEntitlements)) return;
  QRTErrorRef lookupError;
  QRTMetadataRef container = QRTContainerCache::sharedInstance().containerForUser(
      {QRTSystemContainerUserId, QRTClassSystemData, identifier}, &lookupError);
  if (!container) {
    QRTLog(kLogError, "Failed to retrieve system container %@: %@", identifier, lookupError);
    return;
  }
  QRTLog(kLogError, "Deleting system container for ID: %@ because it is no longer in the entitlements", identifier);
  uint64_t code = QRTErrorNone;
  // The caller holds the all-identifiers lock.
  QRTClientConnection::sharedClientConnection().stageForDeleteContainersWithUsers(
      {QRTSystemContainerUserId}, {container->uuid()}, {identifier}, {container->containerClass()}, false, &code);
  if (code != QRTErrorNone) {
    QRTLog(kLogError, "Failed to destroy system container with identifier %@: %llu", identifier,
           static_cast<unsigned long long>(code));
  }
}

QRTErrorRef QRTCodeSigningMapping::_setCodeSigningDictionaryValues(const std::vector<QRTCodeSigningEntry>& values,
                                                                   const std::vector<std::string>& forIdentifiers) {
  if (values.size() != forIdentifiers.size()) {
    return QRT_ERROR(QRTErrorCodeSigningInputMismatch, nullptr, true,
                     "Can't act on an invalid input: values count: %ld, IDs count: %ld",
                     static_cast<long>(values.size()), static_cast<long>(forIdentifiers.size()));
  }
  QRTErrorRef result;
  for (size_t i = 0; i < values.size(); ++i) {
    const std::string& identifier = forIdentifiers[i];
    QRTErrorRef error;
    std::optional<QRTCodeSigningEntry> stored = _onQueue_storedEntry(identifier, &error);
    if (error) {
      QRTLog(kLogError, "Error retrieving entry from DB with identifier %@ : %@", identifier, error);
      return error;
    }
    const bool wanted = values[i].codeSigningInfo.has_value();
    if (!wanted && !stored) continue;
    if (wanted && stored && values[i] == *stored) continue;
    if (!wanted) {
      if (_onQueue_writeEntry(identifier, stored, nullptr, &error)) {
        QRTLog(kLogDebug, "Deleted Code Signing Mapping for ID: %@", identifier);
      } else {
        QRTLog(kLogError, "Failed to delete code signing info from DB for %@ : %@", identifier, error);
        result = error;
      }
    } else if (_onQueue_writeEntry(identifier, stored, &values[i], &error)) {
      QRTLog(kLogDebug, "Set Code Signing Mapping for ID: %@ : %@", identifier, values[i]);
    } else {
      QRTLog(kLogError, "Failed to write code signing info to DB for %@ : %@", identifier, error);
      result = error;
    }
  }
  return result;
}

void QRTCodeSigningMapping::_onQueue_removeCodeSigningDictionariesForIdentifierAndItsChildren(
    const std::string& identifier) {
  QRTErrorRef error;
  std::optional<std::vector<std::string>> children =
      codeSigningMappingDB->childIdentifiersForParentIdentifier(identifier, &error);
  if (!children && error && !(error->domain() == QRTErrorDomain && error->code() == QRTErrorNotInDatabase)) {
    QRTLog(kLogError, "Error retrieving child bundles ids from DB with identifier %@ : %@", identifier, error);
    return;
  }
  std::vector<std::string> all = children ? *children : std::vector<std::string>{};
  all.push_back(identifier);
  for (const std::string& item : all) {
    uint64_t code = _onQueue_processCodeSigningInfo(nullptr, item, nullptr);
    if (code != QRTErrorNone) {
      QRTLog(kLogError, "Failed to clear entitlements for %@ : %llu", item, static_cast<unsigned long long>(code));
    }
  }
}

// ---- invalidation ----

bool QRTCodeSigningMapping::_onQueue_invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier,
                                                                                          QRTErrorRef* error) {
  generation_.fetch_add(1, std::memory_order_acq_rel);
  std::vector<std::string> rows{identifier};
  QRTErrorRef childError;
  if (auto children = codeSigningMappingDB->childIdentifiersForParentIdentifier(identifier, &childError)) {
    rows.insert(rows.end(), children->begin(), children->end());
  }
  const bool invalidated = codeSigningMappingDB->invalidateCodeSigningForIdentifierAndAllChildren(identifier, error);
  _onQueue_readBack(std::move(rows), {});
  return invalidated;
}

uint64_t QRTCodeSigningMapping::_onQueue_invalidateCodeSigningInfoForAppsWithoutBundleContainer() {
  uint64_t result = QRTErrorNone;
  QRTErrorRef failure = QRT_GUARD([&] {
    // Collected first: the enumeration's statement stays open while it runs.
    std::vector<std::string> orphans;
    QRTContainerCache& cache = QRTContainerCache::sharedInstance();
    QRTErrorRef error = codeSigningMappingDB->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [&](const std::string& identifier, const QRTCodeSigningEntry& entry) {
          if (entry.isRegisteredByCaller()) return;
          for (uint64_t bundleClass : {QRTClassAppBundle, QRTClassAddonBundle, QRTClassVPNBundle}) {
            QRTErrorRef lookupError;
            if (cache.containerForUser({QRTInstallerUserId, bundleClass, identifier}, &lookupError)) return;
          }
          orphans.push_back(identifier);
        });
    for (const std::string& identifier : orphans) {
      QRTErrorRef invalidateError;
      generation_.fetch_add(1, std::memory_order_acq_rel);
      if (!codeSigningMappingDB->invalidateCodeSigningWithIdentifier(identifier, &invalidateError)) {
        QRT_ERROR(QRTErrorDatabase, invalidateError, true, "Failed to invalidate code signing info for %@ : %@",
                  identifier, invalidateError);
      }
      _onQueue_readBack({identifier}, {});
    }
    if (error) {
      QRTLog(kLogError, "Failed to enumerate containers when invalidating code signing info: %@", error);
      result = error->resultCode();
    }
  });
  if (failure) result = failure->resultCode();
  return result;
}
