#pragma once

namespace yomber {

/// Lets this process open as many descriptors as the system allows it at all: a program that holds
/// a socket for each of its clients reaches the usual limit with a thousand.
void raiseDescriptorLimit();

}  // namespace yomber
