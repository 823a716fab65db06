// What the container operations ask of components that are built later: the
// code-signing mapping (which identifiers have system containers, dropping
// and invalidating an identifier's code-signing records) and the
// data-protection manager (the class an application's entitlements ask for).
// Each is a small interface held by QRVServices; the defaults give the
// neutral answers until the real components are connected.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "base/QRVPlist.h"

class QRVCommandQueue;

class QRVCodeSigningQueries {
 public:
  virtual ~QRVCodeSigningQueries() = default;
  // Whether the identifier's code signing grants it a system container.
  virtual bool identifierHasSystemContainer(const std::string& identifier) = 0;
  // Drops the code-signing records of `identifier` and its children as part
  // of deleting its bundle; may append further commands to `queue`. Returns
  // 1 or an error code.
  virtual uint64_t removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string& identifier,
                                                                           QRVCommandQueue& queue) = 0;
  // Marks the records of `identifier` and its children invalid (a replaced
  // bundle). Returns 1 or an error code.
  virtual uint64_t invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier) = 0;
};

// Knows no code signing: no system containers, nothing to drop.
class QRVNoCodeSigningQueries : public QRVCodeSigningQueries {
 public:
  bool identifierHasSystemContainer(const std::string&) override { return false; }
  uint64_t removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string&, QRVCommandQueue&) override {
    return 1;
  }
  uint64_t invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string&) override { return 1; }
};

// The info value holding the data-protection class a container was last
// given (or was asked to be created with).
inline constexpr const char* kQRVContentProtectionClassKey = "com.kelva.Verdane.ContentProtectionClass";

// The class `info` records; none when it holds no number there.
inline std::optional<uint32_t> QRVContentProtectionClassInInfo(const QRVPlist& info) {
  const QRVPlist* value = info.isDictionary() ? info.get(kQRVContentProtectionClassKey) : nullptr;
  if (!value) return std::nullopt;
  if (value->type() == QRVPlist::Type::UInteger) return static_cast<uint32_t>(value->uint64Value());
  if (value->type() == QRVPlist::Type::Real) return static_cast<uint32_t>(static_cast<uint64_t>(value->realValue()));
  return std::nullopt;
}

class QRVDataProtectionQueries {
 public:
  virtual ~QRVDataProtectionQueries() = default;
  // The data-protection class the identifier's entitlements ask for; 0 when
  // they ask for none.
  virtual uint32_t intendedDataProtectionClassBasedOnEntitlementsForIdentifier(const std::string& identifier) = 0;
};

// Asks for no class.
class QRVNoDataProtectionQueries : public QRVDataProtectionQueries {
 public:
  uint32_t intendedDataProtectionClassBasedOnEntitlementsForIdentifier(const std::string&) override { return 0; }
};

class QRVSystemGroupQueries {
 public:
  virtual ~QRVSystemGroupQueries() = default;
  // The system group container identifiers the code signing of `identifier`
  // lets it use.
  virtual std::vector<std::string> systemGroupIdentifiersForIdentifier(const std::string& identifier) = 0;
};

// Grants no system group, so staging shared content is refused (55) until
// the code-signing mapping answers for real.
class QRVNoSystemGroupQueries : public QRVSystemGroupQueries {
 public:
  std::vector<std::string> systemGroupIdentifiersForIdentifier(const std::string&) override { return {}; }
};
