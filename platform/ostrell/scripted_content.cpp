#include "platform/ostrell/scripted_content.h"

#include <filesystem>
#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/error_codec.h"
#include "platform/ostrell/scripted_daemon_state.h"

namespace yomber {
namespace {

using Wire = protocol::Content;
using State = ScriptedDaemon::State;

std::string textOf(bool value) { return value ? "true" : "false"; }

std::optional<std::int64_t> valueOf(protocol::OptionalInt64::Reader reader) {
  return reader.isValue() ? std::optional(reader.getValue()) : std::nullopt;
}

std::string textOf(const std::optional<std::int64_t>& value) {
  return value ? std::to_string(*value) : "";
}

NSErrorRef noSuchFile(const std::string& path) {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError,
                                  {{NSFilePathErrorKey, path}});
}

void encodeLocation(const ScriptedLocation& answer, Wire::LocationResult::Builder result) {
  if (answer.error) {
    ipc::encodeError(answer.error, result.initError());
  } else {
    result.setPath(wireData(answer.path));
  }
}

void encodeState(const QSContentState& state, Wire::State::Builder builder) {
  builder.setLocal(static_cast<Wire::State::Local>(state.local));
  builder.setUpload(static_cast<Wire::State::Upload>(state.upload));
  builder.setPinned(state.isPinned);
  builder.setSize(state.size);
  builder.setLocalBytes(state.localBytes);
  ipc::encodeOptional(state.lastFailure, builder.initLastFailure());
}

void encodeTransfer(const QSTransfer& transfer, Wire::Transfer::Builder builder) {
  builder.setPath(wireData(transfer.url->path()));
  builder.setKind(static_cast<Wire::Transfer::Kind>(transfer.kind));
  builder.setTotal(transfer.total);
  builder.setDone(transfer.done);
  builder.setAttempts(transfer.attempts);
  ipc::encodeOptional(transfer.failure, builder.initFailure());
  if (transfer.nextAttempt) {
    builder.getNextAttempt().setValue(transfer.nextAttempt->nanoseconds());
  }
}

/// Moves the file and its item to the trash's files.
ScriptedLocation moveToTrash(State& state, const std::string& path) {
  const std::filesystem::path source(path);
  const std::string target = state.locations.trashFiles() + "/" + source.filename().string();
  std::error_code failure;
  std::filesystem::rename(source, target, failure);
  if (failure) return {{}, noSuchFile(path)};
  LockGuard guard(state.mutex);
  for (auto& [identifier, entry] : state.items) {
    if (entry.second == path) entry.second = target;
  }
  return {target, nullptr};
}

ScriptedContentAnswers::ContainerLocation containerLocation(State& state,
                                                            const std::string& containerID) {
  LockGuard guard(state.mutex);
  for (const auto& each : state.containers) {
    if (each.containerID == containerID) return {each.documentsPath, nullptr};
  }
  return {std::nullopt, noSuchFile(containerID)};
}

class ContentServer final : public Wire::Server {
 public:
  explicit ContentServer(std::shared_ptr<State> state) : state_(std::move(state)) {}

  kj::Promise<void> startProviding(StartProvidingContext context) override;
  kj::Promise<void> startDownloading(StartDownloadingContext context) override;
  kj::Promise<void> evict(EvictContext context) override;
  kj::Promise<void> setPinned(SetPinnedContext context) override;
  kj::Promise<void> capabilityToMove(CapabilityToMoveContext context) override;
  kj::Promise<void> trash(TrashContext context) override;
  kj::Promise<void> putBackLocation(PutBackLocationContext context) override;
  kj::Promise<void> emptyTrash(EmptyTrashContext context) override;
  kj::Promise<void> physicalLocation(PhysicalLocationContext context) override;
  kj::Promise<void> containerLocation(ContainerLocationContext context) override;
  kj::Promise<void> setLastUsedDate(SetLastUsedDateContext context) override;
  kj::Promise<void> setFavoriteRank(SetFavoriteRankContext context) override;
  kj::Promise<void> setTagNames(SetTagNamesContext context) override;
  kj::Promise<void> contentState(ContentStateContext context) override;
  kj::Promise<void> transfers(TransfersContext context) override;

