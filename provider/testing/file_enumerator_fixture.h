#pragma once

#include <algorithm>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "provider/enumeration/file_enumerator.h"
#include "provider/testing/provider_fixture.h"

namespace yomber {

/// A folder's enumerator ("i:3") in the extension's surroundings.
class FileEnumeratorFixture : public ProviderTest {
 protected:
  [[nodiscard]] std::shared_ptr<QSFileEnumerator> makeEnumerator(
      Recursive recursive = Recursive::No) const {
    return QSFileEnumerator::initWithFileObjectID(
        std::make_shared<const QSFileObjectID>(QSFileObjectID::Kind::Folder, 3),
        NSURL::fileURLWithPath(inRoot("folder")), "i:3", recursive);
  }
  [[nodiscard]] std::shared_ptr<QSFileEnumerator> makeRootEnumerator() const {
    return QSFileEnumerator::initWithFileObjectID(nullptr, NSURL::fileURLWithPath(daemon.root()),
                                                  NSFileProviderRootContainerItemIdentifier,
                                                  Recursive::No);
  }

  [[nodiscard]] static NSFileProviderSyncAnchor currentAnchor(
      const std::shared_ptr<QSFileEnumerator>& of) {
    NSFileProviderSyncAnchor result;
    of->currentSyncAnchorWithCompletionHandler(
        [&result](NSFileProviderSyncAnchor anchor) { result = std::move(anchor); });
    return result;
  }
  [[nodiscard]] static std::uint64_t rankOf(const NSFileProviderSyncAnchor& anchor) {
    std::uint64_t rank = 0;
    std::memcpy(&rank, anchor->bytes().data(), sizeof(rank));
    return rank;
  }

  void answerPageWith(const ScriptedDaemon::Page& page) {
    daemon.script([&page](ScriptedDaemon::Answers& answers) {
      answers.enumerateItemsInFolder = [page](const QSFileObjectIDRef&, std::uint8_t, std::uint64_t,
                                              std::uint32_t) { return page; };
    });
  }
  std::shared_ptr<RecordingEnumerationObserver> list(const NSFileProviderPage& page) {
    return list(enumerator, page);
  }
  static std::shared_ptr<RecordingEnumerationObserver> list(
      const std::shared_ptr<QSFileEnumerator>& of, const NSFileProviderPage& page) {
    auto observer = std::make_shared<RecordingEnumerationObserver>();
    of->enumerateItemsForObserver(observer, page);
    EXPECT_TRUE(observer->waitUntilFinished());
    return observer;
  }
  std::shared_ptr<RecordingChangeObserver> changesFrom(const NSFileProviderSyncAnchor& anchor) {
    auto observer = std::make_shared<RecordingChangeObserver>();
    enumerator->enumerateChangesForObserver(observer, anchor);
    EXPECT_TRUE(observer->isFinished());
    return observer;
  }

  /// Hands a batch to the enumerator, as the daemon's connection does; true when it was answered.
  bool receive(const std::vector<ItemFields>& items) {
    QSQueryItems batch;
    for (const auto& fields : items) batch.push_back(std::make_shared<const QSQueryItem>(fields));
    bool answered = false;
    enumerator->receiveUpdates(batch, {}, {}, [&answered] { answered = true; });
    return answered;
  }
  [[nodiscard]] static ItemFields dead(ItemFields item) {
    constexpr std::uint32_t kItemFlagDead = 1;
    item.flags |= kItemFlagDead;
    return item;
  }

  /// The methods that were called on the daemon, of those named, in order.
  [[nodiscard]] std::vector<std::string> daemonCalls(
      const std::vector<std::string>& methods) const {
    std::vector<std::string> result;
    for (const auto& call : daemon.calls()) {
      if (std::find(methods.begin(), methods.end(), call.method) != methods.end()) {
        result.push_back(call.method);
      }
    }
    return result;
  }

  std::shared_ptr<QSFileEnumerator> enumerator = makeEnumerator();
};

}  // namespace yomber
