// The daemon's process-wide objects, built once at start and handed to every
// connection. Tests build their own, on a temporary root and with fakes.
#pragma once

#include <memory>

#include "QRVFileManager.h"
#include "QRVGlobalConfiguration.h"
#include "QRVPlatform.h"
#include "QRVSerialQueue.h"
#include "QRVUserIdentityCache.h"

struct QRVServices {
  QRVPlatform platform;
  std::shared_ptr<QRVFileManager> fileManager;
  std::shared_ptr<QRVGlobalConfiguration> globalConfiguration;
  std::shared_ptr<QRVUserIdentityCache> userIdentityCache;
  // Shared by every client connection for its asynchronous work.
  std::shared_ptr<QRVSerialQueue> backgroundQueue;

  // The services of a daemon on `root` over `platform`.
  static std::shared_ptr<QRVServices> make(const std::string& root, QRVPlatform platform);
};
