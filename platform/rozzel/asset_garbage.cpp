#include "platform/rozzel/asset_garbage.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <optional>
#include <string_view>
#include <vector>

#include "platform/foundation/fault_points.h"
#include "platform/rozzel/record_batch.h"
#include "platform/rozzel/record_codec.h"
#include "platform/rozzel/store_failure.h"

namespace yomber {

namespace {

constexpr std::int64_t kRecordsAtOnce = 500;
constexpr std::size_t kAssetsAtOnce = 64;

FaultPoint whenChosen("rozzel.garbage.chosen");
FaultPoint whenMovedAway("rozzel.garbage.moved");

void pass(FaultPoint& point) {
  if (point.hit()) throwErrno("dropping assets was told to fail", EIO);
}

std::string_view hashBytes(const RZAsset& asset) {
  // NOLINTNEXTLINE: a hash is bytes to SQLite.
  return {reinterpret_cast<const char*>(asset.hash.data()), asset.hash.size()};
}

std::optional<std::int64_t> anyDeadZone(RecordsConnection& connection) {
  RecordsQuery query(connection.prepared("SELECT id FROM zone WHERE dead=1 LIMIT 1"));
  return query.step() ? std::optional(query->integer(0)) : std::nullopt;
}

/// What a damaged record referred to is unknown, and so is never dropped.
std::vector<RZAsset> assetsIn(std::string_view body) {
  std::vector<RZAsset> assets;
  const NSErrorRef damaged = catchingFailures([&] {
    for (const auto& [key, value] : decodeRecordValues(body, std::nullopt)) {
      if (const auto* const asset = std::get_if<RZAsset>(&value)) assets.push_back(*asset);
    }
  });
  if (damaged) assets.clear();
  return assets;
}

/// Answers how many records went.
std::uint64_t clearSomeRecords(RecordsConnection& connection, std::int64_t zone, NSDate now) {
  std::vector<std::int64_t> ids;
  RecordsQuery rows(connection.prepared("SELECT id, body FROM record WHERE zone=?1 LIMIT ?2"), zone,
                    kRecordsAtOnce);
  while (rows.step()) {
    ids.push_back(rows->integer(0));
    for (const RZAsset& asset : assetsIn(rows->bytes(1))) releaseAsset(connection, asset, now);
  }
  for (const std::int64_t id : ids) {
    RecordsQuery(connection.prepared("DELETE FROM record WHERE id=?1"), id).run();
  }
  return ids.size();
}

std::int64_t clearSomeTombstones(RecordsConnection& connection, std::int64_t zone) {
  RecordsQuery(connection.prepared("DELETE FROM tombstone WHERE zone=?1 AND sequence IN (SELECT "
                                   "sequence FROM tombstone WHERE zone=?1 LIMIT ?2)"),
               zone, kRecordsAtOnce)
      .run();
  return connection.changes();
}

/// Drops those of some assets that may go.
class AssetDropper {
 public:
  AssetDropper(RecordsConnection& connection, const AssetFolder& folder, const std::string& staging,
               NSDate before, RZGarbageReport& report)
      : connection_(connection),
        folder_(folder),
        staging_(staging),
        before_(before),
        report_(report) {}

  void add(const RZAsset& asset) {
    candidates_.push_back(asset);
    if (candidates_.size() >= kAssetsAtOnce) drop();
  }

  /// What was chosen may have been stored or referred to again since: looks once more, now that
  /// nobody can.
  void drop() {
    if (candidates_.empty()) return;
    pass(whenChosen);
    MovedAssets away;
    {
      const AssetLock lock(folder_, AssetLock::Kind::Dropping);
      RecordsTransaction transaction(connection_, RecordsTransaction::Kind::Write);
      for (const RZAsset& asset : candidates_) {
        if (!isUsed(asset)) moveAway(asset, away.paths);
      }
      pass(whenMovedAway);
      transaction.commit();
    }
    candidates_.clear();
  }

