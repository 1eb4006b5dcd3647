#include "Daemon/store/QRTContentClass.h"

const char* QRTContentClassPathName(uint64_t containerClass) {
  static const char* const kNames[] = {
      "Undefined",           "Bundle/Application", "Data/Application", "Bundle/AddonPlugin", "Data/AddonPlugin",
      "Bundle/VPNPlugin",    "Data/VPNPlugin",     "Shared/AppGroup",  "Bundle/Framework",   "Data/RelayService",
      "Data/InternalDaemon", "Data/TempDir",       "Data/System",      "Shared/SystemGroup",
  };
  return containerClass < sizeof kNames / sizeof kNames[0] ? kNames[containerClass] : kNames[0];
}
