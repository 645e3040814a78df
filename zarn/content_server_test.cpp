#include <gmock/gmock.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/lock.h"
#include "platform/foundation/progress.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/move_capability.h"
#include "protocols/content.capnp.h"
#include "zarn/content_engine.h"
#include "zarn/test_daemon.h"

namespace yomber::test {
namespace {

using Content = protocol::Content;
using testing::ElementsAre;
using testing::HasSubstr;

/// An engine that does what the test says, when it says so.
class CommandedEngine final : public ContentEngine,
                              public std::enable_shared_from_this<CommandedEngine> {
 public:
  void start() override {}
  void stop() override {}
  void setStore(std::shared_ptr<ContentStore>, const std::string&) override {}
  std::unique_ptr<ContentWish> startProviding(std::string_view path, std::uint64_t options,
                                              Completion completion) override {
    class Wish final : public ContentWish {
     public:
      Wish(std::shared_ptr<CommandedEngine> engine, std::string path)
          : engine_(std::move(engine)), path_(std::move(path)) {}
      ~Wish() override { engine_->end(path_); }
      NSProgressRef progress() const override { return nullptr; }

     private:
      const std::shared_ptr<CommandedEngine> engine_;  // a wish may be dropped after the test
      const std::string path_;
    };
    LockGuard guard(mutex_);
    options_[std::string(path)] = options;
    wishes_[std::string(path)] = std::move(completion);
    changed_.notifyAll();
    return std::make_unique<Wish>(shared_from_this(), std::string(path));
  }
  void evict(std::string_view path, Completion completion) override {
    completion(path.ends_with("here")
                   ? nullptr
                   : NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorCannotEvict));
  }
  NSErrorRef setPinned(std::string_view path, bool isPinned) override {
    LockGuard guard(mutex_);
    pinned_[std::string(path)] = isPinned;
    return nullptr;
  }
  std::optional<ContentState> contentState(std::string_view path,
                                           NSErrorRef* error) const override {
    LockGuard guard(mutex_);
    const auto pinned = pinned_.find(std::string(path));
    if (pinned == pinned_.end()) {
      storeError(error, NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError));
      return std::nullopt;
    }
    return ContentState{.local = ContentState::Local::Downloading,
                        .upload = ContentState::Upload::Uploading,
                        .isPinned = pinned->second,
                        .size = 70'000,
                        .localBytes = 4096,
                        .lastFailure = NSError::errorWithErrno(ENOSPC)};
  }
  ContentTransfers transfers(std::size_t limit) const override {
    ContentTransfers result;
    result.transfers.resize(limit + 5);
    result.transfers[0] = {.item = 7,
                           .path = "/x",
                           .kind = ContentTransfer::Kind::Evict,
                           .total = 10,
                           .done = 4,
                           .attempts = 2,
                           .failure = NSError::errorWithErrno(EIO),
                           .nextAttempt = 99};
    result.waiting = 3;
    result.finished = 12;
    return result;
  }
  void sweep() override {}
  void retryNow() override {}
  bool waitUntilIdle(std::chrono::milliseconds) override { return true; }

  bool waitForWish(const std::string& path) {
    return waitFor([&]() REQUIRES(mutex_) { return wishes_.contains(path); });
  }
  bool waitForEnd(const std::string& path) {
    return waitFor([&]() REQUIRES(mutex_) { return ended_.contains(path); });
  }
  void complete(const std::string& path, NSErrorRef error) {
    Completion completion;
    {
      LockGuard guard(mutex_);
      completion = std::exchange(wishes_[path], nullptr);
    }
    completion(std::move(error));
  }
  std::uint64_t optionsOf(const std::string& path) {
    LockGuard guard(mutex_);
    return options_[path];
  }

