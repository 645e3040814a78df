#include "platform/ostrell/scripted_sharing.h"

#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/error_codec.h"
#include "platform/ostrell/constants.h"
#include "platform/ostrell/scripted_daemon_state.h"
#include "platform/ostrell/share_wire.h"

namespace yomber {
namespace {

using Wire = protocol::Sharing;
using State = ScriptedDaemon::State;

std::string nameOf(const std::string& path) { return path.substr(path.rfind('/') + 1); }

NSErrorRef notShared() {
  return NSError::errorWithDomain(QSOstrellErrorDomain, QSOstrellErrorNotShared);
}

void encodeAnswer(const ScriptedSharingAnswers::Share& answer,
                  protocol::ShareResult::Builder result) {
  if (answer.error) {
    ipc::encodeError(answer.error, result.initError());
  } else if (answer.share) {
    encodeShare(*answer.share, result.initShare());
  } else {
    result.initShare();
  }
}

/// What a call about one share says of it.
std::vector<std::string> argumentsOf(const RZShareRef& share) {
  return {share ? share->title() : "", share ? share->changeTag() : ""};
}

class SharingServer final : public Wire::Server {
 public:
  explicit SharingServer(std::shared_ptr<State> state) : state_(std::move(state)) {}

  kj::Promise<void> checkIfShareable(CheckIfShareableContext context) override;
  kj::Promise<void> copyShare(CopyShareContext context) override;
  kj::Promise<void> newShare(NewShareContext context) override;
  kj::Promise<void> saveShare(SaveShareContext context) override;
  kj::Promise<void> destroyShare(DestroyShareContext context) override;
  kj::Promise<void> copyShareURL(CopyShareURLContext context) override;
  kj::Promise<void> copyShareToken(CopyShareTokenContext context) override;
  kj::Promise<void> refreshSharingState(RefreshSharingStateContext context) override;
  kj::Promise<void> shareOptions(ShareOptionsContext context) override;
  kj::Promise<void> acceptShare(AcceptShareContext context) override;
  kj::Promise<void> sharesWithMe(SharesWithMeContext context) override;

