#include "tests/harness/odd_files.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cerrno>
#include <filesystem>
#include <random>
#include <stdexcept>
#include <system_error>
#include <vector>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <openssl/evp.h>

#include "platform/foundation/file_descriptor.h"

namespace yomber::testing {

namespace {

namespace fs = std::filesystem;

constexpr std::size_t kBlock = 4096;
constexpr std::size_t kPiece = 256 * 1024;
constexpr std::size_t kLongestName = 255;
constexpr std::size_t kFilesInFolder = 40;

void require(bool isDone, const std::string& path) {
  if (!isDone) throw std::system_error(errno, std::generic_category(), path);
}

// Names.

/// Pads a name to as many bytes as a name may have, not in the middle of a letter.
std::string padded(std::string name, const std::string& letter) {
  while (name.size() + letter.size() <= kLongestName) name += letter;
  return name;
}

std::string oddName(std::size_t number) {
  const std::string text = std::to_string(number);
  switch (number % 24) {
    case 0:
      return "." + text;
    case 1:
      return "-rf " + text;
    case 2:
      return " " + text + " ";
    case 3:
      return "line\nbreak " + text;
    case 4:
      return "bytes \xff\xfe\x80 " + text;
    case 5:
      return padded("long " + text + " ", "x");
    case 6:
      return padded("lang " + text + " ", "\xc3\xa4");
    case 7:
      return "\xc3\xa9t\xc3\xa9 " + text;  // a twin of the next number's
    case 8:
      return "e\xcc\x81te\xcc\x81 " + std::to_string(number - 1);
    case 9:
      return "Letter " + text;  // a twin of the next number's
    case 10:
      return "letter " + std::to_string(number - 1);
    case 11:
      return "quote ' \" ` $HOME \\ " + text;
    case 12:
      return "... " + text + " ...";
    case 13:
      return "%41 * ? [a] : ; | " + text;
    case 14:
      return "\xf0\x9f\x8e\x89 " + text + ".txt";
    case 15:
      return "tab\t bell\a escape\x1b[31m " + text;
    case 16:
      return "\xe2\x80\xae"
             "from right to left " +
             text;
    case 17:
      return "~" + text + "~";
    default:
      return "report " + text + ".pdf";
  }
}

/// The folder of a file's number; some are in folders of folders.
std::string folderName(std::size_t number) {
  const std::size_t folder = number / kFilesInFolder;
  std::string name = "folder " + std::to_string(folder);
  if (folder % 3 == 1) name = "deep/" + name + "/below\nit";
  if (folder % 5 == 2) name += "/\xc3\xbc \xff";
  return name;
}

// Contents.

class OddFile {
 public:
  OddFile(std::string path, std::size_t number, std::uint64_t largest, std::size_t count)
      : path_(std::move(path)),
        number_(number),
        random_(number * 7919 + 1),
        size_(sizeFor(largest, count)),
        file_(open(path_.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600)) {
    require(static_cast<bool>(file_), path_);
  }

  void make() {
    writeContent();
    setAttributes();
    setModeAndDate();
  }

 private:
  /// The first ones are as large as can be; of the others most are small, and some right at the
  /// bounds of blocks.
  std::uint64_t sizeFor(std::uint64_t largest, std::size_t count) {
    constexpr std::array<std::uint64_t, 8> kBounds{0,          1,          kBlock - 1, kBlock,
                                                   kBlock + 1, 2 * kBlock, kPiece,     kPiece + 1};
    if (number_ < 2) return largest;
    if (number_ < 6) return largest / 8 + number_;
    if (number_ < 6 + count / 500) return std::min<std::uint64_t>(largest, (4U << 20U) + number_);
    if (number_ % 4 == 0) return std::min(largest, kBounds[number_ / 4 % kBounds.size()]);
    constexpr std::uint64_t kPowers = 18;
    const std::uint64_t bound = std::uint64_t{1} << (random_() % kPowers);
    return std::min(largest, bound + random_() % bound);
  }