 private:
  /// Large files take long to go, so nobody waits for this. They go as well when the rows cannot be
  /// stored: on a full disk it is they that make room.
  struct MovedAssets {
    std::vector<std::string> paths;
    MovedAssets() = default;
    MovedAssets(const MovedAssets&) = delete;
    MovedAssets& operator=(const MovedAssets&) = delete;
    ~MovedAssets() {
      for (const std::string& path : paths) unlink(path.c_str());
    }
  };

  bool isUsed(const RZAsset& asset) {
    RecordsQuery row(connection_.prepared("SELECT uses, released FROM asset WHERE hash=?1"),
                     hashBytes(asset));
    return row.step() && (row->integer(0) > 0 || row->integer(1) >= before_.nanoseconds());
  }

  void moveAway(const RZAsset& asset, std::vector<std::string>& away) {
    const std::string path = folder_.pathFor(asset);
    struct stat status{};
    const bool there = lstat(path.c_str(), &status) == 0;
    if (!there && errno != ENOENT) return;
    if (there) {
      if (NSDate::fromTimespec(status.st_mtim) >= before_) return;
      std::string target = staging_ + "/dropped-" + asset.hexHash();
      if (rename(path.c_str(), target.c_str()) != 0) return;
      away.push_back(std::move(target));
      ++report_.assetsDropped;
      report_.bytesDropped += static_cast<std::uint64_t>(status.st_size);
    }
    RecordsQuery(connection_.prepared("DELETE FROM asset WHERE hash=?1"), hashBytes(asset)).run();
  }

  RecordsConnection& connection_;
  const AssetFolder& folder_;
  const std::string& staging_;
  const NSDate before_;
  RZGarbageReport& report_;
  std::vector<RZAsset> candidates_;
};

/// Assets whose last record is gone.
std::vector<RZAsset> releasedAssets(RecordsConnection& connection, NSDate before) {
  std::vector<RZAsset> assets;
  RecordsQuery rows(connection.prepared("SELECT hash FROM asset WHERE uses=0 AND released<?1"),
                    before.nanoseconds());
  while (rows.step()) {
    RZAsset& asset = assets.emplace_back();
    const std::string_view hash = rows->bytes(0);
    std::memcpy(asset.hash.data(), hash.data(), std::min(hash.size(), asset.hash.size()));
  }
  return assets;
}

bool isKnown(RecordsConnection& connection, const RZAsset& asset) {
  RecordsQuery row(connection.prepared("SELECT 1 FROM asset WHERE hash=?1"), hashBytes(asset));
  return row.step();
}

/// Files that no record ever referred to.
std::vector<RZAsset> strayAssets(RecordsConnection& connection, const std::string& folder) {
  std::vector<RZAsset> assets;
  std::error_code error;
  for (const auto& entry : std::filesystem::directory_iterator(folder, error)) {
    const auto asset = RZAsset::fromHexHash(entry.path().filename().string(), 0);
    if (asset && !isKnown(connection, *asset)) assets.push_back(*asset);
  }
  return assets;
}

}  // namespace

void clearDeadZones(RecordsConnection& connection, NSDate now, RZGarbageReport& report) {
  while (true) {
    RecordsTransaction transaction(connection, RecordsTransaction::Kind::Write);
    const auto zone = anyDeadZone(connection);
    if (!zone) return;
    const std::uint64_t cleared = clearSomeRecords(connection, *zone, now);
    if (cleared == 0 && clearSomeTombstones(connection, *zone) == 0) {
      RecordsQuery(connection.prepared("DELETE FROM zone WHERE id=?1"), *zone).run();
    }
    transaction.commit();
    report.recordsCleared += cleared;
  }
}

void dropUnusedAssets(RecordsConnection& connection, const AssetFolder& folder,
                      const std::string& staging, NSDate before, RZGarbageReport& report) {
  AssetDropper dropper(connection, folder, staging, before, report);
  for (const RZAsset& asset : releasedAssets(connection, before)) dropper.add(asset);
  for (unsigned byte = 0; byte < 256; ++byte) {
    const std::string path = folder.folderFor(static_cast<std::uint8_t>(byte));
    for (const RZAsset& asset : strayAssets(connection, path)) dropper.add(asset);
  }
  dropper.drop();
}

}  // namespace yomber
