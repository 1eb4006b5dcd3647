// The process-wide record of each program's code-signing information, and
// what its entitlements grant: group containers and a system container. All
// database work runs on one serial queue; the operations that change entries
// hold the all-identifiers lock around it, taken before entering the queue.
// The look-ups answer from an in-memory snapshot of the database that every
// write brings up to date, and reach the queue only when the snapshot cannot
// answer (an identifier it does not hold may still be imported on demand).
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "base/PlistValue.h"
#include "base/QRTURL.h"
#include "Daemon/QRTError.h"
#include "Daemon/codesign/QRTCodeSigningEntry.h"
#include "Daemon/codesign/QRTCodeSigningMappingSnapshot.h"
#include "Daemon/groups/QRTGroupNames.h"
#include "platform/Queue.h"

class QRTSQLiteDB;

inline constexpr const char* QRTCodeSigningEntitlementsKey = "com.norvane.QuarterKit.Entitlements";
inline constexpr const char* QRTCodeSigningDataContainerClassKey = "com.norvane.QuarterKit.DataContainerClass";
inline constexpr const char* QRTCodeSigningParentBundleIDKey = "com.norvane.QuarterKit.ParentBundleID";
inline constexpr const char* QRTCodeSigningPlaceholderKey = "com.norvane.QuarterKit.PlaceholderEntitlements";
inline constexpr const char* QRTCodeSigningRegByCallerKey = "RegByCaller";
inline constexpr const char* QRTCachedCodeSigningInfoKey = "com.norvane.Emplacer.CachedCodeSigningInfo";
inline constexpr const char* QRTApplicationGroupsEntitlement = "com.norvane.security.application-groups";
inline constexpr const char* QRTSystemGroupsEntitlement = "com.norvane.security.system-groups";
inline constexpr const char* QRTSystemGroupContainersEntitlement = "com.norvane.security.system-group-containers";
inline constexpr const char* QRTSystemContainerEntitlement = "com.norvane.security.system-container";

// Group identifier to the number of stored programs naming it.
using QRTGroupReferenceCounts = std::map<std::string, int64_t>;
enum QRTGroupType : int64_t;

class QRTCodeSigningMapping : public QRTGroupNames {
 public:
  // Made on first use; null when the database can't be opened (logged
  // "Failed to initialize database.").
  static QRTCodeSigningMapping* sharedInstance();

