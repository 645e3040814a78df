#pragma once

#include <memory>
#include <string>

#include "provider/services/listening_service_source.h"

namespace yomber {

/// Vends what live collaboration on one document needs.
///
/// Ownership and thread-safety: as ListeningServiceSource.
class QSFileProviderPandrelCollaborationServiceSource final : public ListeningServiceSource {
 public:
  static std::shared_ptr<QSFileProviderPandrelCollaborationServiceSource>
  initWithFileProviderExtension(std::shared_ptr<QSFileProviderExtension> fileProviderExtension,
                                std::string itemIdentifier,
                                std::shared_ptr<NSOperationQueue> operationQueue);

  /// QSCollaborationServiceName.
  [[nodiscard]] NSFileProviderServiceName serviceName() const override;

 protected:
  void exportObjectTo(NSXPCConnection& connection) override;
  [[nodiscard]] EndLog endLog() const override;

 private:
  using ListeningServiceSource::ListeningServiceSource;
};

}  // namespace yomber
