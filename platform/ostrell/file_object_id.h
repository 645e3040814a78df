#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "platform/foundation/object.h"

namespace yomber {

class QSFileObjectID;
using QSFileObjectIDRef = std::shared_ptr<const QSFileObjectID>;

/// The daemon's id of a file, folder or alias. Prints as a kind letter, a colon and the decimal raw
/// id: "d:" a document (a bookmark file too), "i:" a folder, "a:" an alias to something outside the
/// drive's own zones. Raw ids are positive 63-bit numbers, issued once and never used again.
///
/// Ownership: shared, immutable. Compared by value with `isEqual`.
class QSFileObjectID final : public NSObject {
 public:
  enum class Kind : std::uint8_t { Document, Folder, Alias };

  QSFileObjectID(Kind kind, std::uint64_t rawID) : kind_(kind), rawID_(rawID) {}

  /// Nil for anything that `asString` could not have printed: another letter, a sign, leading
  /// zeros, zero, more than 63 bits, trailing bytes.
  static QSFileObjectIDRef fileObjectIDWithString(std::string_view string);

  [[nodiscard]] Kind kind() const { return kind_; }
  [[nodiscard]] std::uint64_t rawID() const { return rawID_; }
  [[nodiscard]] bool isDocumentID() const { return kind_ == Kind::Document; }
  [[nodiscard]] bool isFolderOrAliasID() const { return kind_ != Kind::Document; }
  [[nodiscard]] std::string asString() const;
  [[nodiscard]] bool isEqual(const QSFileObjectID& other) const {
    return kind_ == other.kind_ && rawID_ == other.rawID_;
  }
  [[nodiscard]] std::string description() const override { return asString(); }

 private:
  const Kind kind_;
  const std::uint64_t rawID_;
};

/// For maps keyed by id.
struct QSFileObjectIDHash {
  std::size_t operator()(const QSFileObjectIDRef& id) const {
    return std::hash<std::uint64_t>()(id->rawID());
  }
};
struct QSFileObjectIDEqual {
  bool operator()(const QSFileObjectIDRef& left, const QSFileObjectIDRef& right) const {
    return left->isEqual(*right);
  }
};

}  // namespace yomber
