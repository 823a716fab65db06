// Facts about the installed system: the build variant and version.
#pragma once

#include <string>

#include "base/QRVPlist.h"

class QRVSystemInfo {
 public:
  virtual ~QRVSystemInfo() = default;
  // An internal build enables test commands, larger logs and aborting on
  // exceptions.
  virtual bool isInternalBuild() = 0;
  virtual std::string buildVersion() = 0;
  // The system-version dictionary (every key of the release file).
  virtual QRVPlist systemVersion() = 0;
};
