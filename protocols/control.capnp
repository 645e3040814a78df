@0xe2d94b8f61a0c704;

# What fileproviderd serves on its control socket, by item: to the command line and the files browser.
#
# Everything here goes through the extension. While no extension can be had (zarn is down, nobody is
# signed in) calls fail with a domain error within a bounded time; none hangs.

using Cxx = import "/capnp/c++.capnp";
$Cxx.namespace("yomber::protocol");
using Common = import "common.capnp";
using Changes = import "changes.capnp".Changes;
using Services = import "services.capnp";
using ThumbnailReceiver = import "thumbnails.capnp".ThumbnailReceiver;

interface Control {
  item @0 (identifier :Text) -> (result :ItemResult);
  locate @1 (identifier :Text) -> (result :LocationResult);
  # The location of an item, aliases resolved.
  identify @2 (path :Data) -> (result :IdentifierResult);

  list @3 (container :Text, sortOrder :Common.SortOrder) -> (listing :Listing);
  # The root, a folder, or all folders (the framework's constants).

  watch @4 (container :Text, watcher :Watcher) -> (registration :Watch);
  # A folder, the root or the working set. The watcher gets the present items first, then each change.

  status @5 () -> (status :Status);

  changes @6 () -> (changes :Changes);
  # Changes are never repeated: when the extension ends in the middle of one, it fails, and whether it
  # was carried out is to be looked up.

  # --- Content, by location inside the tree.

  startProviding @7 (path :Data, options :UInt64) -> (need :Need, failure :Common.OptionalError);
  # Answered when the content can be read. From the call on, and until the need that is answered is
  # dropped, the host asks nobody to give the content up. Dropping the call takes the wish back. Options
  # are Foundation's reading options. A folder is answered at once.
  stopProviding @8 (path :Data) -> (failure :Common.OptionalError);
  # Asks for the content to be given up. Answered when that has been tried; what came of it only the
  # daemon knows. NSPOSIXErrorDomain EBUSY while somebody needs it.
  itemChanged @9 (path :Data) -> (failure :Common.OptionalError);
  # The content was written through a path.
  movingItem @10 (path :Data, destination :Data)
      -> (requiresProviding :Bool, failure :Common.OptionalError);
  # Whether the content has to be here before the item is moved.

  # --- Thumbnails.

  fetchThumbnails @11 (identifiers :List(Text), width :Float64, height :Float64,
                       receiver :ThumbnailReceiver) -> (failure :Common.OptionalError);
  # Tells of each of the items once, as soon as its thumbnail is known, or that it has none. The size
  # is in points. Answered when the receiver took the last one; a failure is the last of several, and
  # of an item that it befell the receiver was told as well. Dropping the call ends it. At most
  # 100,000 items.

  # --- Services of an item.

  services @12 (identifier :Text)
      -> (services :List(Services.Service), failure :Common.OptionalError);
  # What programs can ask of the item beyond this protocol: each service with an endpoint, over which
  # the client talks to the extension directly. An item without services is no failure.
  service @13 (identifier :Text, name :Text)
      -> (endpoint :Services.ServiceEndpoint, failure :Common.OptionalError);
  # One of them. NSCocoaErrorDomain 3328 when the item does not have it.

  struct ItemResult {
    union {
      item @0 :Common.Item;
      error @1 :Common.Error;
    }
  }
  struct LocationResult {
    union {
      path @0 :Data;
      error @1 :Common.Error;
    }
  }
  struct IdentifierResult {
    union {
      identifier @0 :Text;
      error @1 :Common.Error;
    }
  }
  struct Status {
    extensionPid @0 :UInt32;         # 0 while there is none
    extensionStarts @1 :UInt64;
    daemonReachable @2 :Bool;
    watches @3 :UInt32;
    enumerators @4 :UInt32;
    residentBytes @5 :UInt64;
    openDescriptors @6 :UInt32;
    lastFailure @7 :Common.OptionalError;   # why there is no extension
  }
}

interface Listing {
  # A listing in progress: pages of at most 200 items. Dropping it ends it.
  next @0 () -> (result :PageResult);

  struct PageResult {
    union {
      page :group {
        items @0 :List(Common.Item);
        more @1 :Bool;
      }
      error @2 :Common.Error;
    }
  }
}

interface Watch {}

interface Need {}
# Somebody needs an item's content. It ends when it is dropped, or with its connection.

interface Watcher {
  # The host sends one call after the other, each when the last was answered.
  #
  # A watcher that keeps items by identifier, puts those of `didList` and `didUpdate` in and takes those
  # of `didDelete` out holds what the host knows.

  didList @0 (items :List(Common.Item), last :Bool) -> ();
  # The container as it is, in pages; `last` on the last one, which may be empty. Sent at the start, and
  # never again. What changes before the last page is told as it comes: an item may be listed again, or
  # be deleted.
  didUpdate @1 (items :List(Common.Item)) -> ();
  didDelete @2 (identifiers :List(Text)) -> ();
  didPause @3 (error :Common.Error) -> ();
  # Changes cannot be seen at the moment; the host goes on trying, and sends what was missed.
  didResume @4 () -> ();
  # What was missed has been sent; from here on changes are seen again.
  didEnd @5 (error :Common.Error) -> ();
  # The folder is gone (its items were deleted before), or cannot be watched at all. The last call.
}
