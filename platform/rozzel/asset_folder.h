#pragma once

#include <cstdint>
#include <string>

#include "platform/foundation/date.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/rozzel/asset.h"

namespace yomber {

/// Where a store's assets lie: `assets/<first two digits>/<hash>`. Failures are StoreFailure.
///
/// Thread-safety: immutable; every operation may be called on any thread.
class AssetFolder {
 public:
  explicit AssetFolder(std::string storeFolder);

  [[nodiscard]] const std::string& storeFolder() const { return storeFolder_; }
  [[nodiscard]] std::string stagingFolder() const { return storeFolder_ + "/staging"; }
  /// The folder of all assets whose hash begins with this byte.
  [[nodiscard]] std::string folderFor(std::uint8_t firstByte) const;
  [[nodiscard]] std::string pathFor(const RZAsset& asset) const;

  /// Makes `assets` and `staging` where they are missing.
  void create() const;
  /// Makes the folders below `assets`, all at once: a sync for each would cost more.
  void createSubfolders() const;

  /// Throws RZErrorAssetMissing or, when it has another size, RZErrorAssetDamaged.
  void require(const RZAsset& asset) const;
  [[nodiscard]] FileDescriptor open(const RZAsset& asset) const;
  /// Throws RZErrorAssetDamaged unless `found` is the content of `asset`.
  static void requireSame(const RZAsset& asset, const RZAsset& found);

 private:
  const std::string storeFolder_;
};

/// Held while assets come into their place (Publishing) or are dropped from it (Dropping), so that
/// nothing is dropped that someone is just storing again. Between processes, and short.
class AssetLock {
 public:
  enum class Kind { Publishing, Dropping };
  AssetLock(const AssetFolder& folder, Kind kind);

 private:
  FileDescriptor descriptor_;
};

/// Sets a file's modification time, which says since when an asset is there.
void setModificationTime(const std::string& path, NSDate date);
/// Removes a folder with all that is in it, as far as that works.
void removeWholeFolder(const std::string& path);
void syncStoreFolder(const std::string& path);

}  // namespace yomber
