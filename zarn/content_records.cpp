#include "zarn/content_records.h"

#include <algorithm>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/error_codec.h"
#include "platform/rozzel/identifiers.h"
#include "zarn/content/content_rows.h"
#include "zarn/row_queries.h"

namespace yomber {
namespace {

using Wire = protocol::Daemon;

/// A reader must not keep the database's log from being written back for long.
constexpr std::size_t kReadAtOnce = 4096;

}  // namespace

std::vector<std::uint64_t> ContentRecords::documentsIn(
    capnp::List<Wire::ObjectID>::Reader objects) {
  std::vector<std::uint64_t> documents;
  documents.reserve(objects.size());
  for (const auto object : objects) {
    const bool isDocument = object.getKind() == Wire::ObjectKind::DOCUMENT;
    if (isDocument && object.getRawID() >= kFirstIssuedID) documents.push_back(object.getRawID());
  }
  return documents;
}

ContentRecords ContentRecords::find(const Drive& drive, const std::vector<std::uint64_t>& documents,
                                    NSErrorRef failure, const ipc::CancelFlag& cancelled) {
  ContentRecords found;
  found.failure_ = std::move(failure);
  const auto account = drive.account->current();
  if (!found.failure_ && !account) found.failure_ = drive.accountError();
  for (std::size_t begin = 0; begin < documents.size() && !found.failure_; begin += kReadAtOnce) {
    if (cancelled.isSet()) break;
    const std::size_t end = std::min(begin + kReadAtOnce, documents.size());
    found.failure_ = drive.database->read([&](Connection& connection) {
      for (std::size_t i = begin; i < end; ++i) {
        const auto zone = findRecordZone(connection, documents[i], account->name);
        if (zone) found.byZone_[*zone].push_back(documents[i]);
      }
    });
  }
  return found;
}

void ContentRecords::encode(Wire::ContentRecordsResult::Builder result) const {
  if (failure_) {
    ipc::encodeError(failure_, result.initError());
    return;
  }
  std::size_t count = 0;
  for (const auto& [zone, ids] : byZone_) count += ids.size();
  auto found = result.initFound();
  auto zones = found.initZones(static_cast<unsigned>(byZone_.size()));
  auto records = found.initRecords(static_cast<unsigned>(count));
  unsigned zoneIndex = 0;
  unsigned index = 0;
  for (const auto& [zone, ids] : byZone_) {
    zones[zoneIndex].setName(wireText(zone.zoneName()));
    zones[zoneIndex].setOwner(wireText(zone.ownerName()));
    for (const std::uint64_t id : ids) {
      auto record = records[index++];
      record.initObject().setKind(Wire::ObjectKind::DOCUMENT);
      record.getObject().setRawID(id);
      record.setRecord(wireText(std::to_string(id)));
      record.setZone(zoneIndex);
    }
    ++zoneIndex;
  }
}

}  // namespace yomber
