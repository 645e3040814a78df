#pragma once

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/temporary_directory.h"
#include "platform/rozzel/embedded_engine.h"
#include "platform/rozzel/share.h"
#include "zarn/content/content_store.h"
#include "zarn/content/shares.h"
#include "zarn/content/test_content.h"
#include "zarn/content_engine.h"
#include "zarn/database.h"
#include "zarn/item_store.h"
#include "zarn/scanner.h"
#include "zarn/test_waiting.h"

namespace yomber {

/// One account's drive on a store that several use. What is shared is followed only when somebody
/// asks.
class SharingDrive {
 public:
  static constexpr std::chrono::milliseconds kPatience{30'000};

  SharingDrive(const std::string& home, std::shared_ptr<EmbeddedEngine> records, std::string name)
      : layout(home), account(std::move(name)), records_(std::move(records)) {
    EXPECT_EQ(layout.createFolders(), 0);
    open();
    EXPECT_EQ(scanner->scanAll(), nullptr);
    start();
  }
  ~SharingDrive() {
    if (engine) engine->stop();
  }
  SharingDrive(const SharingDrive&) = delete;
  SharingDrive& operator=(const SharingDrive&) = delete;

  void open() {
    NSErrorRef error;
    database = Database::open(layout.databasePath(), &error);
    ASSERT_NE(database, nullptr) << error->description();
    store = std::make_shared<ItemStore>(database, layout);
    scanner = std::make_shared<Scanner>(store, std::weak_ptr<FolderVisitor>());
  }
  void start() {
    ContentEngine::Options options;
    options.firstPause = std::chrono::milliseconds(5);
    options.longestPause = std::chrono::milliseconds(20);
    options.offlinePause = std::chrono::milliseconds(5);
    options.settlePause = std::chrono::milliseconds(1);
    options.uploadPause = std::chrono::milliseconds::zero();
    options.sharesPause = std::chrono::hours(1);
    engine = ContentEngine::create(store, scanner, options);
    engine->setStore(std::make_shared<ContentStore>(records_, account), account);
    engine->start();
  }
  void restart() {
    engine->stop();
    engine.reset();
    scanner.reset();
    store.reset();
    database.reset();
    open();
    EXPECT_EQ(scanner->scanAll(), nullptr);
    start();
  }

  [[nodiscard]] Shares& shares() const { return *engine->shares(); }
  [[nodiscard]] std::string at(const std::string& path) const {
    return path.empty() ? layout.root() : layout.root() + "/" + path;
  }
  void write(const std::string& path, const std::string& content) const {
    std::ofstream(at(path), std::ios::binary) << content;
    ASSERT_TRUE(std::filesystem::exists(at(path))) << path;
  }
  void makeFolder(const std::string& path) const {
    ASSERT_EQ(mkdir(at(path).c_str(), 0700), 0) << path;
  }
  void rename(const std::string& from, const std::string& to) const {
    ASSERT_EQ(::rename(at(from).c_str(), at(to).c_str()), 0) << from << " " << to;
  }
  void remove(const std::string& path) const { std::filesystem::remove_all(at(path)); }
  [[nodiscard]] bool exists(const std::string& path) const {
    return std::filesystem::exists(std::filesystem::symlink_status(at(path)));
  }
  [[nodiscard]] bool isFault(const std::string& path) const { return isFaultAtPath(at(path)); }
  /// What the file holds, as it is here.
  [[nodiscard]] std::string read(const std::string& path) const {
    std::ifstream file(at(path), std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
  }
  NSErrorRef provide(const std::string& path) const {
    Answer answer;
    const auto wish = engine->startProviding(at(path), 0, answer.take());
    return answer.get();
  }
  /// What whoever opens it gets.
  [[nodiscard]] std::string readWhole(const std::string& path) const {
    const NSErrorRef error = provide(path);
    return error ? "<" + error->description() + ">" : read(path);
  }
  [[nodiscard]] std::optional<ItemRow> row(const std::string& path) const {
    return store->itemAtPath(at(path));
  }
  [[nodiscard]] std::uint64_t id(const std::string& path) const {
    const auto found = row(path);
    return found ? found->id : 0;
  }
  [[nodiscard]] std::vector<std::string> names(const std::string& folder = {}) const {
    std::vector<std::string> result;
    for (const auto& each : std::filesystem::directory_iterator(at(folder)))
      result.push_back(each.path().filename());
    std::sort(result.begin(), result.end());
    return result;
  }

  /// Scans, and waits until all that can be done was done.
  void settle() const {
    ASSERT_EQ(scanner->scanAll(), nullptr);
    ASSERT_TRUE(engine->waitUntilIdle(kPatience));
  }
  /// Takes over what others have changed.
  NSErrorRef follow() const {
    NSErrorRef error = shares().refresh(std::string(NSFileProviderRootContainerItemIdentifier));
    EXPECT_TRUE(engine->waitUntilIdle(kPatience));
    return error;
  }

  /// Shares what is there with those people, or changes with whom it is.
  RZShareRef share(const std::string& path, const std::vector<RZShareParticipant>& people) const {
    Shares::Copied copied;
    NSErrorRef error = shares().copyShare(at(path), copied);
    if (error) error = shares().newShare(at(path), copied.share);
    EXPECT_EQ(error, nullptr) << error->description();
    if (error) return nullptr;
    RZShare changed = *copied.share;
    std::vector<RZShareParticipant> all = changed.participants();
    all.resize(1);
    all.insert(all.end(), people.begin(), people.end());
    changed.setParticipants(all);
    RZShareRef saved;
    error = shares().save(changed, saved);
    EXPECT_EQ(error, nullptr) << error->description();
    EXPECT_TRUE(engine->waitUntilIdle(kPatience));
    return saved;
  }
  NSErrorRef stopSharing(const std::string& path) const {
    Shares::Copied copied;
    NSErrorRef error = shares().copyShare(at(path), copied);
    if (!error) error = shares().destroy(*copied.share);
    EXPECT_TRUE(engine->waitUntilIdle(kPatience));
    return error;
  }
  NSErrorRef accept(const RZShareRef& share, std::string* identifier = nullptr) const {
    std::string accepted;
    NSErrorRef error = shares().accept(share->URL().value_or(""), accepted);
    if (identifier != nullptr) *identifier = accepted;
    EXPECT_TRUE(engine->waitUntilIdle(kPatience));
    return error;
  }

  const TreeLayout layout;
  const std::string account;
  std::shared_ptr<Database> database;
  std::shared_ptr<ItemStore> store;
  std::shared_ptr<Scanner> scanner;
  std::shared_ptr<ContentEngine> engine;

 private:
  const std::shared_ptr<EmbeddedEngine> records_;
};

/// Has whoever comes to a fault point wait there.
class Pause {
 public:
  Pause(const std::string& point, std::string gate) : gate_(std::move(gate)) {
    EXPECT_EQ(FaultPoint::arm(point + "=pause-until-file:" + gate_), nullptr);
  }
  ~Pause() { end(); }
  Pause(const Pause&) = delete;
  Pause& operator=(const Pause&) = delete;

  [[nodiscard]] bool isReached() const { return std::filesystem::exists(gate_ + ".reached"); }
  [[nodiscard]] bool waitUntilReached() const {
    return waitUntil([this] { return isReached(); });
  }
  void end() const { std::ofstream(gate_).put('x'); }

 private:
  const std::string gate_;
};

/// Ann and Bob, each with a drive, on one store.
class TwoDrives : public testing::Test {
 protected:
  TwoDrives() : storePath(directory_.path() + "/store") {
    EXPECT_EQ(EmbeddedEngine::create(storePath), nullptr);
    records = std::make_shared<EmbeddedEngine>(storePath);
    ann = std::make_unique<SharingDrive>(directory_.path() + "/ann", records, "ann");
    bob = std::make_unique<SharingDrive>(directory_.path() + "/bob", records, "bob");
  }
  ~TwoDrives() override { FaultPoint::disarmAll(); }

  static RZShareParticipant viewer(const std::string& name) {
    return {.userName = name, .permission = RZShareParticipantPermission::ReadOnly};
  }
  static RZShareParticipant editor(const std::string& name) {
    return {.userName = name, .permission = RZShareParticipantPermission::ReadWrite};
  }
  /// A folder of Ann's with a document and a folder in it, which Bob has accepted.
  void shareFolder(const RZShareParticipant& participant) {
    ann->makeFolder("Plans");
    ann->makeFolder("Plans/Old");
    ann->write("Plans/a.txt", kLong);
    ann->write("Plans/Old/b.txt", "short");
    ann->settle();
    share = ann->share("Plans", {participant});
    ASSERT_NE(share, nullptr);
    const NSErrorRef error = bob->accept(share);
    ASSERT_EQ(error, nullptr) << error->description();
  }
  /// What Ann puts into it later.
  void addToFolder() const {
    ann->write("Plans/new.txt", kLong);
    ann->makeFolder("Plans/Folder");
    ann->write("Plans/Folder/in.txt", "in it");
    ann->write("Plans/stays.txt", "stays");
    ann->settle();
  }
  /// Both take over, again and again, what the other has changed.
  void followBoth() const {
    for (int turn = 0; turn < 3; ++turn) {
      ASSERT_EQ(bob->follow(), nullptr);
      ASSERT_EQ(ann->follow(), nullptr);
    }
  }
  /// Has something done at a fault point of Bob's taking over.
  void meanwhile(const std::string& point, const std::function<void()>& work) const {
    const std::string gate = storePath + "-go";
    ASSERT_EQ(FaultPoint::arm(point + "=pause-until-file:" + gate), nullptr);
    std::thread following([&] { (void)bob->follow(); });
    const bool isReached = waitUntil([&] { return std::filesystem::exists(gate + ".reached"); });
    if (isReached) work();
    std::ofstream(gate).put('x');
    following.join();
    FaultPoint::disarmAll();
    ASSERT_TRUE(isReached);
  }
  /// The zones with a record of the item, among those that the account has or that it is shown.
  [[nodiscard]] std::vector<std::string> zonesWith(
      const std::string& account, std::uint64_t id,
      RZDatabaseScope scope = RZDatabaseScope::Private) const {
    RZDatabaseID database{QSUbiquitousRozzelContainerIdentifier, account};
    database.scope = scope;
    std::vector<RZRecordZone> zones;
    EXPECT_EQ(records->fetchZones(database, zones), nullptr);
    std::vector<std::string> names;
    for (const RZRecordZone& zone : zones) {
      std::vector<RZFetchedRecord> found;
      EXPECT_EQ(records->fetchRecords(database, {RZRecordID(std::to_string(id), zone.zoneID)},
                                      std::nullopt, found),
                nullptr);
      if (found.at(0).record) names.push_back(zone.zoneID.zoneName());
    }
    return names;
  }
  [[nodiscard]] Pause pauseAt(const std::string& point) const {
    return {point, storePath + "-" + point};
  }
  void goOffline() const { std::ofstream(storePath + "/offline").put('x'); }
  void comeBack() const { std::filesystem::remove(storePath + "/offline"); }

  static const std::string kLong;

 private:
  TemporaryDirectory directory_;

 protected:
  std::string storePath;
  std::shared_ptr<EmbeddedEngine> records;
  std::unique_ptr<SharingDrive> ann;
  std::unique_ptr<SharingDrive> bob;
  RZShareRef share;
};

inline const std::string TwoDrives::kLong = std::string(20'000, 'x') + "the end";

}  // namespace yomber
