#include "model/QRVContainerIdentity.h"

#include "base/QRVLog.h"
#include "users/QRVUserIdentityCache.h"

bool QRVContainerIdentity::validate(const QRVUserIdentityRef& userIdentity, const std::string& identifier,
                                    QRVContainerClass containerClass, QRVError* error) {
  if (!userIdentity)
    return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject, "Invalid object: no user identity"));
  if (identifier.empty())
    return QRVFail(error, QRV_ERROR(QRVResultCode::kMissingIdentifier, "Invalid object: missing identifier"));
  if (!QRVContainerClassIsValid(containerClass))
    return QRVFail(error,
                   QRV_ERROR(QRVResultCode::kInvalidObject, "Invalid object: container class = {}", containerClass));
  return true;
}

QRVContainerIdentityRef QRVContainerIdentity::containerIdentityWithUserIdentity(QRVUserIdentityRef userIdentity,
                                                                                const std::string& identifier,
                                                                                QRVContainerClass containerClass,
                                                                                QRVError* error) {
  if (!validate(userIdentity, identifier, containerClass, error)) return nullptr;
  return QRVContainerIdentityRef(new QRVContainerIdentity(std::move(userIdentity), identifier, containerClass));
}

QRVContainerIdentityRef QRVContainerIdentity::containerIdentityWithIdentifier(const std::string& identifier,
                                                                              QRVContainerClass containerClass,
                                                                              QRVUserIdentityCache& cache,
                                                                              QRVError* error) {
  if (QRVUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject,
                             "Attempt to create a container identity without a user identity when one is required; "
                             "identifier = [{}], class = {}",
                             identifier, containerClass));
    return nullptr;
  }
  return containerIdentityWithUserIdentity(cache.defaultUserIdentity(), identifier, containerClass, error);
}

bool QRVContainerIdentity::isEqualToContainerIdentity(const QRVContainerIdentity& other) const {
  return containerClass_ == other.containerClass_ && identifier_ == other.identifier_ &&
         userIdentity_->isEqualToUserIdentity(*other.userIdentity_);
}

size_t QRVContainerIdentity::hash() const {
  return std::hash<std::string>()(identifier_) ^ userIdentity_->hash() ^ static_cast<size_t>(containerClass_);
}

std::string QRVContainerIdentity::description() const {
  return fmt::format("<QRVContainerIdentity: {}; userIdentity = {}, identifier = {}, class = {}>",
                     static_cast<const void*>(this), userIdentity_->shortDescription(), identifier_, containerClass_);
}

QRVConcreteContainerIdentityRef QRVConcreteContainerIdentity::containerIdentityWithUUID(
    const QRVUUID& uuid, QRVUserIdentityRef userIdentity, const std::string& identifier,
    QRVContainerClass containerClass, QRVError* error) {
  // Any UUID value names a container, the all-zero one included: a UUID that
  // names none is simply not found. Data that is no UUID at all is refused
  // where the request is unpacked.
  if (!validate(userIdentity, identifier, containerClass, error)) return nullptr;
  return QRVConcreteContainerIdentityRef(
      new QRVConcreteContainerIdentity(std::move(userIdentity), identifier, containerClass, uuid));
}

bool QRVConcreteContainerIdentity::isEqual(const QRVContainerIdentity& other) const {
  const auto* concrete = dynamic_cast<const QRVConcreteContainerIdentity*>(&other);
  return concrete && isEqualToConcreteContainerIdentity(*concrete);
}

bool QRVConcreteContainerIdentity::isEqualToConcreteContainerIdentity(const QRVConcreteContainerIdentity& other) const {
  return uuid_ == other.uuid_ && isEqualToContainerIdentity(other);
}

size_t QRVConcreteContainerIdentity::hash() const {
  return QRVContainerIdentity::hash() ^ std::hash<QRVUUID>()(uuid_);
}

std::string QRVConcreteContainerIdentity::description() const {
  return fmt::format("<QRVConcreteContainerIdentity: {}; userIdentity = {}, identifier = {}, class = {}, uuid = {}>",
                     static_cast<const void*>(this), userIdentity()->shortDescription(), identifier(),
                     containerClass(), uuid_.string());
}
