#include "zarn/daemon_server.h"

#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <utility>

#include "platform/fileprovider/item_codec.h"
#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/process_usage.h"
#include "platform/ipc/error_codec.h"
#include "platform/ipc/server_call.h"
#include "platform/ostrell/constants.h"
#include "zarn/content_records.h"
#include "zarn/content_server.h"
#include "zarn/daemon_errors.h"
#include "zarn/item_encoder.h"
#include "zarn/item_sender_server.h"
#include "zarn/journal_sender.h"
#include "zarn/sharing_server.h"

namespace yomber {

namespace {

using Wire = protocol::Daemon;

constexpr std::size_t kMaximumTokenLength = 4096;
constexpr const char* kProgram = "zarn";

std::uint64_t nextConnection() {
  static std::atomic<std::uint64_t> last{0};
  return ++last;
}

bool isOfKind(const ItemRow& row, Wire::ObjectKind kind) {
  switch (kind) {
    case Wire::ObjectKind::FOLDER:
      return row.kind == ItemKind::Folder;
    case Wire::ObjectKind::ALIAS:
      return row.kind == ItemKind::Alias;
    case Wire::ObjectKind::DOCUMENT:
      return row.kind != ItemKind::Folder && row.kind != ItemKind::Alias;
  }
  return false;
}

Wire::ObjectKind objectKind(ItemKind kind) {
  if (kind == ItemKind::Folder) return Wire::ObjectKind::FOLDER;
  return kind == ItemKind::Alias ? Wire::ObjectKind::ALIAS : Wire::ObjectKind::DOCUMENT;
}

std::string describe(Wire::ObjectID::Reader object) {
  const char* const letter = object.getKind() == Wire::ObjectKind::FOLDER  ? "i:"
                             : object.getKind() == Wire::ObjectKind::ALIAS ? "a:"
                                                                           : "d:";
  return letter + std::to_string(object.getRawID());
}

ListingOrder listingOrder(protocol::SortOrder order) {
  return order == protocol::SortOrder::DATE ? ListingOrder::Date : ListingOrder::Name;
}

/// An item that was looked up, or why there is none.
struct FoundItem {
  std::optional<ItemRow> row;
  NSErrorRef error;
};

struct FoundPage {
  ListingPage page;
  NSErrorRef error;
};

template <typename Context>
void answerItem(Context context, const FoundItem& found, const std::string& what) {
  const std::uint64_t words = found.row ? encodedRowWords(*found.row) + 8 : 64;
  auto result = context.getResults(capnp::MessageSize{words, 0}).initResult();
  if (found.row) {
    encodeRow(*found.row, result.initItem());
  } else {
    ipc::encodeError(found.error ? found.error : noSuchLocationError(what), result.initError());
  }
}

/// Where the item of that id is, provided that `isIt` holds for it. Root and trash, which were
/// issued no id, are always what they are.
template <typename IsIt>
std::optional<std::string> locationOf(const ItemStore& store, std::uint64_t id, const IsIt& isIt,
                                      const std::string& what, NSErrorRef& failure) {
  if (failure) return std::nullopt;
  std::optional<std::string> path;
  if (id < kFirstIssuedID) {
    path = store.logicalPath(id, &failure);
  } else if (auto located = store.located(id, &failure); located && isIt(located->row)) {
    path = std::move(located->path);
  }
  if (!path && !failure) failure = noSuchItemError(what);
  return path;
}

/// Whether something that the drive may take for an item lies there. One look at the disk.
bool isOnDisk(const TreeLayout& layout, const std::string& path) {
  struct stat status{};
  return layout.placeOf(path) && !layout.isExcluded(path) && lstat(path.c_str(), &status) == 0;
}

template <typename Context>
void answerLocation(Context context, const std::optional<std::string>& path,
                    const NSErrorRef& failure) {
  const std::uint64_t words = path ? path->size() / sizeof(capnp::word) + 16 : 64;
  auto result = context.getResults(capnp::MessageSize{words, 0}).initResult();
  if (path) {
    result.setPath(wireData(*path));
  } else {
    ipc::encodeError(failure, result.initError());
  }
}

}  // namespace

/// Ends what it stands for when the client drops it.
class DaemonServer::RegistrationServer final : public protocol::Registration::Server {
 public:
  explicit RegistrationServer(std::shared_ptr<void> token) : token_(std::move(token)) {}

