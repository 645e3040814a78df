#pragma once

#include <map>
#include <string>
#include <string_view>
#include <vector>

namespace yomber {

/// A file of groups of keys, as desktop files, thumbnailers and icon themes are.
///
/// Lenient: lines that are neither a group, a key nor a comment are passed over, and of a key that
/// is there twice the first counts. Values are as they are written, without space around them.
/// Thread-safety: immutable after construction.
class KeyFile {
 public:
  explicit KeyFile(std::string_view text);
  /// What cannot be read, or is no regular file, has no group. What is longer than `limit` bytes is
  /// cut off.
  static KeyFile read(const std::string& path, std::size_t limit = std::size_t{1024} * 1024);

  [[nodiscard]] bool hasGroup(const std::string& group) const { return groups_.contains(group); }
  /// Empty when it is not there.
  [[nodiscard]] const std::string& value(const std::string& group, const std::string& key) const;
  /// The value's entries between `separator`s, without those that are empty.
  [[nodiscard]] std::vector<std::string> list(const std::string& group, const std::string& key,
                                              char separator) const;
  /// `otherwise` for what is no whole number.
  [[nodiscard]] int number(const std::string& group, const std::string& key, int otherwise) const;

 private:
  std::map<std::string, std::map<std::string, std::string>> groups_;
};

}  // namespace yomber
