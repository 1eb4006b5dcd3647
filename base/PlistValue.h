// The property-list value is the client library's public type; the daemon
// calls it by its short name.
#pragma once

#include <quarterkit/PlistValue.h>

namespace plist = quarterkit::plist;
