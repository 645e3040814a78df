#pragma once

#include <sys/types.h>

#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform/foundation/lock.h"
#include "platform/rozzel/asset_folder.h"
#include "platform/rozzel/asset_staging.h"
#include "platform/rozzel/embedded_engine.h"
#include "platform/rozzel/records_connection.h"
#include "platform/rozzel/records_schema.h"
#include "platform/rozzel/store_failure.h"

namespace yomber {

/// What the embedded engine keeps: where its store is, and connections to it. Finds out at every
/// call whether the store is in reach, and whether it is still the one that was opened.
///
/// Thread-safety: every operation may be called on any thread.
class EmbeddedEngine::Store {
 public:
  Store(std::string folder, EmbeddedEngineOptions options);

  [[nodiscard]] const AssetFolder& assets() const { return assets_; }
  [[nodiscard]] const EmbeddedEngineOptions& options() const { return options_; }
  [[nodiscard]] NSDate now() const;

  /// Throws RZErrorNetworkUnavailable.
  void requireReachable() const { (void)identify(); }

  /// Runs `work(connection)`; its failure is the answer.
  template <typename Work>
  [[nodiscard]] NSErrorRef withConnection(Work&& work) {
    return catchingFailures([&] {
      Lease lease = borrow();
      try {
        work(*lease.connection);
      } catch (const StoreFailure& failure) {
        if (!isOfDatabase(failure.error)) giveBack(std::move(lease));
        throw;
      }
      giveBack(std::move(lease));
    });
  }
  /// The same within a transaction, which is committed when `work` returns.
  template <typename Work>
  [[nodiscard]] NSErrorRef withTransaction(RecordsTransaction::Kind kind, Work&& work) {
    return withConnection([&](RecordsConnection& connection) {
      RecordsTransaction transaction(connection, kind);
      work(connection);
      transaction.commit();
    });
  }

  [[nodiscard]] std::shared_ptr<StagingSession> session();

 private:
  /// Which file a path led to.
  struct Identity {
    dev_t device = 0;
    ino_t inode = 0;
    friend bool operator==(const Identity&, const Identity&) = default;
  };
  struct Lease {
    Identity identity;
    std::unique_ptr<RecordsConnection> connection;
  };

  [[nodiscard]] Identity identify() const;
  [[nodiscard]] Lease borrow();
  /// True for failures after which a connection is not used again.
  [[nodiscard]] static bool isOfDatabase(const NSErrorRef& error);
  void giveBack(Lease lease);

  const AssetFolder assets_;
  const EmbeddedEngineOptions options_;

  Mutex mutex_;
  std::vector<Lease> idle_ GUARDED_BY(mutex_);
  std::shared_ptr<StagingSession> session_ GUARDED_BY(mutex_);
};

}  // namespace yomber
