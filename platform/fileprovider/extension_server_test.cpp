#include "platform/fileprovider/extension_server.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdlib.h>

#include <atomic>
#include <cerrno>
#include <filesystem>
#include <future>
#include <stdexcept>
#include <thread>

#include "platform/fileprovider/errors.h"
#include "platform/fileprovider/extension_main.h"
#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/manager.h"
#include "platform/fileprovider/wire_item.h"
#include "platform/foundation/drive_paths.h"
#include "platform/foundation/log.h"
#include "platform/ipc/call.h"
#include "platform/ipc/connection.h"
#include "platform/ipc/error_codec.h"

namespace yomber {
namespace {

using namespace std::chrono_literals;
using protocol::Enumerator;
using protocol::Extension;
using protocol::ExtensionHost;

NSFileProviderItemRef itemNamed(const std::string& identifier) {
  ItemFields fields;
  fields.identifier = identifier;
  return std::make_shared<WireItem>(fields);
}

/// Waits until `condition` holds, ten seconds at most.
bool eventually(const std::function<bool()>& condition) {
  const auto deadline = std::chrono::steady_clock::now() + 10s;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::yield();
  }
  return true;
}

class ScriptedEnumerator final : public NSFileProviderChangeEnumerator {
 public:
  void enumerateItemsForObserver(NSFileProviderEnumerationObserverRef observer,
                                 NSFileProviderPage page) override {
    lastPage = page;
    if (dropsObservers) return;
    if (throws) throw std::runtime_error("scripted");
    observer->didEnumerateItems({itemNamed("a"), itemNamed("b")});
    observer->finishEnumeratingUpToPage(NSData::dataWithString("more"));
  }
  void enumerateChangesForObserver(NSFileProviderChangeObserverRef observer,
                                   NSFileProviderSyncAnchor anchor) override {
    if (anchor->bytes() == "old") {
      return observer->finishEnumeratingWithError(NSError::errorWithDomain(
          NSFileProviderErrorDomain, NSFileProviderErrorSyncAnchorExpired));
    }
    observer->didUpdateItems({itemNamed("u")});
    observer->didDeleteItemsWithIdentifiers({"x", "y"});
    observer->finishEnumeratingChangesUpToSyncAnchor(NSData::dataWithString("new"), true);
  }
  void currentSyncAnchorWithCompletionHandler(
      std::function<void(NSFileProviderSyncAnchor)> completionHandler) override {
    completionHandler(NSData::dataWithString("here"));
  }
  void invalidate() override { ++invalidations; }

  std::atomic<int> invalidations{0};
  bool dropsObservers = false;
  bool throws = false;
  NSFileProviderPage lastPage;
};

/// Tells no changes.
class PlainEnumerator final : public NSFileProviderEnumerator {
 public:
  void enumerateItemsForObserver(NSFileProviderEnumerationObserverRef observer,
                                 NSFileProviderPage /*page*/) override {
    observer->finishEnumeratingUpToPage(nullptr);
  }
  void invalidate() override {}
};

class ScriptedExtension final : public NSFileProviderExtension {
 public:
  NSURLRef URLForItemWithPersistentIdentifier(
      const NSFileProviderItemIdentifier& identifier) override {
    if (identifier == "blocked") gate.get_future().wait();
    return identifier == "nothing" ? nullptr : NSURL::fileURLWithPath("/tree/" + identifier);
  }
  std::optional<NSFileProviderItemIdentifier> persistentIdentifierForItemAtURL(
      const NSURLRef& url) override {
    if (url->path() == "/outside") return std::nullopt;
    return url->lastPathComponent();
  }
  NSFileProviderItemRef itemForIdentifier(const NSFileProviderItemIdentifier& identifier,
                                          NSErrorRef* error) override {
    if (identifier != "collides") return identifier == "nothing" ? nullptr : itemNamed(identifier);
    storeError(error, fileProviderErrorForCollisionWithItem(itemNamed("in the way")));
    return nullptr;
  }
  NSFileProviderEnumeratorRef enumeratorForContainerItemIdentifier(
      const NSFileProviderItemIdentifier& identifier, NSErrorRef* error) override {
    if (identifier == "plain") return std::make_shared<PlainEnumerator>();
    if (identifier != "nothing") return enumerator;
    storeError(error, fileProviderErrorForNonExistentItemWithIdentifier(identifier));
    return nullptr;
  }

