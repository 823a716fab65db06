#include "operations/QRVApplicationTerminationAssertion.h"

#include <cstdlib>

#include "base/QRVLog.h"

namespace {

const char* reasonText(int reason) {
  switch (reason) {
    case QRVApplicationTerminationAssertion::kReasonNone:
      return "none";
    case QRVApplicationTerminationAssertion::kReasonDataProtection:
      return "data protection";
    case QRVApplicationTerminationAssertion::kReasonContainerChange:
      return "container change";
    default:
      return nullptr;
  }
}

}  // namespace

QRVApplicationTerminationAssertion::QRVApplicationTerminationAssertion(
    std::shared_ptr<QRVApplicationTermination> service, const std::string& bundleIdentifier, int reason) {
  const char* why = reasonText(reason);
  if (!why) {
    // A reason the service does not know means a caller was built against a
    // different list: carrying on could stop the wrong thing.
    QRVLogError("Unknown reason: {}", reason);
    abort();
  }
  if (!service) {
    QRVLogError("Application termination service is not available; {} is not stopped", bundleIdentifier);
    return;
  }
  // The service answers synchronously, so there is nothing to wait for here.
  QRVError error;
  assertion_ = service->terminate(bundleIdentifier, why, &error);
  if (!assertion_)
    QRVLogError("Failed to acquire termination assertion for {} : {}", bundleIdentifier, error.description());
}

QRVApplicationTerminationAssertion::~QRVApplicationTerminationAssertion() {
  if (assertion_) {
    QRVLogError("termination assertion destroyed while still held");
    abort();
  }
}

void QRVApplicationTerminationAssertion::invalidate() { assertion_.reset(); }
