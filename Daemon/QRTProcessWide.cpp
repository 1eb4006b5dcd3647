#include "Daemon/QRTProcessWide.h"

#include <memory>

#include "platform/Queue.h"

uint32_t gQRTLogFileCount = 1;

platform::Queue& QRTDeathRowQueue() {
  static std::shared_ptr<platform::Queue> queue =
      platform::makeSerialQueue("com.norvane.quarterd.deathrow", platform::QueuePriority::Idle);
  return *queue;
}

const std::shared_ptr<platform::Queue>& QRTLockStateQueue() {
  static const std::shared_ptr<platform::Queue> queue = platform::makeSerialQueue("com.norvane.quarterd.lockstate");
  return queue;
}

void run_async_with_transaction(platform::Queue& queue, platform::Work work) {
  platform::transactionBegin();
  queue.async([work = std::move(work)] {
    work();
    platform::transactionEnd();
  });
}
