#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "platform/foundation/error.h"
#include "zarn/containers.h"
#include "zarn/item_store.h"
#include "zarn/scanner.h"

namespace yomber {

/// Where items and containers are on this disk.
///
/// Thread-safety: every operation may be called on any thread but the database's writer thread.
class ItemLocations {
 public:
  ItemLocations(std::shared_ptr<ItemStore> store, std::shared_ptr<Scanner> scanner,
                std::shared_ptr<Containers> containers)
      : store_(std::move(store)),
        scanner_(std::move(scanner)),
        containers_(std::move(containers)) {}

  /// Where the item with that logical location is on this disk; nearly always that very location.
  [[nodiscard]] std::optional<std::string> physicalLocation(std::string_view path,
                                                            NSErrorRef* error) const;

  enum class Recreate : bool { No = false, Yes = true };
  struct Container {
    std::string documents;
    std::string displayName;
    std::uint64_t generation = 0;  ///< of the list of containers
  };
  /// A container's Documents folder, made where it is missing if that is asked for; its row is
  /// right then. QSOstrellErrorDomain 3 for an unknown container, NSCocoaErrorDomain 4 for a folder
  /// that is missing, 516 where something else has its place.
  [[nodiscard]] std::optional<Container> containerLocation(const std::string& containerID,
                                                           Recreate recreate,
                                                           NSErrorRef* error) const;

 private:
  NSErrorRef makeDocuments(const std::string& containerID, const std::string& documents) const;
  NSErrorRef scanDocuments(const std::string& containerID, const std::string& documents,
                           bool isNew) const;

  const std::shared_ptr<ItemStore> store_;
  const std::shared_ptr<Scanner> scanner_;
  const std::shared_ptr<Containers> containers_;
};

}  // namespace yomber
