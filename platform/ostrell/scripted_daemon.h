#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/fileprovider/item.h"
#include "platform/foundation/error.h"
#include "platform/ostrell/file_object_id.h"
#include "platform/ostrell/scripted_content.h"
#include "platform/ostrell/scripted_sharing.h"
#include "platform/rozzel/identifiers.h"

namespace yomber {

/// A daemon for tests: it speaks the daemon's protocol on the daemon's socket of a temporary home,
/// and answers what the test tells it to.
///
/// While one lives it is the daemon of this process's default connection; the library starts out
/// with no connection and empty caches, and does so again when it is destroyed. One at a time.
///
/// Thread-safety: every operation may be called on any thread but the loop thread, unless it says
/// otherwise. Those called `wait…` end after ten seconds at the latest and answer false then.
class ScriptedDaemon {
 public:
  using Location = ScriptedLocation;
  struct Item {
    ItemFields item;
    NSErrorRef error;  ///< sent instead when set; so in all answers
  };
  struct Page {
    std::vector<ItemFields> items;
    std::uint64_t nextOffset = 0;
    NSErrorRef error;
  };
  struct Rank {
    std::uint64_t rank = 0;
    NSErrorRef error;
  };
  struct Changes {
    std::vector<ItemFields> updated;
    std::vector<QSFileObjectIDRef> deleted;
    std::string token;
    NSErrorRef error;
  };
  struct Account {
    std::optional<std::string> name;  ///< nobody is signed in without one
    std::optional<std::string> perAppAccountIdentifier;
    NSErrorRef error;
  };
  struct Container {
    std::string containerID;
    std::string displayName;
    std::string documentsPath;
    std::string applicationID;
    std::string iconName;
  };

  struct Records {
    std::map<std::string, RZRecordID> records;  ///< by the object's string
    NSErrorRef error;
  };

  /// What is answered. Called on the loop thread: they may not block (see `hold`) and may not call
  /// the daemon. Those left alone answer from what `addItem` and `addContainer` put in.
  struct Answers {
    std::function<Location(const std::string& identifier)> urlForItemIdentifier;
    std::function<Location(const QSFileObjectID& object)> documentLocation;
    std::function<Item(const std::string& path, bool fakeFSEvent)> itemAtLocation;
    std::function<std::vector<Container>()> containers;
    std::function<Item(const std::string& containerID, bool forceScan)> containerItem;
    /// `folder` is nil for the root.
    std::function<Page(const QSFileObjectIDRef& folder, std::uint8_t sortOrder,
                       std::uint64_t offset, std::uint32_t limit)>
        enumerateItemsInFolder;
    std::function<Page(std::uint8_t sortOrder, std::uint64_t offset, std::uint32_t limit)>
        enumerateAllFolders;
    std::function<Rank()> currentNotifRank;
    std::function<Changes(const std::optional<std::string>& token, std::uint32_t limit)>
        enumerateWorkingSetChanges;
    /// The failure of a subscription, nil to grant it.
    std::function<NSErrorRef()> getItemUpdateSender;
    std::function<NSErrorRef(const std::string& path, std::uint32_t options)> watchItem;
    std::function<Account()> account;
    /// Left alone: the store has no document.
    std::function<Records(const std::vector<std::string>& objects)> contentRecords;
  };

  /// A call that arrived and whose answer was made: the method as the protocol names it, and its
  /// parameters in their order, as text ("true", "200", "d:5"; the root folder and an absent token
  /// are ""). Of a sender's calls (boostPriority, watchItem, invalidate), the subscription's number
  /// comes first. "startProviding.dropped" is one that the client gave up before it was answered;
  /// so it is with every call about a share.
  struct Call {
    std::string method;
    std::vector<std::string> arguments;
    friend bool operator==(const Call&, const Call&) = default;
  };

  /// Makes the home with the drive's folders in it, and serves. Somebody is signed in, as "someone"
  /// with the per-application identifier "someone-here"; the default, Documents and Desktop
  /// containers exist.
  ScriptedDaemon();
  ~ScriptedDaemon();
  ScriptedDaemon(const ScriptedDaemon&) = delete;
  ScriptedDaemon& operator=(const ScriptedDaemon&) = delete;

  [[nodiscard]] const std::string& home() const;
  /// The drive's root folder.
  [[nodiscard]] const std::string& root() const;

  /// Changes the answers; takes effect for the calls that arrive later.
  void script(const std::function<void(Answers& answers)>& change);
  /// The same for what is answered about content.
  void scriptContent(const std::function<void(ScriptedContentAnswers& answers)>& change);
  /// The same for what is answered about sharing.
  void scriptSharing(const std::function<void(ScriptedSharingAnswers& answers)>& change);
  /// Makes the item known, at that location, to the answers that were left alone. Replaces an item
  /// of the same identifier. Makes no file.
  void addItem(const ItemFields& item, const std::string& path);
  void addContainer(const Container& container);

  [[nodiscard]] std::vector<Call> calls() const;
  [[nodiscard]] std::size_t callCount(const std::string& method) const;
  void forgetCalls();
  /// Waits until `count` calls of `method` have arrived since the last `forgetCalls`.
  [[nodiscard]] bool waitForCalls(const std::string& method, std::size_t count = 1);
  /// Waits until `condition` holds; it is tested whenever anything happens here, and now and then
  /// besides, and may call this object's getters.
  [[nodiscard]] bool waitUntil(const std::function<bool()>& condition);

  /// From now on answers to `method` are made, but not sent, until `release`. "*" is every method.
  void hold(const std::string& method);
  /// Sends what was held back and ends the hold.
  void release(const std::string& method);

  /// Ends all connections; new ones are taken.
  void dropConnections();
  /// Ends all connections and takes no more until `start`.
  void stop();
  void start();
  [[nodiscard]] std::size_t connectionCount() const;

  /// Subscriptions are numbered from 0 in the order in which they were granted.
  [[nodiscard]] std::size_t subscriptionCount() const;
  /// Whether the client still holds the subscription's sender.
  [[nodiscard]] bool isSubscribed(std::size_t subscription) const;
  /// Sends a batch. `answered` (may be empty) runs on the loop thread, with nil once the receiver
  /// replied, or with the failure.
  void sendUpdates(std::size_t subscription, const std::vector<ItemFields>& items,
                   std::function<void(NSErrorRef)> answered = {});
  void sendProgressUpdates(std::size_t subscription, const std::vector<std::string>& identifiers);
  void failSender(std::size_t subscription, const NSErrorRef& error);

  [[nodiscard]] std::size_t observerCount() const;
  void postAccountTokenDidChange();
  void postContainerListDidChange();

  struct State;

 private:
  std::shared_ptr<State> state_;
};

/// A document or folder for `ScriptedDaemon`, with the identifier that belongs to the raw id.
[[nodiscard]] ItemFields scriptedDocument(
    std::uint64_t rawID, const std::string& filename,
    const std::string& parentIdentifier = NSFileProviderRootContainerItemIdentifier);
[[nodiscard]] ItemFields scriptedFolder(
    std::uint64_t rawID, const std::string& filename,
    const std::string& parentIdentifier = NSFileProviderRootContainerItemIdentifier);

}  // namespace yomber
