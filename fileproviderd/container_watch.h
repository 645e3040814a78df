#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "fileproviderd/backoff.h"
#include "fileproviderd/container_picture.h"
#include "fileproviderd/host_clock.h"
#include "fileproviderd/hosted_enumerator.h"
#include "fileproviderd/watcher_outbox.h"

namespace yomber {

/// Keeps one watcher's picture of one container right, whatever happens to the extension and to
/// zarn.
///
/// A pass takes the anchor, lists page by page, drains the changes that are signalled meanwhile and
/// applies them when the listing is complete. From then on the watch is live: a signal makes it ask
/// for the changes since the anchor that it was given last; one request is in flight, one more is
/// remembered. It never asks for the current anchor again without listing again. On an expired
/// anchor, and after any failure, it makes another pass and tells the watcher only what differs
/// from what it was told before. When the folder itself is gone, the watch ends.
///
/// A watcher gets one call after the other. While it has not answered, no changes are asked for:
/// they wait in the extension, merged and bounded, and expire when there are too many. So nothing
/// is buffered here for a slow watcher.
///
/// Thread-safety: loop thread only.
/// Ownership: shared; destroying it ends the watch and invalidates its enumerator.
class ContainerWatch : public std::enable_shared_from_this<ContainerWatch> {
 public:
  struct Limits {
    std::size_t drained = 100'000;  ///< changes kept during a listing; with more it starts again
    std::size_t itemsPerCall = 1'000;
    /// A watch that was live for so long lists again at once when its anchor expires.
    std::chrono::milliseconds calm{1'000};
  };

  /// `source` and `clock` must outlive the watch.
  ContainerWatch(std::string container, EnumeratorSource& source, HostClock& clock,
                 std::shared_ptr<ContainerWatcher> watcher, const Backoff::Random& random,
                 Limits limits);
  ContainerWatch(std::string container, EnumeratorSource& source, HostClock& clock,
                 std::shared_ptr<ContainerWatcher> watcher, const Backoff::Random& random)
      : ContainerWatch(std::move(container), source, clock, std::move(watcher), random, Limits{}) {}

  void start();

  /// The container has changes.
  void signalled();
  /// zarn is there (again): a watch that failed tries again at once.
  void wake();
  /// So does one that waits for somebody to sign in, and no other.
  void accountMayHaveChanged();
  /// The extension is gone, and the enumerator with it.
  void extensionDidEnd(const NSErrorRef& reason);

  [[nodiscard]] const std::string& container() const { return container_; }
  [[nodiscard]] bool isLive() const { return stage_ == Stage::Live; }
  [[nodiscard]] bool hasEnded() const { return stage_ == Stage::Ended; }
  [[nodiscard]] bool hasEnumerator() const { return enumerator_ != nullptr; }

 private:
  enum class Stage : std::uint8_t {
    Opening,  ///< gets an enumerator, then its anchor
    Listing,
    Settling,  ///< all pages are there; gets the changes made meanwhile
    Live,
    Waiting,     ///< for the next attempt
    Confirming,  ///< asks whether the folder is really gone
    Ended,
  };
  enum class WaitingFor : std::uint8_t {
    Calm,  ///< the folder changes faster than it can be listed
    SignIn,
    Recovery,
  };
  using Drained = std::unordered_map<std::string, std::optional<ItemFields>>;

  void beginPass();
  void didOpen(HostedEnumeratorRef enumerator, const NSErrorRef& error);
  void takeAnchor();
  void didTakeAnchor(AnchorAnswer answer);
  void listPage(const NSDataRef& page);
  void didListPage(PageAnswer answer);
  void tellListed(std::vector<ItemFields> items);

  void advance();
  void askForChanges();
  void didGetChanges(ChangesAnswer answer);
  void keep(ChangesAnswer answer);
  void settle();
  void tellDrained();
  void tellChanges(std::vector<ItemFields> updated, const std::vector<std::string>& deleted);
  void tellItems(std::vector<ItemFields> items);
  void tellDeletions(std::vector<std::string> identifiers);
  void finishPass();

  void anchorExpired();
  void passFailed(const NSErrorRef& error);
  void retryLater(const NSErrorRef& error);
  void waitForNextPass(std::chrono::milliseconds delay, WaitingFor what);
  void tryAgainNow();
  void end(const NSErrorRef& error);
  void leaveEpoch();

  /// Wraps a step so that it runs only while the watch lives and nothing has begun anew since.
  template <typename... Arguments>
  std::function<void(Arguments...)> inThisEpoch(void (ContainerWatch::*step)(Arguments...));
  void whenTold(std::function<void()> step);

  const std::string container_;
  EnumeratorSource& source_;
  HostClock& clock_;
  const Limits limits_;
  const std::shared_ptr<WatcherOutbox> outbox_;

  Stage stage_ = Stage::Waiting;
  WaitingFor waitingFor_ = WaitingFor::Recovery;
  std::uint64_t epoch_ = 0;  ///< answers to what was asked in an earlier one are dropped
  HostedEnumeratorRef enumerator_;
  NSDataRef anchor_;
  bool isAsking_ = false;     ///< a request for changes is in flight
  bool isSignalled_ = false;  ///< the container has changed since the last request
  bool hasMore_ = false;      ///< the last answer was not the whole
  bool hasAskedInSettling_ = false;
  Drained drained_;
  bool hasOverflowed_ = false;

  ContainerPicture picture_;
  bool isFirstPass_ = true;  ///< the watcher has not got the last page of its listing
  bool isPaused_ = false;
  std::function<void()> afterTelling_;
  HostClock::TimerRef timer_;
  Backoff failureBackoff_;
  Backoff expiryBackoff_;
  HostClock::TimePoint liveSince_;
};

}  // namespace yomber
