#pragma once

#include <memory>
#include <string>

#include "provider/services/listening_service_source.h"

namespace yomber {

/// Vends the sharing of one item.
///
/// Ownership and thread-safety: as ListeningServiceSource.
class QSSharingClient final : public ListeningServiceSource {
 public:
  static std::shared_ptr<QSSharingClient> initWithFileProviderExtension(
      std::shared_ptr<QSFileProviderExtension> fileProviderExtension, std::string itemIdentifier,
      std::shared_ptr<NSOperationQueue> operationQueue);

  /// QSSharingServiceName.
  [[nodiscard]] NSFileProviderServiceName serviceName() const override;

 protected:
  void exportObjectTo(NSXPCConnection& connection) override;
  [[nodiscard]] EndLog endLog() const override;

 private:
  using ListeningServiceSource::ListeningServiceSource;
};

}  // namespace yomber
