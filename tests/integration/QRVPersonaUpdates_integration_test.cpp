// The persona list read by the running daemon follows the persona file.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <fstream>

#include "client/QRVClient.h"
#include "integration/QRVRunAs.h"
#include "support/QRVDaemonTest.h"
#include "support/QRVEventually.h"
#include "support/QRVRequests.h"

namespace {

constexpr uid_t kInstallerUID = 2201;

QRVPlist persona(uint64_t id, uint64_t type, const std::string& uniqueString, const std::string& home) {
  return QRVDaemonProcess::persona(id, type, uniqueString, home);
}

class PersonaUpdatesTest : public QRVDaemonTest {
 protected:
  void SetUp() override {
    writePersonas({persona(1000, 0, "PERSONAL", "/private/var/mobile")});
    startDaemon({{kInstallerUID, "com.example.installer", QRVEntitlements({"allowed"})}});
  }

  void writePersonas(QRVPlist::Array personas) { daemon_.writePersonas(std::move(personas)); }

  uint64_t createInPersona(const std::string& uniqueString) {
    QRVPlist request =
        QRVCreateRequest("com.example.work", 2).set("PersonaUniqueString", QRVPlist::string(uniqueString));
    return QRVClient::resultCode(QRVRepliesAs(daemon_, kInstallerUID, {request})[0]);
  }
};

TEST_F(PersonaUpdatesTest, PersonaAddedWhileRunningIsKnownWithoutARestart) {
  std::filesystem::create_directories(daemon_.root() + "/private/var/work");
  EXPECT_EQ(createInPersona("WORK"), 11u);
  const pid_t pid = daemon_.pid();

  writePersonas({persona(1000, 0, "PERSONAL", "/private/var/mobile"), persona(1001, 1, "WORK", "/private/var/work")});
  EXPECT_TRUE(QRVEventually([&] { return createInPersona("WORK") == 1; }, std::chrono::seconds(10)));
  EXPECT_EQ(daemon_.pid(), pid);
  EXPECT_TRUE(daemon_.logEventuallyContains("Received persona list update"));

  // Removed again, it is unknown again.
  writePersonas({persona(1000, 0, "PERSONAL", "/private/var/mobile")});
  EXPECT_TRUE(QRVEventually([&] { return createInPersona("WORK") == 11; }, std::chrono::seconds(10)));
}

}  // namespace
