#pragma once

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/data.h"
#include "platform/foundation/size.h"
#include "platform/foundation/url.h"

namespace yomber {

class QSContainer;
using QSContainerRef = std::shared_ptr<const QSContainer>;

/// An application's part of the drive.
///
/// Ownership: shared, immutable; the list is a snapshot that the library keeps until the daemon
/// says that it changed (QSContainerListDidChangeNotification) or the connection is lost.
/// Thread-safety: every operation may be called on any thread; the class operations may block for a
/// synchronous daemon reply when there is no snapshot.
class QSContainer {
 public:
  struct Fields {
    std::string containerID;
    std::string displayName;
    std::string applicationID;
    std::string iconName;
    NSURLRef documentsURL;
  };
  explicit QSContainer(Fields fields) : fields_(std::move(fields)) {}

  [[nodiscard]] const std::string& containerID() const { return fields_.containerID; }
  [[nodiscard]] const std::string& displayName() const { return fields_.displayName; }
  [[nodiscard]] const std::string& applicationID() const { return fields_.applicationID; }
  [[nodiscard]] const std::string& iconName() const { return fields_.iconName; }
  /// The location of its Documents folder.
  [[nodiscard]] const NSURLRef& documentsURL() const { return fields_.documentsURL; }

  /// A picture of it for a square of that size, in points: the nearest to its smaller side that is
  /// no smaller. Nil when there is none. `shouldTransformToAppIcon` (may be null) says whether it
  /// is a bare drawing that whoever shows it has to make an application's icon of. Reads files.
  [[nodiscard]] NSDataRef bestFittingImageDataForSize(CGSize size,
                                                      bool* shouldTransformToAppIcon) const;

  /// Empty when the daemon cannot be asked. Also starts observing the list.
  static std::map<std::string, QSContainerRef> allContainersByContainerID();
  static std::vector<QSContainerRef> allContainers();

 private:
  const Fields fields_;
};

}  // namespace yomber
