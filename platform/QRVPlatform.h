// The platform services a daemon runs on, handed to it at construction. Only
// main() builds the real ones; tests mix real and fake services.
#pragma once

#include <chrono>
#include <memory>
#include <string>

#include "platform/QRVAccounts.h"
#include "platform/QRVApplicationTermination.h"
#include "platform/QRVFeatureFlags.h"
#include "platform/QRVFileSystem.h"
#include "platform/QRVFileSystemExtras.h"
#include "platform/QRVFirstBootMarker.h"
#include "platform/QRVInstanceLock.h"
#include "platform/QRVLockStateService.h"
#include "platform/QRVMessageService.h"
#include "platform/QRVNotificationService.h"
#include "platform/QRVPersonaService.h"
#include "platform/QRVSandbox.h"
#include "platform/QRVSystemInfo.h"
#include "platform/QRVTrustStore.h"
#include "platform/QRVUpcallTransport.h"

struct QRVPlatform {
  // Claimed before anything else: one daemon per root.
  std::shared_ptr<QRVInstanceLock> instanceLock;
  std::shared_ptr<QRVMessageService> messages;
  std::shared_ptr<QRVTrustStore> trustStore;
  std::shared_ptr<QRVSandbox> sandbox;
  std::shared_ptr<QRVLockStateService> lockState;
  std::shared_ptr<QRVNotificationService> notifications;
  std::shared_ptr<QRVPersonaService> personas;
  std::shared_ptr<QRVFirstBootMarker> firstBootMarker;
  std::shared_ptr<QRVSystemInfo> systemInfo;
  std::shared_ptr<QRVAccounts> accounts;
  std::shared_ptr<QRVFeatureFlags> featureFlags;
  // The file manager's two seams: the POSIX calls, and what lies beyond them.
  std::shared_ptr<QRVFileSystem> posixFileSystem;
  std::shared_ptr<QRVFileSystemExtras> fileSystem;
  std::shared_ptr<QRVApplicationTermination> applicationTermination;
  // Where sandbox launchers ask for a process's container paths.
  std::shared_ptr<QRVUpcallTransport> upcall;

  struct LinuxOptions {
    // How long a client may leave its replies unread before it is cut off.
    std::chrono::milliseconds writeStallTimeout{30'000};
    // How long a client may take to finish a frame it has begun.
    std::chrono::milliseconds readStallTimeout{30'000};
    // Open client connections beyond which new ones are refused.
    size_t maxConnections = 256;
    // The slice under which applications run, one "app-<identifier>.scope"
    // each; an absolute path, taken under the daemon's root.
    std::string applicationSlice = "/sys/fs/cgroup/quorva-apps.slice";
  };
  // The Linux services for a daemon whose paths all lie under `root`.
  static QRVPlatform makeLinux(const std::string& root, const LinuxOptions& options);
};
