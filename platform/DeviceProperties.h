// Device properties and the system version record, read from files under the
// device root each time they are asked for.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "base/PlistValue.h"

namespace platform {

// R/etc/device-properties.plist; a missing file or key gives the default.
bool deviceIsInternalBuild();
uint64_t deviceMultiUserFlags();
bool deviceRefusesTerminationAssertions();

// R/etc/system-version.plist; nothing when it cannot be read.
std::optional<plist::Dictionary> systemVersionRecord();

}  // namespace platform
