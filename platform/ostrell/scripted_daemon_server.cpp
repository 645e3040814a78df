#include <kj/debug.h>

#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/error_codec.h"
#include "platform/ostrell/daemon_wire.h"
#include "platform/ostrell/scripted_daemon_state.h"

namespace yomber {
namespace {

using Wire = protocol::Daemon;
using State = ScriptedDaemon::State;

std::string textOf(bool value) { return value ? "true" : "false"; }

void encodeItemList(const std::vector<ItemFields>& items,
                    capnp::List<protocol::Item>::Builder builder) {
  for (unsigned i = 0; i < items.size(); ++i) encodeItem(items[i], builder[i]);
}

void encodeLocation(const ScriptedDaemon::Location& answer, Wire::LocationResult::Builder result) {
  if (answer.error) {
    ipc::encodeError(answer.error, result.initError());
  } else {
    result.setPath(wireData(answer.path));
  }
}

void encodeItemAnswer(const ScriptedDaemon::Item& answer, Wire::ItemResult::Builder result) {
  if (answer.error) {
    ipc::encodeError(answer.error, result.initError());
  } else {
    encodeItem(answer.item, result.initItem());
  }
}

void encodePage(const ScriptedDaemon::Page& answer, Wire::PageResult::Builder result) {
  if (answer.error) {
    ipc::encodeError(answer.error, result.initError());
    return;
  }
  auto page = result.initPage();
  encodeItemList(answer.items, page.initItems(static_cast<unsigned>(answer.items.size())));
  page.setNextOffset(answer.nextOffset);
}

void encodeChanges(const ScriptedDaemon::Changes& answer, Wire::WorkingSetResult::Builder result) {
  if (answer.error) {
    ipc::encodeError(answer.error, result.initError());
    return;
  }
  auto changes = result.initChanges();
  encodeItemList(answer.updated, changes.initUpdated(static_cast<unsigned>(answer.updated.size())));
  auto deleted = changes.initDeleted(static_cast<unsigned>(answer.deleted.size()));
  for (unsigned i = 0; i < answer.deleted.size(); ++i)
    encodeObjectID(*answer.deleted[i], deleted[i]);
  changes.setToken(wireData(answer.token));
}

void encodeAccount(const ScriptedDaemon::Account& answer, Wire::AccountResult::Builder result) {
  if (answer.error) {
    ipc::encodeError(answer.error, result.initError());
  } else if (!answer.name) {
    result.setNone();
  } else {
    auto account = result.initAccount();
    account.setName(wireText(*answer.name));
    if (answer.perAppAccountIdentifier) {
      account.setPerAppAccountIdentifier(wireText(*answer.perAppAccountIdentifier));
    }
  }
}

void encodeRecords(const ScriptedDaemon::Records& answer,
                   Wire::ContentRecordsResult::Builder result) {
  if (answer.error) {
    ipc::encodeError(answer.error, result.initError());
    return;
  }
  const auto count = static_cast<unsigned>(answer.records.size());
  auto found = result.initFound();
  auto records = found.initRecords(count);
  auto zones = found.initZones(count);
  unsigned i = 0;
  for (const auto& [object, record] : answer.records) {
    encodeObjectID(*QSFileObjectID::fileObjectIDWithString(object), records[i].initObject());
    records[i].setRecord(wireText(record.recordName()));
    records[i].setZone(i);
    zones[i].setName(wireText(record.zoneID().zoneName()));
    zones[i].setOwner(wireText(record.zoneID().ownerName()));
    ++i;
  }
}

class SenderServer final : public protocol::ItemSender::Server {
 public:
  SenderServer(std::shared_ptr<State> state, std::size_t number)
      : state_(std::move(state)), number_(number) {}
  ~SenderServer() {
    state_->receivers[number_] = nullptr;
    LockGuard guard(state_->mutex);
    state_->isSubscribed[number_] = false;
    state_->didHappen();
  }

