// The daemon's process-wide objects, built once at start and handed to every
// connection. Tests build their own, on a temporary root and with fakes.
#pragma once

#include <functional>
#include <memory>

#include "base/QRVSerialQueue.h"
#include "codesigning/QRVCodeSigningMapping.h"
#include "core/QRVTestLocks.h"
#include "fs/QRVFileManager.h"
#include "model/QRVContainerCache.h"
#include "model/QRVContainerCacheSeams.h"
#include "model/QRVGlobalConfiguration.h"
#include "operations/QRVContainerOperationSeams.h"
#include "platform/QRVPlatform.h"
#include "users/QRVUserIdentityCache.h"

class QRVContainerMigrator;
class QRVDataProtectionManager;
class QRVGroupManager;

struct QRVServices {
  QRVPlatform platform;
  std::shared_ptr<QRVFileManager> fileManager;
  std::shared_ptr<QRVGlobalConfiguration> globalConfiguration;
  std::shared_ptr<QRVUserIdentityCache> userIdentityCache;
  // The index of the containers on disk.
  std::shared_ptr<QRVContainerCache> containerCache;
  // Shared by every client connection for its asynchronous work.
  std::shared_ptr<QRVSerialQueue> backgroundQueue;
  // Empties death row, at background priority.
  std::shared_ptr<QRVSerialQueue> deathRowQueue;
  // Carries data-protection work; suspended while the device is locked.
  std::shared_ptr<QRVSerialQueue> lockStateQueue;
  // Held and blocking points driven by the testability command.
  std::shared_ptr<QRVTestLocks> testLocks;
  // The entitlements of installed and registered identifiers; it also
  // answers the code-signing, system-group and plug-in-parent seams below.
  std::shared_ptr<QRVCodeSigningMapping> codeSigningMapping;

  // The questions the container operations ask of other components. make()
  // connects the real ones; tests may install their own.
  std::shared_ptr<QRVCodeSigningQueries> codeSigning;
  std::shared_ptr<QRVDataProtectionQueries> dataProtection;
  std::shared_ptr<QRVWellKnownNames> wellKnownNames;
  std::shared_ptr<QRVPluginParentResolver> pluginParents;
  // Which system group containers an identifier may stage shared content into.
  std::shared_ptr<QRVSystemGroupQueries> systemGroups;
  // Group containers: which an owner claims, and the sweep of unclaimed ones.
  std::shared_ptr<QRVGroupManager> groupManager;
  // Changes of data containers' protection classes; it also answers the
  // data-protection seam above.
  std::shared_ptr<QRVDataProtectionManager> dataProtectionManager;
  // The one-time migrations of an older on-disk layout.
  std::shared_ptr<QRVContainerMigrator> containerMigrator;

  // Runs `job` on `queue` inside a keep-alive transaction, so the daemon is
  // not considered idle until it has finished.
  void asyncWithKeepAlive(const std::shared_ptr<QRVSerialQueue>& queue, std::function<void()> job);

  // The services of a daemon on `root` over `platform`.
  static std::shared_ptr<QRVServices> make(const std::string& root, QRVPlatform platform);
};
