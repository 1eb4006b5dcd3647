// The first-boot marker: R/run/quarterd.fb_check holding the current boot id.
#pragma once

#include <string>

namespace platform {

// True when the file exists and holds the current boot id.
bool firstBootMarkerExists();
// Creates the marker (mode 0400). On failure returns false with errno set.
bool createFirstBootMarker();
std::string firstBootMarkerPath();

}  // namespace platform
