#include "platform/ostrell/record_store.h"

#include <memory>

#include "platform/ostrell/account.h"
#include "platform/rozzel/container.h"
#include "platform/rozzel/embedded_engine.h"

namespace yomber {

void installRecordStore(const std::string& folder) {
  RZContainer::setSessionSource([engine = std::make_shared<EmbeddedEngine>(folder)] {
    RZContainer::Session session{.engine = engine};
    const QSAccountRef account = QSAccount::currentCachedLoggedInAccountWithError(nullptr);
    if (account != nullptr) session.accountName = account->name();
    return session;
  });
}

RZOperationGroupRef qs_downloadThumbnailsUserInitiated() {
  return std::make_shared<const RZOperationGroup>("download-thumbnails-user-initiated");
}

}  // namespace yomber
