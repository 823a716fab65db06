#include "model/QRVContainerClass.h"

const char* QRVContainerClassRelativeDirectory(QRVContainerClass c) {
  static const char* const kDirectories[] = {
      "Undefined",          "Bundle/Application", "Data/Application", "Bundle/SpindlePlugin", "Data/SpindlePlugin",
      "Bundle/VPNPlugin",   "Data/VPNPlugin",     "Shared/AppGroup",  "Bundle/Framework",     "Data/RelayService",
      "Data/InternalDaemon", "Data/TempDir",      "Data/System",      "Shared/SystemGroup",   "MAX",
  };
  return c < sizeof kDirectories / sizeof kDirectories[0] ? kDirectories[c] : nullptr;
}
