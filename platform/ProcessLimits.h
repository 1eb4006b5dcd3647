// The process's resource limits and the allocator's settings.
#pragma once

#include <cstddef>
#include <cstdint>

namespace platform {

// What raising the descriptor limit did.
struct DescriptorLimit {
  int error = 0;            // 0, or the errno of the call that failed
  bool readFailed = false;  // the limit could not even be read
  uint64_t hardLimit = 0;   // the limit asked for when it was read
};

// Raises the soft limit on open descriptors to the hard limit, when lower.
DescriptorLimit raiseDescriptorLimit();

// Serves allocations of at least bytes from mappings of their own, so that
// freeing them gives the memory back to the system at once. False when the
// allocator refuses the setting (sanitizer allocators do).
bool returnLargeAllocationsToSystem(size_t bytes);

// The calling thread yields to every other: the idle scheduling policy
// (SCHED_IDLE) for the processor and the idle I/O class for the disk, so that
// background work runs only when nothing else wants either. Threads it starts
// inherit both. The errno of the first refusal, or 0.
int makeThisThreadIdle();
// Forgets the calling thread, made idle before, as it ends.
void forgetThisIdleThread();
// Every idle thread back to the normal policy and I/O class, and no more
// made idle: at termination, background work still running must finish in
// time, not wait for a machine that is never idle.
void endIdlePriority();

}  // namespace platform
