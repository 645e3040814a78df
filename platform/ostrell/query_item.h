#pragma once

#include <memory>
#include <vector>

#include "platform/fileprovider/item.h"
#include "platform/foundation/error.h"
#include "platform/foundation/url.h"
#include "platform/ostrell/file_object_id.h"

namespace yomber {

class QSContainer;
class QSQueryItem;
using QSQueryItemRef = std::shared_ptr<const QSQueryItem>;

/// Whether the daemon is to scan the location before it answers.
enum class ForceScan : bool { No = false, Yes = true };

/// The client library's item: what the daemon says of one file, folder or alias. Conforms to the
/// framework's item protocol and is handed to the framework as it is.
///
/// Ownership: shared, immutable. Thread-safety: immutable.
class QSQueryItem final : public NSFileProviderItem {
 public:
  explicit QSQueryItem(ItemFields fields);

  [[nodiscard]] const ItemFields& fields() const override { return fields_; }
  /// Whether this is a deletion: only identifier, kind and id count then.
  [[nodiscard]] bool isDead() const;
  /// Nil for the root.
  [[nodiscard]] const QSFileObjectIDRef& fileObjectID() const { return fileObjectID_; }
  [[nodiscard]] std::string description() const override;

  /// The item that describes a container's folder, or nil. A synchronous daemon call; failures are
  /// logged and answered as nil.
  static QSQueryItemRef containerItemForContainer(
      const std::shared_ptr<const QSContainer>& container, ForceScan forceScan);
  /// The item at a location. A synchronous daemon call.
  static QSQueryItemRef askDaemonQueryItemForURL(const NSURLRef& url, ForceScan andFakeFSEvent,
                                                 NSErrorRef* error);

 private:
  const ItemFields fields_;
  const QSFileObjectIDRef fileObjectID_;
};

using QSQueryItems = std::vector<QSQueryItemRef>;

/// The items as the framework takes them; the very same objects.
[[nodiscard]] NSFileProviderItems fileProviderItems(const QSQueryItems& items);

}  // namespace yomber
