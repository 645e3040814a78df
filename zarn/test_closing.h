#pragma once

#include <gtest/gtest.h>

#include <filesystem>
#include <string>
#include <system_error>

#include "zarn/database.h"
#include "zarn/write_transaction.h"

namespace yomber {

/// Returns when what was begun in a database before is done and forgotten, with what it held: two
/// turns, since what ends with the first may still be about to be forgotten.
inline void waitUntilWritten(Database& database) {
  for (int turn = 0; turn < 2; ++turn)
    EXPECT_EQ(database.write([](WriteTransaction&) { return NSErrorRef(); }), nullptr);
}

/// Whether this process has anything open in a folder. A child that inherits an open database
/// cannot use it.
[[nodiscard]] inline bool hasOpenFileIn(const std::string& folder) {
  for (const auto& each : std::filesystem::directory_iterator("/proc/self/fd")) {
    std::error_code gone;
    const auto target = std::filesystem::read_symlink(each.path(), gone).string();
    if (target.starts_with(folder + "/")) return true;
  }
  return false;
}

}  // namespace yomber