  std::promise<void> gate;
  const std::shared_ptr<ScriptedEnumerator> enumerator = std::make_shared<ScriptedEnumerator>();
};

/// An extension at one end of a socket pair, and its host at the other.
class ExtensionServer : public testing::Test {
 protected:
  ExtensionServer() {
    registerItemsInErrors();
    ipc::UniqueFd ours;
    ipc::UniqueFd theirs;
    EXPECT_TRUE(ipc::makeSocketPair(ours, theirs));
    served = ipc::Connection::adopt(theirs.release(),
                                    [extension = extension] { return serveExtension(extension); });
    host = ipc::Connection::adopt(ours.release());
    remote = host->bootstrap<Extension>();
  }

  ipc::Remote<Enumerator> open(const std::string& container, NSErrorRef* error = nullptr) {
    ipc::Remote<Enumerator> opened;
    EXPECT_EQ(nullptr, ipc::callAndWait(
                           remote, &Extension::Client::enumeratorRequest,
                           [&](auto params) { params.setContainer(container); },
                           [&](auto results) {
                             if (results.getResult().isEnumerator()) {
                               opened =
                                   ipc::Remote<Enumerator>(results.getResult().getEnumerator());
                             } else {
                               storeError(error, ipc::decodeError(results.getResult().getError()));
                             }
                           }));
    return opened;
  }

  /// The page's identifiers, joined, and its token; or the error.
  static std::string page(const ipc::Remote<Enumerator>& enumerator, const std::string& token,
                          NSErrorRef* error = nullptr) {
    std::string told;
    NSErrorRef failure = ipc::callAndWait(
        enumerator, &Enumerator::Client::enumerateItemsRequest,
        [&](auto params) {
          if (!token.empty()) params.initPage().setToken(wireData(token));
        },
        [&](auto results) {
          const auto result = results.getResult();
          if (result.isError()) return storeError(error, ipc::decodeError(result.getError()));
          for (const auto item : result.getPage().getItems()) {
            told += stringFromWire(item.getIdentifier()) + ",";
          }
          told += stringFromWire(result.getPage().getNext().getValue());
        });
    EXPECT_EQ(failure, nullptr);
    return told;
  }

