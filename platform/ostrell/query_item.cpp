#include "platform/ostrell/query_item.h"

#include <optional>
#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/ostrell/container.h"
#include "platform/ostrell/daemon_link.h"
#include "platform/ostrell/daemon_wire.h"
#include "platform/ostrell/errors.h"
#include "platform/ostrell/patient_call.h"

namespace yomber {
namespace {

using Wire = protocol::Daemon;

}  // namespace

QSQueryItem::QSQueryItem(ItemFields fields)
    : fields_(std::move(fields)),
      fileObjectID_(QSFileObjectID::fileObjectIDWithString(fields_.identifier)) {}

bool QSQueryItem::isDead() const { return (fields_.flags & protocol::ITEM_FLAG_DEAD) != 0; }

std::string QSQueryItem::description() const {
  std::string text = "<QSQueryItem " + fields_.identifier;
  if (isDead()) return text + " dead>";
  return text + " \"" + fields_.filename + "\" in " + fields_.parentIdentifier + ">";
}

QSQueryItemRef QSQueryItem::containerItemForContainer(
    const std::shared_ptr<const QSContainer>& container, ForceScan forceScan) {
  if (!container) return nullptr;
  QSQueryItemRef item;
  NSErrorRef refusal;
  const NSErrorRef failure = DaemonLink::current()->callAndWait(
      &Wire::Client::containerItemRequest,
      [&](Wire::ContainerItemParams::Builder params) {
        params.setContainerID(wireText(container->containerID()));
        params.setForceScan(forceScan == ForceScan::Yes);
      },
      [&](const Wire::ContainerItemResults::Reader& results) {
        item = decodeItemResult(results.getResult(), &refusal);
      });
  if (failure || refusal) {
    log_error(qsc_default_log(), "[ERROR] can't get the item of the container %@: %@",
              container->containerID(), failure ? failure : refusal);
    return nullptr;
  }
  return item;
}

QSQueryItemRef QSQueryItem::askDaemonQueryItemForURL(const NSURLRef& url, ForceScan andFakeFSEvent,
                                                     NSErrorRef* error) {
  if (!url) {
    storeError(error, NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError));
    return nullptr;
  }
  const bool isScan = andFakeFSEvent == ForceScan::Yes;
  const auto link = DaemonLink::current();
  NSErrorRef failure;
  const auto session = link->waitForSession(&failure);
  using Answer = std::pair<QSQueryItemRef, NSErrorRef>;
  std::optional<Answer> answer;
  const auto fill = [path = url->path(), isScan](Wire::ItemAtLocationParams::Builder params) {
    params.setPath(wireData(path));
    params.setFakeFSEvent(isScan);
  };
  const auto decode = [](const Wire::ItemAtLocationResults::Reader& results) {
    Answer decoded;
    decoded.first = decodeItemResult(results.getResult(), &decoded.second);
    return decoded;
  };
  if (session && isScan) {  // reads all that a new folder holds
    failure =
        waitPatiently(link, session, &Wire::Client::itemAtLocationRequest, fill, decode, answer);
  } else if (session) {
    failure = link->callAndWait(&Wire::Client::itemAtLocationRequest, fill,
                                [&](const auto& results) { answer = decode(results); });
  }
  if (answer && answer->second) failure = answer->second;
  if (failure) storeError(error, failure);
  return answer && !failure ? answer->first : nullptr;
}

NSFileProviderItems fileProviderItems(const QSQueryItems& items) {
  return {items.begin(), items.end()};
}

}  // namespace yomber