 private:
  template <typename Condition>
  bool waitFor(Condition condition) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    LockGuard guard(mutex_);
    while (!condition()) {
      if (!changed_.waitUntil(mutex_, deadline)) return false;
    }
    return true;
  }
  void end(const std::string& path) {
    Completion completion;
    {
      LockGuard guard(mutex_);
      completion = std::exchange(wishes_[path], nullptr);
      ended_.insert(path);
      changed_.notifyAll();
    }
    if (completion) {
      completion(NSError::errorWithDomain(NSCocoaErrorDomain, NSUserCancelledError));
    }
  }

  mutable Mutex mutex_;
  Condition changed_;
  std::map<std::string, Completion> wishes_ GUARDED_BY(mutex_);
  std::map<std::string, std::uint64_t> options_ GUARDED_BY(mutex_);
  std::map<std::string, bool> pinned_ GUARDED_BY(mutex_);
  std::set<std::string> ended_ GUARDED_BY(mutex_);
};

class ContentServerTest : public DaemonTest {
 protected:
  void SetUp() override {
    Drive::Options options;
    options.engine = engine_;
    upSignedIn(options);
    content_ = getContent();
  }
  void TearDown() override { content_ = nullptr; }

  ipc::Remote<Content> getContent() {
    ipc::Remote<Content> content;
    call(
        &Wire::Client::contentRequest, [](auto) {},
        [&](auto results) { content = ipc::Remote<Content>(results.getContent()); });
    return content;
  }
  template <typename Method, typename Fill, typename Decode>
  void ask(Method method, Fill fill, Decode decode) {
    const auto error = ipc::callAndWait(content_, method, fill, decode);
    ASSERT_EQ(error, nullptr) << error->description();
  }
  /// For calls with one path that answer a failure.
  template <typename Method, typename Fill>
  NSErrorRef askFailure(Method method, const std::string& path, Fill fill) {
    NSErrorRef failure;
    ask(
        method,
        [&](auto params) {
          params.setPath(wireData(path));
          fill(params);
        },
        [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); });
    return failure;
  }
  template <typename Method>
  std::string askLocation(Method method, const std::string& path, NSErrorRef* error = nullptr) {
    std::string location;
    ask(
        method, [&](auto params) { params.setPath(wireData(path)); },
        [&](auto results) {
          const auto result = results.getResult();
          if (result.isPath()) location = stringFromWire(result.getPath());
          if (result.isError()) storeError(error, ipc::decodeError(result.getError()));
        });
    return location;
  }
  std::string trash(const std::string& path, NSErrorRef* error = nullptr) {
    return askLocation(&Content::Client::trashRequest, path, error);
  }
  NSErrorRef setTags(const std::string& path, const std::vector<std::string>& names) {
    return askFailure(&Content::Client::setTagNamesRequest, path, [&](auto params) {
      auto list = params.initNames(static_cast<unsigned>(names.size()));
      for (unsigned i = 0; i < list.size(); ++i) list.set(i, wireText(names[i]));
    });
  }
  static void expectError(const NSErrorRef& error, const char* domain, std::int64_t code) {
    ASSERT_NE(error, nullptr);
    EXPECT_TRUE(error->is(domain, code)) << error->description();
  }
  std::string at(const std::string& name) const { return root_ + "/" + name; }

  const std::shared_ptr<CommandedEngine> engine_ = std::make_shared<CommandedEngine>();
  ipc::Remote<Content> content_;
};

/// A call of startProviding and its answer.
struct Providing {
  explicit Providing(const ipc::Remote<Content>& content, const std::string& path,
                     std::uint64_t options = 0) {
    handle = ipc::call(
        content, &Content::Client::startProvidingRequest,
        [=](auto params) {
          params.setPath(wireData(path));
          params.setOptions(options);
        },
        [state = state](NSErrorRef error, const auto* results) {
          LockGuard guard(state->mutex);
          state->failure = results ? ipc::decodeOptional(results->getFailure()) : error;
          state->isDone = true;
          state->changed.notifyAll();
        });
  }
  bool wait() const {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    LockGuard guard(state->mutex);
    while (!state->isDone) {
      if (!state->changed.waitUntil(state->mutex, deadline)) return false;
    }
    return true;
  }
  NSErrorRef failure() const {
    LockGuard guard(state->mutex);
    return state->failure;
  }

