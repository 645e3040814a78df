#include "platform/fileprovider/reply_observers.h"

#include <algorithm>
#include <utility>

#include "platform/foundation/log.h"

namespace yomber {
namespace {

void logLateCall(const char* call) {
  log_fault(defaultLog(), "[CRIT] %s on an observer that has been finished already; ignored", call);
}

NSErrorRef invalidReply(const char* text) {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid,
                                  {{NSLocalizedDescriptionKey, std::string(text)}});
}

NSErrorRef orUnnamedFailure(NSErrorRef error) {
  return error != nullptr ? std::move(error)
                          : invalidReply("the extension failed without saying why");
}

NSErrorRef unfinishedError() {
  return invalidReply("the extension dropped the request without finishing it");
}

void append(NSFileProviderItems& to, const NSFileProviderItems& items) {
  std::copy_if(items.begin(), items.end(), std::back_inserter(to),
               [](const NSFileProviderItemRef& item) { return item != nullptr; });
}

}  // namespace

PageObserver::PageObserver(Handler handler) : handler_(std::move(handler)) {}

PageObserver::~PageObserver() {
  if (handler_) handler_(EnumeratedPage{.items = {}, .next = nullptr, .error = unfinishedError()});
}

void PageObserver::didEnumerateItems(const NSFileProviderItems& items) {
  LockGuard guard(mutex_);
  if (!handler_) return logLateCall("didEnumerateItems");
  append(page_.items, items);
}

void PageObserver::finishEnumeratingUpToPage(NSFileProviderPage nextPage) {
  Handler handler;
  EnumeratedPage page;
  {
    LockGuard guard(mutex_);
    if (!handler_) return logLateCall("finishEnumeratingUpToPage");
    handler = std::exchange(handler_, nullptr);
    page = std::move(page_);
  }
  page.next = std::move(nextPage);
  handler(std::move(page));
}

void PageObserver::finishEnumeratingWithError(NSErrorRef error) {
  Handler handler;
  {
    LockGuard guard(mutex_);
    if (!handler_) return logLateCall("finishEnumeratingWithError");
    handler = std::exchange(handler_, nullptr);
    page_.items.clear();
  }
  handler(
      EnumeratedPage{.items = {}, .next = nullptr, .error = orUnnamedFailure(std::move(error))});
}

ChangesObserver::ChangesObserver(Handler handler) : handler_(std::move(handler)) {}

ChangesObserver::~ChangesObserver() {
  if (!handler_) return;
  EnumeratedChanges unfinished;
  unfinished.error = unfinishedError();
  handler_(std::move(unfinished));
}

void ChangesObserver::didUpdateItems(const NSFileProviderItems& items) {
  LockGuard guard(mutex_);
  if (!handler_) return logLateCall("didUpdateItems");
  append(changes_.updated, items);
}

void ChangesObserver::didDeleteItemsWithIdentifiers(
    const std::vector<NSFileProviderItemIdentifier>& identifiers) {
  LockGuard guard(mutex_);
  if (!handler_) return logLateCall("didDeleteItemsWithIdentifiers");
  changes_.deleted.insert(changes_.deleted.end(), identifiers.begin(), identifiers.end());
}

void ChangesObserver::finishEnumeratingChangesUpToSyncAnchor(NSFileProviderSyncAnchor anchor,
                                                             bool moreComing) {
  Handler handler;
  EnumeratedChanges changes;
  {
    LockGuard guard(mutex_);
    if (!handler_) return logLateCall("finishEnumeratingChangesUpToSyncAnchor");
    handler = std::exchange(handler_, nullptr);
    changes = std::move(changes_);
  }
  if (anchor == nullptr) {
    changes.error = invalidReply("the extension told changes without an anchor");
  }
  changes.anchor = std::move(anchor);
  changes.moreComing = moreComing;
  handler(std::move(changes));
}

void ChangesObserver::finishEnumeratingWithError(NSErrorRef error) {
  Handler handler;
  EnumeratedChanges changes;
  {
    LockGuard guard(mutex_);
    if (!handler_) return logLateCall("finishEnumeratingWithError");
    handler = std::exchange(handler_, nullptr);
  }
  changes.error = orUnnamedFailure(std::move(error));
  handler(std::move(changes));
}

}  // namespace yomber
