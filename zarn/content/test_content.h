#pragma once

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <memory>
#include <string>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/gate.h"
#include "platform/ostrell/constants.h"
#include "platform/rozzel/container.h"
#include "platform/rozzel/embedded_engine.h"
#include "zarn/content/content_rows.h"
#include "zarn/content/content_store.h"
#include "zarn/content/fault_file.h"
#include "zarn/content_engine.h"
#include "zarn/test_drive.h"
#include "zarn/test_waiting.h"

namespace yomber {

/// What came of one request.
class Answer {
 public:
  ContentEngine::Completion take() {
    return [state = state_](NSErrorRef error) {
      state->error = std::move(error);
      ++state->calls;
      state->gate.open();
    };
  }
  [[nodiscard]] bool isThere() const { return state_->calls.load() != 0; }
  [[nodiscard]] int calls() const { return state_->calls.load(); }
  /// Waits for it. A request that is never answered is an error of its own.
  NSErrorRef get() {
    if (!state_->gate.wait()) return NSError::errorWithDomain("NoAnswer", 1);
    return state_->error;
  }

 private:
  struct State {
    Gate gate;
    std::atomic<int> calls{0};
    NSErrorRef error;
  };
  std::shared_ptr<State> state_ = std::make_shared<State>();
};

/// A drive with a content engine and a record store beside it.
class ContentDrive : public TestDrive {
 protected:
  static constexpr std::chrono::milliseconds kPatience{30'000};

  ContentDrive() : storePath(layout.home() + "/store") {
    EXPECT_EQ(EmbeddedEngine::create(storePath), nullptr);
    records = std::make_shared<EmbeddedEngine>(storePath);
    scan();
    startEngine();
  }
  ~ContentDrive() override {
    FaultPoint::disarmAll();
    if (engine) engine->stop();
  }

  void startEngine(const std::string& account = "ann") {
    options.firstPause = std::chrono::milliseconds(5);
    options.longestPause = std::chrono::milliseconds(20);
    options.offlinePause = std::chrono::milliseconds(5);
    options.settlePause = settlePause;
    options.uploadPause = std::chrono::milliseconds::zero();
    engine = ContentEngine::create(
        store, std::make_shared<Scanner>(store, std::weak_ptr<FolderVisitor>()), options);
    if (!account.empty()) signIn(account);
    engine->start();
  }
  void signIn(const std::string& account) {
    engine->setStore(std::make_shared<ContentStore>(records, account), account);
  }
  void restartEngine() {
    engine->stop();
    engine.reset();
    reopen();
    startEngine();
  }
  /// Scans, and waits until everything that could be done was done.
  void settle() {
    scan();
    ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  }

  NSErrorRef evict(const std::string& path) {
    Answer answer;
    engine->evict(at(path), answer.take());
    return answer.get();
  }
  NSErrorRef provide(const std::string& path, std::uint64_t readingOptions = 0) {
    Answer answer;
    const auto wish = engine->startProviding(at(path), readingOptions, answer.take());
    return answer.get();
  }
  [[nodiscard]] bool isFault(const std::string& path) const { return isFaultAtPath(at(path)); }
  [[nodiscard]] ContentState state(const std::string& path) const {
    NSErrorRef error;
    const auto result = engine->contentState(at(path), &error);
    EXPECT_TRUE(result) << path << ": " << (error ? error->description() : "");
    return result.value_or(ContentState{});
  }
  [[nodiscard]] std::string read(const std::string& path) const {
    std::ifstream file(at(path), std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
  }
  [[nodiscard]] struct stat status(const std::string& path) const {
    struct stat result{};
    EXPECT_EQ(lstat(at(path).c_str(), &result), 0) << path;
    return result;
  }
  /// Content that no two seeds share, without runs of zeros.
  static std::string content(std::size_t size, unsigned seed = 1) {
    std::string result(size, '\0');
    std::uint64_t value = seed * 0x9e3779b97f4a7c15ULL + 1;
    for (char& byte : result) {
      value ^= value << 13U;
      value ^= value >> 7U;
      value ^= value << 17U;
      byte = static_cast<char>((value & 0x7fU) + 1);
    }
    return result;
  }
  /// The record of an item; null when the store has none.
  [[nodiscard]] RZRecordRef record(std::uint64_t item, const std::string& account = "ann") const {
    const RZContainer container(records, QSUbiquitousDefaultContainerID, account);
    return container.privateCloudDatabase()->fetchRecord(
        RZRecordID(std::to_string(item), RZRecordZoneID(QSUbiquitousDefaultContainerID)));
  }
  [[nodiscard]] std::string nameInStore(std::uint64_t item) const {
    const auto found = record(item);
    const auto* const name = found ? found->valueForKey<std::string>("name") : nullptr;
    return name != nullptr ? *name : std::string();
  }
  [[nodiscard]] std::string contentInStore(std::uint64_t item) const {
    const auto found = record(item);
    const auto* const asset = found ? found->valueForKey<RZAsset>("content") : nullptr;
    std::string bytes;
    if (asset != nullptr) {
      EXPECT_EQ(records->readAsset(*asset, 64 << 20, bytes), nullptr);
    }
    return bytes;
  }
  void goOffline() const { std::ofstream(storePath + "/offline").put('x'); }
  void comeBack() const { std::filesystem::remove(storePath + "/offline"); }
  /// The files in which the store keeps assets.
  [[nodiscard]] std::vector<std::string> assetFiles() const {
    std::vector<std::string> result;
    for (const auto& each : std::filesystem::recursive_directory_iterator(storePath + "/assets")) {
      if (each.is_regular_file()) result.push_back(each.path());
    }
    return result;
  }
  /// Flips bits of a byte of those that have that size.
  void damageAssets(std::uintmax_t size, std::streamoff offset) const {
    for (const std::string& path : assetFiles()) {
      if (std::filesystem::file_size(path) != size) continue;
      ASSERT_EQ(chmod(path.c_str(), 0600), 0);
      std::fstream file(path, std::ios::in | std::ios::out | std::ios::binary);
      file.seekg(offset);
      const int byte = file.get();
      file.seekp(offset);
      file.put(static_cast<char>(byte ^ 0x55));
    }
  }

  /// A document whose content is in the store only.
  void makeFault(const std::string& path, const std::string& text) {
    write(path, text);
    settle();
    const NSErrorRef error = evict(path);
    ASSERT_EQ(error, nullptr) << error->description();
    ASSERT_TRUE(isFault(path));
  }
  void stopAt(const std::string& point) {
    gate_ = layout.home() + "/go-" + point;
    for (const char* const suffix : {"", ".reached"}) std::filesystem::remove(gate_ + suffix);
    ASSERT_EQ(FaultPoint::arm(point + "=pause-until-file:" + gate_), nullptr);
  }
  bool isStopped() const {
    return waitUntil([&] { return std::filesystem::exists(gate_ + ".reached"); });
  }
  void go() const { std::ofstream(gate_).put('x'); }

  std::string storePath;
  std::string gate_;
  std::chrono::milliseconds settlePause{1};  ///< of the next engine
  std::shared_ptr<EmbeddedEngine> records;
  ContentEngine::Options options;
  std::shared_ptr<ContentEngine> engine;
};

}  // namespace yomber
