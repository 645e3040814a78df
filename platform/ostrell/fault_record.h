#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/rozzel/asset.h"

namespace yomber {

/// What a fault's attribute says: all that is needed to know the item again, and to bring its
/// content back, should the database be lost.
struct FaultRecord {
  std::uint64_t item = 0;
  RZAsset content;
  std::int64_t mtime = 0;  ///< of the file when its content was given up
  std::uint64_t head = 0;  ///< tells whether the kept bytes are still those of then
  std::string tag;         ///< of the store's record
  std::string account;     ///< whose record that is

  [[nodiscard]] std::string encoded() const;
  /// Nothing when the text makes no sense, or is of a later version.
  static std::optional<FaultRecord> decode(std::string_view text);
  friend bool operator==(const FaultRecord&, const FaultRecord&) = default;
};

/// The record of a file that is open, or open as a place only (O_PATH). Nothing when it is no
/// fault; with `isDamaged` set when it is one that cannot be understood.
[[nodiscard]] std::optional<FaultRecord> readFaultRecord(int file, bool& isDamaged);

/// Tells kept bytes apart.
[[nodiscard]] std::uint64_t headChecksum(std::string_view bytes);

}  // namespace yomber
