#pragma once

#include <sys/types.h>

namespace yomber::bench {

/// The most resident memory that a process has ever had, in MiB. Throws when it is gone.
[[nodiscard]] double peakMebibytes(pid_t pid);

/// What the files of memory take that a process has open now, in MiB; resident memory does not
/// count them. 0 when it is gone.
[[nodiscard]] double memoryFileMebibytes(pid_t pid);

/// Seconds of processor time that a process has used. Throws when it is gone.
[[nodiscard]] double processorSeconds(pid_t pid);

}  // namespace yomber::bench
