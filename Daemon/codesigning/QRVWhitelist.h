// The well-known system containers and the look-up whitelist: a fixed table
// compiled into the daemon, built once per process and never changed.
//
// It answers which system containers (class 12) and system group containers
// (class 13) are kept for particular system services whatever the
// entitlements say (and under which directory name), and which clients may
// look up containers that are not their own without a look-up entitlement.
// The rows are listed in docs/well-known-containers.md.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "base/QRVPlist.h"
#include "model/QRVContainerCacheSeams.h"

class QRVWhitelist : public QRVWellKnownNames {
 public:
  // The one system group container every process may reach: the system
  // group path request hands it to any caller, whether or not the caller's
  // code signing lists it, and boot set-up gives it a fresh directory UUID
  // after a build upgrade.
  static constexpr const char* kSharedSystemGroupIdentifier = "systemgroup.com.kelva.quorva.shared";

  // The four collections, in their property-list shapes:
  //  - system container mapping and system group container mapping:
  //    dictionary, identifier -> value (the directory name, a string);
  //  - whitelisted container mapping: dictionary, class number (as a
  //    decimal string key) -> array of container identifiers;
  //  - whitelisted code-sign identifier mapping: dictionary, client
  //    identifier -> none (anything) or dictionary, class number (decimal
  //    string key) -> none (any container of the class) or array of
  //    container identifiers.
  // Every array is turned into a set here.
  QRVWhitelist(const QRVPlist& systemContainerMapping, const QRVPlist& systemGroupContainerMapping,
               const QRVPlist& whitelistedContainerMapping, const QRVPlist& whitelistedCodeSignIdentifierMapping);

  // The built-in table; on an internal build one more system group.
  static const QRVWhitelist& sharedWhitelist(bool isInternalImage);

  std::vector<std::string> wellknownSystemContainers() const;
  std::vector<std::string> wellknownSystemGroupContainers() const;
  bool systemContainerIdIsWellknown(const std::string& identifier) override;
  bool systemGroupContainerIdIsWellknown(const std::string& identifier) override;
  std::optional<std::string> wellknownSystemContainerForId(const std::string& identifier) override;
  std::optional<std::string> wellknownSystemGroupContainerForId(const std::string& identifier) override;
  bool containerIdIsWellknown(const std::string& identifier, uint64_t containerClass);
  std::optional<std::string> wellknownContainerForId(const std::string& identifier, uint64_t containerClass);
  bool isLookupWhitelistedFromCodeSignIdentifier(const std::string& codeSignIdentifier, uint64_t containerClass,
                                                 const std::string& containerIdentifier) override;
};
