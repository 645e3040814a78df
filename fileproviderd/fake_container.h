#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "fileproviderd/container_watch.h"
#include "fileproviderd/fake_clock.h"
#include "platform/fileprovider/constants.h"
#include "protocols/common.capnp.h"

namespace yomber {

/// A container whose enumerators behave as the extension's: each keeps a history of its own, hands
/// every change out once, and drops the history when it is asked with an anchor that is not its
/// newest or when too much waits in it.
class FakeContainer final : public EnumeratorSource {
 public:
  explicit FakeContainer(ManualExecutor& executor) : executor_(executor) {}

  std::map<std::string, ItemFields> items;
  std::size_t pageSize = 3;
  std::size_t historyLimit = 5'000;
  NSErrorRef openError;  ///< what `enumerator` fails with
  NSErrorRef pageError;
  NSErrorRef changesError;
  bool tellsChanges = true;
  bool tellsDeletionsAsDead = false;  ///< as updates with the flag of the dead
  bool isReallyGone = false;
  bool isWorkingSet = false;         ///< lists nothing and replays everything as changes
  std::size_t changesPerAnswer = 0;  ///< of a working set; 0: all
  std::function<void()> beforeEachPage;
  std::vector<std::weak_ptr<ContainerWatch>> watches;

  int opened = 0;
  int pagesAsked = 0;
  int changesAsked = 0;
  int anchorsAsked = 0;
  int changesInFlight = 0;
  int mostChangesInFlight = 0;

  void put(const std::string& identifier, std::uint64_t version = 1) {
    ItemFields item;
    item.identifier = identifier;
    item.filename = "name of " + identifier;
    item.version = version;
    item.rank = ++rank_;
    items[identifier] = item;
    note(identifier, item);
  }
  void remove(const std::string& identifier) {
    items.erase(identifier);
    ++rank_;
    note(identifier, std::nullopt);
  }
  /// Every history is lost; nobody is told.
  void expireAll() {
    for (auto* enumerator : enumerators_) enumerator->expire();
  }
  void signalAll() {
    for (const auto& weak : watches) {
      if (const auto watch = weak.lock()) watch->signalled();
    }
  }
  [[nodiscard]] std::size_t liveEnumerators() const { return enumerators_.size(); }

  void enumerator(const std::string& /*container*/, EnumeratorHandler handler) override {
    executor_.post([this, handler = std::move(handler)] {
      if (openError != nullptr) return handler(nullptr, openError);
      ++opened;
      handler(std::make_shared<FakeEnumerator>(*this), nullptr);
    });
  }
  void isGone(const std::string& /*container*/, std::function<void(bool)> handler) override {
    executor_.post([this, handler = std::move(handler)] { handler(isReallyGone); });
  }

 private:
  class FakeEnumerator final : public HostedEnumerator {
   public:
    explicit FakeEnumerator(FakeContainer& container) : container_(container) {
      container_.enumerators_.insert(this);
    }
    ~FakeEnumerator() override { container_.enumerators_.erase(this); }

    void items(const NSDataRef& page, std::function<void(PageAnswer)> handler) override {
      ++container_.pagesAsked;
      const std::string after = page ? std::string(page->bytes()) : std::string();
      post([this, after, handler = std::move(handler)] {
        if (container_.beforeEachPage) container_.beforeEachPage();
        handler(container_.page(after));
      });
    }
    void changes(const NSDataRef& anchor, std::function<void(ChangesAnswer)> handler) override {
      ++container_.changesAsked;
      container_.mostChangesInFlight =
          std::max(container_.mostChangesInFlight, ++container_.changesInFlight);
      auto& container = container_;
      container_.executor_.post(
          [this, &container, alive = std::weak_ptr(alive_), anchor, handler = std::move(handler)] {
            --container.changesInFlight;
            if (alive.expired()) return handler(lost<ChangesAnswer>());
            handler(container.isWorkingSet ? replay(anchor) : handOut(anchor));
          });
    }
    void currentAnchor(std::function<void(AnchorAnswer)> handler) override {
      ++container_.anchorsAsked;
      post([this, handler = std::move(handler)] {
        AnchorAnswer answer;
        if (container_.tellsChanges) {
          answer.anchor = NSData::dataWithString(
              container_.isWorkingSet ? "initial" : std::to_string(generation_) + ":0");
        }
        handler(std::move(answer));
      });
    }

    void note(const std::string& identifier, const std::optional<ItemFields>& item) {
      pending_[identifier] = item;
      if (pending_.size() > container_.historyLimit) expire();
    }
    void expire() {
      static int generations = 0;
      generation_ = ++generations;
      rank_ = 0;
      pending_.clear();
    }

   private:
    template <typename Work>
    void post(Work work) {
      container_.executor_.post([alive = std::weak_ptr(alive_), work = std::move(work)] {
        if (!alive.expired()) work();
      });
    }
    template <typename Answer>
    static Answer lost() {
      Answer answer;
      answer.error = NSError::errorWithDomain(NSCocoaErrorDomain, NSXPCConnectionInterrupted);
      return answer;
    }

