#pragma once

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/lock.h"
#include "platform/foundation/temporary_directory.h"
#include "platform/ostrell/user_defaults.h"
#include "platform/rozzel/container.h"
#include "platform/rozzel/embedded_engine.h"
#include "provider/testing/gate.h"
#include "provider/testing/operations_fixture.h"

namespace yomber {

struct ThumbnailAnswer {
  NSFileProviderItemIdentifier identifier;
  NSDataRef data;
  std::optional<std::string> type;
  NSErrorRef error;

  [[nodiscard]] std::string image() const {
    return data == nullptr ? "nil" : std::string(data->bytes());
  }
};

/// An extension over a record store in the scripted daemon's home, and this user's data folder with
/// icons and thumbnailers.
class ThumbnailTest : public OperationsTest {
 protected:
  ThumbnailTest() {
    const std::string store = daemon.home() + "/store";
    EXPECT_EQ(EmbeddedEngine::create(store), nullptr);
    engine = std::make_shared<EmbeddedEngine>(store);
    answerRecords();
  }
  ~ThumbnailTest() override {
    QSCUserDefaults::defaultsForMangledID(std::nullopt)
        .setMaxRecordCountInFetchRecordsOperation(std::nullopt);
    QSRemoteUserDefaults::sharedDefaults().setMinFileSizeForThumbnailTransfer(std::nullopt);
  }
  static void SetUpTestSuite() {
    setenv("XDG_DATA_HOME", dataHome().c_str(), 1);
    writeFile(dataHome() + "/icons/hicolor/index.theme",
              "[Icon Theme]\nName=Hicolor\nDirectories=48x48/apps\n[48x48/apps]\nSize=48\n");
    writeFile(dataHome() + "/icons/hicolor/48x48/apps/notes.png", png(48));
    writeFile(dataHome() + "/thumbnailers/test.thumbnailer",
              "[Thumbnailer Entry]\nExec=/bin/true %i %o\nMimeType=image/jpeg;\n");
  }
  static const std::string& dataHome() {
    static const TemporaryDirectory directory;
    return directory.path();
  }
  static void writeFile(const std::string& path, const std::string& text) {
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    std::ofstream(path) << text;
  }
  /// The beginning of a square picture.
  static std::string png(unsigned char side) {
    std::string bytes("\x89PNG\r\n\x1a\n\0\0\0\rIHDR\0\0\0", 19);
    bytes += static_cast<char>(side);
    bytes += std::string(3, '\0') + static_cast<char>(side) + std::string(5, '\0');
    return bytes;
  }

  [[nodiscard]] RZContainer storeOf(const std::string& account) const {
    return {engine, QSUbiquitousRozzelContainerIdentifier, account};
  }
  /// A document's record in a zone of that owner, known to the daemon. Without a thumbnail it has
  /// none.
  void addRecord(std::uint64_t rawID, const std::optional<std::string>& thumbnail,
                 std::int64_t size = 5, const std::string& owner = "someone",
                 const std::string& zone = "zone") {
    addRecords({{rawID, thumbnail}}, size, owner, zone);
  }
  void addRecords(const std::map<std::uint64_t, std::optional<std::string>>& pictures,
                  std::int64_t size = 5, const std::string& owner = "someone",
                  const std::string& zone = "zone") {
    const RZContainer container = storeOf(owner);
    const RZRecordZoneID zoneID(zone);
    const auto& database = container.privateCloudDatabase();
    EXPECT_EQ(database->createZone(zoneID), nullptr);
    if (owner != "someone") {
      EXPECT_EQ(engine->addMember(database->databaseID(), zoneID, {.accountName = "someone"}),
                nullptr);
    }
    RZRecordBatch batch;
    std::map<std::string, RZAsset> assets;
    for (const auto& [rawID, thumbnail] : pictures) {
      const RZRecordID id(std::to_string(rawID), zoneID);
      const auto record = std::make_shared<RZRecord>(kQSRecordTypeDocument, id);
      record->setObject(size, kQSRecordKeySize);
      if (thumbnail) {
        if (!assets.contains(*thumbnail)) assets[*thumbnail] = stored(*thumbnail);
        record->setObject(assets[*thumbnail], kQSRecordKeyThumbnail1024x1024);
      }
      batch.recordsToSave.push_back(record);
      know(rawID, {std::to_string(rawID),
                   RZRecordZoneID(zone, owner == "someone" ? RZCurrentUserDefaultName : owner)});
    }
    std::vector<RZRecordRef> saved;
    EXPECT_EQ(database->modifyRecords(batch, saved), nullptr);
  }
  /// The daemon says that the document's content is in that record.
  void know(std::uint64_t rawID, const RZRecordID& recordID) {
    LockGuard guard(known_->mutex);
    known_->records.insert_or_assign(identifierOf(rawID), recordID);
  }
  static std::string identifierOf(std::uint64_t rawID) { return "d:" + std::to_string(rawID); }
  static std::vector<std::string> identifiersOf(std::uint64_t first, std::uint64_t count) {
    std::vector<std::string> identifiers;
    for (std::uint64_t i = 0; i < count; ++i) identifiers.push_back(identifierOf(first + i));
    return identifiers;
  }
  static void setBatchSize(std::uint32_t count) {
    QSCUserDefaults::defaultsForMangledID(std::nullopt)
        .setMaxRecordCountInFetchRecordsOperation(count);
  }

  NSProgressRef fetch(const std::vector<std::string>& identifiers,
                      CGSize size = {.width = 256, .height = 256}) {
    return extension->fetchThumbnailsForItemIdentifiers(
        identifiers, size,
        TypedThumbnailHandler([this](const NSFileProviderItemIdentifier& identifier, NSDataRef data,
                                     const std::optional<std::string>& type, NSErrorRef error) {
          if (whenAnswered) whenAnswered(identifier);
          thumbnails->add({identifier, std::move(data), type, std::move(error)});
        }),
        into(errors));
  }
  /// The same, until it is complete; answers the completion's error.
  NSErrorRef fetchAll(const std::vector<std::string>& identifiers,
                      CGSize size = {.width = 256, .height = 256}) {
    (void)fetch(identifiers, size);
    return only(errors);
  }
  [[nodiscard]] ThumbnailAnswer onlyThumbnail() const {
    const auto all = thumbnails->values();
    EXPECT_EQ(all.size(), 1U);
    return all.empty() ? ThumbnailAnswer{} : all.front();
  }

  std::shared_ptr<EmbeddedEngine> engine;
  std::function<void(const std::string& identifier)> whenAnswered;
  const std::shared_ptr<Awaited<ThumbnailAnswer>> thumbnails =
      std::make_shared<Awaited<ThumbnailAnswer>>();

 private:
  struct Known {
    Mutex mutex;
    std::map<std::string, RZRecordID> records GUARDED_BY(mutex);
  };

  RZAsset stored(const std::string& text) const {
    RZAsset asset;
    EXPECT_EQ(engine->storeAsset(std::as_bytes(std::span(text)), asset), nullptr);
    return asset;
  }
  void answerRecords() {
    daemon.script([known = known_](ScriptedDaemon::Answers& answers) {
      answers.contentRecords = [known](const std::vector<std::string>& objects) {
        ScriptedDaemon::Records found;
        LockGuard guard(known->mutex);
        for (const auto& object : objects) {
          const auto record = known->records.find(object);
          if (record != known->records.end()) found.records.insert(*record);
        }
        return found;
      };
    });
  }

  const std::shared_ptr<Known> known_ = std::make_shared<Known>();
};

}  // namespace yomber
