#include "zarn/drive.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <thread>
#include <utility>

#include "platform/foundation/background_thread.h"
#include "platform/foundation/date.h"
#include "platform/foundation/fault_points.h"
#include "platform/foundation/lock.h"
#include "platform/foundation/log.h"
#include "platform/ostrell/constants.h"
#include "platform/rozzel/embedded_engine.h"
#include "zarn/content/content_store.h"
#include "zarn/lent_mode.h"

namespace yomber {

namespace {

NSErrorRef loggedOutError() {
  return NSError::errorWithDomain(
      QSOstrellErrorDomain, QSOstrellErrorLoggedOut,
      {{NSLocalizedDescriptionKey,
        std::string("nobody is signed in to the drive: yomber account sign-in NAME")}});
}

NSErrorRef folderError(int number, const TreeLayout& layout) {
  const auto cause = NSError::errorWithErrno(number, layout.tree());
  return NSError::errorWithDomain(
      NSPOSIXErrorDomain, number,
      {{NSFilePathErrorKey, layout.tree()},
       {NSLocalizedDescriptionKey, "the drive's folders cannot be made in " + layout.home() + ": " +
                                       cause->localizedDescription()}});
}

/// The store is made once. One that is missing later is out of reach: an empty one in its place
/// would have lost everything that is not here.
void makeStoreOnce(const DrivePaths& paths) {
  const std::string mark = paths.home + "/store.made";
  if (access(mark.c_str(), F_OK) == 0) return;
  NSErrorRef error = EmbeddedEngine::create(paths.store);
  if (!error) {
    const FileDescriptor made(open(mark.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
    if (!made) error = NSError::errorWithErrno(errno, mark);
  }
  if (error) log_error(defaultLog(), "[ERROR] the record store cannot be made: %@", error);
}

RZEngineRef openStore(const DrivePaths& paths, const std::shared_ptr<ContentEngine>& other) {
  if (other) return nullptr;
  makeStoreOnce(paths);
  return std::make_shared<EmbeddedEngine>(paths.store);
}

}  // namespace

/// What has to be done now and then: marks for files that the first scan left unmarked, whose
/// upload waits for that, items that leave the working set as time goes by, and content in the
/// store that nobody refers to any more.
class Drive::Housekeeping {
 public:
  Housekeeping(std::shared_ptr<Scanner> scanner, std::shared_ptr<ContentEngine> engine,
               std::shared_ptr<WorkingSetSignals> signals, std::optional<StoreUpkeep> upkeep)
      : scanner_(std::move(scanner)),
        engine_(std::move(engine)),
        signals_(std::move(signals)),
        upkeep_(std::move(upkeep)),
        thread_([this] { run(); }) {}
  ~Housekeeping() {
    {
      LockGuard guard(mutex_);
      isStopping_ = true;
      changed_.notifyAll();
    }
    thread_.join();
  }

 private:
  // Somewhat faster than small files are uploaded; each mark is a change that the observer sees.
  static constexpr std::uint32_t kStamps = 500;
  static constexpr std::chrono::milliseconds kStampPause{100};
  static constexpr std::chrono::seconds kErrorPause{10};
  static constexpr std::chrono::minutes kPause{15};

  /// False when it is time to stop.
  bool pause(std::chrono::milliseconds length) {
    const auto until = std::chrono::steady_clock::now() + length;
    LockGuard guard(mutex_);
    while (!isStopping_) {
      if (!changed_.waitUntil(mutex_, until)) break;
    }
    return !isStopping_;
  }

  /// False when it is time to stop.
  bool stamp() {
    for (std::uint32_t count = 1; count != 0;) {
      const NSErrorRef error = scanner_->stampSome(kStamps, count);
      if (error) {
        log_error(defaultLog(), "[ERROR] files cannot be marked with their ids yet: %@", error);
        if (!pause(kErrorPause)) return false;
        count = 1;
        continue;
      }
      engine_->didStamp();
      if (count != 0 && !pause(kStampPause)) return false;
    }
    return true;
  }

  void run() {
    giveWayToOthers();
    while (true) {
      signals_->expire(NSDate::now().nanoseconds());
      if (!stamp() || !pause(kPause)) return;
      if (upkeep_) (void)upkeep_->runIfDue();
    }
  }

  const std::shared_ptr<Scanner> scanner_;
  const std::shared_ptr<ContentEngine> engine_;
  const std::shared_ptr<WorkingSetSignals> signals_;
  std::optional<StoreUpkeep> upkeep_;
  Mutex mutex_;
  Condition changed_;
  bool isStopping_ GUARDED_BY(mutex_) = false;
  std::thread thread_;
};

std::shared_ptr<Drive> Drive::open(const DrivePaths& paths, Options options, NSErrorRef* error) {
  NSErrorRef failure = paths.create();
  if (!failure) {
    const TreeLayout layout(paths.home);
    if (const int number = layout.createFolders()) failure = folderError(number, layout);
  }
  std::shared_ptr<Database> database;
  if (!failure) database = Database::open(paths.database, &failure);
  std::shared_ptr<Account> account;
  if (database) account = Account::open(paths.home + "/account", &failure);
  if (!account) {
    storeError(error, std::move(failure));
    return nullptr;
  }
  std::shared_ptr<Drive> drive(
      new Drive(paths, std::move(options), std::move(database), std::move(account)));
  drive->account->onChange([drive = drive.get()] { drive->accountDidChange(); });
  drive->trash->recover();
  setLentModesFolder(drive->layout.privateArea() + "/modes");
  restoreLentModes();
  return drive;
}

Drive::Drive(const DrivePaths& drivePaths, Options options, std::shared_ptr<Database> opened,
             std::shared_ptr<Account> openedAccount)
    : paths(drivePaths),
      layout(drivePaths.home),
      database(std::move(opened)),
      store(std::make_shared<ItemStore>(database, layout)),
      listing(std::make_shared<Listing>(database)),
      feed(std::make_shared<ChangeFeed>(database)),
      observer(std::make_shared<TreeObserver>(options.observer)),
      scanner(std::make_shared<Scanner>(store, observer)),
      journal(std::make_shared<TreeJournal>(
          store,
          [weak = std::weak_ptr(observer)](std::uint64_t folder) {
            const auto strong = weak.lock();
            return strong && strong->isWatched(folder);
          },
          options.journal)),
      watchers(Watchers::create(
          [itemStore = store](std::uint64_t id) { return itemStore->ancestors(id); },
          options.watchers)),
      registrations(std::make_shared<Registrations>()),
      firstScan(std::make_shared<FirstScanGate>()),
      account(std::move(openedAccount)),
      containers(std::make_shared<Containers>(std::move(options.applications), layout)),
      trash(Trash::create(store, scanner)),
      setters(std::make_shared<ItemSetters>(store, scanner)),
      moves(std::make_shared<MoveCapabilities>(store, scanner, trash)),
      locations(std::make_shared<ItemLocations>(store, scanner, containers)),
      engine(options.engine ? options.engine
                            : ContentEngine::create(store, scanner, options.content)),
      workingSetSignals_(std::make_shared<WorkingSetSignals>(feed,
                                                             [weak = std::weak_ptr(registrations)] {
                                                               if (const auto strong = weak.lock())
                                                                 strong->workingSetDidChange();
                                                             })),
      records_(openStore(paths, options.engine)) {
  observer->setEventSink(journal);
  database->addSink(observer);
  database->addSink(journal);
  database->addSink(watchers);
  database->addSink(workingSetSignals_);
  database->addSink(trash);
  engine->setTrash([owned = trash](const std::string& path) {
    NSErrorRef error;
    (void)owned->trash(path, [] { return false; }, &error);
    return error;
  });
}

Drive::~Drive() { stop(); }

void Drive::start() {
  if (!database->needsFirstScan()) {
    workingSetSignals_->start();
    firstScan->open();
  }
  updateStore();
  engine->start();
  // Before the scan, so that it looks into the containers' folders too.
  (void)containers->start(
      {.apply = [this](const auto& folders) { return applyContainers(folders); },
       .didChange = [this] { registrations->containerListDidChange(); }});
  observer->start(
      {.scanAll = [this] { return scanAll(); },
       .scanDirty = [this](const auto& dirty,
                           auto& notFound) { return scanner->scanDirty(dirty, notFound); },
       .didFinishFirstScan =
           [this] {
             housekeeping_ =
                 std::make_unique<Housekeeping>(scanner, engine, workingSetSignals_, storeUpkeep());
           }});
}

void Drive::stop() {
  engine->stop();
  containers->stop();
  observer->stop();
  housekeeping_.reset();
}

NSErrorRef Drive::scanAll() {
  firstScan->retry();
  hasBegunScanning_.store(true);
  const bool isFirst = database->needsFirstScan();
  const auto begin = std::chrono::steady_clock::now();
  ScanReport report;
  static FaultPoint beforeScan("zarn.drive.before-scan");
  NSErrorRef error =
      beforeScan.hit() ? NSError::errorWithErrno(EIO, layout.tree()) : scanner->scanAll(&report);
  if (error) {
    if (isFirst) firstScan->fail(error);
    return error;
  }
  const auto duration = std::chrono::steady_clock::now() - begin;
  log_default(defaultLog(),
              "[NOTICE] scanned %llu folders with %llu entries in %.3f s, %llu changes",
              report.folders, report.entries, std::chrono::duration<double>(duration).count(),
              report.changes);
  if (report.unreadable != 0) {
    log_error(defaultLog(), "[ERROR] %llu folders cannot be read; what was known of them stays",
              report.unreadable);
  }
  if (isFirst) {
    // Nobody was told of what it found, and only now it is known how names are shown.
    journal->didLoseTrack();
    workingSetSignals_->start();
    updateStore();
    firstScan->open();
    engine->sweep();
  }
  return nullptr;
}

NSErrorRef Drive::applyContainers(const std::vector<ContainerFolder>& folders) {
  if (NSErrorRef error = store->setContainers(folders)) return error;
  if (!hasBegunScanning_.load()) return nullptr;  // the scan will look into them
  for (const auto& folder : folders) {
    const auto row = store->itemForContainer(folder.containerID);
    if (!row) continue;
    if (NSErrorRef error = scanner->scanSubtree(row->id)) return error;
  }
  return nullptr;
}

void Drive::accountDidChange() {
  if (auto error = accountError()) watchers->failAll(error);
  updateStore();
  registrations->accountTokenDidChange();
}

void Drive::updateStore() {
  // A first scan starts with a database of its own; it is told of the account then.
  if (!records_ || database->needsFirstScan()) return;
  LockGuard guard(storeMutex_);
  const auto current = account->current();
  if (current) {
    engine->setStore(std::make_shared<ContentStore>(records_, current->name), current->name);
  } else {
    engine->setStore(nullptr, {});
  }
}

std::optional<StoreUpkeep> Drive::storeUpkeep() const {
  if (!records_) return std::nullopt;
  const auto isIdle = [content = engine] {
    return content->waitUntilIdle(std::chrono::milliseconds::zero());
  };
  return StoreUpkeep(records_, database, isIdle, {});
}

NSErrorRef Drive::accountError() const { return account->current() ? nullptr : loggedOutError(); }

}  // namespace yomber
