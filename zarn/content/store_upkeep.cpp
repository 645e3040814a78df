#include "zarn/content/store_upkeep.h"

#include <utility>

#include "platform/foundation/date.h"
#include "platform/foundation/log.h"
#include "zarn/content/thumbnail_rows.h"
#include "zarn/schema.h"
#include "zarn/write_transaction.h"

namespace yomber {

StoreUpkeep::StoreUpkeep(RZEngineRef records, std::shared_ptr<Database> database,
                         std::function<bool()> isIdle, Options options)
    : records_(std::move(records)),
      database_(std::move(database)),
      isIdle_(std::move(isIdle)),
      options_(std::move(options)) {}

std::int64_t StoreUpkeep::now() const {
  return options_.clock ? options_.clock() : NSDate::now().nanoseconds();
}

bool StoreUpkeep::isDue(std::int64_t now) const {
  std::int64_t last = 0;
  const NSErrorRef error = database_->read(
      [&](Connection& connection) { last = metaInteger(connection, meta::kCollectedAt); });
  if (error) return false;
  // A clock that was put back must not put this off for ever.
  const std::int64_t passed = last > now ? options_.interval.count() : now - last;
  if (passed < options_.interval.count()) return false;
  return isIdle_() || passed >= (options_.interval + options_.patience).count();
}

bool StoreUpkeep::runIfDue() {
  const std::int64_t begun = now();
  if (!isDue(begun)) return false;
  RZGarbageReport report;
  if (const NSErrorRef error = records_->collectGarbage(report)) {
    log_default(defaultLog(), "[NOTICE] the record store cannot be tidied now: %@", error);
    return false;
  }
  if (report.assetsDropped != 0 || report.recordsCleared != 0) {
    log_default(defaultLog(),
                "[NOTICE] the record store dropped %llu contents of %llu bytes, and %llu records",
                report.assetsDropped, report.bytesDropped, report.recordsCleared);
  }
  const NSErrorRef error = database_->write([&](WriteTransaction& transaction) {
    setMetaInteger(transaction.connection(), meta::kCollectedAt, begun);
    removeUnusedThumbnails(transaction.connection());
    return NSErrorRef();
  });
  if (error) log_error(defaultLog(), "[ERROR] it cannot be noted when it did so: %@", error);
  return true;
}

}  // namespace yomber
