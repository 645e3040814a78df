#pragma once

#include "platform/foundation/error.h"

namespace yomber {

/// What `yomber` answers to the shell. Stable: scripts may test them. The values are those of
/// sysexits.h where it has one.
enum class ExitCode : int {
  Ok = 0,
  Failure = 1,
  NotPermitted = 13,  ///< an item or a share is not the user's to have, or to change (EACCES)
  NameTaken = 17,     ///< the name is taken (EEXIST)
  NoRoom = 28,        ///< the disk is full, or a quota is used up (ENOSPC)
  Usage = 64,         ///< the command line is wrong
  NoSuchItem = 66,    ///< the item or location is not in the drive
  Unavailable = 69,   ///< the drive is not up, or does not answer
  CannotCreate = 73,  ///< the drive cannot be started here
  Damaged = 74,       ///< the content in the store is damaged or missing
  TryAgain = 75,      ///< not at the moment: the store is out of reach, or the content is in use
  NotSignedIn = 77,
};

[[nodiscard]] ExitCode exitCodeFor(const NSErrorRef& error);

}  // namespace yomber
