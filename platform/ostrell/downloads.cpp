#include "platform/ostrell/downloads.h"

#include <utility>

#include "platform/ostrell/daemon_connection.h"

namespace yomber {

void QSStartDownloadForItemsWithOptions(const std::vector<NSURLRef>& urls, std::uint64_t options,
                                        QSErrorReply completion) {
  const auto complete = [completion = std::move(completion)](const NSErrorRef& error) {
    if (completion) completion(error);
  };
  QSDaemonConnection::defaultConnection()
      .remoteObjectProxyWithErrorHandler(complete)
      ->startDownloadingItemsAtURLs(urls, options, complete);
}

}  // namespace yomber