  [[nodiscard]] bool hasHoles() const { return number_ % 6 == 1 && size_ > 4 * kBlock; }

  void writeContent() {
    std::vector<std::uint64_t> piece(kPiece / sizeof(std::uint64_t));
    std::uint64_t offset = 0;
    for (std::size_t index = 0; offset < size_; ++index) {
      const auto length = static_cast<std::size_t>(std::min<std::uint64_t>(kPiece, size_ - offset));
      for (std::size_t i = 0; i < (length + 7) / 8; ++i) piece[i] = random_();
      const bool isHole = hasHoles() && (index % 4 != 0 || length > 4 * kBlock);
      // In pieces with a hole just one block, or none.
      const bool beginsWithData = index == 0 && number_ % 12 == 1;
      const std::size_t begin = isHole && !beginsWithData ? length / 2 : 0;
      const std::size_t kept = index % 4 == 0 ? kBlock : 0;
      const std::size_t end = isHole ? std::min(length, begin + kept) : length;
      const auto* bytes = reinterpret_cast<const char*>(piece.data());
      const ssize_t written =
          pwrite(file_.get(), bytes + begin, end - begin, static_cast<off_t>(offset + begin));
      require(written == static_cast<ssize_t>(end - begin), path_);
      offset += length;
    }
    require(ftruncate(file_.get(), static_cast<off_t>(size_)) == 0, path_);
  }

  void setAttribute(const char* name, const std::string& value) {
    require(fsetxattr(file_.get(), name, value.data(), value.size(), 0) == 0, path_);
  }

  void setAttributes() {
    if (number_ % 3 == 0) setAttribute("user.comment", "of number " + std::to_string(number_));
    if (number_ % 7 == 0) setAttribute("user.binary", std::string("\0\xff\n\0", 4));
    if (number_ % 11 == 0) setAttribute("user.empty", {});
    if (number_ % 13 == 0) setAttribute("user.large", std::string(2500, 'v'));
    if (number_ % 5 == 0) setAttribute("user.xdg.tags", "work,two words,\xc3\xa4");
  }

