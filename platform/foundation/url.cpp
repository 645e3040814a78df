#include "platform/foundation/url.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>

#include "platform/foundation/fault_attributes.h"
#include "platform/foundation/percent_encoding.h"

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

constexpr std::size_t kMaximumTextBytes = 4096;

bool isInScheme(char c) {
  return (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-' || c == '+' || c == '.';
}

}  // namespace

NSURL::NSURL(std::string path) : path_(normalised(path)) {}

NSURLRef NSURL::fileURLWithPath(std::string_view path) {
  if (path.empty() || path.front() != '/' || path.find('\0') != std::string_view::npos) {
    return nullptr;
  }
  return std::make_shared<NSURL>(std::string(path));
}

NSURLRef NSURL::URLWithString(std::string_view text) {
  const std::string_view scheme = text.substr(0, text.find(':'));
  const bool isURL = text.size() <= kMaximumTextBytes && scheme.size() + 1 < text.size() &&
                     !scheme.empty() && scheme != "file" && scheme.front() >= 'a' &&
                     scheme.front() <= 'z' && std::ranges::all_of(scheme, isInScheme) &&
                     std::ranges::all_of(text, [](char c) { return c > ' ' && c < '\x7f'; });
  return isURL ? NSURLRef(new NSURL(Elsewhere{std::string(text)})) : nullptr;
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
  if (!isFileURL()) return text_;
  return "file://" + percentEncoded(path_, kPlainInURLPaths);
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
