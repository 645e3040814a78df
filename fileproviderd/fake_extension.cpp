// An extension for the host's tests. What it answers is commanded by files in <home>/fake:
//
//   items       "identifier version" a line: the one folder there is
//   root        exists: the root's location is known
//   hang        exists: what is asked now is never answered
//   signed-out  exists: items, enumerators and pages fail with -1000; paths have no identifier,
//               and but the root no item has a location
//   zarn-lost   exists: items and services fail as when zarn ends in the middle of a lookup
//   die-on-page exists: the process ends when a page is asked for
//   commands    a pipe that takes "signal CONTAINER" lines
//   slow        exists: content is not provided until it is stopped, or "slow" goes
//   die-on-content, die-on-stop, die-on-rename, die-on-thumbnails
//               exists: the process ends in the middle of that
//   die-on-service
//               exists: the process ends when it is asked for services
//   large-thumbnails
//               exists: they have a MiB each
//
// Items whose identifier begins with "none" have no thumbnail and are not spoken of; of others that
// are no item, there is an error. A thumbnail is told of twice; the second has another picture.
//
// What is done to content is noted in <home>/fake/journal, a line each.
//
// The item "self" tells of the process: its filename is a letter for each descriptor that it was
// given, a slash, and the signal that it gets when its parent dies.

#include <sys/prctl.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <future>
#include <map>
#include <string>
#include <thread>

#include "platform/fileprovider/errors.h"
#include "platform/fileprovider/extension_main.h"
#include "platform/fileprovider/manager.h"
#include "platform/fileprovider/wire_item.h"
#include "platform/foundation/lock.h"
#include "platform/xpc/test_workshop.h"

namespace yomber {
namespace {

std::string fakePath(const char* name) {
  return std::string(std::getenv("YOMBER_HOME")) + "/fake/" + name;
}

bool isCommanded(const char* name) { return access(fakePath(name).c_str(), F_OK) == 0; }

void hangIfCommanded() {
  if (isCommanded("hang")) std::promise<void>().get_future().wait();
}

NSErrorRef signedOut() {
  return NSError::errorWithDomain(NSFileProviderErrorDomain, NSFileProviderErrorNotAuthenticated);
}

NSErrorRef interruption() {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSXPCConnectionInterrupted);
}

std::map<std::string, std::uint64_t> readItems() {
  std::map<std::string, std::uint64_t> items;
  std::ifstream file(fakePath("items"));
  std::string identifier;
  std::uint64_t version = 0;
  while (file >> identifier >> version) items[identifier] = version;
  return items;
}

NSFileProviderItemRef makeItem(const std::string& identifier, std::uint64_t version) {
  ItemFields fields;
  fields.identifier = identifier;
  fields.filename = "name of " + identifier;
  fields.version = version;
  fields.capabilities = NSFileProviderItemCapabilitiesAllowsRenaming;
  return std::make_shared<WireItem>(fields);
}

/// What the item "self" shows.
std::string& selfDescription() {
  static std::string description;
  return description;
}

/// To be called before anything opens a descriptor of its own.
std::string describeDescriptors() {
  std::string given;
  constexpr int kMany = 64;
  for (int fd = 0; fd < kMany; ++fd) {
    std::error_code error;
    const auto target =
        std::filesystem::read_symlink("/proc/self/fd/" + std::to_string(fd), error).string();
    if (!error) given += target.starts_with("socket") ? "s" : target == "/dev/null" ? "n" : "o";
  }
  return given;
}

/// Tells as changes how the file of items differs from what it told before.
class FileEnumerator final : public NSFileProviderChangeEnumerator {
 public:
  void enumerateItemsForObserver(NSFileProviderEnumerationObserverRef observer,
                                 NSFileProviderPage page) override {
    hangIfCommanded();
    if (isCommanded("die-on-page")) _exit(3);
    if (isCommanded("signed-out")) return observer->finishEnumeratingWithError(signedOut());
    constexpr std::size_t kPageSize = 200;
    const bool isFirst = page == nullptr ||
                         page->isEqualToData(NSFileProviderInitialPageSortedByName) ||
                         page->isEqualToData(NSFileProviderInitialPageSortedByDate);
    const std::string after = isFirst ? std::string() : std::string(page->bytes());
    const auto all = readItems();
    NSFileProviderItems items;
    NSFileProviderPage next;
    for (auto item = all.upper_bound(after); item != all.end(); ++item) {
      if (items.size() == kPageSize) {
        next = NSData::dataWithString(items.back()->itemIdentifier());
        break;
      }
      items.push_back(makeItem(item->first, item->second));
    }
    observer->didEnumerateItems(items);
    observer->finishEnumeratingUpToPage(next);
  }

