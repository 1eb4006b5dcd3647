// The entry point for changing a data container's protection class: decides
// whether a change is needed and allowed, records and starts it, records the
// new class in the container's info values once it succeeded, and at
// start-up carries out every change a crash or reboot interrupted.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "Daemon/QRTError.h"
#include "Daemon/dataprotection/QRTDataProtectionChangeOperation.h"
#include "platform/Queue.h"

inline constexpr const char* QRTContentProtectionClassInfoKey = "com.norvane.Emplacer.ContentProtectionClass";

class QRTDataProtectionManager {
 public:
  // Gets the result code: 1 on success.
  using Completion = std::function<void(uint64_t code)>;

  static QRTDataProtectionManager& defaultManager();

  // The completion is called exactly once, possibly after the next unlock.
  // A change that finds the device locked runs again on lockStateQueue,
  // which its owner runs only while the device is unlocked.
  void setDataProtectionOnDataContainerForUser(uint32_t userId, const std::optional<std::string>& identifier,
                                               uint64_t containerClass, int32_t dataProtectionClass,
                                               bool isSecondOrThirdPartyApp, bool retryIfLocked,
                                               const std::shared_ptr<platform::Queue>& lockStateQueue,
                                               Completion withCompletion);
  bool restartPendingDataProtectionOperationsWithError(const std::shared_ptr<platform::Queue>& lockStateQueue,
                                                       QRTErrorRef* error);
  void _startDataProtectionChangeOperation(const QRTDataProtectionChangeOperation::Ref& operation,
                                           Completion withCompletion);

  // Every pending-update file is read, written and deleted on it.
  const std::shared_ptr<platform::Queue>& protectionOperationFileQueue() const { return protectionOperationFileQueue_; }

 private:
  QRTDataProtectionManager();
  // The body of setDataProtectionOnDataContainerForUser; the code of a
  // failure before the change started, or 0 once the change owns the completion.
  uint64_t _setDataProtection(uint32_t userId, const std::optional<std::string>& identifier, uint64_t containerClass,
                              int32_t dataProtectionClass, bool isSecondOrThirdPartyApp, bool retryIfLocked,
                              const std::shared_ptr<platform::Queue>& lockStateQueue, const Completion& completion);
  void _restartPendingOperationAtURL(const QRTURL& file, const std::shared_ptr<platform::Queue>& lockStateQueue);

  std::shared_ptr<platform::Queue> protectionOperationFileQueue_;
};
