#pragma once

#include <cstdint>

namespace yomber {

/// The client library's error domain. Code 2 is the one that the framework acts on.
inline constexpr const char* QSOstrellErrorDomain = "QSOstrellErrorDomain";
inline constexpr std::int64_t QSOstrellErrorNotEntitled = 1;
inline constexpr std::int64_t QSOstrellErrorLoggedOut = 2;
inline constexpr std::int64_t QSOstrellErrorInvalidParameter = 3;
/// The connection to the daemon was lost; what was registered there is gone.
inline constexpr std::int64_t QSOstrellErrorConnectionLost = 4;
/// A watcher left too many changes waiting and was cut off; list again.
inline constexpr std::int64_t QSOstrellErrorWatcherTooSlow = 5;
/// The item's local content cannot be given up; the description says why.
inline constexpr std::int64_t QSOstrellErrorCannotEvict = 6;

/// User-information keys of QSOstrellErrorInvalidParameter.
inline constexpr const char* QSOstrellErrorParameterKey = "QSOstrellErrorParameter";
inline constexpr const char* QSOstrellErrorValueKey = "QSOstrellErrorValue";

// Plain literals, never destroyed: threads may still use them while the process ends.

/// Containers that every drive has. The default container's documents location is the drive's root.
inline constexpr const char* QSUbiquitousDefaultContainerID = "com.kelvo.YomberDrive";
inline constexpr const char* QSUbiquitousDocumentsContainerID = "com.kelvo.YomberDrive.Documents";
inline constexpr const char* QSUbiquitousDesktopContainerID = "com.kelvo.YomberDrive.Desktop";

/// Names of the ordinary folders in the root that those two containers stand for.
inline constexpr const char* QSUbiquitousDocumentsFolderName = "Documents";
inline constexpr const char* QSUbiquitousDesktopFolderName = "Desktop";

/// Posted after the account changed; observers ask QSAccount afresh.
inline constexpr const char* QSAccountTokenDidChangeNotification =
    "QSAccountTokenDidChangeNotification";
/// Posted after the list of containers changed.
inline constexpr const char* QSContainerListDidChangeNotification =
    "QSContainerListDidChangeNotification";

}  // namespace yomber