  void enumerateChangesForObserver(NSFileProviderChangeObserverRef observer,
                                   NSFileProviderSyncAnchor anchor) override {
    hangIfCommanded();
    LockGuard guard(mutex_);
    if (!anchor->isEqualToData(anchorNow())) {
      return observer->finishEnumeratingWithError(NSError::errorWithDomain(
          NSFileProviderErrorDomain, NSFileProviderErrorSyncAnchorExpired));
    }
    const auto now = readItems();
    NSFileProviderItems updated;
    std::vector<std::string> deleted;
    for (const auto& [identifier, version] : now) {
      const auto told = told_.find(identifier);
      if (told == told_.end() || told->second != version) {
        updated.push_back(makeItem(identifier, version));
      }
    }
    for (const auto& [identifier, version] : told_) {
      if (!now.contains(identifier)) deleted.push_back(identifier);
    }
    told_ = now;
    if (!updated.empty() || !deleted.empty()) ++rank_;
    observer->didUpdateItems(updated);
    observer->didDeleteItemsWithIdentifiers(deleted);
    observer->finishEnumeratingChangesUpToSyncAnchor(anchorNow(), false);
  }

  void currentSyncAnchorWithCompletionHandler(
      std::function<void(NSFileProviderSyncAnchor)> completionHandler) override {
    hangIfCommanded();
    NSFileProviderSyncAnchor anchor;
    {
      LockGuard guard(mutex_);
      told_ = readItems();
      anchor = anchorNow();
    }
    completionHandler(anchor);
  }

  void invalidate() override {}

 private:
  NSDataRef anchorNow() REQUIRES(mutex_) {
    return NSData::dataWithString(std::to_string(getpid()) + ":" + std::to_string(rank_));
  }

  Mutex mutex_;
  int rank_ GUARDED_BY(mutex_) = 0;
  std::map<std::string, std::uint64_t> told_ GUARDED_BY(mutex_);
};

/// Each endpoint has a workshop behind it.
class WorkshopSource final : public NSFileProviderServiceSource {
 public:
  [[nodiscard]] NSFileProviderServiceName serviceName() const override { return "test.workshop"; }
  NSXPCListenerEndpointRef makeListenerEndpointAndReturnError(NSErrorRef* /*error*/) override {
    listener_ = NSXPCListener::anonymousListener();
    listener_->setDelegate(vendor_);
    listener_->resume();
    return listener_->endpoint();
  }

 private:
  const std::shared_ptr<test::WorkshopVendor> vendor_ = std::make_shared<test::WorkshopVendor>();
  NSXPCListenerRef listener_;
};

class FakeExtension final : public NSFileProviderExtension {
 public:
  NSURLRef URLForItemWithPersistentIdentifier(
      const NSFileProviderItemIdentifier& identifier) override {
    hangIfCommanded();
    if (identifier == NSFileProviderRootContainerItemIdentifier) {
      return isCommanded("root") ? NSURL::fileURLWithPath("/root") : nullptr;
    }
    if (isCommanded("signed-out")) return nullptr;
    return readItems().contains(identifier) ? NSURL::fileURLWithPath("/root/" + identifier)
                                            : nullptr;
  }

  std::optional<NSFileProviderItemIdentifier> persistentIdentifierForItemAtURL(
      const NSURLRef& url) override {
    auto name = url->lastPathComponent();
    if (isCommanded("signed-out") || !readItems().contains(name)) return std::nullopt;
    return name;
  }

  NSFileProviderItemRef itemForIdentifier(const NSFileProviderItemIdentifier& identifier,
                                          NSErrorRef* error) override {
    hangIfCommanded();
    if (identifier == "self") return describeSelf();
    if (isCommanded("zarn-lost")) {
      storeError(error, interruption());
      return nullptr;
    }
    if (isCommanded("signed-out")) {
      storeError(error, signedOut());
      return nullptr;
    }
    const auto items = readItems();
    const auto item = items.find(identifier);
    if (item != items.end()) return makeItem(identifier, item->second);
    storeError(error, fileProviderErrorForNonExistentItemWithIdentifier(identifier));
    return nullptr;
  }

  NSFileProviderEnumeratorRef enumeratorForContainerItemIdentifier(
      const NSFileProviderItemIdentifier& identifier, NSErrorRef* error) override {
    hangIfCommanded();
    if (isCommanded("signed-out")) {
      storeError(error, signedOut());
      return nullptr;
    }
    if (identifier == "gone") {
      storeError(error, fileProviderErrorForNonExistentItemWithIdentifier(identifier));
      return nullptr;
    }
    return std::make_shared<FileEnumerator>();
  }

  std::vector<NSFileProviderServiceSourceRef> supportedServiceSourcesForItemIdentifier(
      const NSFileProviderItemIdentifier& identifier, NSErrorRef* error) override {
    if (isCommanded("zarn-lost")) {
      storeError(error, interruption());
      return {};
    }
    if (isCommanded("die-on-service")) {
      std::filesystem::remove(fakePath("die-on-service"));
      _exit(3);
    }
    if (!readItems().contains(identifier)) return {};
    return {std::make_shared<WorkshopSource>()};
  }

