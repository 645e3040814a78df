#pragma once

#include <cstdint>

#include "platform/foundation/error.h"

namespace yomber {

/// Whether the framework has a code of its own domain for `error`; stores it through `code` when
/// given. Stores nothing when there is none.
bool _qs_getFileProviderDomainErrorCode(const NSErrorRef& error, std::int64_t* code);

/// The error in the framework's domain, with `error` under NSUnderlyingErrorKey and nothing else;
/// the very same error when the framework has no code for it. Never fails, never logs.
[[nodiscard]] NSErrorRef qs_fileProviderError(const NSErrorRef& error);

}  // namespace yomber
