#include "upcall/QRVProcessContainers.h"

#include "base/QRVLog.h"
#include "base/QRVUpcallMessage.h"
#include "core/QRVClientIdentity.h"
#include "model/QRVContainerIdentity.h"
#include "operations/QRVClientConnection.h"
#include "packbuff/packbuff.h"

namespace M = QRVUpcallMessage;

namespace {

// Releases a packed-buffer handle on every path.
struct PackbuffDeleter {
  void operator()(sb_packbuff* pb) const { sb_packbuff_free(pb); }
};
using Packbuff = std::unique_ptr<sb_packbuff, PackbuffDeleter>;

const char* requestItemName(uint16_t valueType) {
  switch (valueType) {
    case M::kRequestCodeSignatureID:
      return "QV_KERN_REQUEST_CODE_SIGNATURE_ID";
    case M::kRequestContainerID:
    case M::kRequestSystemContainerID:
      return "QV_KERN_REQUEST_CONTAINER_ID";
    case M::kRequestApplicationID:
      return "QV_KERN_REQUEST_APPLICATION_ID";
    case M::kRequestAppGroupID:
      return "QV_KERN_REQUEST_APP_GROUP_ID";
    case M::kRequestSystemGroupContainerID:
      return "QV_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID";
    default:
      return "?";
  }
}

std::string describe(const std::map<std::string, std::string>& paths) {
  std::string out = "{";
  for (const auto& [identifier, path] : paths) out += fmt::format(" {} = {};", identifier, path);
  return out + (paths.empty() ? "}" : " }");
}

}  // namespace

int32_t QRVProcessContainers::replyForRequest(const uint8_t* bytes, size_t length, std::vector<uint8_t>* reply) {
  Request request;
  if (int32_t status = _unpackRequest(bytes, length, &request); status != 0) return status;

  Packbuff replyBuffer(sb_packbuff_new(4096));
  if (!replyBuffer) return M::kStatusNoReplyBuffer;

  std::optional<std::string> dataIdentifier = request.containerID ? request.containerID : request.codeSigningID;
  QRVUserIdentityRef userIdentity;
  if (dataIdentifier) {
    int32_t status = 0;
    userIdentity = _userIdentityForRequest(request, &status);
    if (!userIdentity) return status;
  }

  // The daemon acting for that user, with every lookup open to it: the
  // kernel asks on the process's behalf, not as the process.
  auto connection = std::make_shared<QRVClientConnection>(
      QRVClientIdentity::privilegedClientIdentityWithUserIdentity(
          userIdentity ? userIdentity : services_->userIdentityCache->defaultUserIdentity()),
      /*entitled=*/true, /*allowOtherIdLookup=*/true, /*unrestricted=*/true, std::nullopt, std::nullopt,
      std::make_shared<QRVCommandQueue>(), services_);
  connection->setAllowGroupIdLookup(true);

  Containers found;
  if (request.uid == 0) {
    std::string home = services_->globalConfiguration->homeDirectory();
    if (home.size() > 1 && home.back() == '/') home.pop_back();
    found.home = home;
  } else if (userIdentity) {
    found.home = userIdentity->homeDirectoryURL();
  }

  if (dataIdentifier) {
    uint64_t containerClass = _dataContainerClass(*dataIdentifier, request.containerType);
    _checkUID(*connection, containerClass, request.uid);
    found.data = _containerPath(*connection, userIdentity, *dataIdentifier, containerClass,
                                "createOrLookupContainerForUser: Failed with error: {}");
    if (found.data)
      found.temp = *found.data + "/tmp";
    else
      found.allFound = false;
  }
  if (request.systemContainerID) {
    found.system = _containerPath(*connection, nullptr, *request.systemContainerID, QRVContainerClassSystemData,
                                  "createOrLookupContainerForUser:(system container) Failed with error: {}");
    if (!found.system) found.allFound = false;
  }
  // Every group asked for, found or not; one that cannot be had leaves the
  // rest of the answer standing.
  auto lookUpGroups = [&](const std::vector<std::string>& identifiers, const QRVUserIdentityRef& user,
                          QRVContainerClass groupClass, const char* failure, std::map<std::string, std::string>* into) {
    for (const std::string& group : identifiers) {
      if (auto path = _containerPath(*connection, user, group, groupClass, failure))
        (*into)[group] = *path;
      else
        found.allFound = false;
    }
  };
  if (!request.appGroupIDs.empty()) {
    _checkUID(*connection, QRVContainerClassAppGroup, request.uid);
    lookUpGroups(request.appGroupIDs, userIdentity, QRVContainerClassAppGroup,
                 "createOrLookupGroupContainersForUser: Failed with error: {}", &found.groups);
  }
  lookUpGroups(request.systemGroupIDs, nullptr, QRVContainerClassSystemGroup,
               "createOrLookupContainerForUser:(system group container) Failed with error: {}", &found.systemGroups);
  // Deferred steps the lookups queued run before the answer goes out.
  uint64_t ignored = 0;
  connection->completeWithError(&ignored);

  QRVLogDebug("UPCALL-Containers for {}({}):", dataIdentifier.value_or("(null)"), request.uid);
  QRVLogDebug("dataContainerURL: {}", found.data.value_or("(null)"));
  QRVLogDebug("tempContainerURL: {}", found.temp.value_or("(null)"));
  QRVLogDebug("homeDirURL: {}", found.home.value_or("(null)"));
  QRVLogDebug("groupURLs: {}", describe(found.groups));
  QRVLogDebug("systemContainerURL: {}", found.system.value_or("(null)"));
  QRVLogDebug("systemGroupURLs: {}", describe(found.systemGroups));

  *reply = _packReply(found, replyBuffer.get());
  return reply->empty() ? M::kStatusNoReplyBuffer : 0;
}

