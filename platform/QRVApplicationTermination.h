// Stopping an application while its container changes underneath it.
#pragma once

#include <memory>
#include <string>

#include "base/QRVError.h"

class QRVApplicationTermination {
 public:
  // Held while the application must stay stopped; releasing it lets the
  // application run again.
  class Assertion {
   public:
    virtual ~Assertion() = default;
  };

  virtual ~QRVApplicationTermination() = default;
  // Stops `identifier`'s running instances and keeps them from starting
  // until the assertion is released. Nothing running is not an error.
  virtual std::unique_ptr<Assertion> terminate(const std::string& identifier,
                                               const std::string& reason, QRVError* error) = 0;
};
