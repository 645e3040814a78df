#pragma once

#include <kj/async.h>

#include <memory>
#include <optional>
#include <utility>

#include "platform/foundation/error.h"

namespace yomber {

/// A value or an error, on its way into a reply.
template <typename Value>
struct Outcome {
  std::optional<Value> value;
  NSErrorRef error;
};

/// The promise of what `start` hands to its handler. Loop thread only.
template <typename Value, typename Start>
kj::Promise<Outcome<Value>> outcomeOf(Start start) {
  auto pair = kj::newPromiseAndFulfiller<Outcome<Value>>();
  auto fulfiller =
      std::make_shared<kj::Own<kj::PromiseFulfiller<Outcome<Value>>>>(kj::mv(pair.fulfiller));
  start([fulfiller](std::optional<Value> value, NSErrorRef error) {
    (*fulfiller)->fulfill({std::move(value), std::move(error)});
  });
  return kj::mv(pair.promise);
}

}  // namespace yomber
