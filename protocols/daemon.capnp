@0xc8a1be70d5f23603;

# What zarn serves on its socket, to the client library in every process of the drive: the extension,
# the host, the command line, the mount.
#
# Any number of connections; requests of one connection may be answered out of order, but a watch is
# active from the moment its call arrives, before any later call of that connection is looked at. When
# a connection is lost, its watches and observers end. All calls are bounded: lists by their limit,
# strings by the message size.
#
# While nobody is signed in, account-bound calls (marked [account]) fail with QSOstrellErrorDomain 2.
#
# zarn serves as soon as it runs. Over an empty database, calls that need items wait for the first scan
# of the tree, in their order, and fail with what stopped it (a full disk, an unreadable tree) while it
# cannot be made; zarn goes on trying. Over an existing one they are answered at once, and what the
# scan finds changed comes as change notifications.

using Cxx = import "/capnp/c++.capnp";
$Cxx.namespace("yomber::protocol");
using Common = import "common.capnp";
using Content = import "content.capnp".Content;
using Sharing = import "sharing.capnp".Sharing;
using TreeObserver = import "tree.capnp".TreeObserver;

interface Daemon {
  describe @0 () -> (home :Data, root :Data, program :Text, bootID :Text, pid :UInt32);
  # `home` as zarn uses it and `root`, the location of the drive's root folder. A client whose own idea
  # of the home differs must not go on.

  # --- Lookups.

  urlForItemIdentifier @1 (identifier :Text) -> (result :LocationResult);
  # The item's location, by its identifier. Also finds items whose location is not inside the visible
  # tree (promises).

  documentLocation @2 (object :ObjectID) -> (result :LocationResult);
  # The location of the file, folder or bookmark of that id; NSCocoaErrorDomain 4 when there is none.

  itemAtLocation @3 (path :Data, fakeFSEvent :Bool) -> (result :ItemResult);
  # [account] The item at a location. With `fakeFSEvent` the location is scanned first, and the answer is given
  # after its row is right. Without it, only a location that has no row, but something on disk, is scanned.

  containers @4 () -> (containers :List(Container), generation :UInt64);
  # The drive's own first. `generation` grows with every change of the list.
  containerItem @5 (containerID :Text, forceScan :Bool) -> (result :ItemResult);

  # --- Listing. `offset` counts entries already delivered; `nextOffset` is 0 when nothing is left.
  # `limit` is at most 1000.

  enumerateItemsInFolder @6 (folder :OptionalObjectID, sortOrder :Common.SortOrder, offset :UInt64, limit :UInt32)
      -> (result :PageResult);                                                       # [account]
  enumerateAllFolders @7 (sortOrder :Common.SortOrder, offset :UInt64, limit :UInt32)
      -> (result :PageResult);                                                       # [account]

  # --- Working set: favourite, tagged, shared and recently used items.

  currentNotifRank @8 () -> (rank :UInt64, failure :Common.OptionalError);           # [account]
  enumerateWorkingSetChanges @9 (token :Common.OptionalData, limit :UInt32) -> (result :WorkingSetResult);
  # [account] From the beginning without a token. When nothing is left, the token answered equals the
  # one given. A token too old to answer, or malformed, gets NSFileProviderErrorDomain -1002.

  # --- Change notifications.

  getItemUpdateSender @10 (receiver :ItemReceiver) -> (result :SenderResult);        # [account]

  # --- Account.

  account @11 () -> (result :AccountResult);
  signIn @12 (name :Text) -> (failure :Common.OptionalError);
  # Does nothing when that account is signed in; fails with QSOstrellErrorDomain 3 when another one is,
  # or when the name is not 1 to 255 bytes of text. An account keeps its identifier from one time that
  # it is signed in to the next.
  signOut @13 () -> (failure :Common.OptionalError);

  # --- Standing registrations; each ends with the connection, or when its returned capability is
  # dropped.

  observe @14 (observer :LibraryObserver) -> (registration :Registration);
  registerHost @15 (host :HostReceiver) -> (registration :Registration);
  # The host gets the signals that zarn raises itself (the working set).

  # --- Status.

  status @16 () -> (status :Status);

  # --- The content of items, and what else is done with items.

  content @17 () -> (content :Content);

  # --- The tree on disk.

  observeTree @18 (observer :TreeObserver) -> (registration :Registration);
  # Active when the call arrives. A standing registration, as those above.

  # --- Where the store has the content of documents.

  contentRecords @19 (objects :List(ObjectID)) -> (result :ContentRecordsResult);
  # [account] The records of those documents whose content the store has, in no particular order.
  # Others are left out. At most 200,000 objects.