int32_t QRVProcessContainers::_unpackRequest(const uint8_t* bytes, size_t length, Request* out) {
  QRVLogDebug("request size: {} ({})", length, fmt::ptr(bytes));
  // The handle reads the caller's bytes in place and never writes or frees
  // them.
  Packbuff request(bytes ? sb_packbuff_init_with_buffer(const_cast<uint8_t*>(bytes), length, /*has_contents=*/true,
                                                   SB_PACKBUFF_DEALLOC_NONE)
                    : nullptr);
  if (!request) {
    QRVLogError("sb_packbuff_init() of request data fails");
    return M::kStatusBadRequest;
  }
  QRVLogDebug("request packbuff byte address:{}", fmt::ptr(sb_packbuff_get_bytes(request.get())));

  uint16_t valueType = 0;
  while (sb_packbuff_get_item_value_type(request.get(), &valueType)) {
    int error = 0;
    if (valueType > M::kRequestLastItem) {
      QRVLogError("unexpected value: {}\n", valueType);
      return M::kStatusBadRequest;
    }
    uint32_t* inlineValue = valueType == M::kRequestUID             ? &out->uid
                            : valueType == M::kRequestContainerType ? &out->containerType
                            : valueType == M::kRequestPersonaID     ? &out->personaID
                                                                    : nullptr;
    if (inlineValue) {
      *inlineValue = sb_packbuff_unpack_uint32(request.get(), &error);
      if (error != 0) {
        const char* name = valueType == M::kRequestUID             ? "QV_KERN_REQUEST_UID"
                           : valueType == M::kRequestContainerType ? "QV_KERN_REQUEST_CONTAINER_TYPE"
                                                                   : "QV_KERN_REQUEST_PERSONA_ID";
        QRVLogError("failed: to unpack uint32 for {}. error: {}\n", name, error);
        return M::kStatusUnreadable;
      }
      continue;
    }
    size_t stringLength = 0;
    const char* string = sb_packbuff_unpack_string(request.get(), &stringLength, &error);
    if (!string || error != 0) {
      QRVLogError("failed: to unpack string for {}. error: {}\n", requestItemName(valueType), error);
      return M::kStatusUnreadable;
    }
    // Up to the first NUL, as the string reads everywhere else.
    std::string value(string);
    switch (valueType) {
      case M::kRequestCodeSignatureID:
        out->codeSigningID = std::move(value);
        break;
      case M::kRequestContainerID:
        out->containerID = std::move(value);
        break;
      case M::kRequestApplicationID:
        out->applicationID = std::move(value);
        break;
      case M::kRequestAppGroupID:
        out->appGroupIDs.push_back(std::move(value));
        break;
      case M::kRequestSystemContainerID:
        out->systemContainerID = std::move(value);
        break;
      case M::kRequestSystemGroupContainerID:
        out->systemGroupIDs.push_back(std::move(value));
        break;
    }
  }
  return 0;
}

QRVUserIdentityRef QRVProcessContainers::_userIdentityForRequest(const Request& request, int32_t* status) {
  QRVUserIdentityCache& cache = *services_->userIdentityCache;
  QRVPersonaService* personas = services_->platform.personas.get();
  QRVUserIdentityRef identity;
  if (personas && personas->isMultiUserHost()) {
    identity = cache.userIdentityForPersonalPersonaWithUID(request.uid, request.uid);
  } else if (request.personaID == M::kNoPersona) {
    identity = cache.userIdentityForPersonalPersona();
  } else {
    std::optional<uint32_t> type = personas ? personas->kernelPersonaType(request.personaID) : std::nullopt;
    if (!type) {
      QRVLogError("{}: Could not look up info for persona id {}", __func__, request.personaID);
      *status = M::kStatusBadRequest;
      return nullptr;
    }
    identity = *type == QRVKernelPersonaTypeManaged || *type == QRVKernelPersonaTypeDefault
                   ? cache.userIdentityWithPersonaID(static_cast<int32_t>(request.personaID))
                   : cache.userIdentityForPersonalPersona();
  }
  if (!identity) {
    QRVLogError("{}: Unable to find user identity for persona id {}", __func__, request.personaID);
    *status = M::kStatusBadRequest;
  }
  return identity;
}

