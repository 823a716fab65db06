// The deferred step that takes containers out of service: each container is
// renamed onto death row (or, when that fails, deleted where it is) and
// forgotten by the container cache. A background queue deletes what lies on
// death row later.
//
// Codes: QRVResultCode::kNotDeleted when a container can be neither moved nor
// deleted, kCacheRemoveFailed when the cache cannot forget it. The first failure ends the run; containers staged
// before it stay staged. An exception is a bug: it goes to the crash
// reporter.
#pragma once

#include <functional>
#include <memory>
#include <vector>

#include "core/QRVCommandQueue.h"
#include "core/QRVServices.h"
#include "model/QRVContainerIdentity.h"

class QRVCommandStageForDelete : public QRVCommand {
 public:
  static constexpr uint64_t kCommandType = 3;

  using ErrorHandler = std::function<void(uint64_t code)>;

  static std::shared_ptr<QRVCommandStageForDelete> commandForStageForDeleteWithContainerIdentities(
      std::vector<QRVContainerIdentityRef> containerIdentities, bool useLocking, ErrorHandler onError,
      std::shared_ptr<QRVServices> services);

  uint64_t command() const override { return kCommandType; }
  bool fromQueue(QRVCommandQueue& queue, uint64_t* result) override;

  bool useLocking() const { return useLocking_; }
  const std::vector<QRVContainerIdentityRef>& containerIdentities() const { return containerIdentities_; }

 private:
  QRVCommandStageForDelete(std::vector<QRVContainerIdentityRef> containerIdentities, bool useLocking,
                           ErrorHandler onError, std::shared_ptr<QRVServices> services)
      : useLocking_(useLocking),
        containerIdentities_(std::move(containerIdentities)),
        onError_(std::move(onError)),
        services_(std::move(services)) {}

  bool stage(const QRVContainerIdentity& identity, QRVCommandQueue& queue, uint64_t* result);

  const bool useLocking_;
  const std::vector<QRVContainerIdentityRef> containerIdentities_;
  const ErrorHandler onError_;
  const std::shared_ptr<QRVServices> services_;
};
