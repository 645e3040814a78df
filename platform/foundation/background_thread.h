#pragma once

namespace yomber {

/// Lets the calling thread give way to others, for the processor as for the disk, for the rest of
/// its life: for work that nobody waits for. What it starts gives way too.
void giveWayToOthers();

}  // namespace yomber
