#pragma once

#include "platform/foundation/error.h"
#include "platform/foundation/url.h"
#include "protocols/services.capnp.h"

namespace yomber {

/// Writes a location or another URL; nil as "none".
void encodeURL(const NSURLRef& url, protocol::OptionalUrl::Builder builder);
/// Nil for "none", and for what is no URL.
[[nodiscard]] NSURLRef decodeURL(protocol::OptionalUrl::Reader reader);

}  // namespace yomber
