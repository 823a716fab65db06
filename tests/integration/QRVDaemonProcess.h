// Runs the real quorvad binary on a temporary root, for integration tests.
//
// The root is prepared as a development root (accounts, os-release, lock
// state) with a trust store written by the test. Clients reach the daemon
// from other processes, usually under other uids (see QRVRunAs.h).
#pragma once

#include <sys/types.h>

#include <chrono>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "base/QRVPlist.h"

class QRVDaemonProcess {
 public:
  // Makes a fresh root (world-searchable, so clients of any uid can reach
  // the socket). The daemon is not started yet.
  QRVDaemonProcess();
  // Stops the daemon, forgets the root's first-boot marker, removes the root.
  ~QRVDaemonProcess();

  const std::string& root() const { return root_; }
  std::string socketPath() const { return root_ + "/run/quorvad/com.kelva.quorvad"; }
  std::string logPath() const { return root_ + "/private/var/root/Library/Logs/Quorva/quorvad.log"; }

  // A trust-store entry matching processes of `uid`.
  void trustUID(uid_t uid, const std::string& signingIdentifier, const QRVPlist& entitlements);
  // A trust-store entry as given, stored as `name`.plist.
  void trustEntry(const std::string& name, const QRVPlist& entry);

  // An entry of the persona list: a persona of uid 501 whose home, under
  // the root, is `home`. Type 0 is the personal persona.
  static QRVPlist persona(uint64_t personaID, uint64_t type, const std::string& uniqueString, const std::string& home);
  // Replaces the root's persona list as a writer of it would: a new file
  // renamed over it, so a running daemon never reads half of one.
  void writePersonas(QRVPlist::Array personas);

  // Starts the daemon with `extraArguments` and waits until it answers on its
  // socket, or until it died in start-up (then waitForExit gives its status).
  // Returns the time that took.
  std::chrono::milliseconds start(const std::vector<std::string>& extraArguments = {});
  // Stops it (SIGTERM, then SIGKILL) and reaps it.
  void stop();
  // Waits for the daemon to exit by itself; returns its wait status.
  std::optional<int> waitForExit(std::chrono::milliseconds timeout);
  bool isRunning();
  pid_t pid() const { return pid_; }
  // Stops the daemon and forgets the root's first-boot marker, as a device
  // reboot would: the next start does the once-per-boot work again.
  void simulateReboot();
  // Whether the daemon recorded this boot's once-per-boot work as done.
  bool bootWorkRecorded() const;

  std::string readLog() const;
  // Waits until the log contains `text`.
  bool logEventuallyContains(const std::string& text, std::chrono::milliseconds timeout = std::chrono::seconds(5));

 private:
  std::string root_;
  pid_t pid_ = -1;
  // The wait status of a daemon that start() saw die, for waitForExit.
  std::optional<int> exitStatus_;
};
