#include "platform/ostrell/daemon_connection.h"

#include <utility>

#include "platform/ostrell/daemon_link.h"
#include "platform/ostrell/daemon_proxies.h"

namespace yomber {
namespace {

/// Finds the link afresh for each proxy, since a test may replace it.
class DefaultConnection final : public QSDaemonConnection {
 public:
  QSDaemonProxyRef remoteObjectProxyWithErrorHandler(
      std::function<void(NSErrorRef)> errorHandler) override {
    return makeDaemonProxy(DaemonLink::current(), std::move(errorHandler));
  }
  QSDaemonSyncProxyRef newSyncProxy() override {
    return makeDaemonSyncProxy(DaemonLink::current());
  }
};

}  // namespace

std::string QSContentRecordIDs::description() const {
  std::string text = "{";
  for (const auto& [object, record] : recordIDs_) {
    if (text.size() > 1) text += ", ";
    text += object->asString() + " = " + record.description();
  }
  return text + "}";
}

QSDaemonConnection& QSDaemonConnection::defaultConnection() {
  static DefaultConnection connection;
  return connection;
}

void QSDaemonConnection::setDefaultHome(const std::string& home) {
  DaemonLink::replaceCurrent(home);
}

}  // namespace yomber
