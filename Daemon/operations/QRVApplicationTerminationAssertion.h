// Keeps an application stopped while its container is changed underneath
// it: construction terminates the application and holds it stopped,
// invalidate() lets it run again. Destroying an object that still holds its
// assertion is a programming error and stops the daemon.
#pragma once

#include <memory>
#include <string>

#include "platform/QRVApplicationTermination.h"

class QRVApplicationTerminationAssertion {
 public:
  // The reasons the termination service knows.
  static constexpr int kReasonNone = -1;
  static constexpr int kReasonDataProtection = 0;
  static constexpr int kReasonContainerChange = 1;

  // Any reason other than -1, 0 or 1 aborts. A null `service` or a refusal
  // is logged, and the object then holds nothing.
  QRVApplicationTerminationAssertion(std::shared_ptr<QRVApplicationTermination> service,
                                     const std::string& bundleIdentifier, int reason);
  ~QRVApplicationTerminationAssertion();
  QRVApplicationTerminationAssertion(const QRVApplicationTerminationAssertion&) = delete;
  QRVApplicationTerminationAssertion& operator=(const QRVApplicationTerminationAssertion&) = delete;

  bool isHeld() const { return assertion_ != nullptr; }
  void invalidate();

 private:
  std::unique_ptr<QRVApplicationTermination::Assertion> assertion_;
};
