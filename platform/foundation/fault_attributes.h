#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace yomber {

/// The extended attribute that an item without local content carries at its place in the tree.
inline constexpr const char* kFaultAttribute = "user.yomber.fault";
/// Holds the boot identifier under which a fault was filled and verified: in that boot the content
/// is readable although the fault attribute still stands; after another it is a fault again.
inline constexpr const char* kFilledAttribute = "user.yomber.filled";

/// While a file is filled in or given up: its modification date, decimal ns, which it gets back
/// when that has ended.
inline constexpr const char* kHeldDateAttribute = "user.yomber.mtime";

/// How much of a fault's content stays in its file: one block, which it costs anyway.
inline constexpr std::uint64_t kKeptBytes = 4096;

/// The identifier of the running system's boot; empty when the system tells none.
[[nodiscard]] const std::string& bootIdentifier();

/// Whether `path` (a final symbolic link is not followed) is a fault whose content cannot be read.
[[nodiscard]] bool isFaultAtPath(const std::string& path);
/// The same of an open file, or of one that is open as a place only (O_PATH).
[[nodiscard]] bool isFault(int descriptor);
/// An extended attribute of either; as getxattr(2).
[[nodiscard]] ssize_t readAttribute(int descriptor, const char* name, void* value,
                                    std::size_t size);

}  // namespace yomber
