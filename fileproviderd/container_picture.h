#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/fileprovider/item.h"

namespace yomber {

/// What a watcher has been told of a container: which items, and in which state; just enough to
/// tell it only the difference after the container was listed again.
///
/// Thread-safety: none of its own.
class ContainerPicture {
 public:
  enum class Change : std::uint8_t {
    Unchanged,  ///< the watcher knows it so
    New,
    Changed,
    Outdated,  ///< older than what the current listing showed
  };

  /// A listing starts; items that it does not show are gone when it ends.
  void beginListing() { ++generation_; }
  /// The item is as `item` says, by a page of the listing.
  Change didList(const ItemFields& item);
  /// The item is as `item` says, by a change.
  Change didUpdate(const ItemFields& item);
  /// False when there was none.
  bool didDelete(const std::string& identifier) { return states_.erase(identifier) > 0; }
  /// Takes out what neither the listing nor a change since showed, and answers it.
  [[nodiscard]] std::vector<std::string> endListing();
  /// Takes out everything.
  [[nodiscard]] std::vector<std::string> clear();

  [[nodiscard]] std::size_t size() const { return states_.size(); }

 private:
  struct State {
    std::uint64_t fingerprint = 0;
    std::uint64_t rank = 0;
    std::uint64_t generation = 0;
  };
  Change store(const ItemFields& item);

  std::unordered_map<std::string, State> states_;
  std::uint64_t generation_ = 0;
};

/// A number that differs when anything differs that an item shows; its rank does not count.
[[nodiscard]] std::uint64_t itemFingerprint(const ItemFields& item);

}  // namespace yomber
