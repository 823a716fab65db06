// Decides whether and how a data container's protection class must change,
// starts the change operations that do it, records the class a container
// ended with in its info values, and at start-up restarts every change a
// previous run left unfinished. It also answers which class an
// application's entitlements ask for, for the containers created for it.
//
// Every update file is written, read and deleted on one serial queue,
// "com.kelva.Quorva.ProtectionOperationFileQueue", shared by all operations
// the manager makes: a newer change of a container replaces the older's file
// there, so the two never interleave.
//
// A change that has to wait for an unlock keeps the application stopped (a
// termination assertion, taken when the retry starts and released when the
// change ends): the application must not run half in the old class and half
// in the new one.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include "base/QRVError.h"
#include "base/QRVSerialQueue.h"
#include "dataprotection/QRVDataProtectionChangeOperation.h"
#include "model/QRVContainerIdentity.h"
#include "operations/QRVContainerOperationSeams.h"

struct QRVServices;

class QRVDataProtectionManager : public QRVDataProtectionQueries {
 public:
  // `error` is null on success.
  using Completion = std::function<void(const QRVError* error)>;

  // Entitlements naming the class an application asks for, in the order
  // they are consulted: the first that holds a string decides.
  static constexpr const char* kDefaultDataProtectionEntitlement = "com.kelva.developer.default-data-protection";
  static constexpr const char* kDataProtectionClassEntitlement = "data-protection-class";
  static constexpr const char* kLegacyDataProtectionClassEntitlement = "DataProtectionClass";

  // The services own the manager; it holds them weakly.
  explicit QRVDataProtectionManager(std::weak_ptr<QRVServices> services);

  // 0 when the identifier's entitlements ask for no class (or name one this
  // daemon does not know, which is logged).
  uint32_t intendedDataProtectionClassBasedOnEntitlementsForIdentifier(const std::string& identifier) override;

  // Changes the class of the data container `containerIdentity` names (its
  // UUID, if any, is not consulted) to `dataProtectionClass`. The completion
  // is called exactly once: at once for a refused or needless change,
  // otherwise when the change has ended, which on a locked device with
  // `retryIfLocked` is after the next unlock. Codes: 11 (not a data
  // container class), 21 (no such container), 38 (a class the caller may
  // not ask for), and those of the change operation.
  void setDataProtectionOnDataContainerForContainerIdentity(const QRVContainerIdentityRef& containerIdentity,
                                                            int32_t dataProtectionClass, bool isSecondOrThirdPartyApp,
                                                            bool retryIfLocked, Completion completion);

  // Turns every update file left in the pending-updates directory back into
  // a running change. A file that cannot be read or names a container that
  // is gone is logged and left where it is; the others still start. Fails
  // only when the directory cannot be listed (a missing one is success).
  bool restartPendingDataProtectionOperationsWithError(QRVError* error);

  // Sets the operation's retry-start and completion blocks and performs it.
  // The first pass runs on the calling thread.
  void _startDataProtectionChangeOperation(const std::shared_ptr<QRVDataProtectionChangeOperation>& operation,
                                           Completion completion);

  const std::shared_ptr<QRVSerialQueue>& protectionOperationFileQueue() const { return fileQueue_; }

 private:
  std::shared_ptr<QRVServices> _services() const;

  std::weak_ptr<QRVServices> services_;
  std::shared_ptr<QRVSerialQueue> fileQueue_;
};
