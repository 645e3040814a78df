#pragma once

#include <cstddef>
#include <string>

#include "yomber/drive_content.h"

namespace yomber {

/// One line for a transfer: what it is, how far it is (as a bar where `barWidth` leaves room for
/// one), and of what; or why it waits.
[[nodiscard]] std::string transferLine(const Transfer& transfer, std::size_t barWidth);

/// "2 under way, 5 waiting".
[[nodiscard]] std::string transferSummary(const Transfers& transfers);

/// Shows the transfers at a terminal, over and over in the same place, until none is left, or the
/// daemon does not answer any more.
NSErrorRef followTransfers(const ipc::Remote<protocol::Daemon>& daemon);

}  // namespace yomber
