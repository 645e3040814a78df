#include "zarn/item_attributes.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <array>
#include <cerrno>
#include <charconv>
#include <limits>
#include <vector>

#include "platform/foundation/descriptor_path.h"
#include "platform/foundation/fault_attributes.h"
#include "zarn/file_descriptor.h"
#include "zarn/lent_mode.h"
#include "zarn/row_queries.h"

namespace yomber {
namespace {

constexpr std::size_t kLargestValue = 65536;  // the kernel's own limit

std::optional<std::string> readValue(const char* path, const char* name) {
  std::array<char, 256> small{};
  const ssize_t length = lgetxattr(path, name, small.data(), small.size());
  if (length >= 0) return std::string(small.data(), static_cast<std::size_t>(length));
  if (errno != ERANGE) return std::nullopt;
  std::string large(kLargestValue, '\0');
  const ssize_t largeLength = lgetxattr(path, name, large.data(), large.size());
  if (largeLength < 0) return std::nullopt;
  large.resize(static_cast<std::size_t>(largeLength));
  return large;
}

std::optional<std::int64_t> readNumber(const char* path, const char* name) {
  const auto text = readValue(path, name);
  if (!text) return std::nullopt;
  std::int64_t number = 0;
  const char* const end = text->data() + text->size();
  const auto [rest, failure] = std::from_chars(text->data(), end, number);
  if (failure != std::errc() || rest != end) return std::nullopt;
  return number;
}

int writeValue(int file, const char* attribute, const std::optional<std::string>& value) {
  const std::string path = pathOfDescriptor(file);
  if (value) {
    return setxattr(path.c_str(), attribute, value->data(), value->size(), 0) == 0 ? 0 : errno;
  }
  return removexattr(path.c_str(), attribute) == 0 || errno == ENODATA ? 0 : errno;
}

void readOne(const char* path, std::string_view name, ItemAttributes& out) {
  if (name == kIDAttribute) {
    const auto id = readNumber(path, kIDAttribute);
    const bool isValid = id && *id >= static_cast<std::int64_t>(kFirstIssuedID);
    if (isValid) out.id = static_cast<std::uint64_t>(*id);
  } else if (name == kFavoriteAttribute) {
    out.extra.favoriteRank = readNumber(path, kFavoriteAttribute);
  } else if (name == kLastUsedAttribute) {
    out.extra.lastUsed = readNumber(path, kLastUsedAttribute);
  } else if (name == kSharedAttribute) {
    out.isShared = true;
  } else if (name == kOnlyReadableAttribute) {
    out.isOnlyReadable = true;
  } else if (name == kTagsAttribute) {
    out.extra.tags = splitTags(readValue(path, kTagsAttribute).value_or(std::string()));
  } else if (name == kFaultAttribute) {
    out.isFault = readValue(path, kFilledAttribute) != bootIdentifier();
  }
}

}  // namespace

ItemAttributes readItemAttributes(const char* path) {
  ItemAttributes result;
  std::array<char, 1024> small{};
  std::vector<char> large;
  const char* names = small.data();
  ssize_t length = llistxattr(path, small.data(), small.size());
  if (length < 0 && errno == ERANGE) {
    large.resize(kLargestValue);
    names = large.data();
    length = llistxattr(path, large.data(), large.size());
  }
  if (length <= 0) return result;
  for (std::string_view rest(names, static_cast<std::size_t>(length)); !rest.empty();) {
    const std::string_view name = rest.substr(0, rest.find('\0'));
    readOne(path, name, result);
    rest.remove_prefix(std::min(rest.size(), name.size() + 1));
  }
  return result;
}

int writeItemAttribute(int folder, const std::string& name, std::uint64_t inode,
                       const char* attribute, const std::optional<std::string>& value) {
  const FileDescriptor file(openat(folder, name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  struct stat status{};
  if (!file || fstat(file.get(), &status) != 0) return errno;
  if (status.st_ino != inode) return ESTALE;
  if (S_ISLNK(status.st_mode)) return EPERM;  // the path below would be its target's
  return withWritePermission(file.get(), [&] { return writeValue(file.get(), attribute, value); });
}

int writeItemExtra(int folder, const std::string& name, std::uint64_t inode,
                   const ItemExtra& extra) {
  const auto text = [](const std::optional<std::int64_t>& number) {
    return number ? std::optional(std::to_string(*number)) : std::nullopt;
  };
  std::optional<std::string> tags;
  if (!extra.tags.empty()) tags = joinTags(extra.tags);
  const std::pair<const char*, std::optional<std::string>> values[] = {
      {kTagsAttribute, std::move(tags)},
      {kFavoriteAttribute, text(extra.favoriteRank)},
      {kLastUsedAttribute, text(extra.lastUsed)}};
  for (const auto& [attribute, value] : values) {
    if (const int failure = writeItemAttribute(folder, name, inode, attribute, value)) {
      return failure;
    }
  }
  return 0;
}

bool stampItem(int folder, const std::string& name, std::uint64_t inode, std::uint64_t id) {
  return writeItemAttribute(folder, name, inode, kIDAttribute, std::to_string(id)) == 0;
}

std::string pathThroughDescriptor(int folder, std::string_view name) {
  return pathOfDescriptor(folder) + "/" + std::string(name);
}

}  // namespace yomber
