// What the container cache asks of parts of the daemon that it does not own:
// the application a plug-in belongs to (from the code-signing mapping) and
// the names of well-known system containers (from the built-in table). Each
// is a small interface handed to the cache at construction; the defaults
// answer "none" and "no names" until the real sources are connected.
//
// Implementations must be thread-safe: the cache calls them while it holds
// its own lock, so they must never call back into the cache.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

class QRVPluginParentResolver {
 public:
  virtual ~QRVPluginParentResolver() = default;
  // The identifier of the application that contains the plug-in
  // `childIdentifier`, or nothing when none is known.
  virtual std::optional<std::string> parentIdentifierForChildIdentifier(const std::string& childIdentifier) = 0;
};

// Knows no parents.
class QRVNoPluginParentResolver : public QRVPluginParentResolver {
 public:
  std::optional<std::string> parentIdentifierForChildIdentifier(const std::string&) override { return std::nullopt; }
};

class QRVWellKnownNames {
 public:
  virtual ~QRVWellKnownNames() = default;
  // Whether `identifier` names a well-known system container (class 12) or
  // system group container (class 13). Such containers may live in a
  // directory named after them instead of a UUID.
  virtual bool systemContainerIdIsWellknown(const std::string& identifier) = 0;
  virtual bool systemGroupContainerIdIsWellknown(const std::string& identifier) = 0;
  // The directory name of a well-known system (group) container, used in
  // place of a UUID when it is created; nothing (the default) for other
  // identifiers.
  virtual std::optional<std::string> wellknownSystemContainerForId(const std::string&) { return std::nullopt; }
  virtual std::optional<std::string> wellknownSystemGroupContainerForId(const std::string&) { return std::nullopt; }
  // Whether the table lets `caller` look up `identifier`'s container of
  // `containerClass` without a lookup entitlement; by default nobody.
  virtual bool isLookupWhitelistedFromCodeSignIdentifier(const std::string& caller, uint64_t containerClass,
                                                         const std::string& identifier) {
    return false;
  }
};

// Knows no names.
class QRVNoWellKnownNames : public QRVWellKnownNames {
 public:
  bool systemContainerIdIsWellknown(const std::string&) override { return false; }
  bool systemGroupContainerIdIsWellknown(const std::string&) override { return false; }
};
