#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <ctime>
#include <optional>
#include <string>

#include "platform/foundation/error.h"
#include "platform/foundation/file_descriptor.h"
#include "zarn/lent_mode.h"

namespace yomber {

/// A regular file, open for changing what is in it while it is to look as it was: its dates and its
/// mode are put back.
///
/// A file that its owner may not write to is made writable for that time.
class ChangedFile {
 public:
  /// Not valid, with an error, when there is no regular file there.
  static ChangedFile open(const std::string& path, NSErrorRef* error);
  ~ChangedFile();
  ChangedFile(ChangedFile&& other) noexcept;
  ChangedFile& operator=(ChangedFile&&) = delete;

  [[nodiscard]] bool isValid() const { return static_cast<bool>(file_); }
  [[nodiscard]] int get() const { return file_.get(); }
  [[nodiscard]] const std::string& path() const { return path_; }
  /// As it was when it was opened.
  [[nodiscard]] const struct stat& status() const { return status_; }

  /// Notes the modification date in the file, so that it is not lost should we end before
  /// `putDatesBack`. A note of an earlier time stays, and counts; so does what somebody who sets
  /// another date meanwhile notes instead.
  [[nodiscard]] NSErrorRef holdDate();
  [[nodiscard]] NSErrorRef putDatesBack();
  /// Puts kept bytes in their place.
  [[nodiscard]] NSErrorRef writeHead(const std::string& head) const;
  /// Gives up the blocks behind the kept bytes.
  [[nodiscard]] NSErrorRef punch() const;
  [[nodiscard]] NSErrorRef setAttribute(const char* name, const std::string& value) const;
  /// One that is not there is no error.
  [[nodiscard]] NSErrorRef removeAttribute(const char* name) const;
  [[nodiscard]] NSErrorRef sync() const;
  [[nodiscard]] NSErrorRef failure(int number) const;

 private:
  ChangedFile() = default;
  [[nodiscard]] bool punchAt(std::uint64_t offset, std::uint64_t length) const;
  void shrinkMap() const;

  FileDescriptor file_;
  std::string path_;
  struct stat status_{};
  std::optional<LentMode> lent_;
  std::timespec mtime_{};
  bool isHeld_ = false;
};

/// The date that an interrupted change of the open file noted; ns.
[[nodiscard]] std::optional<std::int64_t> heldDate(int file);
/// Whether a part of the open file, from `offset` to its end, has no blocks (a hole), or has any.
[[nodiscard]] bool hasHoleFrom(int file, std::uint64_t offset, std::uint64_t size);
[[nodiscard]] bool hasDataFrom(int file, std::uint64_t offset);

}  // namespace yomber
