// The container paths of one process, as the sandbox asks for them when the
// process starts: the request's packed-buffer items in, the reply's
// packed-buffer items out.
//
// The request names the process (code-signing identifier, data container
// identifier, uid, persona, app groups, system container and system groups;
// any order, each may be absent). The reply holds, in this order, the home
// directory, the data container and its "tmp" directory, one key/path pair
// per app group, the system container, one pair per system group, and last
// the status item: 1 when every lookup succeeded, 0 otherwise. A container
// that cannot be made or found is left out and only turns the status to 0;
// a reply that cannot be packed stops growing there, with the status item
// still at its end.
//
// Containers are created when missing, for the user identity that the
// persona (or, on a multi-user host, the uid) names, through a privileged
// connection that may look up any identifier and group. Lookups take the
// usual identifier locks.
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "core/QRVServices.h"
#include "model/QRVUserIdentity.h"

class QRVClientConnection;
struct sb_packbuff;

class QRVProcessContainers {
 public:
  explicit QRVProcessContainers(std::shared_ptr<QRVServices> services) : services_(std::move(services)) {}

  // Answers the request items in the `length` bytes at `bytes` (which may be
  // hostile: nothing outside them is read). Returns 0 with the reply's
  // packed bytes in `reply`, or a status that ends the request before any
  // reply item: 4 for an unknown item or a persona without user identity,
  // 5 for an item that cannot be unpacked, 9 when no reply buffer can be
  // made.
  int32_t replyForRequest(const uint8_t* bytes, size_t length, std::vector<uint8_t>* reply);

 private:
  struct Request {
    std::optional<std::string> codeSigningID;
    std::optional<std::string> containerID;
    std::optional<std::string> applicationID;
    std::optional<std::string> systemContainerID;
    std::vector<std::string> appGroupIDs;
    std::vector<std::string> systemGroupIDs;
    uint32_t uid = 0;
    uint32_t containerType = 0;
    uint32_t personaID = 0xFFFFFFFFu;
  };
  struct Containers {
    std::optional<std::string> home;
    std::optional<std::string> data;
    std::optional<std::string> temp;
    std::map<std::string, std::string> groups;
    std::optional<std::string> system;
    std::map<std::string, std::string> systemGroups;
    bool allFound = true;
  };

  static int32_t _unpackRequest(const uint8_t* bytes, size_t length, Request* out);
  // Null with the status in `status` when the request names no usable user
  // identity.
  QRVUserIdentityRef _userIdentityForRequest(const Request& request, int32_t* status);
  // The data container class for the data identifier, as the sandbox's
  // container type and the code-signing mapping decide it together.
  uint64_t _dataContainerClass(const std::string& identifier, uint32_t containerType);
  // Logs when the owner this class's containers get is not the kernel's uid.
  static void _checkUID(const QRVClientConnection& connection, uint64_t containerClass, uint32_t uid);
  // Creates or looks up one container; the path, or none after logging
  // `failureLog` with the code.
  static std::optional<std::string> _containerPath(QRVClientConnection& connection,
                                                   const QRVUserIdentityRef& userIdentity,
                                                   const std::string& identifier, uint64_t containerClass,
                                                   const char* failureLog);
  // The reply's bytes packed into the empty buffer `pb`; empty when not even
  // the status item fits.
  static std::vector<uint8_t> _packReply(const Containers& containers, sb_packbuff* pb);

  const std::shared_ptr<QRVServices> services_;
};