  using NSFileProviderExtension::startProvidingItemAtURL;
  void startProvidingItemAtURL(const NSURLRef& url, NSFileCoordinatorReadingOptions options,
                               ErrorHandler completionHandler) override {
    note("start " + url->path() + " " + std::to_string(options));
    if (isCommanded("die-on-content")) {
      std::filesystem::remove(fakePath("die-on-content"));
      _exit(3);
    }
    if (isCommanded("slow")) {
      LockGuard guard(mutex_);
      held_[url->path()] = std::move(completionHandler);
      return;
    }
    completionHandler(nullptr);
  }

  void stopProvidingItemAtURL(const NSURLRef& url) override {
    note("stop " + url->path());
    if (isCommanded("die-on-stop")) {
      std::filesystem::remove(fakePath("die-on-stop"));
      _exit(3);
    }
    ErrorHandler held;
    {
      LockGuard guard(mutex_);
      held = std::exchange(held_[url->path()], nullptr);
    }
    if (held) held(NSError::errorWithDomain(NSCocoaErrorDomain, NSUserCancelledError));
  }

  void itemChangedAtURL(const NSURLRef& url) override { note("changed " + url->path()); }

  void movingItemAtURL(const NSURLRef& url, const NSURLRef& destinationURL,
                       MoveHandler completionHandler) override {
    note("moving " + url->path() + " " + destinationURL->path());
    completionHandler(true, nullptr);
  }

  void renameItemWithIdentifier(const NSFileProviderItemIdentifier& identifier,
                                const std::string& toName, ItemHandler completionHandler) override {
    note("rename " + identifier + " " + toName);
    if (isCommanded("die-on-rename")) {
      std::filesystem::remove(fakePath("die-on-rename"));
      _exit(3);
    }
    completionHandler(makeItem(identifier, 2), nullptr);
  }

  using NSFileProviderExtension::fetchThumbnailsForItemIdentifiers;
  NSProgressRef fetchThumbnailsForItemIdentifiers(
      const std::vector<NSFileProviderItemIdentifier>& identifiers, CGSize requestedSize,
      TypedThumbnailHandler handler, ErrorHandler completionHandler) override {
    note("thumbnails " + std::to_string(identifiers.size()));
    const auto progress = NSProgress::progressWithTotalUnitCount(0);
    progress->setCancellationHandler([this] { note("thumbnails cancelled"); });
    const auto items = readItems();
    NSErrorRef failure;
    const std::string picture = isCommanded("large-thumbnails") ? std::string(1 << 20, 'x')
                                : requestedSize.width > requestedSize.height ? "wide"
                                                                             : "high";
    for (const auto& identifier : identifiers) {
      if (identifier.starts_with("none")) continue;
      if (!items.contains(identifier)) {
        failure = fileProviderErrorForNonExistentItemWithIdentifier(identifier);
        handler(identifier, nullptr, std::nullopt, failure);
        continue;
      }
      handler(identifier, NSData::dataWithString(picture + " of " + identifier), "x/fake", nullptr);
      handler(identifier, NSData::dataWithString("again"), std::nullopt, nullptr);
      if (isCommanded("die-on-thumbnails")) {
        std::filesystem::remove(fakePath("die-on-thumbnails"));
        _exit(3);
      }
    }
    completionHandler(failure);
    return progress;
  }

 private:
  void note(const std::string& line) {
    LockGuard guard(mutex_);
    std::ofstream(fakePath("journal"), std::ios::app) << line << std::endl;
  }

  static NSFileProviderItemRef describeSelf() {
    ItemFields fields;
    fields.identifier = "self";
    fields.filename = selfDescription();
    return std::make_shared<WireItem>(fields);
  }

  Mutex mutex_;
  std::map<std::string, ErrorHandler> held_ GUARDED_BY(mutex_);
};

void takeCommands() {
  for (;;) {
    std::ifstream pipe(fakePath("commands"));
    if (!pipe) return;
    std::string verb;
    std::string container;
    while (pipe >> verb >> container) {
      if (verb == "signal") {
        NSFileProviderManager::defaultManager().signalEnumeratorForContainerItemIdentifier(
            container, nullptr);
      }
    }
  }
}

}  // namespace
}  // namespace yomber

int main(int argc, char** argv) {
  yomber::selfDescription() = yomber::describeDescriptors();
  return yomber::NSExtensionMain(argc, argv, [] {
    // The setting belongs to this thread, the first one.
    int signal = 0;
    (void)prctl(PR_GET_PDEATHSIG, &signal);
    yomber::selfDescription() += "/" + std::to_string(signal);
    std::thread(yomber::takeCommands).detach();
    return std::make_shared<yomber::FakeExtension>();
  });
}
