#pragma once

#include <map>
#include <ostream>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/fileprovider/constants.h"
#include "platform/fileprovider/item.h"
#include "platform/foundation/error.h"

namespace yomber {

/// Prints what a watch of the host tells: what is there at first, then each change as it comes.
///
/// What changes while it is listed is listed again by the host. It is printed once where only a
/// listing was asked for, as it was last; otherwise the second time is a change like any other.
///
/// Thread-safety: one thread at a time.
class ChangePrinter {
 public:
  struct Options {
    bool json = false;
    bool listFirst = false;  ///< print what is there at the start as well
    bool once = false;       ///< nothing is printed after the first listing, nor before its end
  };
  /// Items go to `out`, what is said to people to `notes`; both must outlive the printer.
  ChangePrinter(std::ostream& out, std::ostream& notes, Options options)
      : out_(out), notes_(notes), options_(options) {}

  /// Pages of the first listing. True once it is complete and nothing else is to be printed.
  [[nodiscard]] bool listed(const std::vector<ItemFields>& items, bool last);
  void updated(const std::vector<ItemFields>& items);
  void deleted(const std::vector<std::string>& identifiers);
  /// Changes cannot be seen at the moment. True when nobody is to wait for them.
  [[nodiscard]] bool paused(const NSErrorRef& error);
  void resumed();

 private:
  void list(const ItemFields& item);
  void printItem(const char* event, const ItemFields& item);
  void printRemoval(const std::string& identifier, const std::string& name);

  std::ostream& out_;
  std::ostream& notes_;
  const Options options_;
  std::map<NSFileProviderItemIdentifier, std::string> names_;
  /// Of a listing and nothing else: the items in their order; those that went are empty.
  std::vector<ItemFields> held_;
  std::unordered_map<NSFileProviderItemIdentifier, std::size_t> heldAt_;
};

}  // namespace yomber
