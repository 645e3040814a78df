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
/// The item has no share.
inline constexpr std::int64_t QSOstrellErrorNotShared = 20;

/// What NSPOSIXErrorDomain calls "not supported" for shares, whatever this system means by 45.
inline constexpr int QSPOSIXErrorNotSupported = 45;

/// User-information keys of QSOstrellErrorInvalidParameter.
inline constexpr const char* QSOstrellErrorParameterKey = "QSOstrellErrorParameter";
inline constexpr const char* QSOstrellErrorValueKey = "QSOstrellErrorValue";

// Plain literals, never destroyed: threads may still use them while the process ends.

/// Containers that every drive has. The default container's documents location is the drive's root.
inline constexpr const char* QSUbiquitousDefaultContainerID = "com.kelvo.YomberDrive";
inline constexpr const char* QSUbiquitousDocumentsContainerID = "com.kelvo.YomberDrive.Documents";
inline constexpr const char* QSUbiquitousDesktopContainerID = "com.kelvo.YomberDrive.Desktop";

/// The daemon as an application: on whose behalf records are fetched.
inline constexpr const char* QSDaemonBundleID = "com.kelvo.zarn";

/// The container of the record store that has every document's record, in a zone for each of the
/// drive's containers.
inline constexpr const char* QSUbiquitousRozzelContainerIdentifier = QSUbiquitousDefaultContainerID;

/// The type and the keys of a document's record.
inline constexpr const char* kQSRecordTypeDocument = "Document";
/// A folder's; only what is in a share has one.
inline constexpr const char* kQSRecordTypeFolder = "Folder";
inline constexpr const char* kQSRecordKeyName = "name";
inline constexpr const char* kQSRecordKeyParent = "parent";
inline constexpr const char* kQSRecordKeySize = "size";  // of the content, bytes: an integer
inline constexpr const char* kQSRecordKeyModified = "modified";
inline constexpr const char* kQSRecordKeyCreated = "created";
inline constexpr const char* kQSRecordKeyContent = "content";
/// A picture of the content, at most 1024 pixels a side: an asset. Not every document has one.
inline constexpr const char* kQSRecordKeyThumbnail1024x1024 = "thumbnail1024x1024";

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
