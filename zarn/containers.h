#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/error.h"
#include "platform/launchservices/desktop_files.h"
#include "zarn/item_store.h"
#include "zarn/tree_layout.h"

namespace yomber {

/// A container as clients see it.
struct ContainerRecord {
  std::string containerID;
  std::string displayName;
  std::string documents;      ///< location of its Documents folder
  std::string applicationID;  ///< empty for the drive's own
  std::string iconName;

  friend bool operator==(const ContainerRecord&, const ContainerRecord&) = default;
};

struct ContainerList {
  std::vector<ContainerRecord> containers;  ///< the drive's own first, then by container id
  std::uint64_t generation = 0;             ///< grows with every change of the list
};
using ContainerListRef = std::shared_ptr<const ContainerList>;

/// The containers that the applications of these directories are entitled to
/// (QSEntitledContainerIdentifiers), and the drive's own. Of several applications that claim a
/// container, the first has it: in the order of the directories, then of their identifiers.
[[nodiscard]] std::vector<ContainerRecord> readContainers(
    const std::vector<std::string>& directories, const TreeLayout& layout);

/// The drive's containers; follows the installed applications.
///
/// A container gets its folder on disk when its application is there, and keeps it when the
/// application goes: nothing is ever deleted.
///
/// Thread-safety: every operation may be called on any thread. Has one thread of its own.
class Containers {
 public:
  struct Hooks {
    /// Makes the store's containers be these (without the drive's own), before the list shows them.
    /// On an error the list stays and it is tried again at the next change, or after a while.
    std::function<NSErrorRef(const std::vector<ContainerFolder>&)> apply;
    /// The list has changed, from within `start` too.
    std::function<void()> didChange;
  };

  Containers(std::vector<std::string> directories, TreeLayout layout);
  ~Containers();
  Containers(const Containers&) = delete;
  Containers& operator=(const Containers&) = delete;

  /// Reads the list, applies it, and follows it from then on. Answers what `apply` answered.
  [[nodiscard]] NSErrorRef start(Hooks hooks);
  void stop();

  /// Never null.
  [[nodiscard]] ContainerListRef list() const;

 private:
  class State;
  std::unique_ptr<State> state_;
};

}  // namespace yomber