  kj::Promise<void> boostPriority(BoostPriorityContext context) override {
    context.allowCancellation();
    return state_->answered("boostPriority", {std::to_string(number_)});
  }
  kj::Promise<void> watchItem(WatchItemContext context) override {
    context.allowCancellation();
    const auto params = context.getParams();
    const std::string path = stringFromWire(params.getPath());
    const auto options = params.getOptions();
    const auto answer = state_->currentAnswers().watchItem;
    ipc::encodeOptional(answer ? answer(path, options) : nullptr,
                        context.getResults().initFailure());
    return state_->answered("watchItem", {std::to_string(number_), path, std::to_string(options)});
  }
  kj::Promise<void> invalidate(InvalidateContext context) override {
    context.allowCancellation();
    state_->receivers[number_] = nullptr;
    return state_->answered("invalidate", {std::to_string(number_)});
  }

 private:
  const std::shared_ptr<State> state_;
  const std::size_t number_;
};

class RegistrationServer final : public protocol::Registration::Server {
 public:
  RegistrationServer(std::shared_ptr<State> state, protocol::LibraryObserver::Client observer)
      : state_(std::move(state)) {
    state_->observers.emplace(this, kj::mv(observer));
    LockGuard guard(state_->mutex);
    ++state_->observerCount;
    state_->didHappen();
  }
  ~RegistrationServer() {
    state_->observers.erase(this);
    LockGuard guard(state_->mutex);
    --state_->observerCount;
    state_->didHappen();
  }

 private:
  const std::shared_ptr<State> state_;
};

class DaemonServer final : public Wire::Server {
 public:
  explicit DaemonServer(std::shared_ptr<State> state) : state_(std::move(state)) {}

  kj::Promise<void> describe(DescribeContext context) override;
  kj::Promise<void> urlForItemIdentifier(UrlForItemIdentifierContext context) override;
  kj::Promise<void> documentLocation(DocumentLocationContext context) override;
  kj::Promise<void> itemAtLocation(ItemAtLocationContext context) override;
  kj::Promise<void> containers(ContainersContext context) override;
  kj::Promise<void> containerItem(ContainerItemContext context) override;
  kj::Promise<void> enumerateItemsInFolder(EnumerateItemsInFolderContext context) override;
  kj::Promise<void> enumerateAllFolders(EnumerateAllFoldersContext context) override;
  kj::Promise<void> currentNotifRank(CurrentNotifRankContext context) override;
  kj::Promise<void> enumerateWorkingSetChanges(EnumerateWorkingSetChangesContext context) override;
  kj::Promise<void> getItemUpdateSender(GetItemUpdateSenderContext context) override;
  kj::Promise<void> account(AccountContext context) override;
  kj::Promise<void> observe(ObserveContext context) override;
  kj::Promise<void> contentRecords(ContentRecordsContext context) override;
  kj::Promise<void> content(ContentContext context) override;
  kj::Promise<void> sharing(SharingContext context) override;