  const std::shared_ptr<ScriptedExtension> extension = std::make_shared<ScriptedExtension>();
  ipc::Connection::Ref served;
  ipc::Connection::Ref host;
  ipc::Remote<Extension> remote;
};

TEST_F(ExtensionServer, AnswersLookups) {
  const auto locate = [&](const std::string& identifier) {
    std::string path = "nil";
    EXPECT_EQ(nullptr, ipc::callAndWait(
                           remote, &Extension::Client::urlForItemRequest,
                           [&](auto params) { params.setIdentifier(identifier); },
                           [&](auto results) {
                             if (results.getPath().isValue()) {
                               path = stringFromWire(results.getPath().getValue());
                             }
                           }));
    return path;
  };
  EXPECT_EQ(locate("d:1"), "/tree/d:1");
  EXPECT_EQ(locate("nothing"), "nil");

  const auto identify = [&](const std::string& path) {
    std::string identifier = "nil";
    EXPECT_EQ(nullptr, ipc::callAndWait(
                           remote, &Extension::Client::identifierForPathRequest,
                           [&](auto params) { params.setPath(wireData(path)); },
                           [&](auto results) {
                             if (results.getFound())
                               identifier = stringFromWire(results.getIdentifier());
                           }));
    return identifier;
  };
  EXPECT_EQ(identify("/tree/d:9"), "d:9");
  EXPECT_EQ(identify("/outside"), "nil");
  EXPECT_EQ(identify("relative"), "nil") << "what is no path never reaches the extension";
}

TEST_F(ExtensionServer, AnswersItemsAndTheirErrors) {
  const auto item = [&](const std::string& identifier, NSErrorRef* error) {
    std::string found;
    EXPECT_EQ(nullptr, ipc::callAndWait(
                           remote, &Extension::Client::itemForIdentifierRequest,
                           [&](auto params) { params.setIdentifier(identifier); },
                           [&](auto results) {
                             const auto result = results.getResult();
                             if (result.isItem()) {
                               found = stringFromWire(result.getItem().getIdentifier());
                             } else {
                               *error = ipc::decodeError(result.getError());
                             }
                           }));
    return found;
  };
  NSErrorRef error;
  EXPECT_EQ(item("d:4", &error), "d:4");
  EXPECT_EQ(item("nothing", &error), "");
  EXPECT_TRUE(error->is(NSFileProviderErrorDomain, NSFileProviderErrorNoSuchItem))
      << "nil without an error is a missing item";
  EXPECT_EQ(item("collides", &error), "");
  const auto inTheWay = std::get<NSObjectRef>(error->userInfo().at(NSFileProviderErrorItemKey));
  EXPECT_NE(dynamic_cast<const NSFileProviderItem*>(inTheWay.get()), nullptr);
}

TEST_F(ExtensionServer, ARequestThatBlocksHoldsUpNoOther) {
  std::promise<void> answered;
  (void)ipc::call(
      remote, &Extension::Client::urlForItemRequest,
      [](auto params) { params.setIdentifier("blocked"); },
      [&](const NSErrorRef&, const Extension::UrlForItemResults::Reader*) {
        answered.set_value();
      });
  NSErrorRef error;
  EXPECT_EQ(page(open("i:1"), ""), "a,b,more");
  extension->gate.set_value();
  EXPECT_EQ(answered.get_future().wait_for(10s), std::future_status::ready);
}

TEST_F(ExtensionServer, PassesPagesBothWays) {
  const auto enumerator = open("i:1");
  EXPECT_EQ(page(enumerator, ""), "a,b,more");
  EXPECT_EQ(extension->enumerator->lastPage, nullptr);
  EXPECT_EQ(page(enumerator, "more"), "a,b,more");
  EXPECT_EQ(extension->enumerator->lastPage->bytes(), "more");
  NSErrorRef error;
  EXPECT_EQ(page(enumerator, std::string(kMaximumTokenLength + 1, 'x'), &error), "");
  EXPECT_TRUE(error->is(NSPOSIXErrorDomain, EINVAL));
}

TEST_F(ExtensionServer, TranslatesInitialPages) {
  const auto enumerator = open("i:1");
  EXPECT_EQ(nullptr, ipc::callAndWait(
                         enumerator, &Enumerator::Client::enumerateItemsRequest,
                         [](auto params) { params.initPage().setInitialByDate(); }, [](auto) {}));
  EXPECT_EQ(extension->enumerator->lastPage, NSFileProviderInitialPageSortedByDate);
  EXPECT_EQ(nullptr, ipc::callAndWait(
                         enumerator, &Enumerator::Client::enumerateItemsRequest,
                         [](auto params) { params.initPage().setInitialByName(); }, [](auto) {}));
  EXPECT_EQ(extension->enumerator->lastPage, NSFileProviderInitialPageSortedByName);
}

TEST_F(ExtensionServer, PassesChangesAndAnchors) {
  const auto enumerator = open("i:1");
  const auto changes = [&](const std::string& anchor, NSErrorRef* error) {
    std::string told;
    EXPECT_EQ(nullptr, ipc::callAndWait(
                           enumerator, &Enumerator::Client::enumerateChangesRequest,
                           [&](auto params) { params.setAnchor(wireData(anchor)); },
                           [&](auto results) {
                             const auto result = results.getResult();
                             if (result.isError()) {
                               *error = ipc::decodeError(result.getError());
                               return;
                             }
                             const auto got = result.getChanges();
                             told = stringFromWire(got.getUpdated()[0].getIdentifier());
                             for (const auto gone : got.getDeleted())
                               told += "-" + stringFromWire(gone);
                             told += "@" + stringFromWire(got.getAnchor());
                             told += got.getMoreComing() ? "+" : ".";
                           }));
    return told;
  };
  NSErrorRef error;
  EXPECT_EQ(changes("here", &error), "u-x-y@new+");
  EXPECT_EQ(changes("old", &error), "");
  EXPECT_TRUE(error->is(NSFileProviderErrorDomain, NSFileProviderErrorSyncAnchorExpired));
  std::string anchor;
  EXPECT_EQ(nullptr, ipc::callAndWait(
                         enumerator, &Enumerator::Client::currentSyncAnchorRequest, [](auto) {},
                         [&](auto results) { anchor = stringFromWire(results.getAnchor()); }));
  EXPECT_EQ(anchor, "here");
}

TEST_F(ExtensionServer, SaysWhenAnEnumeratorTellsNoChanges) {
  const auto enumerator = open("plain");
  bool supported = true;
  EXPECT_EQ(nullptr, ipc::callAndWait(
                         enumerator, &Enumerator::Client::currentSyncAnchorRequest, [](auto) {},
                         [&](auto results) { supported = results.getSupported(); }));
  EXPECT_FALSE(supported);
  NSErrorRef error;
  EXPECT_EQ(nullptr,
            ipc::callAndWait(
                enumerator, &Enumerator::Client::enumerateChangesRequest, [](auto) {},
                [&](auto results) { error = ipc::decodeError(results.getResult().getError()); }));
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSFeatureUnsupportedError));
}

