// The UUID is the client library's public type; the daemon calls it by its
// own name.
#pragma once

#include <quarterkit/UUID.h>

using QRTUUID = quarterkit::UUID;
