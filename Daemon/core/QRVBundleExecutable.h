// Recognises a client whose program runs from one of the daemon's bundle
// containers (applications, plug-ins, VPN plug-ins): such a process has no
// trust-store entry, and is known by the identifier of the container that
// holds its executable.
//
// Containment. The executable path comes from the kernel (no links, no "."
// or ".."), and it counts only when it lies strictly inside a container
// directory directly below the resolved class directory of a bundle class:
// nothing outside the bundle directory, and nothing a link could have led
// there, is ever taken for a container. The container's identifier comes
// from its metadata file and is accepted only when the container cache
// knows that identifier's container at that very directory, so a metadata
// file planted in a stray directory names nobody.
#pragma once

#include <optional>
#include <string>

#include "core/QRVServices.h"
#include "model/QRVContainerClass.h"

class QRVBundleExecutable {
 public:
  struct Owner {
    std::string identifier;
    QRVContainerClass containerClass = QRVContainerClassUndefined;
  };

  // The bundle container holding the executable `path`, or none (logged at
  // debug level; most peers are simply not bundle programs).
  static std::optional<Owner> ownerOfExecutablePath(const std::string& path, QRVServices& services);

 private:
  // The first component of `path` below `directory` (both absolute, without
  // trailing slash), when something lies below that component.
  static std::optional<std::string> _containerNameBelow(const std::string& directory, const std::string& path);
};
