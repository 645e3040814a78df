#include "tests/harness/stored_thumbnails.h"

#include <algorithm>
#include <span>
#include <stdexcept>

#include "platform/ostrell/constants.h"
#include "platform/rozzel/embedded_engine.h"

namespace yomber::testing {

namespace {

constexpr std::size_t kAtATime = 500;

void require(const NSErrorRef& error) {
  if (error != nullptr) throw std::runtime_error(error->description());
}

}  // namespace

StoredThumbnails::StoredThumbnails(const TestDrive& drive)
    : engine_(std::make_shared<EmbeddedEngine>(drive.home() + "/store")),
      container_(std::make_shared<RZContainer>(
          engine_, QSUbiquitousRozzelContainerIdentifier,
          drive.json({"account"}).at(0).at("account").get<std::string>())) {}

RZRecordRef StoredThumbnails::recordOf(const std::string& identifier) const {
  NSErrorRef error;
  const RZRecordID id(identifier.substr(2), RZRecordZoneID(QSUbiquitousDefaultContainerID));
  RZRecordRef record = container_->privateCloudDatabase()->fetchRecord(id, &error);
  require(error);
  return record;
}

void StoredThumbnails::put(const std::vector<std::string>& identifiers,
                           const std::function<std::string(std::size_t)>& picture) const {
  for (std::size_t begin = 0; begin < identifiers.size(); begin += kAtATime) {
    RZRecordBatch batch{.savePolicy = RZRecordSavePolicy::ChangedKeys};
    NSErrorRef error;
    const auto group = engine_->newAssetGroup(&error);
    require(error);
    const std::size_t end = std::min(begin + kAtATime, identifiers.size());
    for (std::size_t i = begin; i < end; ++i) {
      const auto writer = group->newWriter(&error);
      require(error);
      const std::string bytes = picture(i);
      RZAsset asset;
      require(writer->write(std::as_bytes(std::span(bytes))));
      require(writer->finish(asset));
      const auto record = std::make_shared<RZRecord>(*recordOf(identifiers[i]));
      record->setObject(asset, kQSRecordKeyThumbnail1024x1024);
      batch.recordsToSave.push_back(record);
    }
    require(group->commit());
    std::vector<RZRecordRef> saved;
    require(container_->privateCloudDatabase()->modifyRecords(batch, saved));
  }
}

std::string StoredThumbnails::fileOf(const std::string& identifier) const {
  const RZRecordRef record = recordOf(identifier);
  const auto* const asset = record->valueForKey<RZAsset>(kQSRecordKeyThumbnail1024x1024);
  if (asset == nullptr) throw std::runtime_error(identifier + " has no thumbnail");
  std::string path;
  require(engine_->localFile(*asset, path));
  return path;
}

}  // namespace yomber::testing
