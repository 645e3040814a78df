#include "platform/ostrell/url_additions.h"

#include <limits.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdlib>
#include <memory>
#include <string_view>

#include "platform/ostrell/daemon_link.h"
#include "platform/ostrell/daemon_wire.h"

namespace yomber {
namespace {

using Wire = protocol::Daemon;

/// The text of the symbolic link at `path`; nothing when there is none.
std::optional<std::string> linkText(const std::string& path) {
  std::array<char, PATH_MAX> buffer{};
  const ssize_t length = readlink(path.c_str(), buffer.data(), buffer.size());
  if (length <= 0 || static_cast<std::size_t>(length) == buffer.size()) return std::nullopt;
  return std::string(buffer.data(), static_cast<std::size_t>(length));
}

/// Where `text`, read from a link in `folder`, leads by the look of it: "." and ".." taken away,
/// nothing asked of the disk.
std::string lexicalTarget(std::string_view folder, std::string_view text) {
  std::string path = text.starts_with('/') ? std::string() : std::string(folder);
  while (!text.empty()) {
    const auto end = std::min(text.find('/'), text.size());
    const std::string_view component = text.substr(0, end);
    text.remove_prefix(std::min(end + 1, text.size()));
    if (component.empty() || component == ".") continue;
    if (component == "..") {
      path.erase(std::min(path.rfind('/'), path.size()));
    } else {
      path.append("/").append(component);
    }
  }
  return path;
}

NSErrorRef unresolvable(int number, const std::string& path) {
  if (number != ENOENT && number != ENOTDIR) return NSError::errorWithErrno(number, path);
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSFileNoSuchFileError,
      {{NSUnderlyingErrorKey, NSError::errorWithErrno(number)}, {NSFilePathErrorKey, path}});
}

NSErrorRef leadsOutside(const std::string& path) {
  return NSError::errorWithDomain(
      NSPOSIXErrorDomain, EXDEV,
      {{NSFilePathErrorKey, path},
       {NSLocalizedDescriptionKey, std::string("the bookmark leads out of the drive")}});
}

}  // namespace

NSURLRef qs_documentURLFromFileObjectID(const QSFileObjectIDRef& fileObjectID, NSErrorRef* error) {
  if (!fileObjectID) {
    storeError(error, NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError));
    return nullptr;
  }
  NSURLRef url;
  NSErrorRef refusal;
  const NSErrorRef failure = DaemonLink::current()->callAndWait(
      &Wire::Client::documentLocationRequest,
      [&](Wire::DocumentLocationParams::Builder params) {
        encodeObjectID(*fileObjectID, params.initObject());
      },
      [&](const Wire::DocumentLocationResults::Reader& results) {
        url = decodeLocation(results.getResult(), &refusal);
      });
  if (failure || refusal) {
    storeError(error, failure ? failure : refusal);
    return nullptr;
  }
  return url;
}

bool qs_isExternalDocumentReference(const NSURLRef& url) {
  if (!url || !qs_isInSyncedLocation(url)) return false;
  const auto text = linkText(url->path());
  if (!text) return false;
  const std::string_view path = url->path();
  return DaemonLink::current()->locations().isInTree(
      lexicalTarget(path.substr(0, path.rfind('/')), *text));
}

NSURLRef qs_URLByResolvingExternalDocumentReferenceWithError(const NSURLRef& url,
                                                             NSErrorRef* error) {
  if (!url) {
    storeError(error, NSError::errorWithDomain(NSCocoaErrorDomain, NSFileNoSuchFileError));
    return nullptr;
  }
  const std::unique_ptr<char, decltype(&std::free)> resolved(realpath(url->path().c_str(), nullptr),
                                                             &std::free);
  if (!resolved) {
    storeError(error, unresolvable(errno, url->path()));
    return nullptr;
  }
  if (!DaemonLink::current()->locations().isInTree(resolved.get())) {
    storeError(error, leadsOutside(url->path()));
    return nullptr;
  }
  return NSURL::fileURLWithPath(resolved.get());
}

bool qs_isInOstrellPrivateStorages(const NSURLRef& url) {
  return url && DaemonLink::current()->locations().isPrivate(url->path());
}

bool qs_wouldBeExcludedFromSync(const NSURLRef& url) {
  return url && DaemonLink::current()->locations().isExcluded(url->path());
}

bool qs_isInSyncedLocation(const NSURLRef& url) {
  return url && DaemonLink::current()->locations().isInTree(url->path());
}

void qs_addPhysicalProperty(const NSURLRef& url) {
  if (url) url->setMark(NSURL::Mark::Physical);
}

std::optional<std::string> qs_containerIDIfIsDocumentsContainerURL(const NSURLRef& url) {
  if (!url) return std::nullopt;
  const auto link = DaemonLink::current();
  auto containerID = link->locations().containerOfDocuments(url->path());
  // A folder that looks like a container's but belongs to none is an ordinary one.
  const auto containers = link->containerCache().value();
  if (containerID && containers && !(*containers)->contains(*containerID)) return std::nullopt;
  return containerID;
}

}  // namespace yomber
