// One change of the protection class of a data container's contents. The
// change is recorded in a pending-update file before any item is touched and
// the file goes only when the change is over, so that start-up can carry out
// a change that a crash interrupted; a change that finds the device locked
// waits on the lock-state queue it was given (which runs only while the
// device is unlocked) and runs again after the unlock.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "Daemon/QRTError.h"
#include "Daemon/store/QRTMetadata.h"
#include "base/PlistValue.h"
#include "base/QRTURL.h"
#include "base/QRTUUID.h"
#include "platform/Queue.h"

class QRTDataProtectionChangeOperation : public std::enable_shared_from_this<QRTDataProtectionChangeOperation> {
 public:
  // Bits of changeType.
  enum ChangeType : uint32_t {
    QRTChangeDirectories = 1,
    QRTChangeFiles = 2,
    QRTChangeFilesOnlyToLowerClass = 4,
  };
  using RetryStartBlock = std::function<void()>;
  using CompletionBlock = std::function<void(bool wasLocked, const QRTErrorRef& error)>;
  using QueueRef = std::shared_ptr<platform::Queue>;
  using Ref = std::shared_ptr<QRTDataProtectionChangeOperation>;

  // "IDENTIFIER-CLASS-USER.plist" in the pending-updates directory.
  static QRTURL urlForProtectionOperationWithIdentifier(const std::string& identifier, uint64_t containerClass,
                                                        uint32_t userId);
  static std::optional<plist::Dictionary> _readAndValidateDataProtectionUpdateAtURL(const std::optional<QRTURL>& url,
                                                                                    QRTErrorRef* error);
  // The operation of a pending-update file, with the file's change id.
  static Ref dataProtectionChangeOperationAtURL(const QRTURL& url, QueueRef queue, QueueRef lockStateQueue,
                                                QRTErrorRef* error);
  // A missing file counts as deleted.
  static bool deleteUpdateFileWithIdentifier(const std::string& identifier, uint64_t containerClass, uint32_t userId,
                                             QRTErrorRef* error);
  static Ref dataProtectionChangeOperationWithContainerMetadata(QRTMetadataRef metadata, int32_t settingClass,
                                                                bool retryingIfLocked, uint32_t changeType,
                                                                QueueRef queue, QueueRef lockStateQueue);

  // No change id makes a fresh one. queue is the pending-update files' queue;
  // a change that waits for the unlock runs again on lockStateQueue.
  QRTDataProtectionChangeOperation(QRTMetadataRef metadata, int32_t newClass, bool retryingIfLocked,
                                   uint32_t changeType, std::optional<QRTUUID> internalChangeID, QueueRef queue,
                                   QueueRef lockStateQueue);

  // Each runs its _onQueue_ counterpart synchronously on the file queue.
  bool writeToDiskWithError(QRTErrorRef* error);
  bool _stillMostCurrentUpdate();
  bool _deleteUpdateFileWithError(QRTErrorRef* error);

  // One run under the container's identifier lock (read). Success with
  // *needToRetry when the device refused a change because it is locked.
  bool _runChangeOperationNeedToRetry(bool* needToRetry, QRTErrorRef* error);
  // Runs the change; then either waits for the next unlock (retryIfLocked)
  // or deletes its pending-update file and calls the completion once.
  void performChangeOperation();

  // The walk of one root: every directory (after its contents) and regular
  // file on the root's file system, reached through descriptors, no link
  // followed. *locked when the file system refused a change with EPERM.
  static bool setProtectionClassOfTreeAtURL(const QRTURL& root, int32_t newClass, uint32_t changeType, bool* locked,
                                            QRTErrorRef* error);

  bool retryIfLocked() const { return retryIfLocked_; }
  void setRetryIfLocked(bool v) { retryIfLocked_ = v; }
  bool retried() const { return retried_; }
  void setRetried(bool v) { retried_ = v; }
  const QRTMetadataRef& dataContainerMetadata() const { return dataContainerMetadata_; }
  void setDataContainerMetadata(QRTMetadataRef v) { dataContainerMetadata_ = std::move(v); }
  int32_t newDataProtectionClass() const { return newDataProtectionClass_; }
  void setNewDataProtectionClass(int32_t v) { newDataProtectionClass_ = v; }
  uint32_t changeType() const { return changeType_; }
  void setChangeType(uint32_t v) { changeType_ = v; }
  const RetryStartBlock& retryStartBlock() const { return retryStartBlock_; }
  void setRetryStartBlock(RetryStartBlock v) { retryStartBlock_ = std::move(v); }
  const CompletionBlock& completionBlock() const { return completionBlock_; }
  void setCompletionBlock(CompletionBlock v) { completionBlock_ = std::move(v); }
  const QRTUUID& internalChangeID() const { return internalChangeID_; }
  void setInternalChangeID(const QRTUUID& v) { internalChangeID_ = v; }
  const QueueRef& queue() const { return queue_; }

 private:
  bool _onQueue_writeToDiskWithError(QRTErrorRef* error);
  bool _onQueue_stillMostCurrentUpdate();
  bool _onQueue_deleteUpdateFileWithError(QRTErrorRef* error);
  bool _runChange(bool* needToRetry, QRTErrorRef* error);

  bool retryIfLocked_ = false;
  bool retried_ = false;
  QRTMetadataRef dataContainerMetadata_;
  int32_t newDataProtectionClass_ = 0;
  uint32_t changeType_ = 0;
  RetryStartBlock retryStartBlock_;
  CompletionBlock completionBlock_;
  QRTUUID internalChangeID_;
  QueueRef queue_;
  QueueRef lockStateQueue_;
};
