#include "zarn/working_set_signals.h"

#include <utility>

namespace yomber {

struct WorkingSetSignals::State {
  State(std::shared_ptr<ChangeFeed> changeFeed, std::function<void()> signalling)
      : feed(std::move(changeFeed)),
        signal(std::move(signalling)),
        queue(SerialQueue::create("zarn.working-set-signals")) {}

  /// Moves the token to the end. True when there was something new; the first time, nothing is.
  bool readToEnd() {
    bool hasNews = false;
    const bool isFirst = !token;
    while (true) {
      WorkingSetChanges changes;
      const auto error = feed->workingSetChanges(token, ChangeFeed::kMaximumLimit, changes);
      if (error) {
        // Too old to tell: whoever follows the set lists it again.
        if (!token) return hasNews;
        token.reset();
        hasNews = true;
        continue;
      }
      if (changes.token == token) return hasNews && !isFirst;
      hasNews = hasNews || !changes.updated.empty() || !changes.departed.empty();
      token = std::move(changes.token);
    }
  }

  const std::shared_ptr<ChangeFeed> feed;
  const std::function<void()> signal;
  const std::shared_ptr<SerialQueue> queue;
  std::optional<std::string> token;  // on the queue
};

WorkingSetSignals::WorkingSetSignals(std::shared_ptr<ChangeFeed> feed, std::function<void()> signal)
    : state_(std::make_shared<State>(std::move(feed), std::move(signal))),
      check_(std::make_shared<CoalescedCall>(
          [state = state_](std::function<void(NSErrorRef)> answered) {
            state->queue->async([state, answered = std::move(answered)] {
              if (state->readToEnd()) state->signal();
              answered(nullptr);
            });
          })) {}

WorkingSetSignals::~WorkingSetSignals() = default;

void WorkingSetSignals::start() {
  state_->queue->sync([this] { (void)state_->readToEnd(); });
}

void WorkingSetSignals::committed(const std::vector<ItemChange>&) { check_->request(); }

void WorkingSetSignals::expire(std::int64_t now) {
  state_->queue->async([state = state_, now] {
    if (state->feed->expireRecentlyUsed(now) && state->readToEnd()) state->signal();
  });
}

}  // namespace yomber
