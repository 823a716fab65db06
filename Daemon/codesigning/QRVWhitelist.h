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

 private:
  // A value of the code-sign mapping once its arrays are sets: none
  // (anything), a set of identifiers, a dictionary of further values, or
  // anything else (which matches nothing).
  struct Node {
    enum class Kind { kNone, kSet, kDictionary, kOther };
    Kind kind = Kind::kOther;
    std::set<std::string, std::less<>> set;
    std::map<std::string, Node, std::less<>> dictionary;
  };
  static Node _convertArraysToSetsInNestedDictionary(const QRVPlist& value, int depth);
  // Identifier -> directory name; a row whose name is not one plain path
  // component is dropped (logged), so no name can lead out of its class
  // directory.
  static std::map<std::string, std::string, std::less<>> _directoryNames(const QRVPlist& mapping, const char* what);
  static std::vector<std::string> _keys(const std::map<std::string, std::string, std::less<>>& mapping);

  std::map<std::string, std::string, std::less<>> systemWhitelist_;
  std::map<std::string, std::string, std::less<>> systemGroupWhitelist_;
  // One set per class 0 to 13; a class without an entry has none.
  std::vector<std::optional<std::set<std::string, std::less<>>>> whitelistedContainers_;
  Node whitelistedCodeSignIdentifiers_;
};
