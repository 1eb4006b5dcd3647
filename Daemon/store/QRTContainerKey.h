// Names one container, and how a look-up of it behaves, without positional
// booleans.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

// Names one container: its user, class, identifier and whether it is the
// transient one.
struct QRTContainerKey {
  uint32_t userId = 0;
  uint64_t containerClass = 0;
  std::optional<std::string> identifier;
  bool transient = false;
};
// Whether a look-up makes the container when it is missing.
enum class QRTCreateMode : bool { LookupOnly, CreateIfMissing };
// Whether the call takes the identifier locks itself, or runs where the
// caller already holds them.
enum class QRTLocking : bool { CallerHoldsLocks, TakeLocks };
