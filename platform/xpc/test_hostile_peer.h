#pragma once

#include <functional>
#include <memory>
#include <random>
#include <string>

#include "platform/xpc/connection.h"
#include "platform/xpc/interface.h"
#include "platform/xpc/listener.h"

namespace yomber::test {

/// All that a client of that interface sends for the calls that `makeCalls` makes and its goodbye,
/// after its half of the handshake.
[[nodiscard]] std::string recordedCalls(
    const NSXPCInterfaceRef& interface,
    const std::function<void(const NSXPCConnectionRef& client)>& makeCalls);

/// A few of its bytes are others, or it ends early, or a piece of it comes twice.
[[nodiscard]] std::string mutated(std::string bytes, std::mt19937_64& random);

/// Proves itself to a new listener of that delegate, sends the bytes, and returns when the other
/// side has closed.
void speakTo(const std::shared_ptr<NSXPCListenerDelegate>& delegate, const std::string& bytes);

/// Speaks what was recorded, and then so many times what became of it, in the same way each time.
/// `speak` is given what to send.
void speakMutations(const std::string& valid, int rounds,
                    const std::function<void(const std::string& bytes)>& speak);

}  // namespace yomber::test
