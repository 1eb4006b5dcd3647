// In-tree name of <quarterkit/Requests.h>; qk is the old name of the namespace,
// kept for one release.
#pragma once

#include <quarterkit/Requests.h>

namespace qk = quarterkit;
