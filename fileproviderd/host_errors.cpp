#include "fileproviderd/host_errors.h"

#include <cerrno>
#include <utility>

#include "platform/fileprovider/constants.h"

namespace yomber {
namespace {

NSErrorRef unreachable(std::string text, const NSErrorRef& underlying) {
  NSErrorUserInfo info{{NSLocalizedDescriptionKey, std::move(text)}};
  if (underlying != nullptr) info.emplace(NSUnderlyingErrorKey, underlying);
  return NSError::errorWithDomain(NSFileProviderErrorDomain, NSFileProviderErrorServerUnreachable,
                                  std::move(info));
}

}  // namespace

NSErrorRef zarnNotRunningError(const NSErrorRef& underlying) {
  return unreachable("zarn is not running: start the drive with 'yomber up'", underlying);
}

NSErrorRef extensionUnavailableError(const std::string& reason, const NSErrorRef& underlying) {
  return unreachable("the drive's extension " + reason +
                         "; it is started again by itself, and "
                         "'yomber log' tells more",
                     underlying);
}

NSErrorRef changeInterruptedError(const NSErrorRef& underlying) {
  return unreachable(
      "the drive's extension ended in the middle of the change: look whether it was carried out "
      "before you try again",
      underlying);
}

NSErrorRef invalidRequestError(const std::string& what) {
  return NSError::errorWithDomain(NSPOSIXErrorDomain, EINVAL, {{NSLocalizedDescriptionKey, what}});
}

bool isConnectionError(const NSErrorRef& error) {
  return error != nullptr && (error->is(NSCocoaErrorDomain, NSXPCConnectionInterrupted) ||
                              error->is(NSCocoaErrorDomain, NSXPCConnectionInvalid) ||
                              error->is(NSCocoaErrorDomain, NSXPCConnectionTimedOut));
}

bool isNoSuchItemError(const NSErrorRef& error) {
  return error != nullptr && (error->is(NSFileProviderErrorDomain, NSFileProviderErrorNoSuchItem) ||
                              error->is(NSCocoaErrorDomain, NSFileNoSuchFileError) ||
                              error->is(NSPOSIXErrorDomain, ENOENT));
}

}  // namespace yomber
