// The process-wide queues and settings: the floor that every subsystem may
// stand on. Nothing here calls up into a subsystem or into start-up.
#pragma once

#include <cstdint>
#include <memory>

#include "platform/Queue.h"

// Serial, idle priority for the processor and the disk: destruction of
// death-row items, which yields to every request. Made on first use.
platform::Queue& QRTDeathRowQueue();
// Serial, suspended while the device is locked: protection changes. Start-up
// drives it and hands it to the data-protection manager's calls.
const std::shared_ptr<platform::Queue>& QRTLockStateQueue();
// The log file count (1, or 4 on an internal build).
extern uint32_t gQRTLogFileCount;

// Runs work on queue inside a keep-alive transaction.
void run_async_with_transaction(platform::Queue& queue, platform::Work work);
