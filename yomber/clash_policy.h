#pragma once

#include <functional>
#include <string>

#include <CLI/CLI.hpp>

#include "yomber/drive_changes.h"

namespace yomber {

/// What a command does when the name that it needs is taken.
struct ClashPolicy {
  bool keepBoth = false;  ///< counts on to a free name
  bool replace = false;   ///< moves what is in the way to the trash
};

void addClashOptions(CLI::App& command, ClashPolicy& policy);

/// Makes a change that gives an item the name `name`, as the policy wishes: `attempt` is called
/// with the name until it is free. What was moved out of the way is put back when the change fails.
[[nodiscard]] ChangeResult changeWithPolicy(
    const DriveChanges& changes, const ClashPolicy& policy, const std::string& name,
    const std::function<ChangeResult(const std::string& name)>& attempt);

}  // namespace yomber
