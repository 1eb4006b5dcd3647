#include "Daemon/dataprotection/QRTDataProtectionManager.h"

#include <atomic>
#include <cerrno>

#include "Daemon/QRTCrashPoint.h"
#include "Daemon/dataprotection/QRTApplicationTerminationAssertion.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "platform/Log.h"

using platform::kLogError;
using platform::kLogNotice;

namespace {

// Class 2 is never set on request; other applications may ask only for these.
constexpr int32_t kForbiddenClass = 2;
bool allowedForOtherParties(int32_t cls) { return cls == 0 || cls == 1 || cls == 3; }

// A completion that runs at most once, whatever path reaches it.
QRTDataProtectionManager::Completion once(QRTDataProtectionManager::Completion completion) {
  if (!completion) return nullptr;
  auto called = std::make_shared<std::atomic<bool>>(false);
  return [called, completion = std::move(completion)](uint64_t code) {
    if (!called->exchange(true)) completion(code);
  };
}

int32_t currentProtectionClass(const QRTMetadata& metadata) {
  if (!metadata.info()) return 0;
  const plist::Value* v = plist::find(*metadata.info(), QRTContentProtectionClassInfoKey);
  const plist::Integer* i = v ? v->integerIf() : nullptr;
  return i ? static_cast<int32_t>(i->asSigned()) : 0;
}

}  // namespace

QRTDataProtectionManager& QRTDataProtectionManager::defaultManager() {
  static auto* manager = new QRTDataProtectionManager();
  return *manager;
}

QRTDataProtectionManager::QRTDataProtectionManager()
    : protectionOperationFileQueue_(platform::makeSerialQueue("com.norvane.QuarterKit.ProtectionOperationFileQueue")) {}

void QRTDataProtectionManager::setDataProtectionOnDataContainerForUser(
    uint32_t userId, const std::optional<std::string>& identifier, uint64_t containerClass, int32_t dataProtectionClass,
    bool isSecondOrThirdPartyApp, bool retryIfLocked, const std::shared_ptr<platform::Queue>& lockStateQueue,
    Completion withCompletion) {
  Completion completion = once(std::move(withCompletion));
  uint64_t code;
  try {
    code = _setDataProtection(userId, identifier, containerClass, dataProtectionClass, isSecondOrThirdPartyApp,
                              retryIfLocked, lockStateQueue, completion);
  } catch (...) { code = QRT_EXCEPTION_ERROR()->resultCode(); }
  if (code != 0 && completion) completion(code);
}

uint64_t QRTDataProtectionManager::_setDataProtection(uint32_t userId, const std::optional<std::string>& identifier,
                                                      uint64_t containerClass, int32_t dataProtectionClass,
                                                      bool isSecondOrThirdPartyApp, bool retryIfLocked,
                                                      const std::shared_ptr<platform::Queue>& lockStateQueue,
                                                      const Completion& completion) {
  if (!identifier || !QRTIsPerUserClass(containerClass)) {
    return QRT_ERROR(QRTErrorInvalidParameter, nullptr, true,
                     "Can't act on an invalid object: userId: %u, ID: %@, class: %ld", userId, identifier,
                     static_cast<long>(containerClass))
        ->resultCode();
  }
  QRTErrorRef lookupError;
  QRTMetadataRef metadata =
      QRTContainerCache::sharedInstance().containerForUser({userId, containerClass, identifier}, &lookupError);
  if (!metadata) {
    return QRT_ERROR(QRTErrorNotFound, lookupError, true, "No Container with userId: %u, identifier: %@, Class: %ld",
                     userId, identifier, static_cast<long>(containerClass))
        ->resultCode();
  }
  const int32_t current = currentProtectionClass(*metadata);
  if (dataProtectionClass == current) {
    QRTErrorRef deleteError;
    bool deleted = false;
    protectionOperationFileQueue_->sync([&] {
      deleted = QRTDataProtectionChangeOperation::deleteUpdateFileWithIdentifier(*identifier, containerClass, userId,
                                                                                 &deleteError);
    });
    if (!deleted) {
      QRTLog(kLogError, "Failed to delete existing data protection update file: %@", deleteError);
      return deleteError ? deleteError->resultCode() : QRTErrorRemoveItemFailed;
    }
    return QRTErrorNone;
  }
  if (dataProtectionClass == kForbiddenClass) {
    return QRT_ERROR(QRTErrorInvalidArgument, nullptr, true, "Data protection class %d is not allowed",
                     dataProtectionClass)
        ->resultCode();
  }
  if (isSecondOrThirdPartyApp && !allowedForOtherParties(dataProtectionClass)) {
    return QRT_ERROR(QRTErrorInvalidArgument, nullptr, true,
                     "Data protection class %d is invalid for 2nd and 3rd party apps", dataProtectionClass)
        ->resultCode();
  }
  // Towards a numerically higher class only directories change: files keep theirs.
  const bool towardsLower = current > dataProtectionClass || (current == 0 && dataProtectionClass <= 2);
  const uint32_t changeType = towardsLower ? (QRTDataProtectionChangeOperation::QRTChangeDirectories |
                                              QRTDataProtectionChangeOperation::QRTChangeFiles |
                                              QRTDataProtectionChangeOperation::QRTChangeFilesOnlyToLowerClass)
                                           : QRTDataProtectionChangeOperation::QRTChangeDirectories;
  auto operation = QRTDataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
      metadata, dataProtectionClass, retryIfLocked, changeType, protectionOperationFileQueue_, lockStateQueue);
  QRTErrorRef writeError;
  if (!operation->writeToDiskWithError(&writeError)) {
    QRTLog(kLogError, "Failed to write data protection update file to disk: %@", writeError);
    return writeError ? writeError->resultCode() : QRTErrorWriteFailed;
  }
  QRT_CRASH_POINT("protection-after-pending-write");
  _startDataProtectionChangeOperation(operation, completion);
  return 0;
}

