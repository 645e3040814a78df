#pragma once

#include <cstdint>
#include <string>

/// What this process gives up, so that whoever takes it over by a picture has nothing.
///
/// Both steps answer what went wrong, or nothing. A process that could not give up its rights must
/// not draw.
namespace yomber::thumbnailer {

/// Before libraries are made ready: limits of memory, of files' sizes and numbers, no core, no new
/// privileges; where the kernel has landlock, nothing but the machine's own libraries and fonts can
/// be read, and nothing written.
[[nodiscard]] std::string limitRights(std::uint64_t memory, std::uint64_t fileSize);

/// Afterwards, and for good, for every thread: no file can be opened, no connection made, no other
/// process begun, signalled or looked into. What is open can be read and written.
[[nodiscard]] std::string closeDoors();

/// From now on the process may use so much of the processor; beyond that it is killed.
void limitProcessor(std::uint32_t seconds);

}  // namespace yomber::thumbnailer
