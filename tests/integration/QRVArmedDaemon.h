// Stopping the real daemon dead at a named crash point, as a power loss
// would, for the tests that check what the next start makes of it.
#pragma once

#include <gtest/gtest.h>
#include <sys/wait.h>

#include <cstdlib>

#include "client/QRVClient.h"
#include "integration/QRVDaemonProcess.h"
#include "integration/QRVRunAs.h"

// Starts the daemon armed to stop dead when it reaches `point`.
inline void QRVStartArmed(QRVDaemonProcess& daemon, const char* point) {
  setenv("QUORVAD_CRASH_AT", point, 1);
  daemon.start();
  unsetenv("QUORVAD_CRASH_AT");
}

// Checks that an armed daemon stopped dead at its point: exit status 70.
// For a point in start-up work, right after QRVStartArmed.
inline void QRVExpectStoppedDead(QRVDaemonProcess& daemon) {
  std::optional<int> status = daemon.waitForExit(std::chrono::seconds(5));
  ASSERT_TRUE(status.has_value()) << "the daemon did not stop";
  EXPECT_TRUE(WIFEXITED(*status) && WEXITSTATUS(*status) == 70) << "wait status " << *status;
}

// Sends `request` from a process of `uid` to an armed daemon and checks that
// it stopped dead: no reply, exit status 70.
inline void QRVExpectStoppedDeadBy(QRVDaemonProcess& daemon, uid_t uid, const QRVPlist& request) {
  QRVPlist reply = QRVRepliesAs(daemon, uid, {request})[0];
  EXPECT_EQ(QRVClient::resultCode(reply), 0u) << "the daemon answered instead of stopping";
  QRVExpectStoppedDead(daemon);
}
