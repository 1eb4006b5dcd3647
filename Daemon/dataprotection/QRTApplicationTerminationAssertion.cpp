#include "Daemon/dataprotection/QRTApplicationTerminationAssertion.h"

#include <atomic>
#include <semaphore>

#include "platform/Log.h"

using platform::kLogError;

namespace {

// The platform's reason values are the codes themselves; anything else is
// taken as the installation reason, the only one the daemon uses.
uint8_t platformReason(uint8_t reason) {
  switch (reason) {
    case QRTApplicationTerminationAssertion::ReasonInstallation:
    case QRTApplicationTerminationAssertion::ReasonCacheDeletion:
    case QRTApplicationTerminationAssertion::ReasonCritical: return reason;
    default: return QRTApplicationTerminationAssertion::ReasonInstallation;
  }
}

// The semaphore and the outcome outlive this call when the callback comes late.
struct Acquisition {
  std::binary_semaphore done{0};
  std::atomic<bool> failed{false};
};

}  // namespace

std::shared_ptr<QRTApplicationTerminationAssertion> QRTApplicationTerminationAssertion::initWithBundleIdentifier(
    const std::string& identifier, uint8_t reason) {
  auto acquisition = std::make_shared<Acquisition>();
  auto assertion = platform::TerminationAssertion::make(
      identifier, platformReason(reason), [acquisition, identifier](const std::optional<std::string>& error) {
        if (error) {
          QRTLog(kLogError, "Failed to acquire termination assertion for %@ : %@", identifier, *error);
          acquisition->failed = true;
        }
        acquisition->done.release();
      });
  if (!assertion) {
    QRTLog(kLogError, "Failed to get Ravelhold");
    return nullptr;
  }
  acquisition->done.acquire();
  if (acquisition->failed) {
    assertion->invalidate();
    return nullptr;
  }
  return std::shared_ptr<QRTApplicationTerminationAssertion>(
      new QRTApplicationTerminationAssertion(std::move(assertion)));
}

QRTApplicationTerminationAssertion::~QRTApplicationTerminationAssertion() { invalidate(); }

void QRTApplicationTerminationAssertion::invalidate() {
  std::lock_guard<std::mutex> hold(lock_);
  if (!termAssertion_) return;
  termAssertion_->invalidate();
  termAssertion_.reset();
}
