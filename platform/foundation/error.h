#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <utility>
#include <variant>

#include "platform/foundation/object.h"

namespace yomber {

class NSError;
class NSURL;

/// Errors are immutable and shared; nil means success.
using NSErrorRef = std::shared_ptr<const NSError>;
/// Not to const: marks change a location in place.
using NSURLRef = std::shared_ptr<NSURL>;

/// Domains. Codes are only comparable within one domain.
inline constexpr const char* NSCocoaErrorDomain = "NSCocoaErrorDomain";
inline constexpr const char* NSPOSIXErrorDomain = "NSPOSIXErrorDomain";

/// Cocoa codes that this system makes or tests.
inline constexpr std::int64_t NSFileNoSuchFileError = 4;
inline constexpr std::int64_t NSFileReadUnknownError = 256;
inline constexpr std::int64_t NSFileReadCorruptFileError = 259;
inline constexpr std::int64_t NSFileWriteUnknownError = 512;
inline constexpr std::int64_t NSFileWriteFileExistsError = 516;
inline constexpr std::int64_t NSUserCancelledError = 3072;
inline constexpr std::int64_t NSXPCConnectionInterrupted = 4097;
inline constexpr std::int64_t NSXPCConnectionInvalid = 4099;
inline constexpr std::int64_t NSXPCConnectionReplyInvalid = 4101;
/// The peer is alive but did not answer within the call's time limit.
inline constexpr std::int64_t NSXPCConnectionTimedOut = 4110;
inline constexpr std::int64_t NSUbiquitousFileUnavailableError = 4354;
inline constexpr std::int64_t NSUbiquitousFileNotUploadedDueToQuotaError = 4355;

/// User-information keys.
inline constexpr const char* NSUnderlyingErrorKey = "NSUnderlyingError";
inline constexpr const char* NSLocalizedDescriptionKey = "NSLocalizedDescription";
inline constexpr const char* NSFilePathErrorKey = "NSFilePath";

using NSErrorValue =
    std::variant<std::string, std::int64_t, double, bool, NSErrorRef, NSURLRef, NSObjectRef>;
using NSErrorUserInfo = std::map<std::string, NSErrorValue>;

/// A failure: a domain, a code of that domain, and what else is known about it.
///
/// Ownership: shared, immutable. "The very same error" is the same pointer.
/// Thread-safety: immutable after construction.
class NSError final : public NSObject {
 public:
  NSError(std::string domain, std::int64_t code, NSErrorUserInfo userInfo);

  static NSErrorRef errorWithDomain(std::string domain, std::int64_t code,
                                    NSErrorUserInfo userInfo = {});
  /// POSIX-domain error of an errno value, naming `path` when it is not empty.
  static NSErrorRef errorWithErrno(int number, const std::string& path = {});

  [[nodiscard]] const std::string& domain() const { return domain_; }
  [[nodiscard]] std::int64_t code() const { return code_; }
  [[nodiscard]] const NSErrorUserInfo& userInfo() const { return userInfo_; }
  [[nodiscard]] bool is(const std::string& domain, std::int64_t code) const;

  /// The error under NSUnderlyingErrorKey, or nil.
  [[nodiscard]] NSErrorRef underlyingError() const;
  /// The text for a person: NSLocalizedDescriptionKey where there is one, else a rendering of the
  /// code (`strerror` for POSIX codes).
  [[nodiscard]] std::string localizedDescription() const;
  [[nodiscard]] std::string description() const override;

 private:
  std::string domain_;
  std::int64_t code_;
  NSErrorUserInfo userInfo_;
};

/// Stores `error` through `out` when the caller gave one.
inline void storeError(NSErrorRef* out, NSErrorRef error) {
  if (out != nullptr) *out = std::move(error);
}

}  // namespace yomber
