#pragma once

#include <string>

#include "platform/foundation/error.h"

namespace yomber {

/// What a failure says to a person: the error's own description where it has one, else a sentence
/// for what the framework's codes mean. `error` is not nil.
[[nodiscard]] std::string failureText(const NSErrorRef& error);

}  // namespace yomber
