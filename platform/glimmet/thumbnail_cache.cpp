#include "platform/glimmet/thumbnail_cache.h"

#include <fcntl.h>
#include <openssl/evp.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <span>

#include "platform/foundation/data_directories.h"
#include "platform/foundation/file_descriptor.h"
#include "platform/foundation/hexadecimal.h"
#include "platform/foundation/percent_encoding.h"
#include "platform/foundation/whole_transfer.h"

namespace yomber {
namespace {

constexpr std::string_view kSignature = "\x89PNG\r\n\x1a\n";
constexpr std::size_t kHeaderLength = 8 + 25;  // the signature and the first chunk
constexpr std::size_t kLookedAt = 16384;       // texts come first

std::string md5(std::string_view text) {
  std::array<unsigned char, EVP_MAX_MD_SIZE> hash{};
  unsigned length = 0;
  if (EVP_Digest(text.data(), text.size(), hash.data(), &length, EVP_md5(), nullptr) != 1)
    return {};
  return hexadecimal(std::as_bytes(std::span(hash).first(length)));
}

const char* nameOf(ThumbnailCache::Flavour flavour) {
  switch (flavour) {
    case ThumbnailCache::Flavour::Normal:
      return "normal";
    case ThumbnailCache::Flavour::Large:
      return "large";
    case ThumbnailCache::Flavour::ExtraLarge:
      return "x-large";
    case ThumbnailCache::Flavour::Double:
      return "xx-large";
  }
  return "normal";
}

void appendNumber(std::string& to, std::uint32_t number) {
  for (const unsigned shift : {24U, 16U, 8U, 0U}) to += static_cast<char>(number >> shift & 0xffU);
}

std::uint32_t numberAt(std::string_view bytes, std::size_t at) {
  std::uint32_t result = 0;
  for (const char byte : bytes.substr(at, 4))
    result = result << 8U | static_cast<unsigned char>(byte);
  return result;
}

/// As PNG has it of each chunk.
std::uint32_t checksum(std::string_view bytes) {
  std::uint32_t sum = 0xffffffffU;
  for (const char byte : bytes) {
    sum ^= static_cast<unsigned char>(byte);
    for (int bit = 0; bit < 8; ++bit) sum = sum >> 1U ^ (0xedb88320U & (0U - (sum & 1U)));
  }
  return ~sum;
}

std::string textChunk(std::string_view key, std::string_view value) {
  std::string data = "tEXt";
  data += key;
  data += '\0';
  data += value;
  std::string chunk;
  appendNumber(chunk, static_cast<std::uint32_t>(data.size() - 4));
  chunk += data;
  appendNumber(chunk, checksum(data));
  return chunk;
}

/// The text under a key, of those before the pixels.
std::string_view textOf(std::string_view png, std::string_view key) {
  std::size_t at = kSignature.size();
  while (at + 12 <= png.size()) {
    const std::size_t length = numberAt(png, at);
    const std::string_view type = png.substr(at + 4, 4);
    if (type == "IDAT" || length > png.size() - at - 12) return {};
    const std::string_view data = png.substr(at + 8, length);
    if (type == "tEXt" && data.size() > key.size() && data.starts_with(key) &&
        data[key.size()] == '\0')
      return data.substr(key.size() + 1);
    at += length + 12;
  }
  return {};
}

std::string readStart(const std::string& path) {
  const FileDescriptor file(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  std::string text(kLookedAt, '\0');
  const ssize_t length = file ? read(file.get(), text.data(), text.size()) : -1;
  text.resize(length > 0 ? static_cast<std::size_t>(length) : 0);
  return text.starts_with(kSignature) ? text : std::string();
}

/// For this user alone, and so what is missing above it.
NSErrorRef makePrivateDirectory(const std::filesystem::path& path) {
  std::error_code failure;
  const auto above = path.parent_path();
  if (!above.empty() && above != path && !std::filesystem::exists(above, failure)) {
    if (NSErrorRef error = makePrivateDirectory(above)) return error;
  }
  if (mkdir(path.c_str(), 0700) == 0 || errno == EEXIST) return nullptr;
  return NSError::errorWithErrno(errno, path.string());
}

}  // namespace

std::string fileURI(std::string_view path) {
  return "file://" + percentEncoded(path, kPlainInURLPaths);
}

ThumbnailCache ThumbnailCache::system() {
  const std::string cache = cacheDirectory();
  return ThumbnailCache(cache.empty() ? std::string() : cache + "/thumbnails");
}

std::string ThumbnailCache::entryPath(const std::string& path, Flavour flavour) const {
  return directory_ + "/" + nameOf(flavour) + "/" + md5(fileURI(path)) + ".png";
}

bool ThumbnailCache::has(const File& file, Flavour flavour) const {
  if (directory_.empty()) return false;
  const std::string start = readStart(entryPath(file.path, flavour));
  return !start.empty() && textOf(start, "Thumb::URI") == fileURI(file.path) &&
         textOf(start, "Thumb::MTime") == std::to_string(file.mtime);
}

NSErrorRef ThumbnailCache::store(const File& file, Flavour flavour, std::string_view png) const {
  if (directory_.empty()) return NSError::errorWithErrno(ENOENT);
  if (png.size() < kHeaderLength || !png.starts_with(kSignature))
    return NSError::errorWithErrno(EINVAL, file.path);
  if (NSErrorRef error = makePrivateDirectory(directory_)) return error;
  if (NSErrorRef error = makePrivateDirectory(directory_ + "/" + nameOf(flavour))) return error;
  const std::string path = entryPath(file.path, flavour);
  std::string aside = path + ".XXXXXX";
  const FileDescriptor output(mkostemp(aside.data(), O_CLOEXEC));  // 0600
  if (!output) return NSError::errorWithErrno(errno, path);
  const std::string texts = textChunk("Thumb::URI", fileURI(file.path)) +
                            textChunk("Thumb::MTime", std::to_string(file.mtime)) +
                            textChunk("Thumb::Size", std::to_string(file.size)) +
                            textChunk("Software", "Yomber Drive");
  const std::string head = std::string(png.substr(0, kHeaderLength)) + texts;
  int number = writeWhole(output.get(), head);
  if (number == 0) number = writeWhole(output.get(), png.substr(kHeaderLength), head.size());
  if (number == 0 && rename(aside.c_str(), path.c_str()) != 0) number = errno;
  if (number == 0) return nullptr;
  (void)unlink(aside.c_str());
  return NSError::errorWithErrno(number, path);
}

}  // namespace yomber
