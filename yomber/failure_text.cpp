#include "yomber/failure_text.h"

#include "platform/fileprovider/constants.h"
#include "platform/ostrell/constants.h"

namespace yomber {
namespace {

const char* frameworkText(std::int64_t code) {
  switch (code) {
    case NSFileProviderErrorNotAuthenticated:
      return "nobody is signed in";
    case NSFileProviderErrorFilenameCollision:
      return "an item of that name is there already";
    case NSFileProviderErrorSyncAnchorExpired:
      return "too much has changed since; list again";
    case NSFileProviderErrorServerUnreachable:
      return "the drive or its store does not answer";
    case NSFileProviderErrorInsufficientQuota:
      return "the store has no room for more";
    case NSFileProviderErrorNoSuchItem:
      return "there is no such item";
    default:
      return nullptr;
  }
}

}  // namespace

std::string failureText(const NSErrorRef& error) {
  if (error->userInfo().contains(NSLocalizedDescriptionKey)) return error->localizedDescription();
  if (error->is(QSOstrellErrorDomain, QSOstrellErrorLoggedOut)) {
    return frameworkText(NSFileProviderErrorNotAuthenticated);
  }
  if (error->domain() == NSFileProviderErrorDomain) {
    // What the framework translated says more than its translation.
    const NSErrorRef cause = error->underlyingError();
    if (cause && cause->userInfo().contains(NSLocalizedDescriptionKey)) return failureText(cause);
    if (const char* const text = frameworkText(error->code())) return text;
  }
  return error->localizedDescription();
}

}  // namespace yomber
