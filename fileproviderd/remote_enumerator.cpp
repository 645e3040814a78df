#include "fileproviderd/remote_enumerator.h"

#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

using protocol::Enumerator;

std::vector<ItemFields> decodeItems(capnp::List<protocol::Item>::Reader items) {
  std::vector<ItemFields> decoded;
  decoded.reserve(items.size());
  for (const auto item : items) decoded.push_back(decodeItem(item));
  return decoded;
}

PageAnswer decodePage(Enumerator::PageResult::Reader result) {
  PageAnswer answer;
  if (result.isError()) {
    answer.error = ipc::decodeError(result.getError());
    return answer;
  }
  const auto page = result.getPage();
  answer.items = decodeItems(page.getItems());
  if (page.getNext().isValue()) {
    answer.next = NSData::dataWithString(stringFromWire(page.getNext().getValue()));
  }
  return answer;
}

ChangesAnswer decodeChanges(Enumerator::ChangesResult::Reader result) {
  ChangesAnswer answer;
  if (result.isError()) {
    answer.error = ipc::decodeError(result.getError());
    return answer;
  }
  const auto changes = result.getChanges();
  answer.updated = decodeItems(changes.getUpdated());
  answer.deleted.reserve(changes.getDeleted().size());
  for (const auto identifier : changes.getDeleted()) {
    answer.deleted.push_back(stringFromWire(identifier));
  }
  answer.anchor = NSData::dataWithString(stringFromWire(changes.getAnchor()));
  answer.moreComing = changes.getMoreComing();
  return answer;
}

}  // namespace

RemoteEnumerator::RemoteEnumerator(ipc::Remote<Enumerator> remote,
                                   std::chrono::milliseconds callLimit,
                                   std::function<void(const NSErrorRef&)> watchdog,
                                   std::shared_ptr<void> counted)
    : remote_(std::move(remote)),
      callLimit_(callLimit),
      watchdog_(std::move(watchdog)),
      counted_(std::move(counted)) {}

void RemoteEnumerator::items(const NSDataRef& page, std::function<void(PageAnswer)> handler) {
  (void)ipc::call(
      remote_, &Enumerator::Client::enumerateItemsRequest,
      [page](Enumerator::EnumerateItemsParams::Builder params) {
        if (page == nullptr) {
          params.initPage().setInitialByName();
        } else {
          params.initPage().setToken(wireData(page->bytes()));
        }
      },
      [handler = std::move(handler), watchdog = watchdog_](
          NSErrorRef error, const Enumerator::EnumerateItemsResults::Reader* results) {
        watchdog(error);
        PageAnswer answer;
        if (results != nullptr) {
          answer = decodePage(results->getResult());
        } else {
          answer.error = std::move(error);
        }
        handler(std::move(answer));
      },
      {.timeout = callLimit_});
}

void RemoteEnumerator::changes(const NSDataRef& anchor,
                               std::function<void(ChangesAnswer)> handler) {
  (void)ipc::call(
      remote_, &Enumerator::Client::enumerateChangesRequest,
      [anchor](Enumerator::EnumerateChangesParams::Builder params) {
        params.setAnchor(wireData(anchor->bytes()));
      },
      [handler = std::move(handler), watchdog = watchdog_](
          NSErrorRef error, const Enumerator::EnumerateChangesResults::Reader* results) {
        watchdog(error);
        ChangesAnswer answer;
        if (results != nullptr) {
          answer = decodeChanges(results->getResult());
        } else {
          answer.error = std::move(error);
        }
        handler(std::move(answer));
      },
      {.timeout = callLimit_});
}

void RemoteEnumerator::currentAnchor(std::function<void(AnchorAnswer)> handler) {
  (void)ipc::call(
      remote_, &Enumerator::Client::currentSyncAnchorRequest,
      [](Enumerator::CurrentSyncAnchorParams::Builder) {},
      [handler = std::move(handler), watchdog = watchdog_](
          NSErrorRef error, const Enumerator::CurrentSyncAnchorResults::Reader* results) {
        watchdog(error);
        AnchorAnswer answer;
        if (results != nullptr && results->getSupported()) {
          answer.anchor = NSData::dataWithString(stringFromWire(results->getAnchor()));
        }
        answer.error = std::move(error);
        handler(std::move(answer));
      },
      {.timeout = callLimit_});
}

}  // namespace yomber
