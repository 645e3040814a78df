#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "platform/fileprovider/extension.h"
#include "platform/foundation/error.h"
#include "platform/foundation/url.h"

namespace yomber {

// What an extension does to the files of its tree: additions to locations, the receiver first.
//
// Each acts on one name of the disk at once and never replaces anything. A location that carries
// NSURL::Mark::Physical is acted on where the file is on this disk; the locations that are answered
// are always logical ones, without marks.
//
// Handlers are called exactly once, on a thread of the pool, never before the call returns; they
// may be empty. Thread-safety: any thread, any number at a time.
//
// Errors:
// - nothing there, a nil receiver, a nil folder: Cocoa 4
// - the name is taken: Cocoa 516, with the location in the way (see `fp_collidingURL`)
// - a name that no file can have: Cocoa 514
// - a full disk: Cocoa 640, refused access: 513, everything else: 512, each with the system's error
//   underneath

inline constexpr std::int64_t NSFileReadNoPermissionError = 257;
inline constexpr std::int64_t NSFileWriteNoPermissionError = 513;
inline constexpr std::int64_t NSFileWriteInvalidFileNameError = 514;
inline constexpr std::int64_t NSFileWriteOutOfSpaceError = 640;

/// Whether a taken name is a clash, or is made free by counting: "report 2.pdf".
enum class Bouncing : bool { Forbidden = false, Allowed = true };

/// Copies the file, folder or link at `url`, from anywhere, into the folder, under its own name.
/// The copy appears whole or not at all, and is on the disk by then; it has the content (holes stay
/// holes), permissions, dates and user attributes of its source, and its own identity. Content that
/// is not here (a fault) is Cocoa 4354.
void fp_importUnderFolder(const NSURLRef& url, const NSURLRef& folderURL,
                          URLHandler completionHandler);

/// Makes a folder. One that exists already is answered; only what is no folder is in the way.
void fp_createSubFolder(const NSURLRef& folderURL, const std::string& name,
                        URLHandler completionHandler);

void fp_renameWithNewName(const NSURLRef& url, const std::string& newName,
                          URLHandler completionHandler);

/// Moves into the folder, under the new name where there is one. Onto another file system it is
/// copied first (identity and all), then removed here.
void fp_reparentUnderFolder(const NSURLRef& url, const NSURLRef& folderURL,
                            const std::optional<std::string>& withNewName,
                            URLHandler completionHandler);
/// Where bouncing is allowed, what a trash kept under another name gets back the name that it had.
void fp_reparentUnderFolder(const NSURLRef& url, const NSURLRef& folderURL, Bouncing allowBouncing,
                            URLHandler completionHandler);

/// Deletes what is there, a folder with all that is in it; never follows a link.
void fp_deleteWithCompletionHandler(const NSURLRef& url, ErrorHandler completionHandler);

/// Access for a deletion that the caller carries out itself: calls `handler` once, on this thread,
/// before it returns, with the location to act on (the receiver itself, marks and all) or with why
/// there is none. Not on the loop thread.
void fp_coordinatedDeleteWithHandler(const NSURLRef& url, const URLHandler& handler);

/// The location in the way, which a clash (Cocoa 516) of the operations above carries; else nil.
[[nodiscard]] NSURLRef fp_collidingURL(const NSErrorRef& error);
/// The user-information key of that location.
inline constexpr const char* FPCollidingURLKey = "FPCollidingURL";

/// The path with every name replaced by a token, for logs. Within one process equal names have
/// equal tokens; the extension is kept. Nothing for nothing.
[[nodiscard]] std::optional<std::string> fp_obfuscatedPath(const std::optional<std::string>& path);

/// Where the file with a logical location is on this disk; nil when it is not known, and the
/// logical location then stands. May block.
using PhysicalLocationResolver = std::function<NSURLRef(const NSURLRef& logical)>;
/// The client library sets it. Any thread; an empty one takes it away.
void setPhysicalLocationResolver(PhysicalLocationResolver resolver);

/// The name that a file had before a trash took it, by where it is on this disk; nothing for what
/// is in no trash, or whose name is not known. May block.
using FormerNameResolver = std::function<std::optional<std::string>(const std::string& onDisk)>;
/// The client library sets it. Any thread; an empty one takes it away.
void setFormerNameResolver(FormerNameResolver resolver);

/// Whether a file that is moved from one place on this disk to another leaves the drive by that:
/// then nobody will bring its content any more, and what has it not, or holds a file that has it
/// not, is not moved (Cocoa 4354).
using DepartureRule = std::function<bool(const std::string& from, const std::string& to)>;
/// The client library sets it. Any thread; an empty one takes it away.
void setDepartureRule(DepartureRule rule);

/// Where copies are made before they are renamed into place: a folder of this user's on the tree's
/// file system, made when it is missing. What a crash left there is removed by the next copy. Empty
/// (or on another file system than the destination): a hidden folder in the destination, of a name
/// that never syncs. Any thread.
void setStagingFolder(std::string path);

}  // namespace yomber