  struct State {
    Mutex mutex;
    Condition changed;
    bool isDone GUARDED_BY(mutex) = false;
    NSErrorRef failure GUARDED_BY(mutex);
  };
  std::shared_ptr<State> state = std::make_shared<State>();
  ipc::CallHandle handle;
};

TEST_F(ContentServerTest, AnswersWhenTheContentIsThere) {
  const Providing providing(content_, "/x", ContentEngine::kAfterWhatGoesOn);
  ASSERT_TRUE(engine_->waitForWish("/x"));
  EXPECT_EQ(engine_->optionsOf("/x"), 0x20000U);
  engine_->complete("/x", nullptr);
  ASSERT_TRUE(providing.wait());
  EXPECT_EQ(providing.failure(), nullptr);
  EXPECT_TRUE(engine_->waitForEnd("/x"));
}

TEST_F(ContentServerTest, SaysWhyContentCannotBeHad) {
  const Providing providing(content_, "/x");
  ASSERT_TRUE(engine_->waitForWish("/x"));
  engine_->complete("/x", NSError::errorWithDomain(NSCocoaErrorDomain, 4354));
  ASSERT_TRUE(providing.wait());
  expectError(providing.failure(), NSCocoaErrorDomain, 4354);
}

TEST_F(ContentServerTest, TakesTheWishBackWhenTheCallIsDropped) {
  Providing providing(content_, "/x");
  const Providing other(content_, "/y");
  ASSERT_TRUE(engine_->waitForWish("/x"));
  ASSERT_TRUE(engine_->waitForWish("/y"));
  providing.handle.cancel();
  EXPECT_TRUE(engine_->waitForEnd("/x"));
  engine_->complete("/y", nullptr);
  ASSERT_TRUE(other.wait());
  EXPECT_EQ(other.failure(), nullptr);
}

TEST_F(ContentServerTest, TakesWishesBackWhenTheClientGoes) {
  auto second = ipc::Connection::connect(paths_.daemonSocket);
  auto content = std::exchange(content_, nullptr);
  auto daemon = std::exchange(daemon_, second->bootstrap<Wire>());
  content_ = getContent();
  const Providing providing(content_, "/x");
  ASSERT_TRUE(engine_->waitForWish("/x"));
  content_ = content;
  daemon_ = daemon;
  second.reset();
  EXPECT_TRUE(engine_->waitForEnd("/x"));
}

