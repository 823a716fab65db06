// Requests as the daemon's clients send them, and the entitlements that
// allow them, for tests that talk to a running daemon.
#pragma once

#include <cstdint>
#include <initializer_list>
#include <string>

#include "base/QRVPlist.h"

inline QRVPlist QRVRequest(uint64_t command) {
  return QRVPlist::dictionary().set("Command", QRVPlist::uinteger(command));
}

// Command 0: look up, and by default create, a container.
inline QRVPlist QRVCreateRequest(const std::string& identifier, uint64_t containerClass, bool transient = false,
                                 bool createIfNecessary = true) {
  return QRVRequest(0)
      .set("Identifier", QRVPlist::string(identifier))
      .set("ContainerClass", QRVPlist::uinteger(containerClass))
      .set("CreateIfNecessary", QRVPlist::boolean(createIfNecessary))
      .set("Transient", QRVPlist::boolean(transient));
}

// An entitlements dictionary granting each named right of the daemon
// ("allowed", "testability", ...) as a boolean.
inline QRVPlist QRVEntitlements(std::initializer_list<const char*> rights) {
  QRVPlist entitlements = QRVPlist::dictionary();
  for (const char* right : rights)
    entitlements.set(std::string("com.kelva.private.Quorva.") + right, QRVPlist::boolean(true));
  return entitlements;
}
