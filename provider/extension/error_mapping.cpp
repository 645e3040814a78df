#include "provider/extension/error_mapping.h"

#include <array>

#include "platform/fileprovider/constants.h"
#include "platform/ostrell/constants.h"

namespace yomber {
namespace {

/// NSCocoaErrorDomain: the client library asked for an item that is gone.
constexpr std::int64_t kCocoaItemIsGone = 14;

struct Mapping {
  const char* domain;
  std::int64_t code;
  std::int64_t fileProviderCode;
};

constexpr std::array kMappings{
    Mapping{NSCocoaErrorDomain, NSUbiquitousFileNotUploadedDueToQuotaError,
            NSFileProviderErrorInsufficientQuota},
    Mapping{NSCocoaErrorDomain, NSUbiquitousFileUnavailableError,
            NSFileProviderErrorServerUnreachable},
    Mapping{NSCocoaErrorDomain, kCocoaItemIsGone, NSFileProviderErrorNoSuchItem},
    Mapping{QSOstrellErrorDomain, QSOstrellErrorLoggedOut, NSFileProviderErrorNotAuthenticated},
};

}  // namespace

bool _qs_getFileProviderDomainErrorCode(const NSErrorRef& error, std::int64_t* code) {
  if (error == nullptr) return false;
  for (const Mapping& mapping : kMappings) {
    if (!error->is(mapping.domain, mapping.code)) continue;
    if (code != nullptr) *code = mapping.fileProviderCode;
    return true;
  }
  return false;
}

NSErrorRef qs_fileProviderError(const NSErrorRef& error) {
  std::int64_t code = 0;
  if (!_qs_getFileProviderDomainErrorCode(error, &code)) return error;
  return NSError::errorWithDomain(NSFileProviderErrorDomain, code, {{NSUnderlyingErrorKey, error}});
}

}  // namespace yomber