uint64_t QRVProcessContainers::_dataContainerClass(const std::string& identifier, uint32_t containerType) {
  uint64_t containerClass =
      services_->codeSigningMapping ? services_->codeSigningMapping->dataContainerTypeForIdentifier(identifier) : 0;
  // The per-user classes are the data container classes.
  if (QRVContainerClassIsPerUser(containerClass)) {
    // The sandbox knows what it starts: a plug-in gets a plug-in container
    // whatever the installer recorded.
    if (containerType == M::kContainerTypePlugin && containerClass != QRVContainerClassPluginData) {
      QRVLogNotice("SB Type: {}, MI Type: {}.  Declaring this a plugin", containerType, containerClass);
      return QRVContainerClassPluginData;
    }
    if (containerType == M::kContainerTypeApplication && containerClass != QRVContainerClassAppData)
      QRVLogNotice("SB type is app, but MI type is {}", containerClass);
    return containerClass;
  }
  QRVLogNotice("Invalid data container class for {}: {}", identifier, containerClass);
  containerClass = containerType == M::kContainerTypePlugin ? QRVContainerClassPluginData : QRVContainerClassAppData;
  QRVLogNotice("SB Type: {}, falling back to class: {}", containerType, containerClass);
  return containerClass;
}

void QRVProcessContainers::_checkUID(const QRVClientConnection& connection, uint64_t containerClass, uint32_t uid) {
  uid_t expected = connection.clientIdentity()->posixUIDForContainerClass(containerClass);
  if (expected != uid) QRVLogError("Invalid UID from kernel: {}, expected: {}", uid, expected);
}

std::optional<std::string> QRVProcessContainers::_containerPath(QRVClientConnection& connection,
                                                                const QRVUserIdentityRef& userIdentity,
                                                                const std::string& identifier,
                                                                uint64_t containerClass, const char* failureLog) {
  QRVError error;
  // System containers belong to no user: their identity takes the default
  // one, as every other request for them does.
  QRVContainerIdentityRef containerIdentity =
      QRVContainerClassIsSystem(containerClass)
          ? QRVContainerIdentity::containerIdentityWithIdentifier(
                identifier, containerClass, *connection.services().userIdentityCache, &error)
          : QRVContainerIdentity::containerIdentityWithUserIdentity(userIdentity, identifier, containerClass, &error);
  QRVMetadataRef container =
      containerIdentity ? connection.createOrLookupContainerWithContainerIdentity(
                              containerIdentity, /*createIfNecessary=*/true, /*transient=*/false,
                              /*useLocking=*/true, &error)
                        : nullptr;
  if (container) return container->url();
  QRVLogError(fmt::runtime(failureLog), error.resultCode());
  return std::nullopt;
}

std::vector<uint8_t> QRVProcessContainers::_packReply(const Containers& containers, sb_packbuff* pb) {
  // Once an item cannot be packed nothing more is, except the status that
  // says so.
  bool packed = true;
  auto packString = [&](uint16_t type, const std::optional<std::string>& path) {
    if (!packed || !path) return;
    if (int e = sb_packbuff_pack_string(pb, type, path->c_str(), path->size()); e != 0) {
      QRVLogError("sb_packbuff_pack_string() fails: {}; type: {}, path: {}\n", e, type, *path);
      packed = false;
    }
  };
  auto packPairs = [&](uint16_t keyType, uint16_t valueType, const std::map<std::string, std::string>& pairs,
                       const char* what) {
    for (const auto& [identifier, path] : pairs) {
      if (!packed) return;
      int e = sb_packbuff_pack_key_with_string_value(pb, keyType, identifier.c_str(), valueType, path.c_str());
      if (e != 0) {
        QRVLogError("sb_packbuff_pack_key_with_string_value() fails: {}; group ID: {}, {}: {}\n", e, identifier, what,
                    path);
        packed = false;
      }
    }
  };
  packString(M::kReplyHomeDirectory, containers.home);
  packString(M::kReplyDataContainer, containers.data);
  packString(M::kReplyTempDirectory, containers.temp);
  packPairs(M::kReplyAppGroupID, M::kReplyAppGroupPath, containers.groups, "group container");
  packString(M::kReplySystemContainer, containers.system);
  packPairs(M::kReplySystemGroupID, M::kReplySystemGroupPath, containers.systemGroups, "system group container");
  uint32_t status = containers.allFound && packed ? 1 : 0;
  if (int e = sb_packbuff_pack_uint32(pb, M::kReplyStatus, status); e != 0) {
    QRVLogError("sb_packbuff_pack_uint32() fails: {}; type: {}, value: {}\n", e, M::kReplyStatus, status);
    return {};
  }
  const auto* bytes = static_cast<const uint8_t*>(sb_packbuff_get_bytes(pb));
  std::vector<uint8_t> reply(bytes, bytes + sb_packbuff_get_size(pb));
  QRVLogDebug("packbuff bytes: {}, reply bytes: {}, reply size: {}", fmt::ptr(bytes), fmt::ptr(reply.data()),
              reply.size());
  return reply;
}
