#include "zarn/link_resolver.h"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <climits>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <optional>

#include "platform/foundation/descriptor_path.h"
#include "zarn/file_descriptor.h"
#include "zarn/item_attributes.h"

namespace yomber {
namespace {

std::string realHome(const std::string& home) {
  const std::unique_ptr<char, decltype(&std::free)> resolved(realpath(home.c_str(), nullptr),
                                                             &std::free);
  return resolved ? std::string(resolved.get()) : home;
}

/// What a link says; nothing for what is no link, or longer than paths can be.
std::optional<std::string> readLink(int folder, const std::string& name) {
  std::array<char, PATH_MAX> target{};
  const ssize_t length = readlinkat(folder, name.c_str(), target.data(), target.size());
  if (length <= 0 || static_cast<std::size_t>(length) >= target.size()) return std::nullopt;
  return std::string(target.data(), static_cast<std::size_t>(length));
}

/// Where a descriptor's file is; nothing where that is too deep to be said.
std::optional<std::string> locationOf(int descriptor) {
  auto path = readLink(AT_FDCWD, pathOfDescriptor(descriptor));
  if (!path || path->front() != '/' || path->ends_with(" (deleted)")) return std::nullopt;
  return path;
}

std::string normalized(const std::string& path) {
  std::string result = std::filesystem::path(path).lexically_normal().native();
  while (result.size() > 1 && result.back() == '/') result.pop_back();
  return result;
}

}  // namespace

LinkResolver::LinkResolver(TreeLayout layout)
    : layout_(std::move(layout)), realLayout_(realHome(layout_.home())) {}

bool LinkResolver::isInside(std::string_view path) const {
  for (const TreeLayout* layout : {&layout_, &realLayout_}) {
    const auto place = layout->placeOf(path);
    if (place && place->kind == TreeLayout::Place::Kind::Documents) return true;
  }
  return false;
}

bool LinkResolver::isBookmark(int folder, const std::string& name) const {
  const auto target = readLink(folder, name);
  const auto location = locationOf(folder);
  if (!target || !location) return false;
  const bool isAbsolute = target->starts_with('/');
  if (!isInside(normalized(isAbsolute ? *target : *location + "/" + *target))) return false;
  const FileDescriptor end(openat(folder, name.c_str(), O_PATH | O_CLOEXEC));
  if (!end) return false;
  const auto realLocation = locationOf(end.get());
  return realLocation && isInside(*realLocation);
}

}  // namespace yomber