TEST_F(ExtensionServer, AnswersWhenTheExtensionForgetsOrThrows) {
  const auto enumerator = open("i:1");
  NSErrorRef error;
  extension->enumerator->dropsObservers = true;
  EXPECT_EQ(page(enumerator, "", &error), "");
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
  error = nullptr;
  extension->enumerator->dropsObservers = false;
  extension->enumerator->throws = true;
  EXPECT_EQ(page(enumerator, "", &error), "");
  EXPECT_TRUE(error->is(NSCocoaErrorDomain, NSXPCConnectionReplyInvalid));
}

TEST_F(ExtensionServer, AMissingContainerHasNoEnumerator) {
  NSErrorRef error;
  EXPECT_FALSE(open("nothing", &error));
  EXPECT_TRUE(error->is(NSFileProviderErrorDomain, NSFileProviderErrorNoSuchItem));
}

TEST_F(ExtensionServer, InvalidatesAnEnumeratorOnceWhenItIsDropped) {
  auto enumerator = open("i:1");
  EXPECT_EQ(nullptr,
            ipc::callAndWait(
                enumerator, &Enumerator::Client::invalidateRequest, [](auto) {}, [](auto) {}));
  EXPECT_EQ(extension->enumerator->invalidations, 1);
  enumerator = nullptr;
  auto second = open("i:1");
  second = nullptr;
  EXPECT_TRUE(eventually([&] { return extension->enumerator->invalidations == 2; }));
}

TEST_F(ExtensionServer, InvalidatesEnumeratorsWhenTheHostGoes) {
  const auto enumerator = open("i:1");
  host->close();
  EXPECT_TRUE(eventually([&] { return extension->enumerator->invalidations == 1; }));
}

// --- The process around it.

