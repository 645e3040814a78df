#include "mount/thumbnail_requests.h"

#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/fileprovider/thumbnail.h"
#include "platform/fileprovider/thumbnail_taker.h"
#include "platform/ipc/call.h"
#include "platform/ipc/error_codec.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/daemon_connection.h"
#include "platform/rozzel/container.h"

namespace yomber {
namespace {

using protocol::Control;

constexpr ipc::CallOptions kPatience{.timeout = std::chrono::minutes(2)};
/// Large enough for what the desktop keeps; the store's thumbnails are larger anyway.
constexpr double kSide = 256;

/// Nil when there is none, or with an error.
NSDataRef storedImage(RZDatabase& database, const RZRecordID& recordID, NSErrorRef& error) {
  const RZDesiredKeys keys{{kQSRecordKeyThumbnail1024x1024}};
  std::vector<RZFetchedRecord> fetched;
  error = database.fetchRecords({recordID}, keys, fetched);
  if (!error) error = fetched.front().error;
  if (error) return nullptr;
  const auto* const asset =
      fetched.front().record->valueForKey<RZAsset>(kQSRecordKeyThumbnail1024x1024);
  if (asset == nullptr) return nullptr;
  std::string bytes;
  error = database.engine()->readAsset(*asset, kMaximumThumbnailBytes, bytes);
  return error ? nullptr : std::make_shared<const NSData>(std::move(bytes));
}

/// The records of those of the items that the store has.
QSContentRecordIDsRef recordsOf(const std::vector<std::string>& identifiers, NSErrorRef& error) {
  std::vector<QSFileObjectIDRef> objects;
  for (const std::string& each : identifiers) {
    if (auto object = QSFileObjectID::fileObjectIDWithString(each))
      objects.push_back(std::move(object));
  }
  const auto proxy = QSDaemonConnection::defaultConnection().newSyncProxy();
  proxy->resolveFileObjectIDsToContentRecordIDs(
      objects, [&proxy](const QSContentRecordIDsRef& found, const NSErrorRef& failure) {
        proxy->setObjResult(found, failure);
      });
  error = proxy->error();
  return std::dynamic_pointer_cast<const QSContentRecordIDs>(proxy->result());
}

}  // namespace

ipc::Remote<Control> ThumbnailRequests::control(NSErrorRef* error) {
  if (!connection_ || !connection_->isConnected())
    connection_ = ipc::Connection::connect(controlSocket_, error);
  if (!connection_) return nullptr;
  return connection_->bootstrap<Control>();
}

NSErrorRef ThumbnailRequests::identify(const std::string& location, std::string& identifier) {
  NSErrorRef failure;
  const auto remote = control(&failure);
  if (!remote) return failure;
  NSErrorRef transport = ipc::callAndWait(
      remote, &Control::Client::identifyRequest,
      [&](auto params) { params.setPath(wireData(location)); },
      [&](auto results) {
        const auto result = results.getResult();
        if (result.isError()) {
          failure = ipc::decodeError(result.getError());
        } else {
          identifier = result.getIdentifier().cStr();
        }
      },
      kPatience);
  return transport ? transport : failure;
}

NSErrorRef ThumbnailRequests::fetch(const std::vector<std::string>& identifiers, const Take& take) {
  NSErrorRef failure;
  const auto remote = control(&failure);
  if (!remote) return failure;
  const ThumbnailTaker taker("desktop-thumbnails", [&take](const ItemThumbnail& thumbnail) {
    take(thumbnail.identifier, thumbnail.image);
  });
  NSErrorRef transport = ipc::callAndWait(
      remote, &Control::Client::fetchThumbnailsRequest,
      [&](auto params) {
        auto list = params.initIdentifiers(static_cast<unsigned>(identifiers.size()));
        for (unsigned i = 0; i < list.size(); ++i) list.set(i, wireText(identifiers[i]));
        params.setWidth(kSide);
        params.setHeight(kSide);
        params.setReceiver(taker.receiver());
      },
      [&](auto results) { failure = ipc::decodeOptional(results.getFailure()); }, kPatience);
  return transport ? transport : failure;
}

NSErrorRef ThumbnailRequests::readStored(const std::vector<std::string>& identifiers,
                                         const Take& take) {
  NSErrorRef failure;
  const QSContentRecordIDsRef records = recordsOf(identifiers, failure);
  if (!records) return failure;
  const auto container =
      RZContainer::containerWithIdentifier(QSUbiquitousRozzelContainerIdentifier);
  for (const auto& [object, recordID] : records->recordIDs()) {
    NSErrorRef error;
    const NSDataRef image =
        storedImage(*container->databaseForZone(recordID.zoneID()), recordID, error);
    if (image) take(object->asString(), image);
    if (error) failure = error;
  }
  return failure;
}

}  // namespace yomber
