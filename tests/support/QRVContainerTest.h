// The fixture of tests that drive container operations directly: daemon
// services on a temporary root, callers with chosen powers, identities of the
// mobile user and containers made as the installer makes them.
#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <memory>
#include <optional>
#include <string>

#include "model/QRVContainerCache.h"
#include "operations/QRVClientConnection.h"
#include "support/QRVFiles.h"
#include "support/QRVTestServices.h"

// What a test caller may do, as the dispatcher would have worked it out from
// its entitlements.
struct QRVTestCallerPowers {
  bool entitled = true;
  bool allowOtherIdLookup = false;
  bool unrestricted = false;
  bool groups = false;
  std::optional<QRVPlist> lookup = std::nullopt;
  std::optional<QRVPlist::Array> wipe = std::nullopt;
};

// A well-known system container named "com.example.wellknown".
class QRVTestKnowsOneName : public QRVNoWellKnownNames {
 public:
  std::optional<std::string> wellknownSystemContainerForId(const std::string& id) override {
    return systemContainerIdIsWellknown(id) ? std::optional<std::string>(id) : std::nullopt;
  }
  bool systemContainerIdIsWellknown(const std::string& id) override { return id == "com.example.wellknown"; }
};

class QRVContainerTest : public testing::Test {
 protected:
  // The status of `path` (links followed) as the daemon sees it: without
  // root, the owners it gave are recorded by the file-system wrapper rather
  // than made, and only the wrapper reports them.
  int statThroughSeam(const std::string& path, struct stat* st) {
    return env_.posixFileSystem->status(AT_FDCWD, path, st, 0);
  }

  // The protection class of `path` (never followed), as the daemon reads it.
  uint32_t classOf(const std::string& path) {
    int fd = open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
    EXPECT_GE(fd, 0) << path;
    uint32_t c = 99;
    EXPECT_EQ(env_.fileSystem->protectionClass(fd, &c), 0) << path;
    close(fd);
    return c;
  }
  void setClass(const std::string& path, uint32_t c) {
    int fd = open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
    ASSERT_GE(fd, 0) << path;
    ASSERT_EQ(env_.fileSystem->setProtectionClass(fd, c), 0) << path;
    close(fd);
  }
  // A small file at `path` (directories made as needed), of class `c` unless
  // that is 0.
  void file(const std::string& path, uint32_t c = 0) {
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    QRVWriteText(path, "data");
    if (c) setClass(path, c);
  }

  QRVUserIdentityRef mobile() {
    return env_.services->userIdentityCache->userIdentityForPersonalPersonaWithUID(501, 501);
  }
  // A connection of `caller` (pid 42, running as the mobile user).
  std::shared_ptr<QRVClientConnection> connectionFor(const std::string& caller, QRVTestCallerPowers p = {}) {
    auto identity = std::make_shared<const QRVClientIdentity>(caller, 501, 501, 42, mobile(), QRVPlist::dictionary(),
                                                              false, QRVAuditToken::make(501, 501, 42, 1));
    auto c = std::make_shared<QRVClientConnection>(identity, p.entitled, p.allowOtherIdLookup, p.unrestricted, p.lookup,
                                                   p.wipe, std::make_shared<QRVCommandQueue>(), env_.services);
    c->setAllowGroupIdLookup(p.groups);
    return c;
  }
  // The installer: may do anything to any container.
  std::shared_ptr<QRVClientConnection> admin() {
    return connectionFor("com.example.installer", {.allowOtherIdLookup = true, .unrestricted = true});
  }

  // The identity of `id` in class `c`, of `user` or else of the mobile user
  // where the class belongs to a user and of the default user otherwise.
  QRVContainerIdentityRef identity(const std::string& id, QRVContainerClass c = QRVContainerClassAppData,
                                   QRVUserIdentityRef user = nullptr) {
    QRVError error;
    if (!user)
      user = QRVUserIdentity::isUserIdentityRequiredForContainerClass(c)
                 ? mobile()
                 : env_.services->userIdentityCache->defaultUserIdentity();
    return QRVContainerIdentity::containerIdentityWithUserIdentity(user, id, c, &error);
  }
  QRVMetadataRef create(const QRVContainerIdentityRef& id, bool transient = false) {
    QRVError error;
    auto m = admin()->createOrLookupContainerWithContainerIdentity(id, /*createIfNecessary=*/true, transient,
                                                                   /*useLocking=*/true, &error);
    EXPECT_NE(m, nullptr) << error.description();
    return m;
  }
  QRVMetadataRef lookup(const QRVContainerIdentityRef& id, QRVError* error) {
    return admin()->createOrLookupContainerWithContainerIdentity(id, /*createIfNecessary=*/false,
                                                                 /*transient=*/false, /*useLocking=*/true, error);
  }
  // Whether the cache holds the container (without reading the disk).
  bool known(const QRVMetadataRef& m) {
    return env_.services->containerCache->containerForContainerIdentity(*m->containerIdentity(), m->transient(),
                                                                        /*updateSandbox=*/false, nullptr) != nullptr;
  }
  // Forgets everything in memory, so that what follows sees only the disk.
  void freshCache() {
    env_.services->containerCache = std::make_shared<QRVContainerCache>(
        env_.services->fileManager, env_.services->globalConfiguration, env_.services->userIdentityCache,
        env_.services->platform.sandbox, nullptr, env_.services->wellKnownNames);
  }

  QRVTestServices env_;
};