/// A host that notes signals.
class SignalledHost final : public ExtensionHost::Server {
 public:
  explicit SignalledHost(std::shared_ptr<std::promise<std::string>> signalled)
      : signalled_(std::move(signalled)) {}

 protected:
  kj::Promise<void> signalEnumerator(SignalEnumeratorContext context) override {
    signalled_->set_value(stringFromWire(context.getParams().getContainer()));
    return kj::READY_NOW;
  }

 private:
  const std::shared_ptr<std::promise<std::string>> signalled_;
};

TEST(ExtensionMain, RefusesToRunWithoutAHost) {
  char name[] = "extension";
  char* arguments[] = {name, nullptr};
  const auto make = [] {
    ADD_FAILURE() << "no extension is made";
    return std::make_shared<NSFileProviderExtension>();
  };
  ASSERT_EQ(unsetenv(kExtensionDescriptorVariable), 0);
  EXPECT_EQ(NSExtensionMain(1, arguments, make), 64);
  for (const char* wrong : {"", "x", "3x", "-1", "1000000", "99999999999999999999"}) {
    ASSERT_EQ(setenv(kExtensionDescriptorVariable, wrong, 1), 0);
    EXPECT_EQ(NSExtensionMain(1, arguments, make), 64) << wrong;
  }
}

TEST(ExtensionMain, ServesUntilTheHostGoes) {
  char home[] = "/tmp/yomber-extension-main-XXXXXX";
  ASSERT_NE(mkdtemp(home), nullptr);
  ASSERT_EQ(setenv("YOMBER_HOME", home, 1), 0);
  ASSERT_EQ(DrivePaths::forDefaultHome().create(), nullptr);
  ipc::UniqueFd ours;
  ipc::UniqueFd theirs;
  ASSERT_TRUE(ipc::makeSocketPair(ours, theirs));
  const int socket = theirs.release();
  ASSERT_EQ(fcntl(socket, F_SETFD, 0), 0);
  ASSERT_EQ(setenv(kExtensionDescriptorVariable, std::to_string(socket).c_str(), 1), 0);

  auto result = std::async(std::launch::async, [] {
    char name[] = "extension";
    char* arguments[] = {name, nullptr};
    return NSExtensionMain(1, arguments, [] { return std::make_shared<ScriptedExtension>(); });
  });
  const auto signalled = std::make_shared<std::promise<std::string>>();
  const auto host = ipc::Connection::adopt(
      ours.release(),
      [signalled]() -> capnp::Capability::Client { return kj::heap<SignalledHost>(signalled); });
  std::string path;
  EXPECT_EQ(nullptr,
            ipc::callAndWait(
                host->bootstrap<Extension>(), &Extension::Client::urlForItemRequest,
                [](auto params) { params.setIdentifier("d:1"); },
                [&](auto results) { path = stringFromWire(results.getPath().getValue()); }));
  EXPECT_EQ(path, "/tree/d:1");
  EXPECT_EQ(getenv(kExtensionDescriptorVariable), nullptr);
  EXPECT_EQ(fcntl(socket, F_GETFD), FD_CLOEXEC) << "no child inherits the socket";

  auto answered = std::make_shared<std::promise<NSErrorRef>>();
  ASSERT_TRUE(eventually([&] {
    // The transport is installed right after the connection began to serve.
    auto attempt = std::make_shared<std::promise<NSErrorRef>>();
    NSFileProviderManager::defaultManager().signalEnumeratorForContainerItemIdentifier(
        "i:5", [attempt](NSErrorRef error) { attempt->set_value(std::move(error)); });
    return attempt->get_future().get() == nullptr;
  }));
  EXPECT_EQ(signalled->get_future().get(), "i:5");

  host->close();
  ASSERT_EQ(result.wait_for(10s), std::future_status::ready);
  EXPECT_EQ(result.get(), 0);
  defaultLog().setSink(nullptr);
  std::filesystem::remove_all(home);
}

}  // namespace
}  // namespace yomber
