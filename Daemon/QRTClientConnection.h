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

#include "base/QRTURL.h"
#include "Daemon/QRTError.h"

class QRTMetadata;

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

  // Finds the container of (user, class, identifier, transient), or makes it
  // through the staging directory when asked to. Nothing on failure, with
  // the code in *withError.
  std::shared_ptr<QRTMetadata> createOrLookupContainerForUser(uint32_t userId,
                                                              const std::optional<std::string>& identifier,
                                                              bool createIfNecessary, uint64_t containerClass,
                                                              bool transient, bool useLocking, uint64_t* withError);

  // Queues a death-row pass; the completion gets its result code.
  void deleteContainersOnDeathRowWithCompletion(std::function<void(uint64_t)> completion);

  // Start-up work of the container store, run through the internal client.
  void rebootQuarterSetup();
  void quarterSetup();
  void rebootQuarterCleanup();
  void quarterCleanup();

 private:
  bool _createTopLevelContainerDirectory(const QRTURL& url, uint64_t containerClass, uint32_t owner,
                                         QRTErrorRef* error);
 public:
  // Also used when a container's default structure is made again.
  bool _createSubDirectories(const QRTURL& url, uint32_t userId, uint64_t containerClass, QRTErrorRef* error);
  bool _createDefaultDirectory(const QRTURL& url, mode_t mode, uint32_t owner, QRTErrorRef* error);
  // Moves an item into a fresh holding directory on death row.
  bool _moveItemAtURLToDeathRow(const QRTURL& url, bool isDir, bool startDeletionThread, QRTErrorRef* error);
  bool _removeItemOrMoveToTempAtURL(const QRTURL& url, QRTErrorRef* error);

 private:
  // The body of createOrLookupContainerForUser, under the all-identifiers lock.
  std::shared_ptr<QRTMetadata> _lookupOrCreate(uint32_t userId, const std::string& identifier, bool createIfNecessary,
                                               uint64_t containerClass, bool transient, bool useLocking,
                                               QRTErrorRef* error);
  std::shared_ptr<QRTMetadata> _createNewContainer(uint32_t userId, const std::string& identifier,
                                                   uint64_t containerClass, bool transient, QRTErrorRef* error);
  std::shared_ptr<QRTMetadata> _buildInStaging(const QRTURL& staging, uint32_t userId, const std::string& identifier,
                                               uint64_t containerClass, QRTErrorRef* error);
  uint64_t _runDeathRowPass();

  std::optional<std::string> clientBundleIdentifier_;
  uint32_t clientUserId_ = 0;
  bool allowOtherIdLookup_ = false;
  bool allowGroupIdLookup_ = false;
  std::optional<std::vector<std::string>> entitledWipeIdentifiers_;
};
