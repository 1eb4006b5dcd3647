#include "Daemon/dataprotection/QRTApplicationTerminationAssertion.h"

#include <semaphore.h>

#include <atomic>
#include <cerrno>
#include <cstring>

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
  sem_t semaphore;
  bool made = false;
  std::atomic<bool> failed{false};
  ~Acquisition() {
    if (made) sem_destroy(&semaphore);
  }
};

}  // namespace

std::shared_ptr<QRTApplicationTerminationAssertion> QRTApplicationTerminationAssertion::initWithBundleIdentifier(
    const std::string& identifier, uint8_t reason) {
  auto acquisition = std::make_shared<Acquisition>();
  if (sem_init(&acquisition->semaphore, 0, 0) != 0) {
    QRTLog(kLogError, "Failed to create completion semaphore: %s", strerror(errno));
    return nullptr;
  }
  acquisition->made = true;
  auto assertion = platform::TerminationAssertion::make(
      identifier, platformReason(reason), [acquisition, identifier](const std::optional<std::string>& error) {
        if (error) {
          QRTLog(kLogError, "Failed to acquire termination assertion for %@ : %@", identifier, *error);
          acquisition->failed = true;
        }
        sem_post(&acquisition->semaphore);
      });
  if (!assertion) {
    QRTLog(kLogError, "Failed to get Ravelhold");
    return nullptr;
  }
  while (sem_wait(&acquisition->semaphore) != 0 && errno == EINTR) {}
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
