#pragma once

#include "tests/harness/test_drive.h"

namespace yomber::bench {

/// Waits until a drive has scanned everything and confirmed all of it in the store. Throws
/// std::runtime_error when that takes longer than any machine should need.
void waitUntilQuiet(const testing::TestDrive& drive);

}  // namespace yomber::bench
