@0x8ec5d0c7f4586bcc;

# What zarn does with the content of items, and with items as such, for the client library in every
# process of the drive. Got from `Daemon.content`.
#
# Locations are logical ones inside the tree unless a call says otherwise. A location with nothing at it
# fails with NSCocoaErrorDomain 4, one outside the tree with QSOstrellErrorDomain 3. Calls that change an
# item answer after its row is right.
#
# Why content cannot be had: NSCocoaErrorDomain 4354 while the store is out of reach, 4355 when the
# store's quota is used up, NSPOSIXErrorDomain ENOSPC when this disk is full, NSCocoaErrorDomain 259
# when what the store has is not the content that was put there (damaged or missing), 3072 when the
# wish was cancelled.

using Cxx = import "/capnp/c++.capnp";
$Cxx.namespace("yomber::protocol");
using Common = import "common.capnp";

interface Content {
  startProviding @0 (path :Data, options :UInt64) -> (failure :Common.OptionalError);
  # Answered when the content can be read. Dropping the call takes the wish back; the download goes on
  # while anybody else wishes for it, and is given up, leaving a fault, when nobody does.
  # Options are Foundation's reading options; with bit 17 (0x20000) an item whose content is here is not
  # answered at once, but after what is going on with it (an eviction, say) has ended and it is here.
  # A folder is answered at once.

  evict @1 (path :Data) -> (failure :Common.OptionalError);
  # Gives up the local content; the item stays, as a fault. Nothing happens to what is a fault already.
  # Refused with QSOstrellErrorDomain 6 (with the reason as the description) while the content is not
  # confirmed in the store, changed since, open somewhere, pinned, or has no fault form (folders,
  # symbolic links, several hard links).

  setPinned @2 (path :Data, pinned :Bool) -> (failure :Common.OptionalError);
  # Pinned content is brought here and never evicted. A pinned folder pins what is below it, also later.

  capabilityToMove @3 (source :Data, destination :Data) -> (capability :UInt32, failure :Common.OptionalError);
  # Bits as QSMoveCapability of the client library lists them; none of those that allow where the move
  # is refused, and mostly a failure that says why.
  # The destination is the location after the move; it need not exist.

  trash @4 (path :Data) -> (result :LocationResult);
  # Moves the item to the trash, and answers where it is there. The path may be a physical one.
  putBackLocation @5 (path :Data) -> (result :LocationResult);
  # Where a trashed item came from. That folder may be gone; nothing is looked at but the trash.
  emptyTrash @6 () -> (removed :UInt64, failure :Common.OptionalError);

  physicalLocation @7 (path :Data) -> (result :LocationResult);
  # Where the item with that logical location is on this disk.

  containerLocation @8 (containerID :Text, recreateDocuments :Bool)
      -> (path :Common.OptionalData, displayName :Text, generation :UInt64, failure :Common.OptionalError);
  # The location of a container's Documents folder, which is made where it is missing and
  # `recreateDocuments` asks for it. Unknown container: QSOstrellErrorDomain 3.

  setLastUsedDate @9 (path :Data, date :Common.OptionalInt64) -> (failure :Common.OptionalError);
  setFavoriteRank @10 (path :Data, rank :Common.OptionalInt64) -> (failure :Common.OptionalError);
  setTagNames @11 (path :Data, names :List(Text)) -> (failure :Common.OptionalError);
  # Each replaces what was there; without a value (no names) it is removed. Paths may be physical ones.

  contentState @12 (path :Data) -> (state :State, failure :Common.OptionalError);
  transfers @13 () -> (transfers :List(Transfer), waiting :UInt64, finished :UInt64);
  # What is under way at the moment, at most 1000; how many jobs wait; how many have moved something
  # since zarn started.

  startDownloading @14 (paths :List(Data), options :UInt64) -> (failure :Common.OptionalError);
  # Has the content of items brought here, and answers as soon as that has begun: nobody waits for it,
  # and it is not taken back. What is here already stays as it is. Fails, having begun nothing, when
  # there is nothing at one of the locations. Option 4: it is not the user who asked; the others are
  # reserved. At most 1000 locations.

  struct LocationResult {
    union {
      path @0 :Data;
      error @1 :Common.Error;
    }
  }
  struct State {
    local @0 :Local;
    upload @1 :Upload;
    pinned @2 :Bool;
    size @3 :UInt64;                # bytes
    localBytes @4 :UInt64;          # of blocks on this disk
    lastFailure @5 :Common.OptionalError;   # of the job that waits to be tried again

    enum Local {
      here @0;
      fault @1;
      downloading @2;
      evicting @3;
    }
    enum Upload {
      confirmed @0;                 # the store has this very content
      waiting @1;
      uploading @2;
      none @3;                      # never uploaded: folders, links, excluded names
    }
  }
  struct Transfer {
    path @0 :Data;
    kind @1 :Kind;
    total @2 :UInt64;               # bytes
    done @3 :UInt64;
    attempts @4 :UInt32;
    failure @5 :Common.OptionalError;       # of the last attempt
    nextAttempt @6 :Common.OptionalInt64;   # when it waits

    enum Kind {
      upload @0;
      download @1;
      evict @2;
    }
  }
}
