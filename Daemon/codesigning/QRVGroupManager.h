// Group containers: shared by every identifier that claims the same
// application group (class 7) or system group (class 13). They have no owner:
// they exist because identifiers claim them, they are created the first time
// a claimant asks for them, and the sweep removes those nobody claims any
// more. The truth is the set of claims in the code-signing database, read as
// counted sets from the code-signing mapping; this class keeps no state.
//
// Losing the last claim through one identifier's new information is handled
// by the mapping itself; the sweep here is the boot-time catch-all (for
// claimants removed while the daemon was down).
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/QRVError.h"
#include "codesigning/QRVCodeSigningMapping.h"
#include "model/QRVContainerClass.h"
#include "model/QRVUserIdentity.h"

class QRVCommandQueue;
struct QRVServices;

class QRVGroupManager {
 public:
  // `services` as for the mapping: held weakly, the services own this.
  explicit QRVGroupManager(std::weak_ptr<QRVServices> services);

  // The group identifiers `ownerIdentifier` claims: its system groups for
  // class 13, its application groups otherwise (empty when none). With
  // `useLocking` the global read lock is held for the call. Codes: 11.
  std::optional<std::vector<std::string>> groupContainerIdentifiersForOwnerIdentifier(
      const std::optional<std::string>& ownerIdentifier, QRVContainerClass groupContainerClass, bool useLocking,
      QRVError* error);

  // Queues the deletion of every group container of `type` that no
  // database entry claims: application groups for every accessible user
  // whose user base directory exists, system groups for the default user.
  void reconcileGroupContainersOfType(QRVGroupType type, QRVCommandQueue& commandQueue);

  // The per-user sweep: containers of `containerClass` of `userIdentity`
  // whose identifier has no count in `referenceCounts`.
  void _cleanupUnreferencedGroupContainersForUserIdentity(const QRVUserIdentityRef& userIdentity,
                                                          QRVContainerClass containerClass,
                                                          const QRVGroupReferenceCounts& referenceCounts,
                                                          QRVCommandQueue& commandQueue);

 private:
  std::weak_ptr<QRVServices> services_;
};
