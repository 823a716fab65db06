// A typed layer over QRVClient: one call per container command the daemon
// implements. Each call builds the request dictionary with the daemon's key
// names and types (UUIDs as 16 bytes of data), sends it, and returns the
// result code plus the reply fields that command carries.
//
// The request builders are public (QRVContainerRequests) so a tool can print
// or send a request without going through the typed call.
//
// Usage:
//   QRVContainerClient containers(std::move(*client));
//   QRVClientError error;
//   auto r = containers.createOrLookupContainer({.identifier = "com.example.app", .containerClass = 2},
//                                               /*create=*/true, /*transient=*/false, &error);
//   if (r && r->ok()) use(*r->path);
#pragma once

#include <array>
#include <chrono>
#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "base/QRVPlist.h"
#include "client/QRVClient.h"

using QRVUUIDBytes = std::array<uint8_t, 16>;

// Which container a request names. `uuid` is needed by the commands that
// act on one existing container (metadata, info values, disk usage, ...).
struct QRVContainerRef {
  std::string identifier;
  uint64_t containerClass = 0;
  std::optional<std::string> persona;
  std::optional<QRVUUIDBytes> uuid;
};

// A reply, with the fields the daemon may send parsed out. Fields the
// command does not send (or sent with the wrong type) stay empty.
struct QRVContainerResult {
  uint64_t code = 0;
  QRVPlist reply;
  std::optional<std::string> path;
  std::optional<QRVUUIDBytes> uuid;
  std::optional<bool> existed;
  std::optional<bool> transient;
  std::optional<std::string> identifier;
  std::optional<std::string> persona;
  std::optional<std::string> sandboxToken;
  std::optional<uint64_t> diskUsage;
  std::optional<QRVPlist> infoValue;
  std::optional<QRVPlist> infoDictionary;
  // containersWithClass: parallel arrays.
  std::vector<std::string> identifiers;
  std::vector<QRVUUIDBytes> uuids;
  std::vector<std::string> personas;
  // Group commands: group identifier -> path, and -> sandbox token; the
  // group identifiers an owner claims.
  std::map<std::string, std::string> groupPaths;
  std::map<std::string, std::string> groupTokens;
  std::vector<std::string> groupIdentifiers;

  bool ok() const;
  static QRVContainerResult fromReply(QRVPlist reply);
};

// The owner and class of a group request. No owner means the caller's own
// identifier; the class is 7 (application groups) or 13 (system groups).
struct QRVGroupOwnerRef {
  std::optional<std::string> owner;
  uint64_t groupClass = 7;
  std::optional<std::string> persona;
};

// One container of a stage-for-delete request.
struct QRVDeleteEntry {
  std::string identifier;
  uint64_t containerClass = 0;
  QRVUUIDBytes uuid{};
  std::string persona;  // empty for none
};

namespace QRVContainerRequests {
QRVPlist command(uint64_t number);
QRVPlist createOrLookupContainer(const QRVContainerRef& c, bool create, bool transient);
QRVPlist containersWithClass(uint64_t containerClass, bool transient);
QRVPlist replaceContainer(const QRVContainerRef& oldContainer, const QRVContainerRef& newContainer);
QRVPlist stageContainersForDelete(const std::vector<QRVDeleteEntry>& entries);
QRVPlist deleteContainersOnDeathRow();
QRVPlist setInfoValue(const QRVContainerRef& c, const std::string& key, const QRVPlist& value);
QRVPlist infoValueForKey(const QRVContainerRef& c, const std::string& key);
QRVPlist containerMetadata(const QRVContainerRef& c, bool wantInfo);
QRVPlist recreateDefaultStructure(const QRVContainerRef& c);
QRVPlist regenerateDirectoryUUID(const QRVContainerRef& c);
QRVPlist deleteContainer(const QRVContainerRef& c, bool transient);
QRVPlist wipeContainerContent(const QRVContainerRef& c);
QRVPlist deleteContainerContent(const QRVContainerRef& c);
QRVPlist diskUsage(const QRVContainerRef& c);
// The container's UUID, if any, is not sent: the daemon acts on the current
// container of the identity.
QRVPlist setDataProtection(const QRVContainerRef& c, uint64_t protectionClass, bool thirdParty, bool retryIfLocked);
QRVPlist retryTest(uint64_t crashes);
QRVPlist stageSharedContent(const std::string& identifier, const std::string& sourcePath,
                            const std::string& destPath);
QRVPlist userManagedAssetsPath(const std::string& identifier, const std::optional<std::string>& persona,
                               bool relative, bool create);
QRVPlist deleteUserManagedAsset(const std::string& identifier, const std::optional<std::string>& persona,
                                const std::string& sourcePath);
QRVPlist setTestLock(uint64_t lock, bool enable);
QRVPlist createOrLookupGroupContainers(const QRVGroupOwnerRef& g);
QRVPlist groupContainerIdentifiersForOwner(const QRVGroupOwnerRef& g);
QRVPlist lookupSystemContainer(const std::string& identifier);
QRVPlist groupContainersForOwner(const QRVGroupOwnerRef& g);
QRVPlist systemGroupContainerPath(const std::string& groupIdentifier);
// No `info` removes the identifier's information.
QRVPlist processCodeSigningInfo(const std::string& identifier, const std::optional<QRVPlist>& info,
                                const std::optional<QRVPlist>& options);
QRVPlist codeSigningInfoForIdentifier(const std::string& identifier);
QRVPlist invalidateCodeSigningInfoForAppsWithoutBundleContainer();
QRVPlist performDataMigration();
QRVPlist performPerUserDataMigration();
}  // namespace QRVContainerRequests

