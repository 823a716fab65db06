#include "QRVServices.h"

std::shared_ptr<QRVServices> QRVServices::make(const std::string& root, QRVPlatform platform) {
  auto s = std::make_shared<QRVServices>();
  s->platform = std::move(platform);
  s->fileManager = std::make_shared<QRVFileManager>();
  s->globalConfiguration = std::make_shared<QRVGlobalConfiguration>(root, s->platform.systemInfo, s->fileManager);
  s->backgroundQueue = QRVSerialQueue::create("com.kelva.quorvad.background", nullptr,
                                              QRVSerialQueue::Priority::kBackground);
  return s;
}
