#pragma once

namespace yomber {

/// Nobody else has a file open while this stands; who tries to waits for its end, at most for as
/// long as the system lets them.
class FileLease {
 public:
  /// Takes it on an open file; see `isHeld`.
  explicit FileLease(int file);
  ~FileLease() { release(); }
  FileLease(const FileLease&) = delete;
  FileLease& operator=(const FileLease&) = delete;

  /// Whether it was got, and nobody waits to open the file since.
  [[nodiscard]] bool isHeld() const;
  void release();

 private:
  int file_;
};

}  // namespace yomber
