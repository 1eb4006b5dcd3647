// The client of one request: who is asking and what they may name. Also the
// home of the container operations that the request handlers call.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/PlistValue.h"
#include "base/QRTURL.h"
#include "base/QRTUUID.h"
#include "Daemon/QRTError.h"
#include "Daemon/store/QRTContainerKey.h"

class QRTMetadata;
namespace platform {
class Dir;
}

using QRTMetadataRef = std::shared_ptr<const QRTMetadata>;

class QRTClientConnection {
 public:
  QRTClientConnection(std::optional<std::string> bundleId, uint32_t clientUserId, bool allowOtherIdLookup,
                      std::optional<std::vector<std::string>> entitledWipeIdentifiers);
  QRTClientConnection(std::optional<std::string> bundleId, bool allowOtherIdLookup);

  // The internal client through which start-up work runs: identifier
  // "com.norvane.quarterd.internal", user 0, other-identifier look-up allowed.
  static QRTClientConnection& sharedClientConnection();

  const std::optional<std::string>& clientBundleIdentifier() const { return clientBundleIdentifier_; }
  uint32_t clientUserId() const { return clientUserId_; }
  bool allowOtherIdLookup() const { return allowOtherIdLookup_; }
  void setAllowOtherIdLookup(bool allow) { allowOtherIdLookup_ = allow; }
  bool allowGroupIdLookup() const { return allowGroupIdLookup_; }
  void setAllowGroupIdLookup(bool allow) { allowGroupIdLookup_ = allow; }
  const std::optional<std::vector<std::string>>& entitledWipeIdentifiers() const { return entitledWipeIdentifiers_; }

  // What the caller's uid and identity together allow (root and the internal
  // client: a system process).
  struct Rights {
    int pid = 0;
    bool systemProcess = false;   // root, or a holder of system-level entitlements
    bool systemEntitled = false;  // holds system-level entitlements
    bool masterEntitled = false;  // holds the master entitlement
  };
  const Rights& rights() const { return rights_; }
  void setRights(const Rights& rights) { rights_ = rights; }

  // Finds the container of (user, class, identifier, transient), or makes it
  // through the staging directory when asked to. Nothing on failure, with
  // the code in *withError.
  QRTMetadataRef createOrLookupContainerForUser(const QRTContainerKey& key, QRTCreateMode mode, QRTLocking locking,
                                                uint64_t* withError);

  // Queues a death-row pass; the completion gets its result code.
  void deleteContainersOnDeathRowWithCompletion(std::function<void(uint64_t)> completion);

  // Removal: staging moves containers to death row at once; the parallel
  // arrays describe one container per index.
  void stageForDeleteContainersWithUsers(const std::vector<uint32_t>& users,
                                         const std::vector<std::optional<QRTUUID>>& UUIDs,
                                         const std::vector<std::optional<std::string>>& identifiers,
                                         const std::vector<std::optional<uint64_t>>& classes, bool useLocking,
                                         uint64_t* withError);
  void deleteContainerForUser(uint32_t userId, const std::optional<std::string>& withIdentifier,
                              uint64_t containerClass, bool transient, uint64_t* withError);
  void deleteDataContainerContentForUser(uint32_t userId, const std::optional<std::string>& identifier,
                                         uint64_t containerClass, uint64_t* withError);

  // Queries and info values of existing containers.
  std::optional<std::vector<QRTMetadataRef>> containersForUser(uint32_t userId, uint64_t withClass, bool transient,
                                                               uint64_t* withError);
  QRTMetadataRef metadataForUser(uint32_t userId, const std::optional<QRTUUID>& withUUID,
                                 const std::optional<std::string>& identifier, uint64_t containerClass,
                                 uint64_t* withError);
  // A nil value removes the key.
  void setInfoValue(const std::optional<plist::Value>& value, const std::optional<std::string>& forKey, uint32_t userId,
                    const std::optional<QRTUUID>& uuid, const std::optional<std::string>& identifier,
                    uint64_t containerClass, bool useLocking, uint64_t* withError);
  std::optional<plist::Value> infoValueForKey(const std::optional<std::string>& key, uint32_t userId,
                                              const std::optional<QRTUUID>& uuid,
                                              const std::optional<std::string>& identifier, uint64_t containerClass,
                                              bool useLocking, uint64_t* withError);
  void recreateDefaultStructureForUser(uint32_t userId, const std::optional<QRTUUID>& withUUID,
                                       const std::optional<std::string>& identifier, uint64_t containerClass,
                                       uint64_t* withError);
  void regenerateDirectoryUUIDForUser(uint32_t userId, const std::optional<QRTUUID>& withInternalUUID,
                                      const std::optional<std::string>& identifier, uint64_t containerClass,
                                      uint64_t* withError);
  void _regenerateAllSystemContainerPaths();
  uint64_t diskUsageForUserId(uint32_t userId, const std::optional<QRTUUID>& uuid,
                              const std::optional<std::string>& identifier, uint64_t containerClass,
                              uint64_t* withError);