  // Each returns a code of the daemon's error table (1 = success). A null
  // dictionary means "no code-signing information", which deletes the entry.
  uint64_t processCodeSigningInfo(const plist::Dictionary* codeSigningInfo,
                                  const std::optional<std::string>& forIdentifier,
                                  const plist::Dictionary* withOptions);
  uint64_t processCallerRegisteredEntitlements(const plist::Dictionary& entitlements, const std::string& forIdentifier);
  // The external view: placeholder and invalid entries read as none.
  std::optional<plist::Dictionary> getCodeSigningInfoForIdentifier(const std::optional<std::string>& identifier);
  uint64_t invalidateCodeSigningInfoForAppsWithoutBundleContainer();
  void performAllCodeSigningMigrationAndReconciliation();
  bool invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier, QRTErrorRef* withError);
  void removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string& identifier);

  // The internal view.
  bool codeSigningInfoExistForIdentifier(const std::string& identifier);
  bool identifierHasCallerRegisteredEntitlements(const std::string& identifier);
  bool identifierHasSystemContainer(const std::string& identifier);
  uint64_t dataContainerTypeForIdentifier(const std::string& identifier);
  QRTGroupList appGroupIdentifiersForIdentifier(const std::string& identifier) override;
  QRTGroupList systemGroupIdentifiersForIdentifier(const std::string& identifier) override;

  // Must be called on the queue.
  void iterateGroupIdsWithKey(
      const std::string& key, const std::optional<std::string>& fallBackKey,
      const std::function<void(const std::string& identifier, const QRTGroupList& groups)>& block);

  // How many stored programs (invalid and placeholder ones included) name
  // each group of the type, as handed to the group manager (tests).
  std::optional<QRTGroupReferenceCounts> groupReferenceCounts(QRTGroupType type);
  // Whether the kept counts of both types equal a fresh count (tests).
  bool groupReferenceCountsMatchDatabase();

  // Whether the snapshot holds exactly the entries the database holds (tests).
  bool snapshotMatchesDatabase();
  // What an administrator's check looks at: the database's own consistency
  // checks, the programs whose bundle container is gone (registered by the
  // caller and invalid ones left out), and the group types whose kept
  // reference counts differ from a fresh count; with recount, those are
  // taken afresh, as the next start would.
  struct DatabaseCheck {
    std::vector<std::string> problems;
    std::vector<std::string> withoutBundle;
    std::vector<QRTGroupType> driftedCounts;
  };
  DatabaseCheck checkDatabase(bool recount);

  // Counts the writes to the database, so that callers may remember an
  // answer for as long as nothing was written.
  uint64_t generation() const { return generation_.load(std::memory_order_acquire); }

 private:
  explicit QRTCodeSigningMapping(std::unique_ptr<QRTSQLiteDB> db);
  ~QRTCodeSigningMapping();

  // Runs body on the queue and returns its value.
  template <typename F>
  auto onQueue(F&& body) -> decltype(body());

  uint64_t _onQueue_processCodeSigningInfo(const plist::Dictionary* codeSigningInfo,
                                           const std::optional<std::string>& forIdentifier,
                                           const plist::Dictionary* withOptions);
  std::optional<plist::Dictionary> _onQueue_codeSigningInfoForIdentifier(const std::string& identifier,
                                                                         bool externalRequest);
  std::optional<plist::Dictionary> _onQueue_codeSigningInfoForCodeSigningEntry(
      const std::optional<QRTCodeSigningEntry>& entry, const std::string& identifier, bool externalRequest);
  std::optional<plist::Value> _onQueue_entitlementsForIdentifier(const std::string& identifier);
  std::optional<plist::Value> _onQueue_entitlementsCodeSigningEntry(const std::optional<QRTCodeSigningEntry>& entry,
                                                                    const std::string& identifier);
  bool _onQueue_codeSigningInfoExistForIdentifier(const std::string& identifier);
  bool _onQueue_identifierHasCallerRegisteredEntitlements(const std::string& identifier);
  bool _onQueue_identifierHasSystemContainer(const std::string& identifier);
  uint64_t _onQueue_dataContainerTypeForIdentifier(const std::string& identifier);
  QRTGroupList _onQueue_appGroupIdentifiersForIdentifier(const std::string& identifier);
  QRTGroupList _onQueue_systemGroupIdentifiersForIdentifier(const std::string& identifier);
  uint64_t _onQueue_invalidateCodeSigningInfoForAppsWithoutBundleContainer();
  bool _onQueue_invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier, QRTErrorRef* error);
  void _onQueue_removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string& identifier);

  // Every write of an entry goes through here, so that the kept group
  // counts follow the database. No wanted entry deletes the stored one.
  bool _onQueue_writeEntry(const std::string& identifier, const std::optional<QRTCodeSigningEntry>& stored,
                           const QRTCodeSigningEntry* wanted, QRTErrorRef* error);
  // How many stored programs (invalid and placeholder ones included) name
  // each group of the type. Counted from the database at the first need,
  // then kept up to date by every write of an entry.
  std::optional<QRTGroupReferenceCounts> _onQueue_groupReferenceCounts(QRTGroupType type);
  QRTGroupList _groupsOfEntry(const QRTCodeSigningEntry& entry, const std::string& identifier, QRTGroupType type);
  std::optional<QRTGroupReferenceCounts> _onQueue_countGroupReferences(QRTGroupType type);

  // The snapshot: read whole from the database, or the given rows read back
  // after a write (with the programs listing any child these name). A row
  // that cannot be read back sets the snapshot aside until it is read whole.
  void _onQueue_loadSnapshot();
  std::optional<QRTCodeSigningMappingSnapshot::Entries> _readWholeSnapshot();
  void _onQueue_readBack(std::vector<std::string> identifiers, const std::vector<std::string>& children);
  // The first whole read runs on a thread of its own, beside the request
  // that made the mapping: until it is in, look-ups ask the database, and
  // the rows written meanwhile wait to be read back over it.
  void _onQueue_installSnapshot(std::optional<QRTCodeSigningMappingSnapshot::Entries> entries);
  void _waitForFirstSnapshot();
  // The entry from the snapshot; Unknown when only the queue can tell.
  QRTCodeSigningMappingSnapshot::Lookup _snapshotEntry(const std::string& identifier,
                                                       QRTCodeSigningMappingSnapshot::EntryRef* entry) const;

  // The stored entry; no entry and no error when there is none (67).
  std::optional<QRTCodeSigningEntry> _onQueue_storedEntry(const std::string& identifier, QRTErrorRef* error);
  // Parallel arrays; an entry without a code-signing dictionary deletes.
  QRTErrorRef _setCodeSigningDictionaryValues(const std::vector<QRTCodeSigningEntry>& values,
                                              const std::vector<std::string>& forIdentifiers);
  void _onQueue_deleteSystemContainerIfWithdrawn(const std::optional<plist::Value>& oldEntitlements,
                                                 const std::optional<plist::Value>& newEntitlements,
                                                 const std::string& identifier);
  static QRTGroupList _copyApplicationGroupEntitlementForIdentifier(const std::string& identifier,
                                                                    const std::optional<plist::Value>& entitlements,
                                                                    const std::string& groupKey) {
    return _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements ? &*entitlements : nullptr, groupKey);
  }
  static QRTGroupList _copyApplicationGroupEntitlementForIdentifier(const std::string& identifier,
                                                                    const plist::Value* entitlements,
                                                                    const std::string& groupKey);
  // The system-groups list, or the fall-back key's when that is none or empty.
  static QRTGroupList _systemGroupList(const std::string& identifier, const std::optional<plist::Value>& entitlements) {
    return _systemGroupList(identifier, entitlements ? &*entitlements : nullptr);
  }
  static QRTGroupList _systemGroupList(const std::string& identifier, const plist::Value* entitlements);
  // Drops, with a log line, every identifier without the "systemgroup." prefix.
  static QRTGroupList _withSystemGroupPrefix(QRTGroupList groups);

  // One-time imports of older stores (QRTCodeSigningMigrations.cpp).
  void _migrateFromMappingFileToDBIfNecessary();
  std::optional<plist::Dictionary> _readCodeSigningMappingFromDiskAtURL(const QRTURL& url, QRTErrorRef* error);
  void _onQueue_migrateAppGroupIdsFromDataContainersToFile();
  void _onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile();
  void _onQueue_migrateCachedCodeSigningInfoFromBundleContainersToMapping();
  bool _addMigratedEntry(const QRTCodeSigningEntry& entry, const std::string& identifier, QRTErrorRef* error);
  // The read path's lazy import of what the installer cached in the bundle
  // container, for an identifier the database does not hold.
  std::optional<plist::Dictionary> _onQueue_migrateCachedCodeSigningInfoFromBundleContainer(
      const std::string& identifier);

  std::shared_ptr<platform::Queue> codeSignQueue;
  std::unique_ptr<QRTSQLiteDB> codeSigningMappingDB;
  QRTCodeSigningMappingSnapshot snapshot_;
  std::thread firstSnapshotReader_;
  std::mutex firstSnapshotReaderLock_;                                          // for joining it
  bool readingFirstSnapshot_ = false;                                           // the constructor, then the queue only
  std::vector<std::string> writtenWhileReading_, childrenWrittenWhileReading_;  // likewise
  std::atomic<uint64_t> generation_{0};
  std::optional<QRTGroupReferenceCounts> groupCounts_[2];  // by group type; on the queue only
};
