// The claim of one daemon on its root. Two daemons working on the same
// containers, metadata and journals would undo each other's work, so a daemon
// claims the root before it touches any state and gives up when another
// already holds it. The claim lasts as long as the object (in practice: the
// process).
#pragma once

#include <string>

#include "base/QRVError.h"

class QRVInstanceLock {
 public:
  virtual ~QRVInstanceLock() = default;
  // Where the claim is recorded, for messages.
  virtual const std::string& path() const = 0;
  // Claims the root without waiting. Returns false, with the reason in
  // `error`, when another process holds it or it cannot be taken. Claiming
  // again after a success does nothing.
  virtual bool acquire(QRVError* error) = 0;
};
