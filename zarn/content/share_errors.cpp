#include "zarn/content/share_errors.h"

#include <cerrno>

#include "platform/ostrell/constants.h"
#include "platform/rozzel/errors.h"

namespace yomber {
namespace {

constexpr std::int64_t kWriteFailed = 512;
constexpr std::int64_t kWriteNotAllowed = 513;

NSErrorRef described(const char* domain, std::int64_t code, const std::string& text) {
  return NSError::errorWithDomain(domain, code, {{NSLocalizedDescriptionKey, text}});
}

}  // namespace

NSErrorRef notSignedInError() {
  return described(QSOstrellErrorDomain, QSOstrellErrorLoggedOut,
                   "nobody is signed in to the drive: yomber account sign-in NAME");
}

NSErrorRef notSharedError(const std::string& path) {
  return NSError::errorWithDomain(
      QSOstrellErrorDomain, QSOstrellErrorNotShared,
      {{NSFilePathErrorKey, path},
       {NSLocalizedDescriptionKey, std::string("this is not shared with anybody")}});
}

bool isNoShare(const NSErrorRef& error) {
  return rz_isError(error, RZErrorUnknownItem) || rz_isError(error, RZErrorZoneNotFound);
}

NSErrorRef noSuchSharedItemError(const std::string& what) {
  return described(NSCocoaErrorDomain, NSFileNoSuchFileError, "there is no item " + what);
}

NSErrorRef cannotBeSharedError(const std::string& reason) {
  return NSError::errorWithDomain(NSCocoaErrorDomain, kWriteFailed,
                                  {{NSLocalizedDescriptionKey, "this cannot be shared: " + reason},
                                   {NSUnderlyingErrorKey, NSError::errorWithErrno(EPERM)}});
}

NSErrorRef mayOnlyReadError(const std::string& path, const std::string& title) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, kWriteNotAllowed,
      {{NSFilePathErrorKey, path},
       {NSLocalizedDescriptionKey,
        "\"" + title +
            "\" is shared with you for reading only; copy it, or ask its owner for the "
            "right to change it"},
       {NSUnderlyingErrorKey, NSError::errorWithErrno(EACCES)}});
}

}  // namespace yomber