  // Puts the new container in the old one's place (or, with no old one,
  // makes a transient container permanent), through a journal that start-up
  // recovery completes or undoes.
  void replaceContainer(const std::optional<QRTUUID>& replaceContainer, const std::optional<QRTUUID>& withContainer,
                        uint32_t userIdOld, uint32_t userIdNew, const std::optional<std::string>& identifierOld,
                        const std::optional<std::string>& identifierNew, uint64_t containerClassOld,
                        uint64_t containerClassNew, bool preserveOldUUID, bool startDeletionThread,
                        uint64_t* withError);
  bool _recoverFromReplaceOperationsWithError(QRTErrorRef* error);

  // Operations inside existing containers (QRTClientConnectionAssets.cpp).
  // Paths a client names are kept inside their container (realPathForURL).
  std::optional<QRTURL> userManagedAssetsPathForUser(uint32_t userId, const std::optional<std::string>& identifier,
                                                     bool isRelative, uint64_t* withError);
  void deleteUserManagedAssetForUser(uint32_t userId, const std::optional<std::string>& identifier,
                                     const std::optional<std::string>& relativePath, uint64_t* withError);
  std::optional<QRTURL> stageSharedContentForIdentifier(const std::optional<std::string>& identifier,
                                                        const std::optional<std::string>& sourceRelativePath,
                                                        const std::optional<std::string>& destRelativePath,
                                                        uint64_t* withError);
  void setNetworkExtensionForUser(uint32_t userId, const std::optional<std::string>& identifier,
                                  uint64_t containerClass, uint64_t* withError);
  // Ends the process (exit status 0, no reply) while crashes remain.
  void retryTestForUser(uint32_t userId, uint64_t withNumCrashes, uint64_t* withError);

  // Start-up work of the container store, run through the internal client.
  void rebootQuarterSetup();
  void quarterSetup();
  void rebootQuarterCleanup();
  void quarterCleanup();
  // Hands every entry of the class directory without a valid name or a
  // metadata file to death row.
  void _cleanupOrphanedDataForUser(uint32_t userId, uint64_t containerClass);

 private:
  // Made in staging when it is held (by the last component of url), else
  // from the device root; *out receives the directory, open.
  bool _createTopLevelContainerDirectory(const QRTURL& url, uint64_t containerClass, uint32_t owner,
                                         const platform::Dir* staging, platform::Dir* out, QRTErrorRef* error);

 public:
  // Also used when a container's default structure is made again.
  // container, when given, is url's directory already held.
  bool _createSubDirectories(const QRTURL& url, uint32_t userId, uint64_t containerClass, QRTErrorRef* error,
                             const platform::Dir* container = nullptr);
  bool _createDefaultDirectory(const QRTURL& url, mode_t mode, uint32_t owner, QRTErrorRef* error);
  // Moves an item into a fresh holding directory on death row.
  bool _moveItemAtURLToDeathRow(const QRTURL& url, bool isDir, bool startDeletionThread, QRTErrorRef* error);
  bool _removeItemOrMoveToTempAtURL(const QRTURL& url, QRTErrorRef* error);

 private:
  // The body of createOrLookupContainerForUser, under the all-identifiers lock.
  // key.identifier is set.
  QRTMetadataRef _lookupOrCreate(const QRTContainerKey& key, QRTCreateMode mode, QRTLocking locking,
                                 QRTErrorRef* error);
  QRTMetadataRef _createNewContainer(uint32_t userId, const std::string& identifier, uint64_t containerClass,
                                     bool transient, QRTErrorRef* error);
  // stagingDirectory: the staging directory held, or an invalid one.
  QRTMetadataRef _buildInStaging(const QRTURL& staging, const platform::Dir& stagingDirectory, uint32_t userId,
                                 const std::string& identifier, uint64_t containerClass, QRTErrorRef* error);
  uint64_t _runDeathRowPass();
  // The replace journal: the four directories of one replace, keyed by the
  // journal's key names.
  // A UUID-preserving replace also records the UUID that must stay.
  bool _writeToDiskReplaceAt(const QRTURL& replaceURL, const QRTURL& old, const QRTURL& withNew,
                             const QRTURL& usingStaging, const QRTURL& toDestination,
                             const std::optional<QRTUUID>& preservedUUID, QRTErrorRef* error);
  std::optional<std::map<std::string, QRTURL>> _readAndValidateReplaceFileAtUrl(const QRTURL& url,
                                                                                std::optional<QRTUUID>* preservedUUID,
                                                                                QRTErrorRef* error);
  // The containers a directory-UUID regeneration renames.
  std::vector<QRTMetadataRef> _containersToRename(uint32_t userId, const QRTUUID& uuid,
                                                  const std::optional<std::string>& identifier, uint64_t containerClass,
                                                  QRTErrorRef* error);

  std::optional<std::string> clientBundleIdentifier_;
  uint32_t clientUserId_ = 0;
  bool allowOtherIdLookup_ = false;
  bool allowGroupIdLookup_ = false;
  std::optional<std::vector<std::string>> entitledWipeIdentifiers_;
  Rights rights_;
};
