#pragma once

#include <atomic>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/drive_paths.h"
#include "platform/foundation/error.h"
#include "platform/foundation/lock.h"
#include "platform/rozzel/engine.h"
#include "zarn/account.h"
#include "zarn/change_feed.h"
#include "zarn/containers.h"
#include "zarn/content/store_upkeep.h"
#include "zarn/content_engine.h"
#include "zarn/database.h"
#include "zarn/first_scan_gate.h"
#include "zarn/item_locations.h"
#include "zarn/item_setters.h"
#include "zarn/item_store.h"
#include "zarn/listing.h"
#include "zarn/move_capabilities.h"
#include "zarn/registrations.h"
#include "zarn/scanner.h"
#include "zarn/trash.h"
#include "zarn/tree_journal.h"
#include "zarn/tree_layout.h"
#include "zarn/tree_observer.h"
#include "zarn/watchers.h"
#include "zarn/working_set_signals.h"

namespace yomber {

/// One drive and everything that keeps it: opened, then started, then served to any number of
/// connections, then stopped.
///
/// Ownership: shared by the server's connections and the work that they have going.
/// Thread-safety: `start` and `stop` once each, on one thread, which is not the loop thread; the
/// parts are constant and may be used on any thread, as each of them says.
class Drive : public std::enable_shared_from_this<Drive> {
 public:
  struct Options {
    TreeObserver::Options observer;
    Watchers::Options watchers;
    TreeJournal::Options journal;
    /// Where `.desktop` files are looked for.
    std::vector<std::string> applications = applicationDirectories();
    ContentEngine::Options content;
    /// In the place of the drive's own, which then has no record store.
    std::shared_ptr<ContentEngine> engine;
  };

  /// Makes what is missing in the home and opens the database and the account. Null with an error
  /// that says what to do.
  static std::shared_ptr<Drive> open(const DrivePaths& paths, Options options, NSErrorRef* error);
  ~Drive();
  Drive(const Drive&) = delete;
  Drive& operator=(const Drive&) = delete;

  /// Begins to observe and to scan; the first scan of an empty database has `firstScan` open when
  /// it is done, an old database's rows are served at once.
  void start();
  /// Ends the threads; waits for what they are doing.
  void stop();

  /// Nil, or QSOstrellErrorDomain 2 while nobody is signed in.
  [[nodiscard]] NSErrorRef accountError() const;

  const DrivePaths paths;
  const TreeLayout layout;
  const std::shared_ptr<Database> database;
  const std::shared_ptr<ItemStore> store;
  const std::shared_ptr<Listing> listing;
  const std::shared_ptr<ChangeFeed> feed;
  const std::shared_ptr<TreeObserver> observer;
  const std::shared_ptr<Scanner> scanner;
  const std::shared_ptr<TreeJournal> journal;
  const std::shared_ptr<Watchers> watchers;
  const std::shared_ptr<Registrations> registrations;
  const std::shared_ptr<FirstScanGate> firstScan;
  const std::shared_ptr<Account> account;
  const std::shared_ptr<Containers> containers;
  const std::shared_ptr<Trash> trash;
  const std::shared_ptr<ItemSetters> setters;
  const std::shared_ptr<MoveCapabilities> moves;
  const std::shared_ptr<ItemLocations> locations;
  const std::shared_ptr<ContentEngine> engine;

 private:
  Drive(const DrivePaths& drivePaths, Options options, std::shared_ptr<Database> opened,
        std::shared_ptr<Account> openedAccount);
  [[nodiscard]] NSErrorRef scanAll();
  [[nodiscard]] NSErrorRef applyContainers(const std::vector<ContainerFolder>& folders);
  void accountDidChange();
  /// Gives the engine the store of whoever is signed in, once there are rows.
  void updateStore();

  /// Nothing in the company of another engine.
  [[nodiscard]] std::optional<StoreUpkeep> storeUpkeep() const;

  class Housekeeping;
  std::atomic<bool> hasBegunScanning_{false};
  const std::shared_ptr<WorkingSetSignals> workingSetSignals_;
  const RZEngineRef records_;  ///< null in the company of another engine
  Mutex storeMutex_;  ///< held while the engine is told, so that the last one told is right
  std::unique_ptr<Housekeeping> housekeeping_;
};

}  // namespace yomber
