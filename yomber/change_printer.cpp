#include "yomber/change_printer.h"

#include <nlohmann/json.hpp>

#include "yomber/failure_text.h"
#include "yomber/item_output.h"

namespace yomber {
namespace {

constexpr std::size_t kEventWidth = 9;

}  // namespace

bool ChangePrinter::listed(const std::vector<ItemFields>& items, bool last) {
  for (const ItemFields& item : items) list(item);
  if (last) {
    for (const ItemFields& item : held_) {
      if (!item.identifier.empty()) printItem("present", item);
    }
    held_.clear();
    heldAt_.clear();
    if (!options_.listFirst && !options_.json) {
      notes_ << "watching " << names_.size() << " items" << std::endl;
    }
  }
  out_ << std::flush;
  return last && options_.once;
}

void ChangePrinter::list(const ItemFields& item) {
  if (options_.once) {
    const auto [place, isNew] = heldAt_.try_emplace(item.identifier, held_.size());
    if (isNew) {
      held_.push_back(item);
    } else {
      held_[place->second] = item;
    }
    return;
  }
  const auto [known, isNew] = names_.insert_or_assign(item.identifier, item.filename);
  if (options_.listFirst) printItem(isNew ? "present" : "changed", item);
}

void ChangePrinter::updated(const std::vector<ItemFields>& items) {
  for (const ItemFields& item : items) {
    const auto [known, isNew] = names_.insert_or_assign(item.identifier, item.filename);
    printItem(isNew ? "added" : "changed", item);
  }
  out_ << std::flush;
}

void ChangePrinter::deleted(const std::vector<std::string>& identifiers) {
  for (const std::string& identifier : identifiers) {
    if (options_.once) {
      const auto held = heldAt_.find(identifier);
      if (held == heldAt_.end()) continue;
      held_[held->second] = {};
      heldAt_.erase(held);
      continue;
    }
    const auto known = names_.find(identifier);
    printRemoval(identifier, known == names_.end() ? identifier : known->second);
    if (known != names_.end()) names_.erase(known);
  }
  out_ << std::flush;
}

bool ChangePrinter::paused(const NSErrorRef& error) {
  // A listing fails, and is asked for again by whoever wants it.
  if (options_.once) return true;
  if (options_.json) {
    out_ << jsonLine({{"event", "paused"}, {"error", errorJson(error)}}) << std::endl;
  } else {
    notes_ << "waiting: " << printableName(failureText(error)) << std::endl;
  }
  return false;
}

void ChangePrinter::resumed() {
  if (options_.json) {
    out_ << jsonLine({{"event", "resumed"}}) << std::endl;
  } else {
    notes_ << "watching again" << std::endl;
  }
}

void ChangePrinter::printItem(const char* event, const ItemFields& item) {
  if (options_.json) {
    out_ << jsonLine({{"event", event}, {"item", itemJson(item)}}) << "\n";
  } else {
    std::string head = event;
    head.resize(kEventWidth, ' ');
    out_ << head << itemLine(item, OutputForm::Short) << "\n";
  }
}

void ChangePrinter::printRemoval(const std::string& identifier, const std::string& name) {
  if (options_.json) {
    out_ << jsonLine({{"event", "removed"}, {"id", identifier}}) << "\n";
  } else {
    out_ << "removed  " << printableName(name) << "\n";
  }
}

}  // namespace yomber
