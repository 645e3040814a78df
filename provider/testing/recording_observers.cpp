#include "provider/testing/recording_observers.h"

#include <algorithm>
#include <chrono>

namespace yomber {
namespace {

constexpr auto kPatience = std::chrono::seconds(10);

}  // namespace

std::vector<std::string> RecordedCalls::calls() const {
  LockGuard guard(_lock);
  return _calls;
}

bool RecordedCalls::waitUntilFinished() const {
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  LockGuard guard(_lock);
  while (!_finished) {
    if (!_changed.waitUntil(_lock, deadline)) return _finished;
  }
  return true;
}

bool RecordedCalls::isFinished() const {
  LockGuard guard(_lock);
  return _finished;
}

NSErrorRef RecordedCalls::error() const {
  LockGuard guard(_lock);
  return _error;
}

void RecordedCalls::record(const std::string& call) {
  LockGuard guard(_lock);
  _calls.push_back(call);
  if (call == "page" || call == "anchor" || call == "error") _finished = true;
  _changed.notifyAll();
}

void RecordedCalls::recordError(NSErrorRef error) {
  {
    LockGuard guard(_lock);
    _error = std::move(error);
  }
  record("error");
}

void RecordingEnumerationObserver::didEnumerateItems(const NSFileProviderItems& items) {
  {
    LockGuard guard(_lock);
    _items.insert(_items.end(), items.begin(), items.end());
  }
  record("items");
}

void RecordingEnumerationObserver::finishEnumeratingUpToPage(NSFileProviderPage nextPage) {
  {
    LockGuard guard(_lock);
    _nextPage = std::move(nextPage);
  }
  record("page");
}

void RecordingEnumerationObserver::finishEnumeratingWithError(NSErrorRef error) {
  recordError(std::move(error));
}

std::vector<NSFileProviderItemIdentifier> RecordingEnumerationObserver::identifiers() const {
  std::vector<NSFileProviderItemIdentifier> result;
  for (const auto& item : items()) result.push_back(item->itemIdentifier());
  return result;
}

NSFileProviderItems RecordingEnumerationObserver::items() const {
  LockGuard guard(_lock);
  return _items;
}

NSFileProviderPage RecordingEnumerationObserver::nextPage() const {
  LockGuard guard(_lock);
  return _nextPage;
}

void RecordingChangeObserver::didUpdateItems(const NSFileProviderItems& items) {
  if (whileCalled) whileCalled("updates");
  {
    LockGuard guard(_lock);
    for (const auto& item : items) _updated.push_back(item->itemIdentifier());
    std::sort(_updated.begin(), _updated.end());
  }
  record("updates");
}

void RecordingChangeObserver::didDeleteItemsWithIdentifiers(
    const std::vector<NSFileProviderItemIdentifier>& identifiers) {
  if (whileCalled) whileCalled("deletions");
  {
    LockGuard guard(_lock);
    _deleted.insert(_deleted.end(), identifiers.begin(), identifiers.end());
  }
  record("deletions");
}

void RecordingChangeObserver::finishEnumeratingChangesUpToSyncAnchor(
    NSFileProviderSyncAnchor anchor, bool moreComing) {
  if (whileCalled) whileCalled("anchor");
  {
    LockGuard guard(_lock);
    _anchor = std::move(anchor);
    _moreComing = moreComing;
  }
  record("anchor");
}

void RecordingChangeObserver::finishEnumeratingWithError(NSErrorRef error) {
  if (whileCalled) whileCalled("error");
  recordError(std::move(error));
}

std::vector<NSFileProviderItemIdentifier> RecordingChangeObserver::updated() const {
  LockGuard guard(_lock);
  return _updated;
}

std::vector<NSFileProviderItemIdentifier> RecordingChangeObserver::deleted() const {
  LockGuard guard(_lock);
  return _deleted;
}

NSFileProviderSyncAnchor RecordingChangeObserver::anchor() const {
  LockGuard guard(_lock);
  return _anchor;
}

bool RecordingChangeObserver::moreComing() const {
  LockGuard guard(_lock);
  return _moreComing;
}

}  // namespace yomber