void QRTDataProtectionManager::_startDataProtectionChangeOperation(
    const QRTDataProtectionChangeOperation::Ref& operation, Completion withCompletion) {
  const QRTMetadataRef metadata = operation->dataContainerMetadata();
  const int32_t newClass = operation->newDataProtectionClass();
  const bool retryIfLocked = operation->retryIfLocked();
  // Made just before the re-run after an unlock, given up when the change ends.
  auto assertion = std::make_shared<std::shared_ptr<QRTApplicationTerminationAssertion>>();
  operation->setRetryStartBlock([assertion, identifier = metadata->identifier()] {
    *assertion = QRTApplicationTerminationAssertion::initWithBundleIdentifier(
        identifier, QRTApplicationTerminationAssertion::ReasonInstallation);
  });
  operation->setCompletionBlock([assertion, metadata, newClass, retryIfLocked, completion = std::move(withCompletion)](
                                    bool wasLocked, const QRTErrorRef& error) {
    uint64_t code = QRTErrorNone;
    if (error) {
      code = error->resultCode();
      QRTLog(kLogError, "Failed to set data protection on container with identifier %@ at %@ to %d: %@",
             metadata->identifier(), metadata->url(), newClass, error);
    }
    if (wasLocked && retryIfLocked) QRTLog(kLogError, "Unexpectedly got completion block called with wasLocked");
    if (*assertion) {
      (*assertion)->invalidate();
      assertion->reset();
    }
    if (!error && !wasLocked) {
      uint64_t infoCode = QRTErrorNone;
      QRTClientConnection::sharedClientConnection().setInfoValue(
          plist::Value(static_cast<int64_t>(newClass)), std::string(QRTContentProtectionClassInfoKey),
          metadata->userId(), metadata->uuid(), metadata->identifier(), metadata->containerClass(), true, &infoCode);
      if (infoCode != QRTErrorNone) {
        QRTLog(kLogError, "Failed to set protection class info for %@ at %@ to %d : %llu", metadata->identifier(),
               metadata->url(), newClass, static_cast<unsigned long long>(infoCode));
      }
    }
    if (completion) completion(code);
  });
  operation->performChangeOperation();
}

bool QRTDataProtectionManager::restartPendingDataProtectionOperationsWithError(
    const std::shared_ptr<platform::Queue>& lockStateQueue, QRTErrorRef* error) {
  const QRTURL directory = QRTGlobalConfiguration::sharedInstance().pendingUpdatesDirectory();
  QRTErrorRef listError;
  auto files = QRTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(directory, &listError);
  if (!files) {
    if (listError && listError->domain() == QRTPOSIXErrorDomain && listError->code() == ENOENT) return true;
    QRTLog(kLogError, "Failed to get items at pendingUpdates URL %@ : %@", directory, listError);
    QRTSetError(error, listError);
    return false;
  }
  for (const QRTURL& file : *files) {
    // One bad file must not keep the others from being carried out.
    if (QRTErrorRef failure = QRT_GUARD([&] { _restartPendingOperationAtURL(file, lockStateQueue); }))
      QRTLog(kLogError, "Failed to read data protection change operation at %@ : %@", file, failure);
  }
  return true;
}

void QRTDataProtectionManager::_restartPendingOperationAtURL(const QRTURL& file,
                                                             const std::shared_ptr<platform::Queue>& lockStateQueue) {
  QRTLog(kLogNotice, "Found pending data protection operation at %@", file);
  QRTErrorRef readError;
  auto operation = QRTDataProtectionChangeOperation::dataProtectionChangeOperationAtURL(
      file, protectionOperationFileQueue_, lockStateQueue, &readError);
  if (!operation) {
    QRTLog(kLogError, "Failed to read data protection change operation at %@ : %@", file, readError);
    return;
  }
  const QRTMetadataRef& m = operation->dataContainerMetadata();
  QRTLog(kLogNotice,
         "Starting pending data protection update to protection class %d for user: %u, ID: %@, containerClass: %llu",
         operation->newDataProtectionClass(), m->userId(), m->identifier(),
         static_cast<unsigned long long>(m->containerClass()));
  _startDataProtectionChangeOperation(operation, nullptr);
}
