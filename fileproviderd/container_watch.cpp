#include "fileproviderd/container_watch.h"

#include <algorithm>
#include <iterator>
#include <utility>

#include "fileproviderd/host_errors.h"
#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/errors.h"
#include "platform/foundation/log.h"
#include "protocols/common.capnp.h"

namespace yomber {
namespace {

bool isExpired(const NSErrorRef& error) {
  return error->is(NSFileProviderErrorDomain, NSFileProviderErrorSyncAnchorExpired);
}

/// Folders come and go; the framework's own containers do not.
bool canGoAway(const std::string& container) {
  return container != NSFileProviderRootContainerItemIdentifier &&
         container != NSFileProviderWorkingSetContainerItemIdentifier &&
         container != NSFileProviderAllDirectoriesContainerItemIdentifier;
}

/// Whether the changes say that the item is gone.
bool isDeleted(const std::string& identifier, const ChangesAnswer& changes) {
  const auto isItDead = [&](const ItemFields& item) {
    return item.identifier == identifier && (item.flags & protocol::ITEM_FLAG_DEAD) != 0;
  };
  return std::ranges::count(changes.deleted, identifier) > 0 ||
         std::ranges::any_of(changes.updated, isItDead);
}

bool isSameAnchor(const NSDataRef& one, const NSDataRef& other) {
  return one != nullptr && one->isEqualToData(other);
}

/// Hands `all` over in pieces of at most `limit`.
template <typename T, typename Take>
void inPieces(std::vector<T> all, std::size_t limit, const Take& take) {
  if (all.size() <= limit) {
    if (!all.empty()) take(std::move(all));
    return;
  }
  for (std::size_t start = 0; start < all.size(); start += limit) {
    const auto first = all.begin() + static_cast<std::ptrdiff_t>(start);
    const auto count = static_cast<std::ptrdiff_t>(std::min(limit, all.size() - start));
    take(std::vector<T>(std::make_move_iterator(first), std::make_move_iterator(first + count)));
  }
}

}  // namespace

template <typename... Arguments>
std::function<void(Arguments...)> ContainerWatch::inThisEpoch(
    void (ContainerWatch::*step)(Arguments...)) {
  return [weak = weak_from_this(), epoch = epoch_, step](Arguments... arguments) {
    const auto self = weak.lock();
    if (self != nullptr && self->epoch_ == epoch) {
      (self.get()->*step)(std::forward<Arguments>(arguments)...);
    }
  };
}

ContainerWatch::ContainerWatch(std::string container, EnumeratorSource& source, HostClock& clock,
                               std::shared_ptr<ContainerWatcher> watcher,
                               const Backoff::Random& random, Limits limits)
    : container_(std::move(container)),
      source_(source),
      clock_(clock),
      limits_(limits),
      outbox_(std::make_shared<WatcherOutbox>(std::move(watcher))),
      failureBackoff_(random),
      expiryBackoff_(random) {}

void ContainerWatch::start() {
  outbox_->setOnIdle([weak = weak_from_this()] {
    const auto self = weak.lock();
    if (self == nullptr) return;
    if (const auto step = std::exchange(self->afterTelling_, nullptr)) step();
    self->advance();
  });
  beginPass();
}

void ContainerWatch::signalled() {
  isSignalled_ = true;
  advance();
}

void ContainerWatch::wake() {
  if (stage_ == Stage::Live) return signalled();
  if (stage_ == Stage::Waiting && waitingFor_ != WaitingFor::Calm) tryAgainNow();
}

void ContainerWatch::accountMayHaveChanged() {
  if (stage_ == Stage::Waiting && waitingFor_ == WaitingFor::SignIn) tryAgainNow();
}

void ContainerWatch::tryAgainNow() {
  failureBackoff_.reset();
  beginPass();
}

void ContainerWatch::extensionDidEnd(const NSErrorRef& reason) {
  if (enumerator_ != nullptr) passFailed(reason);
}

// --- A pass.

void ContainerWatch::leaveEpoch() {
  ++epoch_;
  timer_.reset();
  afterTelling_ = nullptr;
  isAsking_ = false;
  hasMore_ = false;
  drained_.clear();
  hasOverflowed_ = false;
}

void ContainerWatch::beginPass() {
  leaveEpoch();
  stage_ = Stage::Opening;
  isSignalled_ = false;
  hasAskedInSettling_ = false;
  anchor_ = nullptr;
  picture_.beginListing();
  source_.enumerator(container_, [weak = weak_from_this(), epoch = epoch_](
                                     HostedEnumeratorRef enumerator, const NSErrorRef& error) {
    const auto self = weak.lock();
    if (self != nullptr && self->epoch_ == epoch) self->didOpen(std::move(enumerator), error);
  });
}

void ContainerWatch::didOpen(HostedEnumeratorRef enumerator, const NSErrorRef& error) {
  if (enumerator == nullptr) return passFailed(error);
  enumerator_ = std::move(enumerator);
  takeAnchor();
}

void ContainerWatch::takeAnchor() {
  enumerator_->currentAnchor(inThisEpoch(&ContainerWatch::didTakeAnchor));
}

void ContainerWatch::didTakeAnchor(AnchorAnswer answer) {
  if (answer.error != nullptr) return passFailed(answer.error);
  if (answer.anchor == nullptr) {
    return end(fileProviderErrorForUnsupportedFeature("watching this container"));
  }
  anchor_ = std::move(answer.anchor);
  stage_ = Stage::Listing;
  listPage(nullptr);
}

void ContainerWatch::listPage(const NSDataRef& page) {
  if (hasOverflowed_) return anchorExpired();
  enumerator_->items(page, inThisEpoch(&ContainerWatch::didListPage));
}

void ContainerWatch::didListPage(PageAnswer answer) {
  if (answer.error != nullptr) return passFailed(answer.error);
  tellListed(std::move(answer.items));
  if (answer.next == nullptr) return settle();
  whenTold([this, next = std::move(answer.next)] { listPage(next); });
}

void ContainerWatch::tellListed(std::vector<ItemFields> items) {
  std::erase_if(items, [this](const ItemFields& item) {
    return picture_.didList(item) == ContainerPicture::Change::Unchanged;
  });
  tellItems(std::move(items));
}

void ContainerWatch::settle() {
  if (hasOverflowed_) return anchorExpired();
  stage_ = Stage::Settling;
  tellDrained();
  advance();
}

void ContainerWatch::finishPass() {
  auto gone = picture_.endListing();
  if (isFirstPass_) {
    isFirstPass_ = false;
    outbox_->send([](ContainerWatcher& watcher, ContainerWatcher::Answered answered) {
      watcher.didList({}, true, std::move(answered));
    });
  }
  tellDeletions(std::move(gone));
  if (std::exchange(isPaused_, false)) {
    outbox_->send([](ContainerWatcher& watcher, ContainerWatcher::Answered answered) {
      watcher.didResume(std::move(answered));
    });
  }
  stage_ = Stage::Live;
  liveSince_ = clock_.now();
  failureBackoff_.reset();
  advance();
}

// --- Changes.

void ContainerWatch::advance() {
  if (isAsking_) return;
  switch (stage_) {
    case Stage::Listing:
      if ((isSignalled_ || hasMore_) && !hasOverflowed_) askForChanges();
      return;
    case Stage::Settling:
      if (!outbox_->isIdle()) return;
      // Not until no signal comes: in a busy folder there is always one.
      if (hasAskedInSettling_ && !hasMore_) return finishPass();
      hasAskedInSettling_ = true;
      return askForChanges();
    case Stage::Live:
      if ((isSignalled_ || hasMore_) && outbox_->isIdle()) askForChanges();
      return;
    case Stage::Opening:
    case Stage::Waiting:
    case Stage::Confirming:
    case Stage::Ended:
      return;
  }
}

void ContainerWatch::askForChanges() {
  isAsking_ = true;
  isSignalled_ = false;
  hasMore_ = false;
  enumerator_->changes(anchor_, inThisEpoch(&ContainerWatch::didGetChanges));
}

void ContainerWatch::didGetChanges(ChangesAnswer answer) {
  isAsking_ = false;
  if (answer.error != nullptr) {
    return isExpired(answer.error) ? anchorExpired() : passFailed(answer.error);
  }
  const bool hasMoved = !isSameAnchor(anchor_, answer.anchor);
  const bool isEmpty = answer.updated.empty() && answer.deleted.empty();
  // "More" with nothing and no new anchor would be asked for without end.
  hasMore_ = answer.moreComing && (hasMoved || !isEmpty);
  anchor_ = std::move(answer.anchor);
  const bool isFolderGone = isDeleted(container_, answer);
  if (stage_ == Stage::Listing) {
    keep(std::move(answer));
  } else {
    tellChanges(std::move(answer.updated), answer.deleted);
  }
  if (isFolderGone) {
    return passFailed(fileProviderErrorForNonExistentItemWithIdentifier(container_));
  }
  advance();
}

void ContainerWatch::keep(ChangesAnswer answer) {
  for (auto& item : answer.updated) {
    const bool isDead = (item.flags & protocol::ITEM_FLAG_DEAD) != 0;
    auto& place = drained_[item.identifier];
    place = isDead ? std::nullopt : std::optional(std::move(item));
  }
  for (const auto& identifier : answer.deleted) drained_[identifier] = std::nullopt;
  if (drained_.size() <= limits_.drained) return;
  log_default(defaultLog(), "[NOTICE] %s changes faster than it can be listed; listing it again",
              container_.c_str());
  hasOverflowed_ = true;
  drained_.clear();
}

void ContainerWatch::tellDrained() {
  std::vector<ItemFields> updated;
  std::vector<std::string> deleted;
  for (auto& [identifier, item] : std::exchange(drained_, {})) {
    if (item) {
      updated.push_back(std::move(*item));
    } else {
      deleted.push_back(identifier);
    }
  }
  tellChanges(std::move(updated), deleted);
}

void ContainerWatch::tellChanges(std::vector<ItemFields> updated,
                                 const std::vector<std::string>& deleted) {
  std::vector<std::string> gone;
  const auto isNoNews = [&](const ItemFields& item) {
    if ((item.flags & protocol::ITEM_FLAG_DEAD) != 0) {
      if (picture_.didDelete(item.identifier)) gone.push_back(item.identifier);
      return true;
    }
    const auto change = picture_.didUpdate(item);
    return change == ContainerPicture::Change::Unchanged ||
           change == ContainerPicture::Change::Outdated;
  };
  std::erase_if(updated, isNoNews);
  for (const auto& identifier : deleted) {
    if (picture_.didDelete(identifier)) gone.push_back(identifier);
  }
  tellItems(std::move(updated));
  tellDeletions(std::move(gone));
}

void ContainerWatch::tellItems(std::vector<ItemFields> items) {
  inPieces(std::move(items), limits_.itemsPerCall, [this](std::vector<ItemFields> piece) {
    outbox_->send([piece = std::move(piece), isListing = isFirstPass_](
                      ContainerWatcher& watcher, ContainerWatcher::Answered answered) {
      if (isListing) {
        watcher.didList(piece, false, std::move(answered));
      } else {
        watcher.didUpdate(piece, std::move(answered));
      }
    });
  });
}

void ContainerWatch::tellDeletions(std::vector<std::string> identifiers) {
  inPieces(std::move(identifiers), limits_.itemsPerCall, [this](std::vector<std::string> piece) {
    outbox_->send(
        [piece = std::move(piece)](ContainerWatcher& watcher, ContainerWatcher::Answered answered) {
          watcher.didDelete(piece, std::move(answered));
        });
  });
}

void ContainerWatch::whenTold(std::function<void()> step) {
  if (outbox_->isIdle()) return step();
  afterTelling_ = std::move(step);
}

// --- Failures.

void ContainerWatch::anchorExpired() {
  const bool wasCalm = stage_ == Stage::Live && clock_.now() - liveSince_ >= limits_.calm;
  log_debug(defaultLog(), "[DEBUG] the anchor of %s expired, listing again", container_.c_str());
  leaveEpoch();
  // It watches where the folder was when it was opened, which may have moved since.
  enumerator_.reset();
  if (wasCalm) {
    expiryBackoff_.reset();
    return beginPass();
  }
  waitForNextPass(expiryBackoff_.next(), WaitingFor::Calm);
}

void ContainerWatch::passFailed(const NSErrorRef& error) {
  log_default(defaultLog(), "[NOTICE] cannot see the changes of %s: %@", container_.c_str(), error);
  leaveEpoch();
  enumerator_.reset();
  if (!isNoSuchItemError(error) || !canGoAway(container_)) return retryLater(error);
  stage_ = Stage::Confirming;
  // The extension says the same when it cannot reach zarn.
  source_.isGone(container_, [weak = weak_from_this(), epoch = epoch_, error](bool isGone) {
    const auto self = weak.lock();
    if (self == nullptr || self->epoch_ != epoch) return;
    if (isGone) {
      self->end(error);
    } else {
      self->retryLater(error);
    }
  });
}

void ContainerWatch::retryLater(const NSErrorRef& error) {
  if (!std::exchange(isPaused_, true)) {
    outbox_->send([error](ContainerWatcher& watcher, ContainerWatcher::Answered answered) {
      watcher.didPause(error, std::move(answered));
    });
  }
  const bool isSignedOut =
      error->is(NSFileProviderErrorDomain, NSFileProviderErrorNotAuthenticated);
  waitForNextPass(failureBackoff_.next(), isSignedOut ? WaitingFor::SignIn : WaitingFor::Recovery);
}

void ContainerWatch::waitForNextPass(std::chrono::milliseconds delay, WaitingFor what) {
  stage_ = Stage::Waiting;
  waitingFor_ = what;
  timer_ = clock_.after(delay, [weak = weak_from_this()] {
    if (const auto self = weak.lock()) self->beginPass();
  });
}

void ContainerWatch::end(const NSErrorRef& error) {
  leaveEpoch();
  enumerator_.reset();
  stage_ = Stage::Ended;
  tellDeletions(picture_.clear());
  outbox_->send([error](ContainerWatcher& watcher, ContainerWatcher::Answered answered) {
    watcher.didEnd(error, std::move(answered));
  });
}

}  // namespace yomber
