// Handing out the group containers an identifier claims.
//
// Group containers come into being the first time one of their claimants
// asks for them. The claims are read and the containers looked up under the
// global lock, so that the sweep and the mapping's deletions (which run under
// the global write lock) never remove a group between the moment its claim is
// read and the moment its container is handed out.
//
// Almost every request finds all its groups already there, so the first pass
// only looks up, under the global read lock, beside other readers. Only when
// a group is missing does a second pass take the global write lock, which a
// creation without locking of its own requires, read the claims again (they
// may have changed while no lock was held) and create what is missing.
#include "base/QRVLog.h"
#include "codesigning/QRVGroupManager.h"
#include "core/QRVLocks.h"
#include "model/QRVContainerCache.h"
#include "operations/QRVClientConnection.h"

namespace {

enum class GroupPass { kLookUpOnly, kCreate };

}  // namespace

std::optional<std::map<std::string, QRVMetadataRef>> QRVClientConnection::groupContainersForOwnerIdentifier(
    const std::optional<std::string>& ownerIdentifier, const QRVUserIdentityRef& userIdentity,
    QRVContainerClass groupContainerClass, QRVError* error) {
  QRVGroupManager& groups = *services_->groupManager;
  if (!ownerIdentifier) {
    // The claims query logs and answers an absent owner (11).
    groups.groupContainerIdentifiersForOwnerIdentifier(std::nullopt, groupContainerClass, /*useLocking=*/false, error);
    return std::nullopt;
  }

  const std::string& caller = clientIdentity_->bundleIdentifier();
  const std::string& owner = *ownerIdentifier;
  bool allowed =
      owner == caller || allowOtherIdLookup_ || unrestricted_ ||
      isEntitledForLookupWithClass(groupContainerClass, owner) ||
      services_->wellKnownNames->isLookupWhitelistedFromCodeSignIdentifier(caller, groupContainerClass, owner);
  if (!allowed) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kNotEntitled,
                             "{} not entitled to retrieve group container class {} with identifier {}", caller,
                             groupContainerClass, owner));
    return std::nullopt;
  }
  // The owner's claims are what entitle the caller to each group below.
  setAllowGroupIdLookup(true);

  // One pass over the owner's groups under the lock the caller holds. Returns
  // false (with `missing` set) when a look-up-only pass found a group absent.
  auto pass = [&](GroupPass mode, std::map<std::string, QRVMetadataRef>* out, bool* missing) {
    auto groupIdentifiers =
        groups.groupContainerIdentifiersForOwnerIdentifier(owner, groupContainerClass, /*useLocking=*/false, error);
    if (!groupIdentifiers) return false;
    for (const std::string& groupIdentifier : *groupIdentifiers) {
      QRVError groupError;
      QRVContainerIdentityRef identity = QRVContainerIdentity::containerIdentityWithUserIdentity(
          userIdentity, groupIdentifier, groupContainerClass, &groupError);
      QRVMetadataRef container =
          identity ? createOrLookupContainerWithContainerIdentity(
                         identity, /*createIfNecessary=*/mode == GroupPass::kCreate, /*transient=*/false,
                         /*useLocking=*/false, &groupError)
                   : nullptr;
      if (container) {
        (*out)[groupIdentifier] = container;
        continue;
      }
      if (mode == GroupPass::kLookUpOnly && QRVContainerCache::isNotFoundError(groupError)) {
        *missing = true;
        return false;
      }
      // One damaged group must not cost the caller all the others.
      QRVLogError("Failed to create or lookup group container: {} : {}", groupIdentifier, groupError.resultCode());
    }
    return true;
  };

  std::map<std::string, QRVMetadataRef> containers;
  bool missing = false;
  {
    QRVGlobalReadLock readLock;
    if (pass(GroupPass::kLookUpOnly, &containers, &missing)) return containers;
  }
  if (!missing) return std::nullopt;  // the claims could not be read

  containers.clear();
  QRVGlobalWriteLock writeLock;
  if (!pass(GroupPass::kCreate, &containers, &missing)) return std::nullopt;
  return containers;
}