    ChangesAnswer handOut(const NSDataRef& anchor) {
      ChangesAnswer answer;
      if (container_.changesError != nullptr) {
        answer.error = container_.changesError;
        return answer;
      }
      if (anchor->bytes() != std::to_string(generation_) + ":" + std::to_string(rank_)) {
        expire();
        answer.error = NSError::errorWithDomain(NSFileProviderErrorDomain,
                                                NSFileProviderErrorSyncAnchorExpired);
        return answer;
      }
      answer.anchor = anchor;
      if (pending_.empty()) return answer;
      for (auto& [identifier, item] : std::exchange(pending_, {})) {
        if (item) {
          answer.updated.push_back(*item);
        } else if (container_.tellsDeletionsAsDead) {
          ItemFields dead;
          dead.identifier = identifier;
          dead.flags = protocol::ITEM_FLAG_DEAD;
          answer.updated.push_back(dead);
        } else {
          answer.deleted.push_back(identifier);
        }
      }
      answer.anchor =
          NSData::dataWithString(std::to_string(generation_) + ":" + std::to_string(++rank_));
      return answer;
    }

    /// The daemon's ranks are the anchors; what was deleted before it was told never shows.
    ChangesAnswer replay(const NSDataRef& anchor) {
      ChangesAnswer answer;
      const std::uint64_t since =
          anchor->bytes() == "initial" ? 0 : std::stoull(std::string(anchor->bytes()));
      std::map<std::uint64_t, ItemFields> byRank;
      for (const auto& [identifier, item] : container_.items) {
        if (item.rank > since) byRank.emplace(item.rank, item);
      }
      std::uint64_t newest = since;
      for (const auto& [rank, item] : byRank) {
        if (container_.changesPerAnswer != 0 &&
            answer.updated.size() == container_.changesPerAnswer) {
          break;
        }
        answer.updated.push_back(item);
        newest = rank;
      }
      answer.anchor = NSData::dataWithString(std::to_string(newest));
      answer.moreComing = newest != since || anchor->bytes() == "initial";
      return answer;
    }

    FakeContainer& container_;
    const std::shared_ptr<int> alive_ = std::make_shared<int>(0);
    int generation_ = 0;
    int rank_ = 0;
    std::map<std::string, std::optional<ItemFields>> pending_;
  };

  PageAnswer page(const std::string& after) {
    PageAnswer answer;
    if (pageError != nullptr) {
      answer.error = pageError;
      return answer;
    }
    if (isWorkingSet) return answer;
    for (auto item = items.upper_bound(after); item != items.end(); ++item) {
      if (answer.items.size() == pageSize) {
        answer.next = NSData::dataWithString(answer.items.back().identifier);
        break;
      }
      answer.items.push_back(item->second);
    }
    return answer;
  }

  void note(const std::string& identifier, const std::optional<ItemFields>& item) {
    for (auto* enumerator : enumerators_) enumerator->note(identifier, item);
    signalAll();
  }

  ManualExecutor& executor_;
  std::set<FakeEnumerator*> enumerators_;
  std::uint64_t rank_ = 0;
};

/// Keeps what it is told by identifier, as the protocol asks, and notes the calls.
class RecordingWatcher final : public ContainerWatcher {
 public:
  explicit RecordingWatcher(ManualExecutor& executor) : executor_(executor) {}

  void didList(const std::vector<ItemFields>& listed, bool last, Answered answered) override {
    EXPECT_FALSE(isListed) << "a page after the last one";
    isListed = last;
    take(listed);
    note(std::string("list ") + std::to_string(listed.size()) + (last ? " last" : ""),
         std::move(answered));
  }
  void didUpdate(const std::vector<ItemFields>& updated, Answered answered) override {
    EXPECT_TRUE(isListed) << "an update before the listing was complete";
    take(updated);
    std::string call = "update";
    for (const auto& item : updated) call += " " + item.identifier;
    note(call, std::move(answered));
  }
  void didDelete(const std::vector<std::string>& identifiers, Answered answered) override {
    std::string call = "delete";
    for (const auto& identifier : identifiers) {
      EXPECT_EQ(items.erase(identifier), 1U) << identifier << " was never told";
      call += " " + identifier;
    }
    note(call, std::move(answered));
  }
  void didPause(const NSErrorRef& error, Answered answered) override {
    EXPECT_FALSE(std::exchange(isPaused, true));
    note("pause " + std::to_string(error->code()), std::move(answered));
  }
  void didResume(Answered answered) override {
    EXPECT_TRUE(std::exchange(isPaused, false));
    note("resume", std::move(answered));
  }
  void didEnd(const NSErrorRef& error, Answered answered) override {
    note("end " + std::to_string(error->code()), std::move(answered));
  }

  /// Answers what was held back.
  void release() {
    holds = false;
    if (const auto answered = std::exchange(held_, nullptr)) executor_.post(answered);
  }
  [[nodiscard]] std::vector<std::string> takeCalls() { return std::exchange(calls, {}); }

  std::map<std::string, ItemFields> items;
  std::vector<std::string> calls;
  bool isListed = false;
  bool isPaused = false;
  bool holds = false;  ///< leaves calls unanswered

 private:
  void take(const std::vector<ItemFields>& told) {
    for (const auto& item : told) items[item.identifier] = item;
  }
  void note(std::string call, Answered answered) {
    EXPECT_FALSE(isBusy_) << "a call before the last was answered: " << call;
    calls.push_back(std::move(call));
    isBusy_ = true;
    auto release = [this, answered = std::move(answered)] {
      isBusy_ = false;
      answered();
    };
    if (holds) {
      held_ = std::move(release);
    } else {
      executor_.post(std::move(release));
    }
  }

  ManualExecutor& executor_;
  Answered held_;
  bool isBusy_ = false;
};

}  // namespace yomber