class QRVContainerClient {
 public:
  using Result = std::optional<QRVContainerResult>;
  explicit QRVContainerClient(QRVClient client,
                              std::chrono::milliseconds timeout = std::chrono::seconds(60))
      : client_(std::move(client)), timeout_(timeout) {}

  QRVClient& connection() { return client_; }

  // Sends any request and parses the reply; nothing (with `error`) when no
  // reply came. A reply with a failure code is still a result: check ok().
  Result call(const QRVPlist& request, QRVClientError* error);

  Result createOrLookupContainer(const QRVContainerRef& c, bool create, bool transient, QRVClientError* e);
  Result containersWithClass(uint64_t containerClass, bool transient, QRVClientError* e);
  Result replaceContainer(const QRVContainerRef& o, const QRVContainerRef& n, QRVClientError* e);
  Result stageContainersForDelete(const std::vector<QRVDeleteEntry>& entries, QRVClientError* e);
  Result deleteContainersOnDeathRow(QRVClientError* e);
  Result setInfoValue(const QRVContainerRef& c, const std::string& key, const QRVPlist& value,
                      QRVClientError* e);
  Result infoValueForKey(const QRVContainerRef& c, const std::string& key, QRVClientError* e);
  Result containerMetadata(const QRVContainerRef& c, bool wantInfo, QRVClientError* e);
  Result recreateDefaultStructure(const QRVContainerRef& c, QRVClientError* e);
  Result regenerateDirectoryUUID(const QRVContainerRef& c, QRVClientError* e);
  Result deleteContainer(const QRVContainerRef& c, bool transient, QRVClientError* e);
  Result wipeContainerContent(const QRVContainerRef& c, QRVClientError* e);
  Result deleteContainerContent(const QRVContainerRef& c, QRVClientError* e);
  Result diskUsage(const QRVContainerRef& c, QRVClientError* e);
  // Answers when the change has ended: with `retryIfLocked` on a locked
  // device, only after the next unlock (mind the timeout).
  Result setDataProtection(const QRVContainerRef& c, uint64_t protectionClass, bool thirdParty, bool retryIfLocked,
                           QRVClientError* e);
  Result retryTest(uint64_t crashes, QRVClientError* e);
  Result stageSharedContent(const std::string& identifier, const std::string& sourcePath,
                            const std::string& destPath, QRVClientError* e);
  Result userManagedAssetsPath(const std::string& identifier, const std::optional<std::string>& persona,
                               bool relative, bool create, QRVClientError* e);
  Result deleteUserManagedAsset(const std::string& identifier, const std::optional<std::string>& persona,
                                const std::string& sourcePath, QRVClientError* e);
  Result setTestLock(uint64_t lock, bool enable, QRVClientError* e);
  // Group and system containers: paths in groupPaths (and tokens in
  // groupTokens for createOrLookupGroupContainers), identifiers in
  // groupIdentifiers, single paths in path.
  Result createOrLookupGroupContainers(const QRVGroupOwnerRef& g, QRVClientError* e);
  Result groupContainerIdentifiersForOwner(const QRVGroupOwnerRef& g, QRVClientError* e);
  Result lookupSystemContainer(const std::string& identifier, QRVClientError* e);
  Result groupContainersForOwner(const QRVGroupOwnerRef& g, QRVClientError* e);
  Result systemGroupContainerPath(const std::string& groupIdentifier, QRVClientError* e);
  // Code-signing information, as the installer hands it over; the stored
  // dictionary comes back in infoDictionary.
  Result processCodeSigningInfo(const std::string& identifier, const std::optional<QRVPlist>& info,
                                const std::optional<QRVPlist>& options, QRVClientError* e);
  Result codeSigningInfoForIdentifier(const std::string& identifier, QRVClientError* e);
  Result invalidateCodeSigningInfoForAppsWithoutBundleContainer(QRVClientError* e);
  // The one-time migrations after an upgrade or a restore: the data
  // migrator's (system container ACLs, bundle ownership, code-signing data)
  // and the per-user ones (default subdirectories, protection classes).
  // Each answers when its work is done.
  Result performDataMigration(QRVClientError* e);
  Result performPerUserDataMigration(QRVClientError* e);

 private:
  QRVClient client_;
  std::chrono::milliseconds timeout_;
};
