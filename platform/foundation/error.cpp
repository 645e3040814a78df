#include "platform/foundation/error.h"

#include <array>
#include <cstring>

#include "platform/foundation/log_format.h"
#include "platform/foundation/url.h"

namespace yomber {
namespace {

/// The meaning of a Cocoa code in plain words, or nothing.
const char* cocoaText(std::int64_t code) {
  switch (code) {
    case NSFileNoSuchFileError:
      return "The file does not exist.";
    case NSFileReadUnknownError:
      return "The file could not be read.";
    case NSFileWriteUnknownError:
      return "The file could not be written.";
    case NSFileWriteFileExistsError:
      return "An item with the same name already exists.";
    case NSUserCancelledError:
      return "The operation was cancelled.";
    case NSXPCConnectionInterrupted:
      return "The connection to the other process was interrupted.";
    case NSXPCConnectionInvalid:
      return "The connection to the other process is closed.";
    case NSXPCConnectionReplyInvalid:
      return "The other process sent an answer that cannot be understood.";
    case NSXPCConnectionTimedOut:
      return "The other process did not answer in time.";
    case NSUbiquitousFileUnavailableError:
      return "The file's content is not on this machine.";
    case NSUbiquitousFileNotUploadedDueToQuotaError:
      return "The file was not uploaded because the account is full.";
    default:
      return nullptr;
  }
}

std::string posixText(int number) {
  std::array<char, 128> buffer{};
  return strerror_r(number, buffer.data(), buffer.size());
}

std::string textOfValue(const NSErrorValue& value) {
  std::string out;
  std::visit([&](const auto& held) { log_detail::append(out, held); }, value);
  return out;
}

}  // namespace

NSError::NSError(std::string domain, std::int64_t code, NSErrorUserInfo userInfo)
    : domain_(std::move(domain)), code_(code), userInfo_(std::move(userInfo)) {}

NSErrorRef NSError::errorWithDomain(std::string domain, std::int64_t code,
                                    NSErrorUserInfo userInfo) {
  return std::make_shared<const NSError>(std::move(domain), code, std::move(userInfo));
}

NSErrorRef NSError::errorWithErrno(int number, const std::string& path) {
  NSErrorUserInfo userInfo;
  if (!path.empty()) userInfo.emplace(NSFilePathErrorKey, path);
  return errorWithDomain(NSPOSIXErrorDomain, number, std::move(userInfo));
}

bool NSError::is(const std::string& domain, std::int64_t code) const {
  return code_ == code && domain_ == domain;
}

NSErrorRef NSError::underlyingError() const {
  const auto found = userInfo_.find(NSUnderlyingErrorKey);
  if (found == userInfo_.end()) return nullptr;
  const auto* const error = std::get_if<NSErrorRef>(&found->second);
  return error != nullptr ? *error : nullptr;
}

std::string NSError::localizedDescription() const {
  const auto found = userInfo_.find(NSLocalizedDescriptionKey);
  if (found != userInfo_.end()) {
    if (const auto* const text = std::get_if<std::string>(&found->second)) return *text;
  }
  if (domain_ == NSPOSIXErrorDomain) return posixText(static_cast<int>(code_));
  if (domain_ == NSCocoaErrorDomain) {
    if (const char* const text = cocoaText(code_)) return text;
  }
  return "The operation could not be completed. (" + domain_ + " error " + std::to_string(code_) +
         ".)";
}

std::string NSError::description() const {
  std::string out = "Error Domain=" + domain_ + " Code=" + std::to_string(code_) + " \"" +
                    localizedDescription() + "\"";
  const char* separator = " UserInfo={";
  for (const auto& [key, value] : userInfo_) {
    if (key == NSLocalizedDescriptionKey) continue;
    out += separator + key + "=" + textOfValue(value);
    separator = ", ";
  }
  if (separator[0] == ',') out += '}';
  return out;
}

}  // namespace yomber
