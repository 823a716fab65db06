#include <malloc.h>
#include <sys/resource.h>

#include "platform/QRVPlatform.h"
#include "platform/linux/QRVLinuxAccounts.h"
#include "platform/linux/QRVLinuxApplicationTermination.h"
#include "platform/linux/QRVLinuxFeatureFlags.h"
#include "platform/linux/QRVLinuxFileSystem.h"
#include "platform/linux/QRVLinuxFileSystemExtras.h"
#include "platform/linux/QRVLinuxFirstBootMarker.h"
#include "platform/linux/QRVLinuxInstanceLock.h"
#include "platform/linux/QRVLinuxLockStateService.h"
#include "platform/linux/QRVLinuxMessageService.h"
#include "platform/linux/QRVLinuxNotificationService.h"
#include "platform/linux/QRVLinuxPersonaService.h"
#include "platform/linux/QRVLinuxSandbox.h"
#include "platform/linux/QRVLinuxSystemInfo.h"
#include "platform/linux/QRVLinuxTrustStore.h"
#include "platform/linux/QRVLinuxUpcallTransport.h"

QRVPlatform QRVPlatform::makeLinux(const std::string& root, const LinuxOptions& linuxOptions) {
  // Requests may carry multi-megabyte strings. By default the allocator
  // raises its mmap threshold to the size of the largest block freed so far
  // (and its trim threshold to twice that), after which such blocks come
  // from the per-thread arenas, whose tops are kept however much lies free:
  // a single burst of large requests left the daemon at over 60 MB for good.
  // Fixed thresholds keep large blocks in their own mappings, which go back
  // to the system when freed.
  mallopt(M_MMAP_THRESHOLD, 256 * 1024);
  mallopt(M_TRIM_THRESHOLD, 1024 * 1024);

  // Each open connection holds four descriptors (the socket, a pidfd and two
  // into the peer's /proc directory), the upcall server and the walks more:
  // the customary soft limit of 1024 (kept low for select(), which the
  // daemon never uses) would run out near the connection bound. The hard
  // limit is the administrator's.
  rlimit files{};
  if (getrlimit(RLIMIT_NOFILE, &files) == 0 && files.rlim_cur < files.rlim_max) {
    files.rlim_cur = files.rlim_max;
    setrlimit(RLIMIT_NOFILE, &files);
  }

  std::string r = root;
  while (r.size() > 1 && r.back() == '/') r.pop_back();
  auto under = [&](const std::string& path) { return r == "/" ? path : r + path; };

  QRVPlatform p;
  p.instanceLock = std::make_shared<QRVLinuxInstanceLock>(under("/run/quorvad/quorvad.lock"));
  QRVLinuxMessageService::Options options;
  options.socketPath = under("/run/quorvad/com.kelva.quorvad");
  options.writeStallTimeout = linuxOptions.writeStallTimeout;
  options.readStallTimeout = linuxOptions.readStallTimeout;
  options.maxConnections = linuxOptions.maxConnections;
  p.messages = std::make_shared<QRVLinuxMessageService>(options);
  p.trustStore = std::make_shared<QRVLinuxTrustStore>(under("/etc/quorva/clients.d"));
  QRVLinuxSandbox::Options sandboxOptions;
  sandboxOptions.keyPath = under("/run/quorva/extension.key");
  sandboxOptions.registryPath = under("/run/quorva/sandbox.plist");
  p.sandbox = std::make_shared<QRVLinuxSandbox>(sandboxOptions);
  p.lockState = std::make_shared<QRVLinuxLockStateService>(under("/run/quorva/lockstate"));
  p.notifications = std::make_shared<QRVLinuxNotificationService>(under("/run/quorva/notify"));
  p.personas = std::make_shared<QRVLinuxPersonaService>(under("/etc/quorva/personas.plist"),
                                                        under("/etc/quorva/host.plist"));
  p.firstBootMarker = std::make_shared<QRVLinuxFirstBootMarker>(r);
  p.systemInfo = std::make_shared<QRVLinuxSystemInfo>(under("/etc/os-release"));
  p.accounts = std::make_shared<QRVLinuxAccounts>(under("/etc/passwd"), under("/etc/group"));
  p.featureFlags = std::make_shared<QRVLinuxFeatureFlags>(under("/etc/quorva/features.plist"));
  p.posixFileSystem = std::make_shared<QRVLinuxFileSystem>();
  p.fileSystem = std::make_shared<QRVLinuxFileSystemExtras>(p.lockState);
  p.applicationTermination = std::make_shared<QRVLinuxApplicationTermination>(under(linuxOptions.applicationSlice));
  // Launchers reach the upcall socket through the group "quorva-launch" when
  // the root's group file has it; otherwise only root does.
  QRVLinuxUpcallTransport::Options upcallOptions;
  upcallOptions.socketPath = under("/run/quorvad/com.kelva.quorvad.upcall");
  upcallOptions.group = p.accounts->groupIDForName("quorva-launch");
  p.upcall = std::make_shared<QRVLinuxUpcallTransport>(upcallOptions);
  return p;
}
