// The built-in well-known table as the container cache and the container
// operations see it: every question goes to the shared table of the build
// variant the global configuration reports.
//
// The variant is asked for on each question rather than when the services
// are assembled, so that the table follows the variant as the daemon first
// reads it, whenever that is. Thread-safe: the table never changes.
#pragma once

#include <memory>

#include "codesigning/QRVWhitelist.h"
#include "model/QRVContainerCacheSeams.h"
#include "model/QRVGlobalConfiguration.h"

class QRVBuiltInWellKnownNames : public QRVWellKnownNames {
 public:
  explicit QRVBuiltInWellKnownNames(std::shared_ptr<QRVGlobalConfiguration> configuration);

  bool systemContainerIdIsWellknown(const std::string& identifier) override;
  bool systemGroupContainerIdIsWellknown(const std::string& identifier) override;
  std::optional<std::string> wellknownSystemContainerForId(const std::string& identifier) override;
  std::optional<std::string> wellknownSystemGroupContainerForId(const std::string& identifier) override;
  bool isLookupWhitelistedFromCodeSignIdentifier(const std::string& caller, uint64_t containerClass,
                                                 const std::string& identifier) override;

 private:
  QRVWhitelist& table();

  const std::shared_ptr<QRVGlobalConfiguration> configuration_;
};
