// The name of a container: a user identity, an identifier and a class. A
// concrete container identity also names one directory on disk by its UUID.
//
// Immutable and shared by reference. Equality is deliberately asymmetric: a
// plain identity compared with a concrete one compares the three base fields
// only, while a concrete identity is equal only to another concrete identity
// with the same UUID.
#pragma once

#include <memory>
#include <string>

#include "base/QRVError.h"
#include "base/QRVUUID.h"
#include "model/QRVContainerClass.h"
#include "model/QRVUserIdentity.h"

class QRVContainerIdentity;
using QRVContainerIdentityRef = std::shared_ptr<const QRVContainerIdentity>;
class QRVConcreteContainerIdentity;
using QRVConcreteContainerIdentityRef = std::shared_ptr<const QRVConcreteContainerIdentity>;

class QRVContainerIdentity {
 public:
  virtual ~QRVContainerIdentity() = default;

  // Checks, in order: a user identity (11), an identifier (18), a valid
  // class 1..13 (11). Each failure is logged.
  static QRVContainerIdentityRef containerIdentityWithUserIdentity(QRVUserIdentityRef userIdentity,
                                                                   const std::string& identifier,
                                                                   QRVContainerClass containerClass, QRVError* error);
  // For classes that need no user identity (bundle and system classes): the
  // cache's default identity is filled in. Other classes fail with 11.
  static QRVContainerIdentityRef containerIdentityWithIdentifier(const std::string& identifier,
                                                                 QRVContainerClass containerClass,
                                                                 QRVUserIdentityCache& cache, QRVError* error);

  const std::string& identifier() const { return identifier_; }
  QRVContainerClass containerClass() const { return containerClass_; }
  const QRVUserIdentityRef& userIdentity() const { return userIdentity_; }
  // The container's UUID for a concrete identity, null otherwise.
  virtual const QRVUUID* uuid() const { return nullptr; }

  virtual bool isEqual(const QRVContainerIdentity& other) const { return isEqualToContainerIdentity(other); }
  bool isEqualToContainerIdentity(const QRVContainerIdentity& other) const;
  virtual size_t hash() const;
  virtual std::string description() const;

 protected:
  QRVContainerIdentity(QRVUserIdentityRef userIdentity, std::string identifier, QRVContainerClass containerClass)
      : identifier_(std::move(identifier)), containerClass_(containerClass), userIdentity_(std::move(userIdentity)) {}
  // The checks of construction; false (with the error) when one fails.
  static bool validate(const QRVUserIdentityRef& userIdentity, const std::string& identifier,
                       QRVContainerClass containerClass, QRVError* error);

 private:
  const std::string identifier_;
  const QRVContainerClass containerClass_;
  const QRVUserIdentityRef userIdentity_;
};

class QRVConcreteContainerIdentity : public QRVContainerIdentity {
 public:
  static QRVConcreteContainerIdentityRef containerIdentityWithUUID(const QRVUUID& uuid,
                                                                   QRVUserIdentityRef userIdentity,
                                                                   const std::string& identifier,
                                                                   QRVContainerClass containerClass, QRVError* error);

  const QRVUUID* uuid() const override { return &uuid_; }
  bool isEqual(const QRVContainerIdentity& other) const override;
  bool isEqualToConcreteContainerIdentity(const QRVConcreteContainerIdentity& other) const;
  size_t hash() const override;
  std::string description() const override;

 private:
  QRVConcreteContainerIdentity(QRVUserIdentityRef userIdentity, std::string identifier,
                               QRVContainerClass containerClass, QRVUUID uuid)
      : QRVContainerIdentity(std::move(userIdentity), std::move(identifier), containerClass), uuid_(uuid) {}

  const QRVUUID uuid_;
};

// For maps keyed by identity (equality as `isEqual` of the stored key).
struct QRVContainerIdentityHash {
  size_t operator()(const QRVContainerIdentityRef& c) const { return c ? c->hash() : 0; }
};
struct QRVContainerIdentityEqual {
  bool operator()(const QRVContainerIdentityRef& a, const QRVContainerIdentityRef& b) const {
    return a == b || (a && b && a->isEqual(*b));
  }
};