 private:
  const std::shared_ptr<State> state_;
};

kj::Promise<void> SharingServer::checkIfShareable(CheckIfShareableContext context) {
  context.allowCancellation();
  const auto rawID = context.getParams().getRawID();
  const auto script = state_->currentSharingAnswers().checkIfShareable;
  const auto answer = script ? script(rawID) : ScriptedSharingAnswers::Shareable();
  context.getResults().setShareable(answer.isShareable);
  ipc::encodeOptional(answer.error, context.getResults().initFailure());
  return state_->answered("checkIfShareable", {std::to_string(rawID)});
}

kj::Promise<void> SharingServer::copyShare(CopyShareContext context) {
  context.allowCancellation();
  const std::string path = stringFromWire(context.getParams().getPath());
  const auto script = state_->currentSharingAnswers().copyShare;
  const auto answer =
      script ? script(path) : ScriptedSharingAnswers::Share{.share = {}, .error = notShared()};
  encodeAnswer(answer, context.getResults().initResult());
  if (answer.rootPath) context.getResults().initRootPath().setValue(wireData(*answer.rootPath));
  return state_->answeredUnlessDropped("copyShare", {path});
}

kj::Promise<void> SharingServer::newShare(NewShareContext context) {
  context.allowCancellation();
  const std::string path = stringFromWire(context.getParams().getPath());
  const auto script = state_->currentSharingAnswers().newShare;
  encodeAnswer(script ? script(path)
                      : ScriptedSharingAnswers::Share{.share = scriptedShare(nameOf(path), "")},
               context.getResults().initResult());
  return state_->answeredUnlessDropped("newShare", {path});
}

kj::Promise<void> SharingServer::saveShare(SaveShareContext context) {
  context.allowCancellation();
  const auto share = decodeShare(context.getParams().getShare());
  const auto script = state_->currentSharingAnswers().saveShare;
  ScriptedSharingAnswers::Share answer{.share = share};
  if (script) {
    answer = script(share);
  } else if (share) {
    answer.share = scriptedShare(share->title(), "1", share->type());
  }
  encodeAnswer(answer, context.getResults().initResult());
  return state_->answeredUnlessDropped("saveShare", argumentsOf(share));
}

kj::Promise<void> SharingServer::destroyShare(DestroyShareContext context) {
  context.allowCancellation();
  const auto share = decodeShare(context.getParams().getShare());
  const auto script = state_->currentSharingAnswers().destroyShare;
  ipc::encodeOptional(script ? script(share) : nullptr, context.getResults().initFailure());
  return state_->answeredUnlessDropped("destroyShare", argumentsOf(share));
}

kj::Promise<void> SharingServer::copyShareURL(CopyShareURLContext context) {
  context.allowCancellation();
  const std::string path = stringFromWire(context.getParams().getPath());
  const std::string type = stringFromWire(context.getParams().getDocumentType());
  const auto script = state_->currentSharingAnswers().copyShareURL;
  const auto answer =
      script ? script(path, type) : ScriptedSharingAnswers::Text{.text = {}, .error = notShared()};
  if (answer.text) context.getResults().initUrl().setValue(wireData(*answer.text));
  ipc::encodeOptional(answer.error, context.getResults().initFailure());
  return state_->answeredUnlessDropped("copyShareURL", {path, type});
}

kj::Promise<void> SharingServer::copyShareToken(CopyShareTokenContext context) {
  context.allowCancellation();
  const std::string path = stringFromWire(context.getParams().getPath());
  const auto script = state_->currentSharingAnswers().copyShareToken;
  const auto answer =
      script ? script(path) : ScriptedSharingAnswers::Tokens{.share = "share", .base = "base"};
  context.getResults().setShareToken(wireText(answer.share));
  context.getResults().setBaseToken(wireText(answer.base));
  ipc::encodeOptional(answer.error, context.getResults().initFailure());
  return state_->answeredUnlessDropped("copyShareToken", {path});
}

kj::Promise<void> SharingServer::refreshSharingState(RefreshSharingStateContext context) {
  context.allowCancellation();
  const std::string identifier = stringFromWire(context.getParams().getIdentifier());
  const auto script = state_->currentSharingAnswers().refreshSharingState;
  ipc::encodeOptional(script ? script(identifier) : nullptr, context.getResults().initFailure());
  return state_->answered("refreshSharingState", {identifier});
}

kj::Promise<void> SharingServer::shareOptions(ShareOptionsContext context) {
  context.allowCancellation();
  const std::string identifier = stringFromWire(context.getParams().getIdentifier());
  const auto script = state_->currentSharingAnswers().shareOptions;
  const auto answer = script ? script(identifier) : ScriptedSharingAnswers::Options();
  auto results = context.getResults();
  results.setIsShared(answer.isShared);
  results.setMayWrite(answer.mayWrite);
  results.setIsSharedItself(answer.isSharedItself);
  if (answer.folderName) results.initFolderName().setValue(wireData(*answer.folderName));
  ipc::encodeOptional(answer.error, results.initFailure());
  return state_->answered("shareOptions", {identifier});
}

kj::Promise<void> SharingServer::acceptShare(AcceptShareContext context) {
  context.allowCancellation();
  const std::string url = stringFromWire(context.getParams().getUrl());
  const auto script = state_->currentSharingAnswers().acceptShare;
  const auto answer = script ? script(url) : ScriptedSharingAnswers::Text{.text = "d:5"};
  if (answer.text) context.getResults().setIdentifier(wireText(*answer.text));
  ipc::encodeOptional(answer.error, context.getResults().initFailure());
  return state_->answeredUnlessDropped("acceptShare", {url});
}

kj::Promise<void> SharingServer::sharesWithMe(SharesWithMeContext context) {
  context.allowCancellation();
  const auto script = state_->currentSharingAnswers().sharesWithMe;
  const auto shares = script ? script() : std::vector<RZShareRef>();
  auto list = context.getResults().initShares(static_cast<unsigned>(shares.size()));
  for (unsigned i = 0; i < list.size(); ++i) {
    if (shares[i]) encodeShare(*shares[i], list[i]);
  }
  return state_->answered("sharesWithMe", {});
}

}  // namespace

protocol::Sharing::Client makeScriptedSharing(std::shared_ptr<ScriptedDaemon::State> state) {
  return kj::heap<SharingServer>(std::move(state));
}

RZShareRef scriptedShare(const std::string& title, const std::string& changeTag,
                         const std::string& type) {
  RZShare::Fields fields{
      .zoneID = RZRecordZoneID("share-1"),
      .rootRecordName = "item",
      .changeTag = changeTag,
      .type = type,
      .title = title,
      .ownerName = "someone",
      .participants = {{.userName = "someone",
                        .role = RZShareParticipantRole::Owner,
                        .permission = RZShareParticipantPermission::ReadWrite,
                        .acceptanceStatus = RZShareParticipantAcceptanceStatus::Accepted}}};
  if (!changeTag.empty()) fields.URL = "yomber-share:0123";
  return RZShare::fromFields(fields);
}

}  // namespace yomber
