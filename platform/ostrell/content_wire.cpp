#include "platform/ostrell/content_wire.h"

#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/error_codec.h"
#include "platform/ostrell/daemon_wire.h"

namespace yomber {
namespace {

using Wire = protocol::Content;

QSContentState::Local decodeLocal(Wire::State::Local local) {
  switch (local) {
    case Wire::State::Local::FAULT:
      return QSContentState::Local::Fault;
    case Wire::State::Local::DOWNLOADING:
      return QSContentState::Local::Downloading;
    case Wire::State::Local::EVICTING:
      return QSContentState::Local::Evicting;
    case Wire::State::Local::HERE:
      break;
  }
  return QSContentState::Local::Here;
}

QSContentState::Upload decodeUpload(Wire::State::Upload upload) {
  switch (upload) {
    case Wire::State::Upload::CONFIRMED:
      return QSContentState::Upload::Confirmed;
    case Wire::State::Upload::WAITING:
      return QSContentState::Upload::Waiting;
    case Wire::State::Upload::UPLOADING:
      return QSContentState::Upload::Uploading;
    case Wire::State::Upload::NONE:
      break;
  }
  return QSContentState::Upload::None;
}

QSTransfer::Kind decodeKind(Wire::Transfer::Kind kind) {
  switch (kind) {
    case Wire::Transfer::Kind::DOWNLOAD:
      return QSTransfer::Kind::Download;
    case Wire::Transfer::Kind::EVICT:
      return QSTransfer::Kind::Evict;
    case Wire::Transfer::Kind::UPLOAD:
      break;
  }
  return QSTransfer::Kind::Upload;
}

QSTransfer decodeTransfer(Wire::Transfer::Reader reader) {
  QSTransfer transfer;
  transfer.url = NSURL::fileURLWithPath(stringFromWire(reader.getPath()));
  transfer.kind = decodeKind(reader.getKind());
  transfer.total = reader.getTotal();
  transfer.done = reader.getDone();
  transfer.attempts = reader.getAttempts();
  transfer.failure = ipc::decodeOptional(reader.getFailure());
  if (reader.getNextAttempt().isValue()) {
    transfer.nextAttempt = NSDate::fromNanoseconds(reader.getNextAttempt().getValue());
  }
  return transfer;
}

}  // namespace

NSURLRef decodeLocation(Wire::LocationResult::Reader reader, NSErrorRef* error) {
  if (reader.isError()) {
    storeError(error, ipc::decodeError(reader.getError()));
    return nullptr;
  }
  auto url = reader.isPath() ? NSURL::fileURLWithPath(stringFromWire(reader.getPath())) : nullptr;
  if (!url) storeError(error, unintelligibleReply("a location"));
  return url;
}

ContainerLocation decodeContainerLocation(Wire::ContainerLocationResults::Reader reader) {
  ContainerLocation location;
  location.displayName = stringFromWire(reader.getDisplayName());
  location.generation = reader.getGeneration();
  location.error = ipc::decodeOptional(reader.getFailure());
  if (location.error) return location;
  const auto path = reader.getPath();
  if (path.isValue()) location.url = NSURL::fileURLWithPath(stringFromWire(path.getValue()));
  if (!location.url) location.error = unintelligibleReply("a location");
  return location;
}

QSContentState decodeContentState(Wire::State::Reader reader) {
  QSContentState state;
  state.local = decodeLocal(reader.getLocal());
  state.upload = decodeUpload(reader.getUpload());
  state.isPinned = reader.getPinned();
  state.size = reader.getSize();
  state.localBytes = reader.getLocalBytes();
  state.lastFailure = ipc::decodeOptional(reader.getLastFailure());
  return state;
}

QSTransfers decodeTransfers(Wire::TransfersResults::Reader reader) {
  QSTransfers transfers;
  for (const auto each : reader.getTransfers()) {
    auto transfer = decodeTransfer(each);
    if (transfer.url) transfers.transfers.push_back(std::move(transfer));
  }
  transfers.waiting = reader.getWaiting();
  transfers.finished = reader.getFinished();
  return transfers;
}

}  // namespace yomber