 private:
  const std::shared_ptr<State> state_;
};

kj::Promise<void> DaemonServer::describe(DescribeContext context) {
  context.allowCancellation();
  auto results = context.getResults();
  results.setHome(wireData(state_->paths.home));
  results.setRoot(wireData(state_->locations.root()));
  results.setProgram("scripted");
  return state_->answered("describe", {});
}

kj::Promise<void> DaemonServer::urlForItemIdentifier(UrlForItemIdentifierContext context) {
  context.allowCancellation();
  const std::string identifier = stringFromWire(context.getParams().getIdentifier());
  const auto answer = state_->currentAnswers().urlForItemIdentifier;
  encodeLocation(answer ? answer(identifier) : state_->locationOf(identifier),
                 context.getResults().initResult());
  return state_->answered("urlForItemIdentifier", {identifier});
}

kj::Promise<void> DaemonServer::documentLocation(DocumentLocationContext context) {
  context.allowCancellation();
  const auto object = decodeObjectID(context.getParams().getObject());
  KJ_REQUIRE(object != nullptr, "no such object can be");
  const auto answer = state_->currentAnswers().documentLocation;
  encodeLocation(answer ? answer(*object) : state_->locationOf(object->asString()),
                 context.getResults().initResult());
  return state_->answered("documentLocation", {object->asString()});
}

kj::Promise<void> DaemonServer::itemAtLocation(ItemAtLocationContext context) {
  context.allowCancellation();
  const std::string path = stringFromWire(context.getParams().getPath());
  const bool fakeFSEvent = context.getParams().getFakeFSEvent();
  const auto answer = state_->currentAnswers().itemAtLocation;
  encodeItemAnswer(answer ? answer(path, fakeFSEvent) : state_->itemAt(path),
                   context.getResults().initResult());
  return state_->answered("itemAtLocation", {path, textOf(fakeFSEvent)});
}

kj::Promise<void> DaemonServer::containers(ContainersContext context) {
  context.allowCancellation();
  const auto answer = state_->currentAnswers().containers;
  std::vector<ScriptedDaemon::Container> list;
  if (answer) {
    list = answer();
  } else {
    LockGuard guard(state_->mutex);
    list = state_->containers;
  }
  auto builder = context.getResults().initContainers(static_cast<unsigned>(list.size()));
  for (unsigned i = 0; i < list.size(); ++i) {
    builder[i].setContainerID(wireText(list[i].containerID));
    builder[i].setDisplayName(wireText(list[i].displayName));
    builder[i].setDocuments(wireData(list[i].documentsPath));
    builder[i].setApplicationID(wireText(list[i].applicationID));
    builder[i].setIconName(wireText(list[i].iconName));
  }
  return state_->answered("containers", {});
}

kj::Promise<void> DaemonServer::containerItem(ContainerItemContext context) {
  context.allowCancellation();
  const std::string containerID = stringFromWire(context.getParams().getContainerID());
  const bool forceScan = context.getParams().getForceScan();
  const auto answer = state_->currentAnswers().containerItem;
  encodeItemAnswer(answer ? answer(containerID, forceScan) : state_->containerItem(containerID),
                   context.getResults().initResult());
  return state_->answered("containerItem", {containerID, textOf(forceScan)});
}

kj::Promise<void> DaemonServer::enumerateItemsInFolder(EnumerateItemsInFolderContext context) {
  context.allowCancellation();
  const auto params = context.getParams();
  const auto folder =
      params.getFolder().isObject() ? decodeObjectID(params.getFolder().getObject()) : nullptr;
  const auto sortOrder = static_cast<std::uint8_t>(params.getSortOrder());
  const auto offset = params.getOffset();
  const auto limit = params.getLimit();
  const auto answer = state_->currentAnswers().enumerateItemsInFolder;
  const std::string parent =
      folder ? folder->asString() : NSFileProviderRootContainerItemIdentifier;
  const auto belongs = [&](const ItemFields& item) { return item.parentIdentifier == parent; };
  encodePage(answer ? answer(folder, sortOrder, offset, limit)
                    : state_->page(belongs, sortOrder, offset, limit),
             context.getResults().initResult());
  return state_->answered("enumerateItemsInFolder",
                          {folder ? folder->asString() : "", std::to_string(sortOrder),
                           std::to_string(offset), std::to_string(limit)});
}

kj::Promise<void> DaemonServer::enumerateAllFolders(EnumerateAllFoldersContext context) {
  context.allowCancellation();
  const auto params = context.getParams();
  const auto sortOrder = static_cast<std::uint8_t>(params.getSortOrder());
  const auto offset = params.getOffset();
  const auto limit = params.getLimit();
  const auto answer = state_->currentAnswers().enumerateAllFolders;
  const auto belongs = [](const ItemFields& item) { return item.kind == ItemKind::Folder; };
  encodePage(
      answer ? answer(sortOrder, offset, limit) : state_->page(belongs, sortOrder, offset, limit),
      context.getResults().initResult());
  return state_->answered("enumerateAllFolders", {std::to_string(sortOrder), std::to_string(offset),
                                                  std::to_string(limit)});
}

kj::Promise<void> DaemonServer::currentNotifRank(CurrentNotifRankContext context) {
  context.allowCancellation();
  const auto answer = state_->currentAnswers().currentNotifRank;
  const auto rank = answer ? answer() : ScriptedDaemon::Rank{1, nullptr};
  context.getResults().setRank(rank.rank);
  ipc::encodeOptional(rank.error, context.getResults().initFailure());
  return state_->answered("currentNotifRank", {});
}

kj::Promise<void> DaemonServer::enumerateWorkingSetChanges(
    EnumerateWorkingSetChangesContext context) {
  context.allowCancellation();
  const auto given = context.getParams().getToken();
  const auto token = given.isValue() ? std::optional(stringFromWire(given.getValue()))
                                     : std::optional<std::string>();
  const auto limit = context.getParams().getLimit();
  const auto answer = state_->currentAnswers().enumerateWorkingSetChanges;
  encodeChanges(answer ? answer(token, limit)
                       : ScriptedDaemon::Changes{{}, {}, token.value_or("scripted"), nullptr},
                context.getResults().initResult());
  return state_->answered("enumerateWorkingSetChanges",
                          {token.value_or(""), std::to_string(limit)});
}

kj::Promise<void> DaemonServer::getItemUpdateSender(GetItemUpdateSenderContext context) {
  context.allowCancellation();
  const auto answer = state_->currentAnswers().getItemUpdateSender;
  auto result = context.getResults().initResult();
  if (const auto refusal = answer ? answer() : nullptr) {
    ipc::encodeError(refusal, result.initError());
  } else {
    const std::size_t number = state_->receivers.size();
    state_->receivers.emplace_back(context.getParams().getReceiver());
    {
      LockGuard guard(state_->mutex);
      state_->isSubscribed.push_back(true);
      state_->didHappen();
    }
    result.setSender(kj::heap<SenderServer>(state_, number));
  }
  return state_->answered("getItemUpdateSender", {});
}

kj::Promise<void> DaemonServer::account(AccountContext context) {
  context.allowCancellation();
  const auto answer = state_->currentAnswers().account;
  encodeAccount(answer ? answer() : ScriptedDaemon::Account{"someone", "someone-here", nullptr},
                context.getResults().initResult());
  return state_->answered("account", {});
}

kj::Promise<void> DaemonServer::observe(ObserveContext context) {
  context.allowCancellation();
  context.getResults().setRegistration(
      kj::heap<RegistrationServer>(state_, context.getParams().getObserver()));
  return state_->answered("observe", {});
}

kj::Promise<void> DaemonServer::contentRecords(ContentRecordsContext context) {
  context.allowCancellation();
  std::vector<std::string> objects;
  for (const auto each : context.getParams().getObjects()) {
    if (const auto object = decodeObjectID(each)) objects.push_back(object->asString());
  }
  const auto answer = state_->currentAnswers().contentRecords;
  encodeRecords(answer ? answer(objects) : ScriptedDaemon::Records(),
                context.getResults().initResult());
  return state_->answered("contentRecords", std::move(objects));
}

kj::Promise<void> DaemonServer::content(ContentContext context) {
  context.getResults().setContent(makeScriptedContent(state_));
  return kj::READY_NOW;
}

kj::Promise<void> DaemonServer::sharing(SharingContext context) {
  context.getResults().setSharing(makeScriptedSharing(state_));
  return kj::READY_NOW;
}

}  // namespace

protocol::Daemon::Client makeScriptedServer(std::shared_ptr<ScriptedDaemon::State> state) {
  return kj::heap<DaemonServer>(std::move(state));
}

}  // namespace yomber
