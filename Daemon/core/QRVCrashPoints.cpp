#include "core/QRVCrashPoints.h"

#include <unistd.h>

#include <cstdlib>
#include <cstring>

#include "base/QRVLog.h"

void QRVCrashPoint(QRVServices& services, const char* name) {
  static const char* const asked = getenv("QUORVAD_CRASH_AT");
  if (!asked || strcmp(asked, name) != 0 || !services.globalConfiguration->isInternalImage()) return;
  QRVLogError("Stopping dead at crash point {}", name);
  _exit(70);
}
