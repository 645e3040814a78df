#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace yomber {

/// What the client library does by default, in this process. Values that the process has not set
/// come from its environment, else from the program.
///
/// Thread-safety: every operation may be called on any thread.
class QSCUserDefaults {
 public:
  /// There is one set of defaults: those of every id are those of the process.
  [[nodiscard]] static QSCUserDefaults& defaultsForMangledID(
      const std::optional<std::string>& mangledID);

  /// How many records a fetch is asked for at most; never 0. 50,000, or
  /// $YOMBER_RECORDS_IN_FETCH.
  [[nodiscard]] std::uint32_t maxRecordCountInFetchRecordsOperation() const;
  /// Nothing: as it was at the start.
  void setMaxRecordCountInFetchRecordsOperation(std::optional<std::uint32_t> count);

 private:
  QSCUserDefaults() = default;
};

/// What the drive as a whole does by default.
///
/// Thread-safety: every operation may be called on any thread.
class QSRemoteUserDefaults {
 public:
  [[nodiscard]] static QSRemoteUserDefaults& sharedDefaults();

  /// In bytes. A larger file without a stored thumbnail is downloaded, so that a thumbnailer of
  /// this machine can draw it. 64 MiB, so that looking at a folder of pictures never downloads one,
  /// or $YOMBER_THUMBNAIL_TRANSFER_BYTES.
  [[nodiscard]] std::uint64_t minFileSizeForThumbnailTransfer() const;
  /// Nothing: as it was at the start.
  void setMinFileSizeForThumbnailTransfer(std::optional<std::uint64_t> size);

 private:
  QSRemoteUserDefaults() = default;
};

}  // namespace yomber
