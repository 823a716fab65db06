// The unpacking steps shared by the command handlers: identities from a
// request's keys, and sandbox extensions for the paths handed back.
#pragma once

#include <optional>
#include <string>

#include "base/QRVPlist.h"
#include "model/QRVContainerIdentity.h"
#include "operations/QRVClientConnection.h"

namespace QRVRequestUnpacking {

// The user identity a request means for a container of `containerClass`:
// the default identity for classes that need none; the persona named by
// "PersonaUniqueString" when given (another persona than the caller's own
// needs the right to look up other identifiers); the caller's own
// otherwise. Fails with 11 (unknown persona) or 55.
QRVUserIdentityRef userIdentityForContainerIdentifier(const QRVPlist& request, QRVContainerClass containerClass,
                                                      QRVClientConnection& connection, QRVError* error);

// "Identifier" + "ContainerClass" + the user identity above. A missing
// identifier is 18, one that is not a string 11.
QRVContainerIdentityRef containerIdentity(const QRVPlist& request, QRVClientConnection& connection, QRVError* error);
// The same plus "UUID" (16 bytes): a missing or malformed UUID is 11.
QRVConcreteContainerIdentityRef concreteContainerIdentity(const QRVPlist& request, QRVClientConnection& connection,
                                                          QRVError* error);

inline constexpr const char* kContainerExtensionClass = "com.kelva.sandbox.container";
inline constexpr const char* kApplicationGroupExtensionClass = "com.kelva.sandbox.application-group";

// A token letting the caller's process reach `path`, or nothing (logged).
std::optional<std::string> issueSandboxExtension(QRVClientConnection& connection, const std::string& path,
                                                 const char* extensionClass);
// The same for a container's directory, with the extension class its
// container class calls for: application groups have their own, so that the
// sandbox can tell a shared group from an application's private data.
std::optional<std::string> issueSandboxExtension(QRVClientConnection& connection, const QRVMetadata& container);

}  // namespace QRVRequestUnpacking
