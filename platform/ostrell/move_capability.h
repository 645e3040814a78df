#pragma once

#include <cstdint>

namespace yomber {

/// What kind of move from one location to another is, and so whether it may be made and what it
/// needs. The daemon computes it; `qs_capabilityToMoveToURL` answers it.
///
/// An allowed move has exactly one of the bits that allow. A refused one has none of them, but a
/// reason where there is one to name; 0 is a refusal that its error explains.
///
/// The store keeps each container, and each shared folder, in a zone of its own. A move within a
/// zone changes a record's parent and name. One into another zone makes new records there, from the
/// content that is here: whoever moves has to provide it first, and keep it until the move is made.
enum QSMoveCapability : std::uint32_t {
  QSMoveCapabilityNone = 0,

  /// Stays in its container: the plain move, and the plain rename.
  QSMoveCapabilityWithinContainer = 1U << 0U,
  /// From one container of this user's into another. Needs the content.
  QSMoveCapabilityAcrossContainers = 1U << 1U,
  /// Refused: the item is fixed in its place (the root, a container's Documents folder, the trash).
  QSMoveCapabilityRefusedFixedItem = 1U << 2U,
  /// Out of a folder that somebody shares, into this user's own. Needs the content: the
  /// participants lose the item, and with it the record that it came from.
  QSMoveCapabilityOutOfSharedZone = 1U << 3U,
  /// Out of this user's own into a shared folder. Needs the content.
  QSMoveCapabilityIntoSharedZone = 1U << 4U,
  /// From one shared folder into another one. Needs the content.
  QSMoveCapabilityAcrossSharedZones = 1U << 5U,
  /// Into the trash, which keeps the item in its container's zone.
  QSMoveCapabilityToTrash = 1U << 6U,
  /// Out of the trash, back into the item's own container.
  QSMoveCapabilityFromTrash = 1U << 7U,
  /// Stays in the shared folder that it is in.
  QSMoveCapabilityWithinSharedZone = 1U << 8U,
  /// Refused: a folder into itself or below itself.
  QSMoveCapabilityRefusedIntoItself = 1U << 9U,
  /// Out of the trash into another container than the item's own. Needs the content.
  QSMoveCapabilityFromTrashAcrossContainers = 1U << 10U,
  /// Refused: one of the two locations holds no items of the drive that could move (private
  /// storage, a location that is no folder's, a share that may only be read).
  QSMoveCapabilityRefusedLocation = 1U << 11U,
  /// The item never syncs (its name is excluded): all of its content is here anyway.
  QSMoveCapabilityNeverSynced = 1U << 12U,
  /// To where nothing syncs: out of the drive, or under an excluded name. Needs the content, which
  /// the store forgets.
  QSMoveCapabilityOutOfSync = 1U << 13U,
};

/// The move is allowed: any of these.
inline constexpr std::uint32_t QSMoveCapabilityAllowedMask = 0x35fb;
/// The move is allowed only with the content present: any of these.
inline constexpr std::uint32_t QSMoveCapabilityNeedsContentMask = 0x243a;

static_assert(QSMoveCapabilityNeedsContentMask ==
              (QSMoveCapabilityAcrossContainers | QSMoveCapabilityOutOfSharedZone |
               QSMoveCapabilityIntoSharedZone | QSMoveCapabilityAcrossSharedZones |
               QSMoveCapabilityFromTrashAcrossContainers | QSMoveCapabilityOutOfSync));
static_assert(QSMoveCapabilityAllowedMask ==
              (QSMoveCapabilityNeedsContentMask | QSMoveCapabilityWithinContainer |
               QSMoveCapabilityToTrash | QSMoveCapabilityFromTrash |
               QSMoveCapabilityWithinSharedZone | QSMoveCapabilityNeverSynced));

}  // namespace yomber
