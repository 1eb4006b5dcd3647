// In-tree name of <quarterkit/Connection.h>; qk is the old name of the namespace,
// kept for one release.
#pragma once

#include <quarterkit/Connection.h>

namespace qk = quarterkit;