 private:
  const std::shared_ptr<void> token_;
};

DaemonServer::DaemonServer(std::shared_ptr<Drive> drive)
    : drive_(std::move(drive)), connection_(nextConnection()) {}

DaemonServer::~DaemonServer() { drive_->listing->connectionEnded(connection_); }

template <typename Context, typename Work>
kj::Promise<void> DaemonServer::whenScanned(Context context, Work work) {
  if (drive_->firstScan->isOpen()) return work(nullptr);
  context.allowCancellation();
  return drive_->firstScan->wait().then(kj::mv(work));
}

kj::Promise<void> DaemonServer::describe(DescribeContext context) {
  auto results = context.getResults();
  results.setHome(wireData(drive_->paths.home));
  results.setRoot(wireData(drive_->layout.root()));
  results.setProgram(kProgram);
  results.setBootID(wireText(bootIdentifier()));
  results.setPid(static_cast<std::uint32_t>(getpid()));
  return kj::READY_NOW;
}

// --- Lookups.

kj::Promise<void> DaemonServer::urlForItemIdentifier(UrlForItemIdentifierContext context) {
  return whenScanned(context, [this, context](NSErrorRef failure) mutable {
    const std::string identifier = stringFromWire(context.getParams().getIdentifier());
    context.releaseParams();
    const auto id = rawIDFromIdentifier(identifier);
    if (!failure && !id) failure = noSuchItemError(identifier);
    const auto isIt = [&](const ItemRow& row) {
      return itemIdentifier(row.id, row.kind) == identifier;
    };
    const auto path = locationOf(*drive_->store, id.value_or(kRootID), isIt, identifier, failure);
    answerLocation(context, path, failure);
    return kj::Promise<void>(kj::READY_NOW);
  });
}

kj::Promise<void> DaemonServer::documentLocation(DocumentLocationContext context) {
  return whenScanned(context, [this, context](NSErrorRef failure) mutable {
    const auto object = context.getParams().getObject();
    const auto isIt = [&](const ItemRow& row) { return isOfKind(row, object.getKind()); };
    const std::uint64_t id = object.getRawID();
    const std::string what = yomber::describe(object);
    if (!failure && id < kFirstIssuedID) failure = noSuchItemError(what);
    const auto path = locationOf(*drive_->store, id, isIt, what, failure);
    answerLocation(context, path, failure);
    return kj::Promise<void>(kj::READY_NOW);
  });
}

/// On the pool: looks at the disk first.
template <typename Context>
kj::Promise<void> DaemonServer::scanAndAnswer(Context context, std::string path) {
  context.allowCancellation();
  return ipc::onPool([drive = drive_, path](const ipc::CancelFlag&) {
           FoundItem found;
           found.row = drive->scanner->scanLocation(path, &found.error);
           return found;
         })
      .then([context, path](FoundItem found) mutable { answerItem(context, found, path); });
}

kj::Promise<void> DaemonServer::itemAtLocation(ItemAtLocationContext context) {
  return whenScanned(context, [this, context](NSErrorRef failure) mutable -> kj::Promise<void> {
    std::string path = stringFromWire(context.getParams().getPath());
    const bool scans = context.getParams().getFakeFSEvent();
    context.releaseParams();
    FoundItem found{.row = {}, .error = failure ? failure : drive_->accountError()};
    if (!found.error && scans) return scanAndAnswer(context, std::move(path));
    if (!found.error) found.row = drive_->store->itemAtPath(path, &found.error);
    // What was made a moment ago may still wait for its turn, behind thousands of others.
    const bool isUnseen = !found.row && !found.error && isOnDisk(drive_->layout, path);
    if (isUnseen) return scanAndAnswer(context, std::move(path));
    answerItem(context, found, path);
    return kj::READY_NOW;
  });
}

kj::Promise<void> DaemonServer::containers(ContainersContext context) {
  const auto list = drive_->containers->list();
  auto results = context.getResults();
  results.setGeneration(list->generation);
  auto builder = results.initContainers(static_cast<unsigned>(list->containers.size()));
  for (unsigned i = 0; i < builder.size(); ++i) {
    const ContainerRecord& record = list->containers[i];
    builder[i].setContainerID(wireText(record.containerID));
    builder[i].setDisplayName(wireText(record.displayName));
    builder[i].setDocuments(wireData(record.documents));
    builder[i].setApplicationID(wireText(record.applicationID));
    builder[i].setIconName(wireText(record.iconName));
  }
  return kj::READY_NOW;
}

kj::Promise<void> DaemonServer::containerItem(ContainerItemContext context) {
  return whenScanned(context, [this, context](NSErrorRef failure) mutable -> kj::Promise<void> {
    const std::string id = stringFromWire(context.getParams().getContainerID());
    const bool scans = context.getParams().getForceScan();
    context.releaseParams();
    std::string path;
    for (const auto& each : drive_->containers->list()->containers) {
      if (each.containerID == id) path = each.documents;
    }
    FoundItem found{.row = {}, .error = std::move(failure)};
    if (!found.error && path.empty()) found.error = invalidParameterError("containerID", id);
    if (!found.error && scans) return scanAndAnswer(context, std::move(path));
    if (!found.error) found.row = drive_->store->itemAtPath(path, &found.error);
    answerItem(context, found, path);
    return kj::READY_NOW;
  });
}

// --- Listing.

/// `find` reads the page on the pool, and whoever did that reads on once it is answered: another
/// thread would begin first, and on few processors keep the answer waiting.
template <typename Context, typename Find>
kj::Promise<void> DaemonServer::answerPage(Context context, Find find) {
  context.allowCancellation();
  const auto readAhead = std::make_shared<Listing::ReadAhead>();
  return ipc::onPool(
             [find = std::move(find), readAhead](const ipc::CancelFlag& cancelled) {
               FoundPage found;
               if (!cancelled.isSet()) found.error = find(found.page, *readAhead);
               return found;
             },
             [readAhead] {
               if (*readAhead) (*readAhead)();
             })
      .then([context](FoundPage found) mutable {
        const auto& rows = found.page.rows;
        const std::uint64_t words = found.error ? 64 : encodedPageWords(found.page);
        auto result = context.getResults(capnp::MessageSize{words, 0}).initResult();
        if (found.error) return ipc::encodeError(found.error, result.initError());
        auto page = result.initPage();
        auto items = page.initItems(static_cast<unsigned>(rows.size()));
        for (unsigned i = 0; i < items.size(); ++i) {
          encodeRow(rows[i], *found.page.contentTypes[i], items[i]);
        }
        page.setNextOffset(found.page.nextOffset);
      });
}

kj::Promise<void> DaemonServer::enumerateItemsInFolder(EnumerateItemsInFolderContext context) {
  return whenScanned(context, [this, context](NSErrorRef failure) mutable {
    const auto params = context.getParams();
    const auto folder = params.getFolder();
    if (!failure) failure = drive_->accountError();
    if (!failure && params.getLimit() > Listing::kMaximumLimit) {
      failure = invalidParameterError("limit", std::to_string(params.getLimit()));
    }
    std::uint64_t id = kRootID;
    if (folder.isObject()) {
      id = folder.getObject().getRawID();
      const bool isFolder = folder.getObject().getKind() == Wire::ObjectKind::FOLDER;
      if (!failure && (!isFolder || id < kFirstIssuedID)) {
        failure = noSuchItemError(yomber::describe(folder.getObject()));
      }
    }
    return answerPage(
        context, [drive = drive_, failure, connection = connection_, id,
                  order = listingOrder(params.getSortOrder()), offset = params.getOffset(),
                  limit = params.getLimit()](ListingPage& page, Listing::ReadAhead& ahead) {
          if (failure) return failure;
          return drive->listing->page(connection, id, order, offset, limit, page, ahead);
        });
  });
}

kj::Promise<void> DaemonServer::enumerateAllFolders(EnumerateAllFoldersContext context) {
  return whenScanned(context, [this, context](NSErrorRef failure) mutable {
    const auto params = context.getParams();
    if (!failure) failure = drive_->accountError();
    if (!failure && params.getLimit() > Listing::kMaximumLimit) {
      failure = invalidParameterError("limit", std::to_string(params.getLimit()));
    }
    return answerPage(
        context, [drive = drive_, failure, connection = connection_,
                  order = listingOrder(params.getSortOrder()), offset = params.getOffset(),
                  limit = params.getLimit()](ListingPage& page, Listing::ReadAhead& ahead) {
          if (failure) return failure;
          return drive->listing->foldersPage(connection, order, offset, limit, page, ahead);
        });
  });
}

// --- Working set.

kj::Promise<void> DaemonServer::currentNotifRank(CurrentNotifRankContext context) {
  auto results = context.getResults();
  const NSErrorRef error = drive_->accountError();
  if (!error) results.setRank(drive_->feed->currentNotifRank());
  ipc::encodeOptional(error, results.initFailure());
  return kj::READY_NOW;
}

kj::Promise<void> DaemonServer::enumerateWorkingSetChanges(
    EnumerateWorkingSetChangesContext context) {
  return whenScanned(context, [this, context](NSErrorRef failure) mutable {
    const auto params = context.getParams();
    if (!failure) failure = drive_->accountError();
    if (!failure && params.getLimit() > ChangeFeed::kMaximumLimit) {
      failure = invalidParameterError("limit", std::to_string(params.getLimit()));
    }
    std::optional<std::string> token;
    if (params.getToken().isValue()) {
      // A token that is too long is malformed, cut or not.
      token = stringFromWire(params.getToken().getValue());
      token->resize(std::min(token->size(), kMaximumTokenLength));
    }
    struct Found {
      WorkingSetChanges changes;
      NSErrorRef error;
    };
    context.allowCancellation();
    return ipc::onPool(
               [drive = drive_, failure, token, limit = params.getLimit()](const ipc::CancelFlag&) {
                 Found found{.changes = {}, .error = failure};
                 if (!failure)
                   found.error = drive->feed->workingSetChanges(token, limit, found.changes);
                 return found;
               })
        .then([context](Found found) mutable {
          auto result = context.getResults().initResult();
          if (found.error) return ipc::encodeError(found.error, result.initError());
          auto changes = result.initChanges();
          const auto& rows = found.changes.updated;
          auto updated = changes.initUpdated(static_cast<unsigned>(rows.size()));
          for (unsigned i = 0; i < updated.size(); ++i) encodeRow(rows[i], updated[i]);
          const auto& departed = found.changes.departed;
          auto deleted = changes.initDeleted(static_cast<unsigned>(departed.size()));
          for (unsigned i = 0; i < deleted.size(); ++i) {
            deleted[i].setRawID(departed[i].id);
            deleted[i].setKind(objectKind(departed[i].kind));
          }
          changes.setToken(wireData(found.changes.token));
        });
  });
}

// --- Change notifications and registrations.

kj::Promise<void> DaemonServer::getItemUpdateSender(GetItemUpdateSenderContext context) {
  auto result = context.getResults().initResult();
  NSErrorRef error = drive_->accountError();
  if (!error && !context.getParams().hasReceiver()) error = invalidParameterError("receiver", "");
  if (error) {
    ipc::encodeError(error, result.initError());
  } else {
    result.setSender(kj::heap<ItemSenderServer>(
        drive_, ipc::Remote<protocol::ItemReceiver>(context.getParams().getReceiver())));
  }
  return kj::READY_NOW;
}

kj::Promise<void> DaemonServer::observe(ObserveContext context) {
  context.getResults().setRegistration(
      kj::heap<RegistrationServer>(drive_->registrations->addObserver(
          ipc::Remote<protocol::LibraryObserver>(context.getParams().getObserver()))));
  return kj::READY_NOW;
}

kj::Promise<void> DaemonServer::registerHost(RegisterHostContext context) {
  context.getResults().setRegistration(kj::heap<RegistrationServer>(drive_->registrations->addHost(
      ipc::Remote<protocol::HostReceiver>(context.getParams().getHost()))));
  return kj::READY_NOW;
}

kj::Promise<void> DaemonServer::observeTree(ObserveTreeContext context) {
  auto observer = ipc::Remote<protocol::TreeObserver>(context.getParams().getObserver());
  context.getResults().setRegistration(kj::heap<RegistrationServer>(
      drive_->journal->subscribe(makeJournalSender(std::move(observer)))));
  return kj::READY_NOW;
}

// --- Account.

kj::Promise<void> DaemonServer::account(AccountContext context) {
  auto result = context.getResults().initResult();
  if (const auto current = drive_->account->current()) {
    auto account = result.initAccount();
    account.setName(wireText(current->name));
    account.setPerAppAccountIdentifier(wireText(current->perAppAccountIdentifier));
  } else {
    result.setNone();
  }
  return kj::READY_NOW;
}

kj::Promise<void> DaemonServer::signIn(SignInContext context) {
  return ipc::onPool([drive = drive_, name = stringFromWire(context.getParams().getName())](
                         const ipc::CancelFlag&) { return drive->account->signIn(name); })
      .then([context](NSErrorRef error) mutable {
        ipc::encodeOptional(error, context.getResults().initFailure());
      });
}

kj::Promise<void> DaemonServer::signOut(SignOutContext context) {
  return ipc::onPool([drive = drive_](const ipc::CancelFlag&) { return drive->account->signOut(); })
      .then([context](NSErrorRef error) mutable {
        ipc::encodeOptional(error, context.getResults().initFailure());
      });
}

// --- Status.

kj::Promise<void> DaemonServer::status(StatusContext context) {
  context.allowCancellation();
  struct Sizes {
    ItemStore::Counts counts;
    ProcessUsage process;
  };
  return ipc::onPool([drive = drive_](const ipc::CancelFlag&) {
           return Sizes{.counts = drive->store->counts(), .process = processUsage()};
         })
      .then([this, context](Sizes sizes) mutable {
        const auto observed = drive_->observer->status();
        const bool isLive = observed.advice.empty();
        const bool isScanning = observed.scanning || !drive_->firstScan->isOpen();
        auto status = context.getResults().initStatus();
        status.setItems(sizes.counts.items);
        status.setFolders(sizes.counts.folders);
        status.setRank(drive_->database->currentRank());
        status.setScan(isScanning ? Wire::Status::Scan::RUNNING : Wire::Status::Scan::DONE);
        status.setWatchedFolders(observed.watchedFolders);
        status.setObservation(isLive ? Wire::Status::Observation::LIVE
                                     : Wire::Status::Observation::SCANNING);
        status.setObservationAdvice(wireText(observed.advice));
        status.setWatchers(static_cast<std::uint32_t>(drive_->watchers->count()));
        status.setResidentBytes(sizes.process.residentBytes);
        status.setOpenDescriptors(sizes.process.openDescriptors);
      });
}

// --- Content.

kj::Promise<void> DaemonServer::contentRecords(ContentRecordsContext context) {
  return whenScanned(context, [this, context](NSErrorRef failure) mutable {
    const auto objects = context.getParams().getObjects();
    if (!failure) failure = drive_->accountError();
    if (!failure && objects.size() > ContentRecords::kMaximumObjects) {
      failure = invalidParameterError("objects", std::to_string(objects.size()));
    }
    std::vector<std::uint64_t> documents;
    if (!failure) documents = ContentRecords::documentsIn(objects);
    context.releaseParams();
    context.allowCancellation();
    return ipc::onPool([drive = drive_, failure = std::move(failure),
                        documents = std::move(documents)](const ipc::CancelFlag& cancelled) {
             return ContentRecords::find(*drive, documents, failure, cancelled);
           })
        .then([context](const ContentRecords& found) mutable {
          found.encode(context.getResults().initResult());
        });
  });
}

kj::Promise<void> DaemonServer::content(ContentContext context) {
  context.getResults().setContent(kj::heap<ContentServer>(drive_, drive_->engine));
  return kj::READY_NOW;
}

kj::Promise<void> DaemonServer::sharing(SharingContext context) {
  context.getResults().setSharing(kj::heap<SharingServer>(drive_));
  return kj::READY_NOW;
}

}  // namespace yomber
