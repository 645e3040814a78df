#include "zarn/content_server.h"

#include <algorithm>
#include <string>
#include <utility>
#include <vector>

#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/log.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/server_call.h"
#include "zarn/daemon_errors.h"
#include "zarn/pending_wish.h"

namespace yomber {

namespace {

using Wire = protocol::Content;

constexpr std::size_t kMaximumTransfers = 1000;
constexpr std::size_t kMaximumDownloads = 1000;

/// What work on the pool answers: a value, or an error, or both.
template <typename Value>
struct Outcome {
  Value value{};
  NSErrorRef error;
};
struct Nothing {};
using Failure = Outcome<Nothing>;
using Location = Outcome<std::optional<std::string>>;

Trash::IsCancelled isSet(const ipc::CancelFlag& flag) {
  return [flag] { return flag.isSet(); };
}

std::optional<std::int64_t> optionalFromWire(protocol::OptionalInt64::Reader reader) {
  if (!reader.isValue()) return std::nullopt;
  return reader.getValue();
}

Wire::State::Local wireLocal(ContentState::Local local) {
  switch (local) {
    case ContentState::Local::Here:
      return Wire::State::Local::HERE;
    case ContentState::Local::Fault:
      return Wire::State::Local::FAULT;
    case ContentState::Local::Downloading:
      return Wire::State::Local::DOWNLOADING;
    case ContentState::Local::Evicting:
      return Wire::State::Local::EVICTING;
  }
  return Wire::State::Local::HERE;
}

Wire::State::Upload wireUpload(ContentState::Upload upload) {
  switch (upload) {
    case ContentState::Upload::Confirmed:
      return Wire::State::Upload::CONFIRMED;
    case ContentState::Upload::Waiting:
      return Wire::State::Upload::WAITING;
    case ContentState::Upload::Uploading:
      return Wire::State::Upload::UPLOADING;
    case ContentState::Upload::None:
      return Wire::State::Upload::NONE;
  }
  return Wire::State::Upload::NONE;
}

Wire::Transfer::Kind wireKind(ContentTransfer::Kind kind) {
  switch (kind) {
    case ContentTransfer::Kind::Upload:
      return Wire::Transfer::Kind::UPLOAD;
    case ContentTransfer::Kind::Download:
      return Wire::Transfer::Kind::DOWNLOAD;
    case ContentTransfer::Kind::Evict:
      return Wire::Transfer::Kind::EVICT;
  }
  return Wire::Transfer::Kind::UPLOAD;
}

void encodeState(const ContentState& state, Wire::State::Builder builder) {
  builder.setLocal(wireLocal(state.local));
  builder.setUpload(wireUpload(state.upload));
  builder.setPinned(state.isPinned);
  builder.setSize(state.size);
  builder.setLocalBytes(state.localBytes);
  ipc::encodeOptional(state.lastFailure, builder.initLastFailure());
}

void encodeTransfer(const ContentTransfer& transfer, Wire::Transfer::Builder builder) {
  builder.setPath(wireData(transfer.path));
  builder.setKind(wireKind(transfer.kind));
  builder.setTotal(transfer.total);
  builder.setDone(transfer.done);
  builder.setAttempts(transfer.attempts);
  ipc::encodeOptional(transfer.failure, builder.initFailure());
  if (transfer.nextAttempt) builder.initNextAttempt().setValue(*transfer.nextAttempt);
}

/// Wishes for an item's content until it is here or cannot be had.
void wishForGood(const std::shared_ptr<ContentEngine>& engine, const std::string& path) {
  PendingWish::start(engine,
                     [path](ContentEngine& owner, ContentEngine::Completion completion) {
                       return owner.startProviding(path, 0, std::move(completion));
                     })
      .then([path](const NSErrorRef& error) {
        if (error) log_error(defaultLog(), "[ERROR] can't download %@: %@", path, error);
      })
      .detach([](kj::Exception&&) {});
}

}  // namespace

ContentServer::ContentServer(std::shared_ptr<Drive> drive, std::shared_ptr<ContentEngine> engine)
    : drive_(std::move(drive)), engine_(std::move(engine)) {}

template <typename Context, typename Work, typename Answer>
kj::Promise<void> ContentServer::run(Context context, SignedIn signedIn, Work work, Answer answer) {
  using Result = std::invoke_result_t<Work&, const ipc::CancelFlag&>;
  context.releaseParams();
  context.allowCancellation();
  auto ready = drive_->firstScan->isOpen() ? kj::Promise<NSErrorRef>(NSErrorRef())
                                           : drive_->firstScan->wait();
  return ready
      .then([drive = drive_, signedIn,
             work = std::move(work)](NSErrorRef failure) mutable -> kj::Promise<Result> {
        if (!failure && signedIn == SignedIn::Needed) failure = drive->accountError();
        if (!failure) return ipc::onPool(std::move(work));
        Result result;
        result.error = std::move(failure);
        return kj::mv(result);
      })
      .then([context, answer = std::move(answer)](Result result) mutable {
        answer(context.getResults(), result);
      });
}

template <typename Context, typename Work>
kj::Promise<void> ContentServer::answerFailure(Context context, Work work) {
  return run(
      context, SignedIn::Needed,
      [work = std::move(work)](const ipc::CancelFlag&) mutable {
        return Failure{.value = {}, .error = work()};
      },
      [](auto results, const Failure& outcome) {
        ipc::encodeOptional(outcome.error, results.initFailure());
      });
}

template <typename Context, typename Work>
kj::Promise<void> ContentServer::answerLocation(Context context, SignedIn signedIn, Work work) {
  return run(
      context, signedIn,
      [work = std::move(work)](const ipc::CancelFlag& cancelled) mutable {
        Location found;
        found.value = work(cancelled, &found.error);
        return found;
      },
      [](auto results, const Location& found) {
        auto result = results.initResult();
        if (found.value) {
          result.setPath(wireData(*found.value));
        } else {
          ipc::encodeError(found.error, result.initError());
        }
      });
}

// --- Content.

template <typename Context, typename Begin>
kj::Promise<void> ContentServer::runUntilDone(Context context, Begin begin) {
  context.releaseParams();
  context.allowCancellation();
  auto ready = drive_->firstScan->isOpen() ? kj::Promise<NSErrorRef>(NSErrorRef())
                                           : drive_->firstScan->wait();
  return ready
      .then([engine = engine_,
             begin = std::move(begin)](NSErrorRef failure) mutable -> kj::Promise<NSErrorRef> {
        if (failure) return kj::mv(failure);
        return PendingWish::start(std::move(engine), std::move(begin));
      })
      .then([context](NSErrorRef error) mutable {
        ipc::encodeOptional(error, context.getResults().initFailure());
      });
}

kj::Promise<void> ContentServer::startProviding(StartProvidingContext context) {
  const auto params = context.getParams();
  return runUntilDone(context,
                      [path = stringFromWire(params.getPath()), options = params.getOptions()](
                          ContentEngine& engine, ContentEngine::Completion completion) {
                        return engine.startProviding(path, options, std::move(completion));
                      });
}

kj::Promise<void> ContentServer::startDownloading(StartDownloadingContext context) {
  struct Found {
    std::vector<std::string> paths;
    NSErrorRef error;
  };
  const auto list = context.getParams().getPaths();
  Found wanted;
  if (list.size() > kMaximumDownloads) {
    wanted.error = invalidParameterError("paths", std::to_string(list.size()));
  } else {
    for (const auto path : list) wanted.paths.push_back(stringFromWire(path));
  }
  return run(
      context, SignedIn::Needed,
      [engine = engine_, wanted = std::move(wanted)](const ipc::CancelFlag&) mutable {
        for (const std::string& path : wanted.paths) {
          if (!wanted.error) (void)engine->contentState(path, &wanted.error);
        }
        return std::move(wanted);
      },
      [engine = engine_](auto results, const Found& found) {
        ipc::encodeOptional(found.error, results.initFailure());
        if (found.error) return;
        for (const std::string& path : found.paths) wishForGood(engine, path);
      });
}

kj::Promise<void> ContentServer::evict(EvictContext context) {
  return runUntilDone(context, [path = stringFromWire(context.getParams().getPath())](
                                   ContentEngine& engine, ContentEngine::Completion completion) {
    engine.evict(path, std::move(completion));
    return std::unique_ptr<ContentWish>();
  });
}

kj::Promise<void> ContentServer::setPinned(SetPinnedContext context) {
  const auto params = context.getParams();
  return run(
      context, SignedIn::NotNeeded,
      [engine = engine_, path = stringFromWire(params.getPath()),
       isPinned = params.getPinned()](const ipc::CancelFlag&) {
        return Failure{.value = {}, .error = engine->setPinned(path, isPinned)};
      },
      [](auto results, const Failure& outcome) {
        ipc::encodeOptional(outcome.error, results.initFailure());
      });
}

kj::Promise<void> ContentServer::contentState(ContentStateContext context) {
  using Found = Outcome<std::optional<ContentState>>;
  return run(
      context, SignedIn::NotNeeded,
      [engine = engine_,
       path = stringFromWire(context.getParams().getPath())](const ipc::CancelFlag&) {
        Found found;
        found.value = engine->contentState(path, &found.error);
        return found;
      },
      [](auto results, const Found& found) {
        if (found.value) encodeState(*found.value, results.initState());
        ipc::encodeOptional(found.value ? nullptr : found.error, results.initFailure());
      });
}

kj::Promise<void> ContentServer::transfers(TransfersContext context) {
  context.releaseParams();
  context.allowCancellation();
  return ipc::onPool([engine = engine_](const ipc::CancelFlag&) {
           return engine->transfers(kMaximumTransfers);
         })
      .then([context](ContentTransfers found) mutable {
        auto results = context.getResults();
        const std::size_t count = std::min(found.transfers.size(), kMaximumTransfers);
        auto transfers = results.initTransfers(static_cast<unsigned>(count));
        for (unsigned i = 0; i < count; ++i) encodeTransfer(found.transfers[i], transfers[i]);
        results.setWaiting(found.waiting);
        results.setFinished(found.finished);
      });
}

// --- Moves and the trash.

kj::Promise<void> ContentServer::capabilityToMove(CapabilityToMoveContext context) {
  using Capability = Outcome<std::uint32_t>;
  const auto params = context.getParams();
  return run(
      context, SignedIn::Needed,
      [moves = drive_->moves, source = stringFromWire(params.getSource()),
       destination = stringFromWire(params.getDestination())](const ipc::CancelFlag&) {
        Capability found;
        found.value = moves->capability(source, destination, &found.error);
        return found;
      },
      [](auto results, const Capability& found) {
        results.setCapability(found.value);
        ipc::encodeOptional(found.error, results.initFailure());
      });
}

kj::Promise<void> ContentServer::trash(TrashContext context) {
  return answerLocation(
      context, SignedIn::Needed,
      [trash = drive_->trash, path = stringFromWire(context.getParams().getPath())](
          const ipc::CancelFlag& cancelled, NSErrorRef* error) {
        return trash->trash(path, isSet(cancelled), error);
      });
}

kj::Promise<void> ContentServer::putBackLocation(PutBackLocationContext context) {
  return answerLocation(
      context, SignedIn::Needed,
      [trash = drive_->trash, path = stringFromWire(context.getParams().getPath())](
          const ipc::CancelFlag&, NSErrorRef* error) {
        return trash->putBackLocation(path, error);
      });
}

kj::Promise<void> ContentServer::emptyTrash(EmptyTrashContext context) {
  using Emptied = Outcome<std::uint64_t>;
  return run(
      context, SignedIn::Needed,
      [trash = drive_->trash](const ipc::CancelFlag& cancelled) {
        Emptied emptied;
        emptied.value = trash->empty(isSet(cancelled), &emptied.error);
        return emptied;
      },
      [](auto results, const Emptied& emptied) {
        results.setRemoved(emptied.value);
        ipc::encodeOptional(emptied.error, results.initFailure());
      });
}

// --- Locations.

kj::Promise<void> ContentServer::physicalLocation(PhysicalLocationContext context) {
  return answerLocation(
      context, SignedIn::NotNeeded,
      [locations = drive_->locations, path = stringFromWire(context.getParams().getPath())](
          const ipc::CancelFlag&, NSErrorRef* error) {
        return locations->physicalLocation(path, error);
      });
}

kj::Promise<void> ContentServer::containerLocation(ContainerLocationContext context) {
  using Found = Outcome<std::optional<ItemLocations::Container>>;
  const auto params = context.getParams();
  const auto recreate =
      params.getRecreateDocuments() ? ItemLocations::Recreate::Yes : ItemLocations::Recreate::No;
  return run(
      context, SignedIn::NotNeeded,
      [locations = drive_->locations, recreate,
       id = stringFromWire(params.getContainerID())](const ipc::CancelFlag&) {
        Found found;
        found.value = locations->containerLocation(id, recreate, &found.error);
        return found;
      },
      [](auto results, const Found& found) {
        if (found.value) {
          results.initPath().setValue(wireData(found.value->documents));
          results.setDisplayName(wireText(found.value->displayName));
          results.setGeneration(found.value->generation);
        }
        ipc::encodeOptional(found.value ? nullptr : found.error, results.initFailure());
      });
}

// --- Setters.

kj::Promise<void> ContentServer::setLastUsedDate(SetLastUsedDateContext context) {
  const auto params = context.getParams();
  return answerFailure(context, [setters = drive_->setters, path = stringFromWire(params.getPath()),
                                 date = optionalFromWire(params.getDate())] {
    return setters->setLastUsedDate(path, date);
  });
}

kj::Promise<void> ContentServer::setFavoriteRank(SetFavoriteRankContext context) {
  const auto params = context.getParams();
  return answerFailure(context, [setters = drive_->setters, path = stringFromWire(params.getPath()),
                                 rank = optionalFromWire(params.getRank())] {
    return setters->setFavoriteRank(path, rank);
  });
}

kj::Promise<void> ContentServer::setTagNames(SetTagNamesContext context) {
  const auto params = context.getParams();
  std::vector<std::string> names;
  for (const auto name : params.getNames()) names.push_back(stringFromWire(name));
  return answerFailure(context, [setters = drive_->setters, path = stringFromWire(params.getPath()),
                                 names] { return setters->setTagNames(path, names); });
}

}  // namespace yomber
