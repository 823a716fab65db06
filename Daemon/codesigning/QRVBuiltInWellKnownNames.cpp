#include "codesigning/QRVBuiltInWellKnownNames.h"

QRVBuiltInWellKnownNames::QRVBuiltInWellKnownNames(std::shared_ptr<QRVGlobalConfiguration> configuration)
    : configuration_(std::move(configuration)) {}

QRVWhitelist& QRVBuiltInWellKnownNames::table() {
  // The shared tables are built once and only ever read: the seam's methods
  // are not const, but none of them changes anything.
  return const_cast<QRVWhitelist&>(QRVWhitelist::sharedWhitelist(configuration_->isInternalImage()));
}

bool QRVBuiltInWellKnownNames::systemContainerIdIsWellknown(const std::string& identifier) {
  return table().systemContainerIdIsWellknown(identifier);
}

bool QRVBuiltInWellKnownNames::systemGroupContainerIdIsWellknown(const std::string& identifier) {
  return table().systemGroupContainerIdIsWellknown(identifier);
}

std::optional<std::string> QRVBuiltInWellKnownNames::wellknownSystemContainerForId(const std::string& identifier) {
  return table().wellknownSystemContainerForId(identifier);
}

std::optional<std::string> QRVBuiltInWellKnownNames::wellknownSystemGroupContainerForId(const std::string& identifier) {
  return table().wellknownSystemGroupContainerForId(identifier);
}

bool QRVBuiltInWellKnownNames::isLookupWhitelistedFromCodeSignIdentifier(const std::string& caller,
                                                                         uint64_t containerClass,
                                                                         const std::string& identifier) {
  return table().isLookupWhitelistedFromCodeSignIdentifier(caller, containerClass, identifier);
}