  # --- Sharing.

  sharing @20 () -> (sharing :Sharing);

  enum ObjectKind {
    document @0;
    folder @1;
    alias @2;
  }
  struct ObjectID {
    kind @0 :ObjectKind;
    rawID @1 :UInt64;
  }
  struct OptionalObjectID {
    union {
      root @0 :Void;
      object @1 :ObjectID;
    }
  }
  struct LocationResult {
    union {
      path @0 :Data;
      error @1 :Common.Error;
    }
  }
  struct ItemResult {
    union {
      item @0 :Common.Item;
      error @1 :Common.Error;
    }
  }
  struct PageResult {
    union {
      page :group {
        items @0 :List(Common.Item);
        nextOffset @1 :UInt64;
      }
      error @2 :Common.Error;
    }
  }
  struct WorkingSetResult {
    union {
      changes :group {
        updated @0 :List(Common.Item);
        deleted @1 :List(ObjectID);
        token @2 :Data;
      }
      error @3 :Common.Error;
    }
  }
  struct SenderResult {
    union {
      sender @0 :ItemSender;
      error @1 :Common.Error;
    }
  }
  struct ContentRecord {
    object @0 :ObjectID;
    record @1 :Text;
    zone @2 :UInt32;                # of the zones in the result
  }
  struct RecordZone {
    name @0 :Text;
    owner @1 :Text;
  }
  struct ContentRecordsResult {
    union {
      found :group {
        records @0 :List(ContentRecord);
        zones @1 :List(RecordZone);
      }
      error @2 :Common.Error;
    }
  }
  struct AccountResult {
    union {
      none @0 :Void;                # nobody is signed in
      account :group {
        name @1 :Text;
        perAppAccountIdentifier @2 :Text;   # empty: none
      }
      error @3 :Common.Error;
    }
  }
  struct Container {
    containerID @0 :Text;
    displayName @1 :Text;
    documents @2 :Data;             # the location of its Documents folder
    applicationID @3 :Text;         # the application it belongs to; empty for the drive's own
    iconName @4 :Text;
  }
  struct Status {
    items @0 :UInt64;
    folders @1 :UInt64;
    rank @2 :UInt64;
    scan @3 :Scan;
    watchedFolders @4 :UInt64;
    observation @5 :Observation;
    observationAdvice @6 :Text;     # what to do when observation is not live
    watchers @7 :UInt32;
    residentBytes @8 :UInt64;
    openDescriptors @9 :UInt32;

    enum Scan {
      running @0;
      done @1;
    }
    enum Observation {
      live @0;
      scanning @1;                  # the system's watch limit is reached: folders are scanned instead
    }
  }
}

interface Registration {}

interface LibraryObserver {
  accountTokenDidChange @0 ();
  containerListDidChange @1 ();
}

interface HostReceiver {
  signalEnumerator @0 (container :Text);
}

interface ItemSender {
  # One receiver's subscription. Dropping it ends its watch.

  boostPriority @0 ();
  watchItem @1 (path :Data, options :UInt32) -> (failure :Common.OptionalError);
  # [account] Watches the folder at a location. Active when the call arrives; the reply brings no items.
  # Options: 1 updates, 2 deletions, 4 the whole subtree, 16 the folder's direct children (part of 4).
  #
  # An item that moves out of what is watched is a deletion there; so is the watched folder's own end.
  # For the root's subtree, so is what goes to the trash. A folder with content that moves into a
  # watched subtree cuts the watcher off, as if it had been too slow: it has to list again.
  # Fails with NSCocoaErrorDomain 4 when nothing is there, NSPOSIXErrorDomain ENOTDIR when it is no folder.

  invalidate @2 ();
}

interface ItemReceiver {
  # Implemented by whoever watches. zarn sends the next batch when the last was answered; a receiver
  # that leaves more than 100,000 changes waiting is cut off: its sender fails with QSOstrellErrorDomain
  # 5, and it comes back for a fresh listing.

  receiveUpdates @0 (items :List(Common.Item), logicalExtensions :List(Text), physicalExtensions :List(Text)) -> ();
  # A batch has each item at most once, in its latest state; deletions are items with the dead flag.

  receiveProgressUpdates @1 (identifiers :List(Text)) -> ();
  # Never answered, by design; the sender drops the call at once.

  senderDidFail @2 (error :Common.Error) -> ();
  # The watch has ended: it was too slow (5), did not take a batch (4), or nobody is signed in any more
  # (2). The library hands the error to the sender's proxies.
}
