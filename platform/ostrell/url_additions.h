#pragma once

#include <optional>
#include <string>

#include "platform/foundation/error.h"
#include "platform/foundation/url.h"
#include "platform/ostrell/file_object_id.h"

namespace yomber {

// What the client library knows of locations. Those that ask the daemon say so; the others look at
// the path and, at most, at the file itself, and never block on another process once the library
// knows the drive's home. A nil location answers false or nil.

/// The document's location; nil and an error when there is none. A synchronous daemon call.
[[nodiscard]] NSURLRef qs_documentURLFromFileObjectID(const QSFileObjectIDRef& fileObjectID,
                                                      NSErrorRef* error);

/// Whether the file is a bookmark: a symbolic link that resolves inside the drive.
[[nodiscard]] bool qs_isExternalDocumentReference(const NSURLRef& url);
/// The bookmark's target; nil and an error when it cannot be resolved (gone, a loop, outside the
/// drive).
[[nodiscard]] NSURLRef qs_URLByResolvingExternalDocumentReferenceWithError(const NSURLRef& url,
                                                                           NSErrorRef* error);

/// Whether the location lies in storage that is never listed (promises, staging).
[[nodiscard]] bool qs_isInOstrellPrivateStorages(const NSURLRef& url);
/// Whether the name, or the name of a folder above it in the tree, is one that never syncs.
[[nodiscard]] bool qs_wouldBeExcludedFromSync(const NSURLRef& url);
/// Whether the location is inside the synced tree.
[[nodiscard]] bool qs_isInSyncedLocation(const NSURLRef& url);

/// Marks the location object, in place, as naming the physical file.
void qs_addPhysicalProperty(const NSURLRef& url);
/// The container's id when the location is a container's Documents folder.
[[nodiscard]] std::optional<std::string> qs_containerIDIfIsDocumentsContainerURL(
    const NSURLRef& url);

}  // namespace yomber
