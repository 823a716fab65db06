#include "client/QRVContainerClient.h"

#include <algorithm>

#include "base/QRVResultCode.h"
#include "client/QRVProtocol.h"

namespace {

using C = QRVCommandNumber;
namespace R = QRVContainerRequests;

QRVPlist uuidValue(const QRVUUIDBytes& uuid) { return QRVPlist::data(QRVPlist::Bytes(uuid.begin(), uuid.end())); }

std::optional<QRVUUIDBytes> uuidFrom(const QRVPlist* value) {
  if (!value || value->type() != QRVPlist::Type::Data || value->dataValue().size() != 16) return std::nullopt;
  QRVUUIDBytes bytes;
  std::copy_n(value->dataValue().begin(), 16, bytes.begin());
  return bytes;
}

std::optional<std::string> stringFrom(const QRVPlist* value) {
  if (!value || !value->isString()) return std::nullopt;
  return value->stringValue();
}

std::optional<bool> boolFrom(const QRVPlist* value) {
  if (!value || value->type() != QRVPlist::Type::Boolean) return std::nullopt;
  return value->boolValue();
}

QRVPlist withCommand(C number) { return R::command(static_cast<uint64_t>(number)); }

// The keys that name one container, as the daemon's identity unpacking
// reads them; `prefix` is "Old"/"New" for the two sides of a replace, whose
// UUID key is spelled differently.
void setContainer(QRVPlist& request, const QRVContainerRef& c, const std::string& prefix = "") {
  request.set(prefix + "Identifier", QRVPlist::string(c.identifier));
  request.set(prefix + "ContainerClass", QRVPlist::uinteger(c.containerClass));
  if (c.persona) request.set(prefix + "PersonaUniqueString", QRVPlist::string(*c.persona));
  if (c.uuid) request.set(prefix.empty() ? "UUID" : prefix + "ContainerUUID", uuidValue(*c.uuid));
}

QRVPlist containerRequest(C number, const QRVContainerRef& c) {
  QRVPlist request = withCommand(number);
  setContainer(request, c);
  return request;
}

void setAssetsOwner(QRVPlist& request, const std::string& identifier, const std::optional<std::string>& persona) {
  request.set("Identifier", QRVPlist::string(identifier));
  if (persona) request.set("PersonaUniqueString", QRVPlist::string(*persona));
}

void setGroupOwner(QRVPlist& request, const QRVGroupOwnerRef& g) {
  if (g.owner) request.set("Identifier", QRVPlist::string(*g.owner));
  request.set("ContainerClass", QRVPlist::uinteger(g.groupClass));
  if (g.persona) request.set("PersonaUniqueString", QRVPlist::string(*g.persona));
}

std::map<std::string, std::string> stringMapFrom(const QRVPlist* value) {
  std::map<std::string, std::string> out;
  if (!value || !value->isDictionary()) return out;
  for (const auto& [key, v] : value->dictionaryValue())
    if (v.isString()) out[key] = v.stringValue();
  return out;
}

}  // namespace

bool QRVContainerResult::ok() const { return code == QRVResultCode::kSuccess; }

QRVContainerResult QRVContainerResult::fromReply(QRVPlist reply) {
  QRVContainerResult r;
  r.code = QRVClient::resultCode(reply);
  r.path = stringFrom(reply.get("ReplyPath"));
  r.uuid = uuidFrom(reply.get("ReplyUUID"));
  r.existed = boolFrom(reply.get("ReplyExisted"));
  r.transient = boolFrom(reply.get("ReplyTransient"));
  r.identifier = stringFrom(reply.get("ReplyIdentifier"));
  r.persona = stringFrom(reply.get("ReplyPersonaUniqueString"));
  r.sandboxToken = stringFrom(reply.get("SandboxToken"));
  if (const QRVPlist* v = reply.get("ReplyDiskUsage"); v && v->type() == QRVPlist::Type::UInteger)
    r.diskUsage = v->uint64Value();
  if (const QRVPlist* v = reply.get("ReplyInfoValue")) r.infoValue = *v;
  if (const QRVPlist* v = reply.get("ReplyInfoDictionary"); v && v->isDictionary()) r.infoDictionary = *v;
  // Entries of the wrong type are dropped rather than shifting the others,
  // so the three arrays stay index-aligned only when the daemon sent them
  // well-formed (it always does).
  for (const QRVPlist& v : reply.arrayForKey("ReplyIdsArray"))
    if (auto s = stringFrom(&v)) r.identifiers.push_back(*s);
  for (const QRVPlist& v : reply.arrayForKey("ReplyUUIDsArray"))
    if (auto u = uuidFrom(&v)) r.uuids.push_back(*u);
  for (const QRVPlist& v : reply.arrayForKey("ReplyPersonaUniqueStringsArray"))
    if (auto s = stringFrom(&v)) r.personas.push_back(*s);
  r.groupPaths = stringMapFrom(reply.get("ReplyGroupContainerDict"));
  r.groupTokens = stringMapFrom(reply.get("SandboxTokenDict"));
  for (const QRVPlist& v : reply.arrayForKey("ReplyGroupIdentifiersArray"))
    if (auto s = stringFrom(&v)) r.groupIdentifiers.push_back(*s);
  r.reply = std::move(reply);
  return r;
}

