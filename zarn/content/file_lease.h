#pragma once

#include <chrono>
#include <string>

namespace yomber {

/// Nobody else has a file open while this stands; who tries to waits for its end, at most for as
/// long as the system lets them.
class FileLease {
 public:
  enum class State {
    Held,          ///< nobody wants the file
    WantedToRead,  ///< somebody waits, to read it
    Lost,          ///< never got, or somebody waits to write to it, or the system let them in
  };

  /// Takes it on an open file; see `state`.
  explicit FileLease(int file);
  ~FileLease() { release(); }
  FileLease(const FileLease&) = delete;
  FileLease& operator=(const FileLease&) = delete;

  [[nodiscard]] State state() const;
  /// Whether it was got, and nobody waits to open the file since.
  [[nodiscard]] bool isHeld() const { return state() == State::Held; }
  void release();

  /// For how long the system makes others wait.
  static std::chrono::milliseconds longestWait();

 private:
  int file_;
};

/// Whether anybody has the file open for writing. False as well when that cannot be told.
[[nodiscard]] bool isOpenForWriting(const std::string& path);

}  // namespace yomber
