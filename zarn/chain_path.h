#pragma once

#include <cstdint>
#include <string>

#include "zarn/row_queries.h"
#include "zarn/tree_layout.h"

namespace yomber {

enum class Names : std::uint8_t { Shown, OnDisk };

/// The path of the item that a chain begins with.
[[nodiscard]] std::string pathOfChain(const TreeLayout& layout, const ItemChain& chain,
                                      Names names);

}  // namespace yomber