TEST_F(ContentServerTest, AsksTheEngineToEvictAndToPin) {
  const auto nothing = [](auto) {};
  EXPECT_EQ(askFailure(&Content::Client::evictRequest, "/here", nothing), nullptr);
  expectError(askFailure(&Content::Client::evictRequest, "/open", nothing), QSOstrellErrorDomain,
              QSOstrellErrorCannotEvict);
  EXPECT_EQ(askFailure(&Content::Client::setPinnedRequest, "/x",
                       [](auto params) { params.setPinned(true); }),
            nullptr);
  ask(
      &Content::Client::contentStateRequest, [](auto params) { params.setPath(wireData("/x")); },
      [](auto results) {
        const auto state = results.getState();
        EXPECT_EQ(state.getLocal(), Content::State::Local::DOWNLOADING);
        EXPECT_EQ(state.getUpload(), Content::State::Upload::UPLOADING);
        EXPECT_TRUE(state.getPinned());
        EXPECT_EQ(state.getSize(), 70'000U);
        EXPECT_EQ(state.getLocalBytes(), 4096U);
        expectError(ipc::decodeOptional(state.getLastFailure()), NSPOSIXErrorDomain, ENOSPC);
      });
  expectError(askFailure(&Content::Client::contentStateRequest, "/y", nothing), NSCocoaErrorDomain,
              NSFileNoSuchFileError);
}

TEST_F(ContentServerTest, ListsABoundedNumberOfTransfers) {
  ask(
      &Content::Client::transfersRequest, [](auto) {},
      [](auto results) {
        EXPECT_EQ(results.getTransfers().size(), 1000U);
        EXPECT_EQ(results.getWaiting(), 3U);
        EXPECT_EQ(results.getFinished(), 12U);
        const auto transfer = results.getTransfers()[0];
        EXPECT_EQ(stringFromWire(transfer.getPath()), "/x");
        EXPECT_EQ(transfer.getKind(), Content::Transfer::Kind::EVICT);
        EXPECT_EQ(transfer.getTotal(), 10U);
        EXPECT_EQ(transfer.getDone(), 4U);
        EXPECT_EQ(transfer.getAttempts(), 2U);
        EXPECT_EQ(transfer.getNextAttempt().getValue(), 99);
        expectError(ipc::decodeOptional(transfer.getFailure()), NSPOSIXErrorDomain, EIO);
      });
}

TEST_F(ContentServerTest, AnswersTheTrashAfterItsRowsAreRight) {
  write("a.txt");
  const auto item = itemAt(at("a.txt"), true);
  ASSERT_TRUE(item.has_value());
  const std::string trashed = trash(at("a.txt"));
  EXPECT_THAT(trashed, HasSubstr("/.Trash/files/a.txt"));
  EXPECT_EQ(locationOf(item->identifier), trashed);
  EXPECT_FALSE(itemAt(at("a.txt"), false).has_value());
  EXPECT_EQ(askLocation(&Content::Client::putBackLocationRequest, trashed), at("a.txt"));

  std::filesystem::rename(trashed, at("a.txt"));
  EXPECT_EQ(itemAt(at("a.txt"), true)->identifier, item->identifier);
}

TEST_F(ContentServerTest, SeesItemsPutBackWithoutBeingTold) {
  write("a.txt");
  const auto item = itemAt(at("a.txt"), true);
  const std::string trashed = trash(at("a.txt"));
  const Subscribed watching = subscribe();
  ASSERT_EQ(watch(watching, root_), nullptr);
  std::filesystem::rename(trashed, at("back.txt"));
  EXPECT_TRUE(watching.watcher->waitForNames({"back.txt"}));
  EXPECT_EQ(locationOf(item->identifier), at("back.txt"));
}

TEST_F(ContentServerTest, EmptiesTheTrash) {
  for (const char* name : {"a", "b"}) {
    write(name);
    trash(at(name));
  }
  ask(
      &Content::Client::emptyTrashRequest, [](auto) {},
      [](auto results) {
        EXPECT_EQ(results.getRemoved(), 2U);
        EXPECT_EQ(ipc::decodeOptional(results.getFailure()), nullptr);
      });
}

TEST_F(ContentServerTest, SetsWhatIsKnownOfAnItem) {
  write("a.txt");
  EXPECT_EQ(setTags(at("a.txt"), {"work", "home"}), nullptr);
  EXPECT_EQ(askFailure(&Content::Client::setFavoriteRankRequest, at("a.txt"),
                       [](auto params) { params.initRank().setValue(4); }),
            nullptr);
  EXPECT_EQ(askFailure(&Content::Client::setLastUsedDateRequest, at("a.txt"),
                       [](auto params) { params.initDate().setValue(5'000'000'000); }),
            nullptr);
  const auto item = itemAt(at("a.txt"), false);
  ASSERT_TRUE(item.has_value());
  EXPECT_THAT(item->tags, ElementsAre("work", "home"));
  EXPECT_EQ(item->favoriteRank, 4);
  ASSERT_TRUE(item->lastUsedDate.has_value());
  EXPECT_EQ(item->lastUsedDate->nanoseconds(), 5'000'000'000);
  EXPECT_EQ(askFailure(&Content::Client::setFavoriteRankRequest, at("a.txt"), [](auto) {}),
            nullptr);
  EXPECT_EQ(itemAt(at("a.txt"), false)->favoriteRank, std::nullopt);
  expectError(setTags(at("a.txt"), {"a,b"}), QSOstrellErrorDomain, QSOstrellErrorInvalidParameter);
  expectError(setTags(at("nothing"), {}), NSCocoaErrorDomain, NSFileNoSuchFileError);
}

TEST_F(ContentServerTest, TellsWhatMovesAre) {
  write("a.txt");
  const auto capability = [&](const std::string& source, const std::string& destination,
                              NSErrorRef& failure) {
    std::uint32_t result = 0;
    ask(
        &Content::Client::capabilityToMoveRequest,
        [&](auto params) {
          params.setSource(wireData(source));
          params.setDestination(wireData(destination));
        },
        [&](auto results) {
          result = results.getCapability();
          failure = ipc::decodeOptional(results.getFailure());
        });
    return result;
  };
  NSErrorRef failure;
  EXPECT_EQ(capability(at("a.txt"), at("b.txt"), failure), QSMoveCapabilityWithinContainer);
  EXPECT_EQ(failure, nullptr);
  EXPECT_EQ(capability(root_, at("b.txt"), failure), QSMoveCapabilityRefusedFixedItem);
  expectError(failure, NSCocoaErrorDomain, NSFileWriteUnknownError);
  EXPECT_EQ(capability(at("gone"), at("b.txt"), failure), 0U);
  expectError(failure, NSCocoaErrorDomain, NSFileNoSuchFileError);
}

TEST_F(ContentServerTest, TellsLocations) {
  write("a.txt");
  EXPECT_EQ(askLocation(&Content::Client::physicalLocationRequest, at("a.txt")), at("a.txt"));
  NSErrorRef error;
  EXPECT_EQ(askLocation(&Content::Client::physicalLocationRequest, "/etc/passwd", &error), "");
  expectError(error, QSOstrellErrorDomain, QSOstrellErrorInvalidParameter);
  const auto container = [&](const std::string& id, bool recreates) {
    std::optional<std::string> path;
    ask(
        &Content::Client::containerLocationRequest,
        [&](auto params) {
          params.setContainerID(wireText(id));
          params.setRecreateDocuments(recreates);
        },
        [&](auto results) {
          if (results.getPath().isValue()) path = stringFromWire(results.getPath().getValue());
          error = ipc::decodeOptional(results.getFailure());
        });
    return path;
  };
  EXPECT_EQ(container(QSUbiquitousDesktopContainerID, false), std::nullopt);
  expectError(error, NSCocoaErrorDomain, NSFileNoSuchFileError);
  EXPECT_EQ(container(QSUbiquitousDesktopContainerID, true), at("Desktop"));
  EXPECT_EQ(error, nullptr);
  EXPECT_TRUE(itemAt(at("Desktop"), false).has_value());
  EXPECT_EQ(container("nobody's", true), std::nullopt);
  expectError(error, QSOstrellErrorDomain, QSOstrellErrorInvalidParameter);
}

TEST_F(ContentServerTest, ChangesNothingWhileNobodyIsSignedIn) {
  write("a.txt");
  ASSERT_EQ(signOut(), nullptr);
  NSErrorRef error;
  EXPECT_EQ(trash(at("a.txt"), &error), "");
  expectError(error, QSOstrellErrorDomain, QSOstrellErrorLoggedOut);
  expectError(setTags(at("a.txt"), {"x"}), QSOstrellErrorDomain, QSOstrellErrorLoggedOut);
  EXPECT_TRUE(std::filesystem::exists(at("a.txt")));
  // What is here stays readable.
  const Providing providing(content_, "/x");
  EXPECT_TRUE(engine_->waitForWish("/x"));
  EXPECT_EQ(askLocation(&Content::Client::physicalLocationRequest, at("a.txt")), at("a.txt"));
}

}  // namespace
}  // namespace yomber::test
