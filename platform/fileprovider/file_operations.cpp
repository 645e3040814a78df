#include "platform/fileprovider/file_operations.h"

#include <cerrno>
#include <exception>
#include <utility>

#include "platform/fileprovider/file_errors.h"
#include "platform/fileprovider/file_placement.h"
#include "platform/foundation/log.h"
#include "platform/foundation/thread_pool.h"

namespace yomber {
namespace {

/// What an operation that ran out of memory answers.
NSErrorRef interrupted(const std::exception& exception) {
  log_fault(defaultLog(), "[CRIT] a file operation threw: %s", exception.what());
  return fileError(ENOMEM, {});
}

/// Answers on the pool what `work` makes of it.
void placeOnPool(URLHandler completionHandler, std::function<Placed()> work) {
  ThreadPool::shared().async([handler = std::move(completionHandler), work = std::move(work)] {
    Placed placed;
    try {
      placed = work();
    } catch (const std::exception& exception) {
      placed = {nullptr, interrupted(exception)};
    }
    if (handler) handler(std::move(placed.url), std::move(placed.error));
  });
}

NSErrorRef noLocation() {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSFileNoSuchFileError,
      {{NSLocalizedDescriptionKey, std::string("there is no location to act on")}});
}

/// Into a folder, under the name or why there can be none.
void placeUnder(const NSURLRef& url, const NSURLRef& folderURL, const std::string& name,
                Bouncing bouncing, URLHandler completionHandler,
                Placed (*operation)(const FileLocation&, const FileDestination&)) {
  placeOnPool(std::move(completionHandler), [=]() -> Placed {
    if (url == nullptr || folderURL == nullptr) return {nullptr, noLocation()};
    if (NSErrorRef error = checkFileName(name)) return {nullptr, std::move(error)};
    return operation(locateFile(url), {locateFolder(folderURL), name, bouncing});
  });
}

std::string nameOf(const NSURLRef& url) {
  return url != nullptr ? url->lastPathComponent() : std::string();
}

}  // namespace

void fp_importUnderFolder(const NSURLRef& url, const NSURLRef& folderURL,
                          URLHandler completionHandler) {
  placeUnder(url, folderURL, nameOf(url), Bouncing::Forbidden, std::move(completionHandler),
             importFile);
}

void fp_createSubFolder(const NSURLRef& folderURL, const std::string& name,
                        URLHandler completionHandler) {
  placeOnPool(std::move(completionHandler), [=]() -> Placed {
    if (folderURL == nullptr) return {nullptr, noLocation()};
    if (NSErrorRef error = checkFileName(name)) return {nullptr, std::move(error)};
    return makeFolder({locateFolder(folderURL), name});
  });
}

void fp_renameWithNewName(const NSURLRef& url, const std::string& newName,
                          URLHandler completionHandler) {
  placeOnPool(std::move(completionHandler), [=]() -> Placed {
    if (url == nullptr) return {nullptr, noLocation()};
    if (NSErrorRef error = checkFileName(newName)) return {nullptr, std::move(error)};
    return renameFile(locateFile(url), newName);
  });
}

void fp_reparentUnderFolder(const NSURLRef& url, const NSURLRef& folderURL,
                            const std::optional<std::string>& withNewName,
                            URLHandler completionHandler) {
  placeUnder(url, folderURL, withNewName ? *withNewName : nameOf(url), Bouncing::Forbidden,
             std::move(completionHandler), moveFile);
}

void fp_reparentUnderFolder(const NSURLRef& url, const NSURLRef& folderURL, Bouncing allowBouncing,
                            URLHandler completionHandler) {
  placeOnPool(std::move(completionHandler), [=]() -> Placed {
    if (url == nullptr || folderURL == nullptr) return {nullptr, noLocation()};
    const FileLocation source = locateFile(url);
    const auto former =
        allowBouncing == Bouncing::Allowed ? formerNameOf(source) : std::optional<std::string>();
    const std::string name = former.value_or(nameOf(url));
    if (NSErrorRef error = checkFileName(name)) return {nullptr, std::move(error)};
    return moveFile(source, {locateFolder(folderURL), name, allowBouncing});
  });
}

void fp_deleteWithCompletionHandler(const NSURLRef& url, ErrorHandler completionHandler) {
  placeOnPool(
      [handler = std::move(completionHandler)](const NSURLRef&, NSErrorRef error) {
        if (handler) handler(std::move(error));
      },
      [url]() -> Placed {
        return {nullptr, url != nullptr ? deleteFile(locateFile(url)) : noLocation()};
      });
}

void fp_coordinatedDeleteWithHandler(const NSURLRef& url, const URLHandler& handler) {
  NSErrorRef error = url != nullptr ? checkFileIsThere(locateFile(url)) : noLocation();
  if (!handler) return;
  if (error != nullptr) return handler(nullptr, std::move(error));
  handler(url, nullptr);
}

NSURLRef fp_collidingURL(const NSErrorRef& error) {
  if (error == nullptr) return nullptr;
  const auto found = error->userInfo().find(FPCollidingURLKey);
  if (found == error->userInfo().end()) return nullptr;
  const auto* const url = std::get_if<NSURLRef>(&found->second);
  return url != nullptr ? *url : nullptr;
}

}  // namespace yomber