namespace QRVContainerRequests {

QRVPlist command(uint64_t number) {
  QRVPlist request = QRVPlist::dictionary();
  request.set(std::string(QRVProtocol::kCommandKey), QRVPlist::uinteger(number));
  return request;
}

QRVPlist createOrLookupContainer(const QRVContainerRef& c, bool create, bool transient) {
  QRVPlist request = containerRequest(C::createOrLookupContainer, c);
  request.set("CreateIfNecessary", QRVPlist::boolean(create));
  request.set("Transient", QRVPlist::boolean(transient));
  return request;
}

QRVPlist containersWithClass(uint64_t containerClass, bool transient) {
  QRVPlist request = withCommand(C::containersWithClass);
  request.set("ContainerClass", QRVPlist::uinteger(containerClass));
  request.set("Transient", QRVPlist::boolean(transient));
  return request;
}

QRVPlist replaceContainer(const QRVContainerRef& oldContainer, const QRVContainerRef& newContainer) {
  QRVPlist request = withCommand(C::replaceContainer);
  setContainer(request, oldContainer, "Old");
  setContainer(request, newContainer, "New");
  return request;
}

QRVPlist stageContainersForDelete(const std::vector<QRVDeleteEntry>& entries) {
  QRVPlist request = withCommand(C::stageContainerForDelete);
  QRVPlist ids = QRVPlist::array(), classes = QRVPlist::array(), uuids = QRVPlist::array(),
           personas = QRVPlist::array();
  for (const QRVDeleteEntry& e : entries) {
    ids.append(QRVPlist::string(e.identifier));
    classes.append(QRVPlist::uinteger(e.containerClass));
    uuids.append(uuidValue(e.uuid));
    personas.append(QRVPlist::string(e.persona));
  }
  request.set("IdentifiersArray", std::move(ids));
  request.set("ContainerClassesArray", std::move(classes));
  request.set("UUIDsArray", std::move(uuids));
  request.set("PersonaUniqueStringsArray", std::move(personas));
  return request;
}

QRVPlist deleteContainersOnDeathRow() { return withCommand(C::deleteContainersOnDeathRow); }

QRVPlist setInfoValue(const QRVContainerRef& c, const std::string& key, const QRVPlist& value) {
  QRVPlist request = containerRequest(C::setInfoValue, c);
  request.set("Key", QRVPlist::string(key));
  request.set("Value", value);
  return request;
}

QRVPlist infoValueForKey(const QRVContainerRef& c, const std::string& key) {
  QRVPlist request = containerRequest(C::infoValueForKey, c);
  request.set("Key", QRVPlist::string(key));
  return request;
}

QRVPlist containerMetadata(const QRVContainerRef& c, bool wantInfo) {
  QRVPlist request = containerRequest(C::containerMetadata, c);
  request.set("InfoDictRequested", QRVPlist::boolean(wantInfo));
  return request;
}

QRVPlist recreateDefaultStructure(const QRVContainerRef& c) {
  return containerRequest(C::recreateDefaultStructure, c);
}
QRVPlist regenerateDirectoryUUID(const QRVContainerRef& c) { return containerRequest(C::regenerateDirectoryUUID, c); }

QRVPlist deleteContainer(const QRVContainerRef& c, bool transient) {
  QRVPlist request = containerRequest(C::deleteContainer, c);
  request.set("Transient", QRVPlist::boolean(transient));
  return request;
}

QRVPlist wipeContainerContent(const QRVContainerRef& c) {
  // The daemon forces the plug-in data class for this command; the class
  // sent is ignored.
  return containerRequest(C::wipeContainerContent, c);
}
QRVPlist deleteContainerContent(const QRVContainerRef& c) { return containerRequest(C::deleteContainerContent, c); }
QRVPlist diskUsage(const QRVContainerRef& c) { return containerRequest(C::diskUsage, c); }

QRVPlist setDataProtection(const QRVContainerRef& c, uint64_t protectionClass, bool thirdParty, bool retryIfLocked) {
  QRVContainerRef withoutUUID = c;
  withoutUUID.uuid.reset();
  QRVPlist request = containerRequest(C::setDataProtection, withoutUUID);
  request.set("DataProtectionClass", QRVPlist::uinteger(protectionClass));
  request.set("IsThirdParty", QRVPlist::boolean(thirdParty));
  request.set("RetryIfLocked", QRVPlist::boolean(retryIfLocked));
  return request;
}

QRVPlist retryTest(uint64_t crashes) {
  QRVPlist request = withCommand(C::retryTest);
  request.set("NumRetryCrashes", QRVPlist::uinteger(crashes));
  return request;
}

QRVPlist stageSharedContent(const std::string& identifier, const std::string& sourcePath,
                            const std::string& destPath) {
  QRVPlist request = withCommand(C::stageSharedContent);
  request.set("Identifier", QRVPlist::string(identifier));
  request.set("SourcePath", QRVPlist::string(sourcePath));
  request.set("DestPath", QRVPlist::string(destPath));
  return request;
}

QRVPlist userManagedAssetsPath(const std::string& identifier, const std::optional<std::string>& persona,
                               bool relative, bool create) {
  QRVPlist request = withCommand(C::userManagedAssetsPath);
  setAssetsOwner(request, identifier, persona);
  request.set("IsRelative", QRVPlist::boolean(relative));
  request.set("CreateIfNecessary", QRVPlist::boolean(create));
  return request;
}

QRVPlist deleteUserManagedAsset(const std::string& identifier, const std::optional<std::string>& persona,
                                const std::string& sourcePath) {
  QRVPlist request = withCommand(C::deleteUserManagedAsset);
  setAssetsOwner(request, identifier, persona);
  request.set("SourcePath", QRVPlist::string(sourcePath));
  return request;
}

QRVPlist setTestLock(uint64_t lock, bool enable) {
  QRVPlist request = withCommand(C::setTestLock);
  request.set("TestLock", QRVPlist::uinteger(lock));
  request.set("Enable", QRVPlist::boolean(enable));
  return request;
}

QRVPlist createOrLookupGroupContainers(const QRVGroupOwnerRef& g) {
  QRVPlist request = withCommand(C::createOrLookupGroupContainers);
  setGroupOwner(request, g);
  return request;
}

QRVPlist groupContainerIdentifiersForOwner(const QRVGroupOwnerRef& g) {
  QRVPlist request = withCommand(C::groupContainerIdentifiersForOwner);
  setGroupOwner(request, g);
  return request;
}

QRVPlist lookupSystemContainer(const std::string& identifier) {
  // System containers are class 12, the only class the command accepts.
  QRVContainerRef container;
  container.identifier = identifier;
  container.containerClass = 12;
  return containerRequest(C::lookupSystemContainer, container);
}

QRVPlist groupContainersForOwner(const QRVGroupOwnerRef& g) {
  QRVPlist request = withCommand(C::groupContainersForOwner);
  setGroupOwner(request, g);
  return request;
}

QRVPlist systemGroupContainerPath(const std::string& groupIdentifier) {
  QRVPlist request = withCommand(C::systemGroupContainerPath);
  request.set("GroupIdentifier", QRVPlist::string(groupIdentifier));
  return request;
}

QRVPlist processCodeSigningInfo(const std::string& identifier, const std::optional<QRVPlist>& info,
                                const std::optional<QRVPlist>& options) {
  QRVPlist request = withCommand(C::processCodeSigningInfo);
  request.set("Identifier", QRVPlist::string(identifier));
  if (info) request.set("CodeSigningInfo", *info);
  if (options) request.set("OptionsDictionary", *options);
  return request;
}

QRVPlist codeSigningInfoForIdentifier(const std::string& identifier) {
  QRVPlist request = withCommand(C::codeSigningInfoForIdentifier);
  request.set("Identifier", QRVPlist::string(identifier));
  return request;
}

QRVPlist invalidateCodeSigningInfoForAppsWithoutBundleContainer() {
  return withCommand(C::invalidateCodeSigningInfoForAppsWithoutBundleContainer);
}

QRVPlist performDataMigration() { return withCommand(C::performDataMigration); }

QRVPlist performPerUserDataMigration() { return withCommand(C::performPerUserDataMigration); }

}  // namespace QRVContainerRequests

