// In-tree name of <quarterkit/Errors.h>; qk is the old name of the namespace,
// kept for one release.
#pragma once

#include <quarterkit/Errors.h>

namespace qk = quarterkit;
