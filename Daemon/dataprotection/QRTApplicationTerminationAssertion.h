// Keeps an application from running while it is held: the protection change
// that waited for an unlock holds one so that the application does not use
// its files while their classes change.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <string>

#include "platform/TerminationAssertion.h"

class QRTApplicationTerminationAssertion {
 public:
  enum Reason : uint8_t { ReasonInstallation = 0, ReasonCacheDeletion = 1, ReasonCritical = 255 };

  // Blocks until the platform grants or refuses; nothing when the assertion
  // could not be made or was refused.
  static std::shared_ptr<QRTApplicationTerminationAssertion> initWithBundleIdentifier(const std::string& identifier,
                                                                                      uint8_t reason);
  ~QRTApplicationTerminationAssertion();
  QRTApplicationTerminationAssertion(const QRTApplicationTerminationAssertion&) = delete;
  QRTApplicationTerminationAssertion& operator=(const QRTApplicationTerminationAssertion&) = delete;

  // Gives the assertion up; the application may run again. Twice is harmless.
  void invalidate();

 private:
  explicit QRTApplicationTerminationAssertion(std::unique_ptr<platform::TerminationAssertion> assertion)
      : termAssertion_(std::move(assertion)) {}

  std::mutex lock_;
  std::unique_ptr<platform::TerminationAssertion> termAssertion_;
};