  void setModeAndDate() {
    constexpr std::array<mode_t, 7> kModes{0644, 0600, 0444, 0400, 0755, 0555, 0664};
    // 1903, 1966, 1970, 2001, 2038 and one second on, 2200.
    constexpr std::array<std::time_t, 7> kDates{-2'100'000'000, -123'456'789,  0,
                                                1'000'000'000,  2'147'483'647, 2'147'483'648,
                                                7'258'118'400};
    require(fchmod(file_.get(), kModes[number_ % kModes.size()]) == 0, path_);
    const auto part = static_cast<long>(random_() % 1'000'000'000);
    const std::time_t date = number_ % 2 == 0 ? kDates[number_ / 2 % kDates.size()]
                                              : static_cast<std::time_t>(random_() % 1'700'000'000);
    const std::array<timespec, 2> times{timespec{date, part}, timespec{date, part}};
    require(futimens(file_.get(), times.data()) == 0, path_);
  }

  const std::string path_;
  const std::size_t number_;
  std::mt19937_64 random_;
  const std::uint64_t size_;
  const FileDescriptor file_;
};

// Looks.

std::string hashOf(const std::string& path) {
  const FileDescriptor file(open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
  require(static_cast<bool>(file), path);
  EVP_MD_CTX* const context = EVP_MD_CTX_new();
  if (context == nullptr) throw std::bad_alloc();
  EVP_DigestInit_ex(context, EVP_sha256(), nullptr);
  std::vector<char> bytes(kPiece);
  ssize_t count = 0;
  while ((count = read(file.get(), bytes.data(), bytes.size())) > 0) {
    EVP_DigestUpdate(context, bytes.data(), static_cast<std::size_t>(count));
  }
  std::string hash(EVP_MAX_MD_SIZE, '\0');
  unsigned length = 0;
  EVP_DigestFinal_ex(context, std::bit_cast<unsigned char*>(hash.data()), &length);
  EVP_MD_CTX_free(context);
  require(count == 0, path);
  hash.resize(length);
  return hash;
}

/// Those of the user's that are not the drive's own.
std::map<std::string, std::string> attributesOf(const std::string& path) {
  std::array<char, 65536> names{};
  const ssize_t length = llistxattr(path.c_str(), names.data(), names.size());
  require(length >= 0, path);
  std::map<std::string, std::string> result;
  for (std::string_view rest(names.data(), static_cast<std::size_t>(length)); !rest.empty();) {
    const std::string name(rest.substr(0, rest.find('\0')));
    rest.remove_prefix(name.size() + 1);
    if (!name.starts_with("user.") || name.starts_with("user.yomber.")) continue;
    std::array<char, 65536> value{};
    const ssize_t size = lgetxattr(path.c_str(), name.c_str(), value.data(), value.size());
    require(size >= 0, path);
    result[name].assign(value.data(), static_cast<std::size_t>(size));
  }
  return result;
}

bool isSame(const timespec& one, const timespec& other) {
  return one.tv_sec == other.tv_sec && one.tv_nsec == other.tv_nsec;
}

std::string textOf(const timespec& date) {
  return std::to_string(date.tv_sec) + " s " + std::to_string(date.tv_nsec) + " ns";
}

}  // namespace

void makeOddFiles(const std::string& folder, std::size_t count, std::uint64_t largest) {
  for (std::size_t number = 0; number < count; ++number) {
    const std::string parent = folder + "/" + folderName(number);
    if (number % kFilesInFolder == 0) fs::create_directories(parent);
    OddFile(parent + "/" + oddName(number), number, largest, count).make();
  }
}

std::string differenceOfCopy(const FileLook& original, const FileLook& copy) {
  std::string text;
  if (original.size != copy.size) {
    text += " size " + std::to_string(original.size) + ", now " + std::to_string(copy.size) + ";";
  }
  const bool areRead = !original.hash.empty() && !copy.hash.empty();
  if (areRead && original.hash != copy.hash) text += " other content;";
  if (original.attributes != copy.attributes) text += " other attributes;";
  if (original.mode != copy.mode) {
    text += " mode " + std::to_string(original.mode) + ", now " + std::to_string(copy.mode) + ";";
  }
  if (!isSame(original.modified, copy.modified)) {
    text += " modified " + textOf(original.modified) + ", now " + textOf(copy.modified) + ";";
  }
  return text;
}

std::string difference(const FileLook& before, const FileLook& after) {
  std::string text = differenceOfCopy(before, after);
  if (before.inode != after.inode) text += " another inode;";
  if (!isSame(before.created, after.created)) {
    text += " created " + textOf(before.created) + ", now " + textOf(after.created) + ";";
  }
  return text;
}

FileLook lookAt(const std::string& path, bool withContent) {
  struct statx status{};
  require(statx(AT_FDCWD, path.c_str(), AT_SYMLINK_NOFOLLOW, STATX_ALL, &status) == 0, path);
  return {.size = status.stx_size,
          .hash = withContent ? hashOf(path) : std::string(),
          .attributes = attributesOf(path),
          .inode = status.stx_ino,
          .mode = status.stx_mode,
          .modified = {status.stx_mtime.tv_sec, status.stx_mtime.tv_nsec},
          .created = {status.stx_btime.tv_sec, status.stx_btime.tv_nsec}};
}

std::uint64_t bytesOnDisk(const std::string& path) {
  struct stat status{};
  require(lstat(path.c_str(), &status) == 0, path);
  return static_cast<std::uint64_t>(status.st_blocks) * 512;
}

std::map<std::string, FileLook> looksBelow(const std::string& folder, bool withContent) {
  std::map<std::string, FileLook> looks;
  for (const auto& entry : fs::recursive_directory_iterator(folder)) {
    if (!entry.is_regular_file()) continue;
    const std::string& path = entry.path().native();
    looks[path.substr(folder.size() + 1)] = lookAt(path, withContent);
  }
  return looks;
}

}  // namespace yomber::testing
