#pragma once

#include <cstdint>
#include <string>
#include <variant>
#include <vector>

namespace yomber {

/// A value of a property list, such as what an application declares about itself.
using NSPropertyValue = std::variant<bool, std::int64_t, std::string, std::vector<std::string>>;

}  // namespace yomber
