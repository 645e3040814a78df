#include "zarn/daemon_errors.h"

#include "platform/ostrell/constants.h"

namespace yomber {

namespace {

/// What came from a peer is repeated to it, but not at any length.
std::string shortened(std::string_view text) {
  constexpr std::size_t kMaximumLength = 4096;
  return std::string(text.substr(0, kMaximumLength));
}

}  // namespace

NSErrorRef noSuchLocationError(const std::string& path) {
  const std::string text = shortened(path);
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSFileNoSuchFileError,
      {{NSFilePathErrorKey, text},
       {NSLocalizedDescriptionKey, "the drive has no item at " + text}});
}

NSErrorRef noSuchItemError(const std::string& identifier) {
  return NSError::errorWithDomain(
      NSCocoaErrorDomain, NSFileNoSuchFileError,
      {{NSLocalizedDescriptionKey, "the drive has no item " + shortened(identifier)}});
}

NSErrorRef invalidParameterError(const char* parameter, std::string_view value) {
  return NSError::errorWithDomain(
      QSOstrellErrorDomain, QSOstrellErrorInvalidParameter,
      {{QSOstrellErrorParameterKey, std::string(parameter)},
       {QSOstrellErrorValueKey, shortened(value)},
       {NSLocalizedDescriptionKey, "not a valid " + std::string(parameter)}});
}

NSErrorRef outsideTreeError(std::string_view path) {
  const std::string text = shortened(path);
  return NSError::errorWithDomain(
      QSOstrellErrorDomain, QSOstrellErrorInvalidParameter,
      {{QSOstrellErrorParameterKey, std::string("path")},
       {QSOstrellErrorValueKey, text},
       {NSLocalizedDescriptionKey,
        text + " is not inside the drive; give a location in its tree"}});
}

NSErrorRef refusedError(int number, std::string_view path, const std::string& reason) {
  const std::string text = shortened(path);
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSFileWriteUnknownError,
                                  {{NSFilePathErrorKey, text},
                                   {NSUnderlyingErrorKey, NSError::errorWithErrno(number, text)},
                                   {NSLocalizedDescriptionKey, reason}});
}

NSErrorRef cancelledError(std::string_view path) {
  return NSError::errorWithDomain(NSCocoaErrorDomain, NSUserCancelledError,
                                  {{NSFilePathErrorKey, shortened(path)},
                                   {NSLocalizedDescriptionKey, std::string("cancelled")}});
}

}  // namespace yomber
