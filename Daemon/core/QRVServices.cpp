#include "core/QRVServices.h"

#include "codesigning/QRVBuiltInWellKnownNames.h"
#include "codesigning/QRVGroupManager.h"
#include "dataprotection/QRVDataProtectionManager.h"
#include "migration/QRVContainerMigrator.h"

std::shared_ptr<QRVServices> QRVServices::make(const std::string& root, QRVPlatform platform) {
  auto s = std::make_shared<QRVServices>();
  s->platform = std::move(platform);
  s->fileManager = std::make_shared<QRVFileManager>(root, s->platform.posixFileSystem, s->platform.fileSystem, s->platform.accounts,
                                                   s->platform.featureFlags);
  s->globalConfiguration =
      std::make_shared<QRVGlobalConfiguration>(root, s->platform.systemInfo, s->platform.accounts, s->fileManager);
  s->backgroundQueue = QRVSerialQueue::create("com.kelva.quorvad.background", nullptr,
                                              QRVSerialQueue::Priority::kBackground);
  s->deathRowQueue = QRVSerialQueue::create("com.kelva.quorvad.deathrow", nullptr,
                                            QRVSerialQueue::Priority::kBackground);
  s->lockStateQueue = QRVSerialQueue::create("com.kelva.quorvad.lockstate");
  s->testLocks = std::make_shared<QRVTestLocks>();

  QRVUserIdentityCache::Options cacheOptions;
  cacheOptions.mobileUID = s->globalConfiguration->currentMobileUserId();
  cacheOptions.mobileGID = s->globalConfiguration->currentMobileGroupId();
  // The services outlive the cache they own; a raw pointer avoids a cycle.
  QRVServices* self = s.get();
  cacheOptions.homeDirectoryForUID = [self](uid_t uid) { return self->fileManager->homeDirectoryURLForPOSIXUID(uid); };
  cacheOptions.pathUnderRoot = [self](const std::string& path) {
    return self->globalConfiguration->pathUnderRoot(path);
  };
  s->userIdentityCache = std::make_shared<QRVUserIdentityCache>(s->platform.personas, std::move(cacheOptions));
  // Before the container cache, which asks the mapping for plug-in parents.
  // The mapping holds the services weakly: they own it.
  s->codeSigningMapping = std::make_shared<QRVCodeSigningMapping>(std::weak_ptr<QRVServices>(s));
  s->codeSigning = s->codeSigningMapping;
  s->systemGroups = s->codeSigningMapping;
  s->pluginParents = s->codeSigningMapping;
  s->dataProtectionManager = std::make_shared<QRVDataProtectionManager>(std::weak_ptr<QRVServices>(s));
  s->dataProtection = s->dataProtectionManager;
  s->wellKnownNames = std::make_shared<QRVBuiltInWellKnownNames>(s->globalConfiguration);
  s->containerCache = std::make_shared<QRVContainerCache>(s->fileManager, s->globalConfiguration, s->userIdentityCache,
                                                          s->platform.sandbox, s->pluginParents, s->wellKnownNames);
  s->groupManager = std::make_shared<QRVGroupManager>(s);
  s->containerMigrator = std::make_shared<QRVContainerMigrator>(std::weak_ptr<QRVServices>(s));
  return s;
}

void QRVServices::asyncWithKeepAlive(const std::shared_ptr<QRVSerialQueue>& queue, std::function<void()> job) {
  std::shared_ptr<QRVMessageService> messages = platform.messages;
  messages->beginTransaction();
  queue->async([messages, job = std::move(job)] {
    job();
    messages->endTransaction();
  });
}
