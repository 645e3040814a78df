#include "platform/ostrell/daemon_wire.h"

#include <limits>
#include <string>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/error_codec.h"
#include "platform/ostrell/errors.h"

namespace yomber {
namespace {

using Wire = protocol::Daemon;

Wire::ObjectKind wireKind(QSFileObjectID::Kind kind) {
  switch (kind) {
    case QSFileObjectID::Kind::Folder:
      return Wire::ObjectKind::FOLDER;
    case QSFileObjectID::Kind::Alias:
      return Wire::ObjectKind::ALIAS;
    case QSFileObjectID::Kind::Document:
      break;
  }
  return Wire::ObjectKind::DOCUMENT;
}

}  // namespace

void encodeObjectID(const QSFileObjectID& object, Wire::ObjectID::Builder builder) {
  builder.setKind(wireKind(object.kind()));
  builder.setRawID(object.rawID());
}

QSFileObjectIDRef decodeObjectID(Wire::ObjectID::Reader reader) {
  constexpr std::uint64_t kLargest = std::numeric_limits<std::int64_t>::max();
  const std::uint64_t rawID = reader.getRawID();
  if (rawID == 0 || rawID > kLargest) return nullptr;
  switch (reader.getKind()) {
    case Wire::ObjectKind::DOCUMENT:
      return std::make_shared<QSFileObjectID>(QSFileObjectID::Kind::Document, rawID);
    case Wire::ObjectKind::FOLDER:
      return std::make_shared<QSFileObjectID>(QSFileObjectID::Kind::Folder, rawID);
    case Wire::ObjectKind::ALIAS:
      return std::make_shared<QSFileObjectID>(QSFileObjectID::Kind::Alias, rawID);
  }
  return nullptr;
}

QSQueryItemRef decodeQueryItem(protocol::Item::Reader reader) {
  auto item = std::make_shared<QSQueryItem>(decodeItem(reader));
  const bool isNamed =
      item->fileObjectID() || item->itemIdentifier() == NSFileProviderRootContainerItemIdentifier;
  return isNamed ? item : nullptr;
}

QSQueryItems decodeQueryItems(capnp::List<protocol::Item>::Reader reader) {
  QSQueryItems items;
  items.reserve(reader.size());
  for (const auto& each : reader) {
    if (auto item = decodeQueryItem(each)) {
      items.push_back(std::move(item));
    } else {
      log_error(qsc_default_log(), "[ERROR] the daemon sent an item without an identity: %@",
                stringFromWire(each.getIdentifier()));
    }
  }
  return items;
}

NSURLRef decodeLocation(Wire::LocationResult::Reader reader, NSErrorRef* error) {
  switch (reader.which()) {
    case Wire::LocationResult::PATH: {
      auto url = NSURL::fileURLWithPath(stringFromWire(reader.getPath()));
      if (!url) storeError(error, unintelligibleReply("a location"));
      return url;
    }
    case Wire::LocationResult::ERROR:
      storeError(error, ipc::decodeError(reader.getError()));
      return nullptr;
  }
  storeError(error, unintelligibleReply("a location"));
  return nullptr;
}

QSQueryItemRef decodeItemResult(Wire::ItemResult::Reader reader, NSErrorRef* error) {
  switch (reader.which()) {
    case Wire::ItemResult::ITEM: {
      auto item = decodeQueryItem(reader.getItem());
      if (!item) storeError(error, unintelligibleReply("an item"));
      return item;
    }
    case Wire::ItemResult::ERROR:
      storeError(error, ipc::decodeError(reader.getError()));
      return nullptr;
  }
  storeError(error, unintelligibleReply("an item"));
  return nullptr;
}

QSContentRecordIDsRef decodeContentRecords(Wire::ContentRecordsResult::Reader reader,
                                           NSErrorRef* error) {
  if (reader.isError()) {
    storeError(error, ipc::decodeError(reader.getError()));
    return nullptr;
  }
  if (!reader.isFound()) {
    storeError(error, unintelligibleReply("a list of records"));
    return nullptr;
  }
  std::vector<RZRecordZoneID> zones;
  for (const auto zone : reader.getFound().getZones()) {
    zones.emplace_back(stringFromWire(zone.getName()), stringFromWire(zone.getOwner()));
  }
  QSContentRecordIDs::Map recordIDs;
  for (const auto each : reader.getFound().getRecords()) {
    auto object = decodeObjectID(each.getObject());
    if (object == nullptr || each.getZone() >= zones.size()) continue;
    recordIDs.insert_or_assign(std::move(object),
                               RZRecordID(stringFromWire(each.getRecord()), zones[each.getZone()]));
  }
  return std::make_shared<const QSContentRecordIDs>(std::move(recordIDs));
}

NSErrorRef unintelligibleReply(const char* what) {
  return ipc::connectionError(
      NSXPCConnectionReplyInvalid,
      std::string("The daemon's answer is not ") + what +
          ". It may be of another version: restart it with \"yomber down\" and \"yomber up\".");
}

}  // namespace yomber
