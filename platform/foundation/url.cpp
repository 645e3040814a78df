#include "platform/foundation/url.h"

#include <sys/stat.h>

#include <cerrno>

#include "platform/foundation/fault_attributes.h"

namespace yomber {
namespace {

/// Absolute, with no empty and no "." component.
std::string normalised(std::string_view path) {
  std::string out;
  out.reserve(path.size() + 1);
  while (!path.empty()) {
    const std::size_t slash = path.find('/');
    const std::string_view component = path.substr(0, slash);
    path.remove_prefix(slash == std::string_view::npos ? path.size() : slash + 1);
    if (component.empty() || component == ".") continue;
    out += '/';
    out += component;
  }
  return out.empty() ? "/" : out;
}

/// Characters that a file URL's path shows as they are.
bool isPlain(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
         std::string_view("-._~/!$&'()*+,=:@").find(c) != std::string_view::npos;
}

}  // namespace

NSURL::NSURL(std::string path) : path_(normalised(path)) {}

NSURLRef NSURL::fileURLWithPath(std::string_view path) {
  if (path.empty() || path.front() != '/' || path.find('\0') != std::string_view::npos) {
    return nullptr;
  }
  return std::make_shared<NSURL>(std::string(path));
}

std::string NSURL::lastPathComponent() const {
  return path_ == "/" ? path_ : path_.substr(path_.rfind('/') + 1);
}

NSURLRef NSURL::URLByAppendingPathComponent(std::string_view component) const {
  return std::make_shared<NSURL>(path_ + "/" + std::string(component));
}

NSURLRef NSURL::URLByDeletingLastPathComponent() const {
  return std::make_shared<NSURL>(path_.substr(0, path_.rfind('/')));
}

std::string NSURL::absoluteString() const {
  constexpr std::string_view kDigits = "0123456789ABCDEF";
  std::string out = "file://";
  out.reserve(out.size() + path_.size());
  for (const char c : path_) {
    if (isPlain(c)) {
      out += c;
      continue;
    }
    const auto byte = static_cast<unsigned char>(c);
    out += '%';
    out += kDigits[byte >> 4U];
    out += kDigits[byte & 0xfU];
  }
  return out;
}

void NSURL::setMark(Mark mark) {
  marks_.fetch_or(static_cast<std::uint32_t>(mark), std::memory_order_relaxed);
}

bool NSURL::hasMark(Mark mark) const {
  return (marks_.load(std::memory_order_relaxed) & static_cast<std::uint32_t>(mark)) != 0;
}

std::optional<NSURLResourceValues> NSURL::resourceValues(NSErrorRef* error) const {
  struct stat status{};
  if (lstat(path_.c_str(), &status) != 0) {
    storeError(error, NSError::errorWithErrno(errno, path_));
    return std::nullopt;
  }
  NSURLResourceValues values;
  values.isDirectory = S_ISDIR(status.st_mode);
  values.isRegularFile = S_ISREG(status.st_mode);
  values.isSymbolicLink = S_ISLNK(status.st_mode);
  values.fileSize = static_cast<std::uint64_t>(status.st_size);
  values.fileResourceIdentifier = status.st_ino;
  values.volumeIdentifier = status.st_dev;
  values.contentModificationDate = NSDate::fromTimespec(status.st_mtim);
  values.attributeModificationDate = NSDate::fromTimespec(status.st_ctim);
  return values;
}

bool NSURL::checkResourceIsReachableAndReturnError(NSErrorRef* error) const {
  if (!resourceValues(error)) return false;
  if (!isFaultAtPath(path_)) return true;
  storeError(error, NSError::errorWithDomain(NSCocoaErrorDomain, NSUbiquitousFileUnavailableError,
                                             {{NSFilePathErrorKey, path_}}));
  return false;
}

bool isPathBelow(std::string_view path, std::string_view ancestor) {
  if (ancestor == "/") return path.size() > 1 && path.front() == '/';
  return path.size() > ancestor.size() && path.starts_with(ancestor) &&
         path[ancestor.size()] == '/';
}

}  // namespace yomber
