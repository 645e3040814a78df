#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace yomber::testing {

/// A content that a test wrote, by what it is made of.
struct Version {
  std::uint32_t seed = 0;
  std::size_t size = 0;

  /// Bytes that no other version has; no long run of zeros is in them.
  [[nodiscard]] std::string bytes() const;
  friend bool operator==(const Version&, const Version&) = default;
};

/// What the manifest knows of one document.
struct Document {
  int number = 0;
  std::string id;    ///< empty until the drive told it
  std::string path;  ///< where it is, or was before it was trashed or something unknown happened
  bool isInTrash = false;
  /// A call about it got no answer: it may have been done, not done, or be done yet.
  bool isUncertain = false;
  std::string mayBeAt;     ///< then: the other place where it may be
  bool mayBeGone = false;  ///< then: it was to be deleted
  bool mayBeInTrash = false;

  /// What was done with it, for who looks into a failure.
  std::string history;

  std::vector<Version> versions;  ///< every content that was begun to be written, in order
  /// Of `versions`, the last that cannot be lost with the power: synced by its writer, or confirmed
  /// by the drive. Nothing: none yet.
  std::optional<std::size_t> durable;
  /// The drive has confirmed it: its id stays, also when the power goes.
  bool isIdSafe = false;
  /// Bytes were written in place since, and not synced: a cut may leave any mixture.
  bool isTorn = false;

  [[nodiscard]] const Version& content() const { return versions.back(); }
  /// Where it is, and what was done with it.
  [[nodiscard]] std::string description() const;
  /// The last content is safe from here on.
  void becameDurable() {
    durable = versions.size() - 1;
    isTorn = false;
  }
};

/// Whether an open file is marked as one whose content is not here, in the boot of that identifier.
[[nodiscard]] bool isMarkedAway(int file, const std::string& boot);
/// The identifier of this boot of the machine.
[[nodiscard]] std::string machineBoot();

/// What can be read at a place.
struct Reading {
  enum class Kind { Nothing, Away, Content } kind = Kind::Nothing;
  std::string bytes;
};
/// Looks and reads under one descriptor: while it is open nobody gives the content up.
[[nodiscard]] Reading readAt(const std::string& path, const std::string& boot);

}  // namespace yomber::testing