 private:
  const std::shared_ptr<State> state_;
};

kj::Promise<void> ContentServer::startProviding(StartProvidingContext context) {
  context.allowCancellation();
  const std::string path = stringFromWire(context.getParams().getPath());
  const auto options = context.getParams().getOptions();
  const auto answer = state_->currentContentAnswers().startProviding;
  ipc::encodeOptional(answer ? answer(path, options) : nullptr, context.getResults().initFailure());
  return state_->answeredUnlessDropped("startProviding", {path, std::to_string(options)});
}

kj::Promise<void> ContentServer::startDownloading(StartDownloadingContext context) {
  context.allowCancellation();
  std::vector<std::string> paths;
  for (const auto path : context.getParams().getPaths()) paths.push_back(stringFromWire(path));
  const auto options = context.getParams().getOptions();
  const auto answer = state_->currentContentAnswers().startDownloading;
  ipc::encodeOptional(answer ? answer(paths, options) : nullptr,
                      context.getResults().initFailure());
  paths.push_back(std::to_string(options));
  return state_->answered("startDownloading", std::move(paths));
}

kj::Promise<void> ContentServer::evict(EvictContext context) {
  context.allowCancellation();
  const std::string path = stringFromWire(context.getParams().getPath());
  const auto answer = state_->currentContentAnswers().evict;
  ipc::encodeOptional(answer ? answer(path) : nullptr, context.getResults().initFailure());
  return state_->answered("evict", {path});
}

kj::Promise<void> ContentServer::setPinned(SetPinnedContext context) {
  context.allowCancellation();
  const std::string path = stringFromWire(context.getParams().getPath());
  const bool pinned = context.getParams().getPinned();
  const auto answer = state_->currentContentAnswers().setPinned;
  ipc::encodeOptional(answer ? answer(path, pinned) : nullptr, context.getResults().initFailure());
  return state_->answered("setPinned", {path, textOf(pinned)});
}

kj::Promise<void> ContentServer::capabilityToMove(CapabilityToMoveContext context) {
  context.allowCancellation();
  const std::string source = stringFromWire(context.getParams().getSource());
  const std::string destination = stringFromWire(context.getParams().getDestination());
  const auto answer = state_->currentContentAnswers().capabilityToMove;
  const auto capability =
      answer ? answer(source, destination)
             : ScriptedContentAnswers::Capability{QSMoveCapabilityWithinContainer, nullptr};
  context.getResults().setCapability(capability.bits);
  ipc::encodeOptional(capability.error, context.getResults().initFailure());
  return state_->answered("capabilityToMove", {source, destination});
}

kj::Promise<void> ContentServer::trash(TrashContext context) {
  context.allowCancellation();
  const std::string path = stringFromWire(context.getParams().getPath());
  const auto answer = state_->currentContentAnswers().trash;
  encodeLocation(answer ? answer(path) : moveToTrash(*state_, path),
                 context.getResults().initResult());
  return state_->answered("trash", {path});
}

kj::Promise<void> ContentServer::putBackLocation(PutBackLocationContext context) {
  context.allowCancellation();
  const std::string path = stringFromWire(context.getParams().getPath());
  const auto answer = state_->currentContentAnswers().putBackLocation;
  encodeLocation(answer ? answer(path) : ScriptedLocation{{}, noSuchFile(path)},
                 context.getResults().initResult());
  return state_->answered("putBackLocation", {path});
}

kj::Promise<void> ContentServer::emptyTrash(EmptyTrashContext context) {
  context.allowCancellation();
  const auto answer = state_->currentContentAnswers().emptyTrash;
  ipc::encodeOptional(answer ? answer() : nullptr, context.getResults().initFailure());
  return state_->answered("emptyTrash", {});
}

kj::Promise<void> ContentServer::physicalLocation(PhysicalLocationContext context) {
  context.allowCancellation();
  const std::string path = stringFromWire(context.getParams().getPath());
  const auto answer = state_->currentContentAnswers().physicalLocation;
  encodeLocation(answer ? answer(path) : ScriptedLocation{path, nullptr},
                 context.getResults().initResult());
  return state_->answered("physicalLocation", {path});
}

kj::Promise<void> ContentServer::containerLocation(ContainerLocationContext context) {
  context.allowCancellation();
  const std::string containerID = stringFromWire(context.getParams().getContainerID());
  const bool recreate = context.getParams().getRecreateDocuments();
  const auto answer = state_->currentContentAnswers().containerLocation;
  const auto location =
      answer ? answer(containerID, recreate) : yomber::containerLocation(*state_, containerID);
  auto results = context.getResults();
  if (location.path) results.initPath().setValue(wireData(*location.path));
  results.setDisplayName(wireText(containerID));
  results.setGeneration(1);
  ipc::encodeOptional(location.error, results.initFailure());
  return state_->answered("containerLocation", {containerID, textOf(recreate)});
}

kj::Promise<void> ContentServer::setLastUsedDate(SetLastUsedDateContext context) {
  context.allowCancellation();
  const std::string path = stringFromWire(context.getParams().getPath());
  const auto date = valueOf(context.getParams().getDate());
  const auto answer = state_->currentContentAnswers().setLastUsedDate;
  ipc::encodeOptional(answer ? answer(path, date) : nullptr, context.getResults().initFailure());
  return state_->answered("setLastUsedDate", {path, textOf(date)});
}

kj::Promise<void> ContentServer::setFavoriteRank(SetFavoriteRankContext context) {
  context.allowCancellation();
  const std::string path = stringFromWire(context.getParams().getPath());
  const auto rank = valueOf(context.getParams().getRank());
  const auto answer = state_->currentContentAnswers().setFavoriteRank;
  ipc::encodeOptional(answer ? answer(path, rank) : nullptr, context.getResults().initFailure());
  return state_->answered("setFavoriteRank", {path, textOf(rank)});
}

kj::Promise<void> ContentServer::setTagNames(SetTagNamesContext context) {
  context.allowCancellation();
  std::vector<std::string> arguments{stringFromWire(context.getParams().getPath())};
  std::vector<std::string> names;
  for (const auto each : context.getParams().getNames()) names.push_back(stringFromWire(each));
  const auto answer = state_->currentContentAnswers().setTagNames;
  ipc::encodeOptional(answer ? answer(arguments.front(), names) : nullptr,
                      context.getResults().initFailure());
  arguments.insert(arguments.end(), names.begin(), names.end());
  return state_->answered("setTagNames", std::move(arguments));
}

kj::Promise<void> ContentServer::contentState(ContentStateContext context) {
  context.allowCancellation();
  const std::string path = stringFromWire(context.getParams().getPath());
  const auto answer = state_->currentContentAnswers().contentState;
  const auto state = answer ? answer(path) : ScriptedContentAnswers::State{};
  encodeState(state.state, context.getResults().initState());
  ipc::encodeOptional(state.error, context.getResults().initFailure());
  return state_->answered("contentState", {path});
}

kj::Promise<void> ContentServer::transfers(TransfersContext context) {
  context.allowCancellation();
  const auto answer = state_->currentContentAnswers().transfers;
  const auto transfers = answer ? answer() : QSTransfers{};
  auto list = context.getResults().initTransfers(static_cast<unsigned>(transfers.transfers.size()));
  for (unsigned i = 0; i < list.size(); ++i) encodeTransfer(transfers.transfers[i], list[i]);
  context.getResults().setWaiting(transfers.waiting);
  context.getResults().setFinished(transfers.finished);
  return state_->answered("transfers", {});
}

}  // namespace

protocol::Content::Client makeScriptedContent(std::shared_ptr<ScriptedDaemon::State> state) {
  return kj::heap<ContentServer>(std::move(state));
}

}  // namespace yomber