QRVContainerClient::Result QRVContainerClient::call(const QRVPlist& request, QRVClientError* error) {
  auto reply = client_.sendRequest(request, timeout_, error);
  if (!reply) return std::nullopt;
  return QRVContainerResult::fromReply(std::move(*reply));
}

using Result = QRVContainerClient::Result;
using Ref = QRVContainerRef;
using E = QRVClientError;

Result QRVContainerClient::createOrLookupContainer(const Ref& c, bool create, bool transient, E* e) {
  return call(R::createOrLookupContainer(c, create, transient), e);
}
Result QRVContainerClient::containersWithClass(uint64_t cls, bool transient, E* e) {
  return call(R::containersWithClass(cls, transient), e);
}
Result QRVContainerClient::replaceContainer(const Ref& o, const Ref& n, E* e) {
  return call(R::replaceContainer(o, n), e);
}
Result QRVContainerClient::stageContainersForDelete(const std::vector<QRVDeleteEntry>& entries, E* e) {
  return call(R::stageContainersForDelete(entries), e);
}
Result QRVContainerClient::deleteContainersOnDeathRow(E* e) { return call(R::deleteContainersOnDeathRow(), e); }
Result QRVContainerClient::setInfoValue(const Ref& c, const std::string& key, const QRVPlist& value, E* e) {
  return call(R::setInfoValue(c, key, value), e);
}
Result QRVContainerClient::infoValueForKey(const Ref& c, const std::string& key, E* e) {
  return call(R::infoValueForKey(c, key), e);
}
Result QRVContainerClient::containerMetadata(const Ref& c, bool wantInfo, E* e) {
  return call(R::containerMetadata(c, wantInfo), e);
}
Result QRVContainerClient::recreateDefaultStructure(const Ref& c, E* e) {
  return call(R::recreateDefaultStructure(c), e);
}
Result QRVContainerClient::regenerateDirectoryUUID(const Ref& c, E* e) { return call(R::regenerateDirectoryUUID(c), e); }
Result QRVContainerClient::deleteContainer(const Ref& c, bool transient, E* e) {
  return call(R::deleteContainer(c, transient), e);
}
Result QRVContainerClient::wipeContainerContent(const Ref& c, E* e) { return call(R::wipeContainerContent(c), e); }
Result QRVContainerClient::deleteContainerContent(const Ref& c, E* e) { return call(R::deleteContainerContent(c), e); }
Result QRVContainerClient::diskUsage(const Ref& c, E* e) { return call(R::diskUsage(c), e); }
Result QRVContainerClient::setDataProtection(const Ref& c, uint64_t protectionClass, bool thirdParty,
                                             bool retryIfLocked, E* e) {
  return call(R::setDataProtection(c, protectionClass, thirdParty, retryIfLocked), e);
}
Result QRVContainerClient::retryTest(uint64_t crashes, E* e) { return call(R::retryTest(crashes), e); }
Result QRVContainerClient::stageSharedContent(const std::string& identifier, const std::string& sourcePath,
                                              const std::string& destPath, E* e) {
  return call(R::stageSharedContent(identifier, sourcePath, destPath), e);
}
Result QRVContainerClient::userManagedAssetsPath(const std::string& identifier,
                                                 const std::optional<std::string>& persona, bool relative,
                                                 bool create, E* e) {
  return call(R::userManagedAssetsPath(identifier, persona, relative, create), e);
}
Result QRVContainerClient::deleteUserManagedAsset(const std::string& identifier,
                                                  const std::optional<std::string>& persona,
                                                  const std::string& sourcePath, E* e) {
  return call(R::deleteUserManagedAsset(identifier, persona, sourcePath), e);
}
Result QRVContainerClient::setTestLock(uint64_t lock, bool enable, E* e) { return call(R::setTestLock(lock, enable), e); }
Result QRVContainerClient::createOrLookupGroupContainers(const QRVGroupOwnerRef& g, E* e) {
  return call(R::createOrLookupGroupContainers(g), e);
}
Result QRVContainerClient::groupContainerIdentifiersForOwner(const QRVGroupOwnerRef& g, E* e) {
  return call(R::groupContainerIdentifiersForOwner(g), e);
}
Result QRVContainerClient::lookupSystemContainer(const std::string& identifier, E* e) {
  return call(R::lookupSystemContainer(identifier), e);
}
Result QRVContainerClient::groupContainersForOwner(const QRVGroupOwnerRef& g, E* e) {
  return call(R::groupContainersForOwner(g), e);
}
Result QRVContainerClient::systemGroupContainerPath(const std::string& groupIdentifier, E* e) {
  return call(R::systemGroupContainerPath(groupIdentifier), e);
}
Result QRVContainerClient::processCodeSigningInfo(const std::string& identifier, const std::optional<QRVPlist>& info,
                                                  const std::optional<QRVPlist>& options, E* e) {
  return call(R::processCodeSigningInfo(identifier, info, options), e);
}
Result QRVContainerClient::codeSigningInfoForIdentifier(const std::string& identifier, E* e) {
  return call(R::codeSigningInfoForIdentifier(identifier), e);
}
Result QRVContainerClient::invalidateCodeSigningInfoForAppsWithoutBundleContainer(E* e) {
  return call(R::invalidateCodeSigningInfoForAppsWithoutBundleContainer(), e);
}

Result QRVContainerClient::performDataMigration(E* e) { return call(R::performDataMigration(), e); }

Result QRVContainerClient::performPerUserDataMigration(E* e) { return call(R::performPerUserDataMigration(), e); }
