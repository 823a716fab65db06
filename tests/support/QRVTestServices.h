// Daemon services on a temporary root with fake platform services.
#pragma once

#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <memory>
#include <string>

#include "core/QRVServices.h"
#include "platform/fake/QRVFakeFileSystemExtras.h"
#include "platform/fake/QRVFakePlatform.h"
#include "platform/fake/QRVFaultInjectionFileSystem.h"
#include "platform/linux/QRVLinuxFileSystem.h"
#include "platform/linux/QRVLinuxFileSystemExtras.h"

class QRVTemporaryDirectory {
 public:
  QRVTemporaryDirectory() {
    std::string pattern = (std::filesystem::temp_directory_path() / "quorvad-test-XXXXXX").string();
    path_ = mkdtemp(pattern.data()) ? pattern : std::string();
  }
  ~QRVTemporaryDirectory() {
    std::error_code ec;
    if (!path_.empty()) std::filesystem::remove_all(path_, ec);
  }
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

// A message service that serves nothing: for tests that drive the daemon's
// objects directly. `onListen`, when set, sees the listener's queue and
// handler, so a test can deliver connections the way the service would.
class QRVNullMessageService : public QRVMessageService {
 public:
  bool listen(const std::string&, std::shared_ptr<QRVSerialQueue> queue, ConnectionHandler handler,
              QRVError*) override {
    if (onListen) onListen(std::move(queue), std::move(handler));
    return true;
  }
  std::function<void(std::shared_ptr<QRVSerialQueue>, ConnectionHandler)> onListen;
  void beginTransaction() override { transactions++; }
  void endTransaction() override { transactions--; }
  bool isIdle() const override { return transactions == 0; }
  std::atomic<int> transactions{0};
};

struct QRVTestServices {
  QRVTemporaryDirectory root;
  std::shared_ptr<QRVNullMessageService> messages = std::make_shared<QRVNullMessageService>();
  std::shared_ptr<QRVFakeTrustStore> trustStore = std::make_shared<QRVFakeTrustStore>();
  std::shared_ptr<QRVFakeSandbox> sandbox = std::make_shared<QRVFakeSandbox>();
  std::shared_ptr<QRVFakeLockStateService> lockState = std::make_shared<QRVFakeLockStateService>();
  std::shared_ptr<QRVFakeNotificationService> notifications = std::make_shared<QRVFakeNotificationService>();
  std::shared_ptr<QRVFakeFirstBootMarker> firstBootMarker = std::make_shared<QRVFakeFirstBootMarker>();
  std::shared_ptr<QRVFakeInstanceLock> instanceLock = std::make_shared<QRVFakeInstanceLock>();
  std::shared_ptr<QRVFakeSystemInfo> systemInfo = std::make_shared<QRVFakeSystemInfo>();
  std::shared_ptr<QRVFakeAccounts> accounts = std::make_shared<QRVFakeAccounts>();
  std::shared_ptr<QRVFakeFeatureFlags> featureFlags = std::make_shared<QRVFakeFeatureFlags>();
  std::shared_ptr<QRVFakePersonaService> personas = std::make_shared<QRVFakePersonaService>();
  std::shared_ptr<QRVFakeApplicationTermination> applicationTermination =
      std::make_shared<QRVFakeApplicationTermination>();
  std::shared_ptr<QRVFakeUpcallTransport> upcall = std::make_shared<QRVFakeUpcallTransport>();
  // The real file system under the fake lock state; classes are kept in memory
  // when the tests cannot write trusted extended attributes (not root).
  std::shared_ptr<QRVFakeFileSystemExtras> fileSystem = std::make_shared<QRVFakeFileSystemExtras>(
      std::make_shared<QRVLinuxFileSystemExtras>(lockState), lockState);
  // The real POSIX calls, wrapped so that single calls can be made to fail;
  // ownership changes are recorded instead of made when not root.
  std::shared_ptr<QRVFaultInjectionFileSystem> posixFileSystem =
      std::make_shared<QRVFaultInjectionFileSystem>(std::make_shared<QRVLinuxFileSystem>());
  std::shared_ptr<QRVServices> services;

  QRVTestServices() {
    QRVPlatform p;
    p.messages = messages;
    p.trustStore = trustStore;
    p.sandbox = sandbox;
    p.lockState = lockState;
    p.notifications = notifications;
    p.firstBootMarker = firstBootMarker;
    p.instanceLock = instanceLock;
    p.systemInfo = systemInfo;
    p.accounts = accounts;
    p.featureFlags = featureFlags;
    p.personas = personas;
    p.posixFileSystem = posixFileSystem;
    p.fileSystem = fileSystem;
    p.applicationTermination = applicationTermination;
    p.upcall = upcall;
    fileSystem->setInMemoryProtectionClasses(geteuid() != 0);
    posixFileSystem->setRecordOwnership(geteuid() != 0);
    accounts->accounts = {{"root", 0, 0, "/private/var/root"},
                          {"installer", 33, 33, "/private/var/installer"},
                          {"mobile", 501, 501, "/private/var/mobile"}};
    accounts->groups = {{"systemusers", 95}};
    // The homes the accounts name, as a prepared root has them.
    std::filesystem::create_directories(root.path() + "/private/var/mobile");
    services = QRVServices::make(root.path(), std::move(p));
  }
};
