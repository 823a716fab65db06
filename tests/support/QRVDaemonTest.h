// The fixture of tests that talk to the real daemon: a daemon process on a
// fresh root that trusts chosen clients, which the tests run under their own
// uids (so the tests need root).
#pragma once

#include <gtest/gtest.h>
#include <unistd.h>

#include <initializer_list>
#include <string>

#include "base/QRVPlist.h"
#include "integration/QRVDaemonProcess.h"
#include "support/QRVRequests.h"

struct QRVTrustedClient {
  uid_t uid;
  std::string signingIdentifier;
  QRVPlist entitlements;
};

class QRVDaemonTest : public testing::Test {
 protected:
  // Trusts `clients` by uid and starts the daemon. Without root the test is
  // skipped instead: call it last in SetUp.
  void startDaemon(std::initializer_list<QRVTrustedClient> clients) {
    if (geteuid() != 0) GTEST_SKIP() << "needs root: clients run under other uids";
    for (const QRVTrustedClient& client : clients)
      daemon_.trustUID(client.uid, client.signingIdentifier, client.entitlements);
    daemon_.start();
  }

  QRVDaemonProcess daemon_;
};
