#pragma once

namespace yomber {

/// Has all threads of this process share two heaps: with one for nearly every thread, what one load
/// has freed in its heap would help no other. To be called first thing in main.
void shareHeaps();

}  // namespace yomber
