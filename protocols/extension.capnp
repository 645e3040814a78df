@0xb0e6cf1d92a7c502;

# Between the host and the extension process, over a socket pair that the extension inherits. Each end
# offers one bootstrap capability: the extension an `Extension`, the host an `ExtensionHost`.
#
# Requests run concurrently on the extension's worker threads. A lost connection ends the extension
# process; all its enumerators die with it.

using Cxx = import "/capnp/c++.capnp";
$Cxx.namespace("yomber::protocol");
using Common = import "common.capnp";
using Changes = import "changes.capnp".Changes;
using Services = import "services.capnp";
using ThumbnailReceiver = import "thumbnails.capnp".ThumbnailReceiver;

interface Extension {
  urlForItem @0 (identifier :Text) -> (path :Common.OptionalData);
  identifierForPath @1 (path :Data) -> (found :Bool, identifier :Text);
  itemForIdentifier @2 (identifier :Text) -> (result :ItemResult);
  enumerator @3 (container :Text) -> (result :EnumeratorResult);

  changes @4 () -> (changes :Changes);

  # --- Content, by location.

  startProviding @5 (path :Data, options :UInt64) -> (failure :Common.OptionalError);
  # Answered when the content can be read. Options are Foundation's reading options. One call at a time
  # for each location; `stopProviding` ends it early, dropping it does not.
  stopProviding @6 (path :Data) -> ();
  # Nobody needs the content any more: what is being brought here is given up, what is here may go.
  # Answered when that has been seen to; what came of it only the daemon knows.
  itemChanged @7 (path :Data) -> ();
  movingItem @8 (path :Data, destination :Data)
      -> (requiresProviding :Bool, failure :Common.OptionalError);
  # Whether the content has to be here before the item is moved.

  # --- Thumbnails.

  fetchThumbnails @9 (identifiers :List(Text), width :Float64, height :Float64,
                      receiver :ThumbnailReceiver) -> (failure :Common.OptionalError);
  # Each thumbnail is told as soon as it is known; answered when the receiver took the last one. An
  # item may be told of more than once, or not at all when nothing is known of it. Dropping the call
  # cancels what is left.

  # --- Services of an item.

  services @10 (identifier :Text, client :UInt32)
      -> (services :List(Services.Service), failure :Common.OptionalError);
  # Each with an endpoint of its own; none is no failure. An endpoint that nobody keeps is gone.
  # `client`: a number for whoever asks the host; each may have only a part of those that wait.
  service @11 (identifier :Text, name :Text, client :UInt32)
      -> (endpoint :Services.ServiceEndpoint, failure :Common.OptionalError);

  struct ItemResult {
    union {
      item @0 :Common.Item;
      error @1 :Common.Error;
    }
  }
  struct EnumeratorResult {
    union {
      enumerator @0 :Enumerator;
      error @1 :Common.Error;
    }
  }
}

interface Enumerator {
  # One enumerator object of the extension. Dropping the capability invalidates it.

  enumerateItems @0 (page :Page) -> (result :PageResult);
  enumerateChanges @1 (anchor :Data) -> (result :ChangesResult);
  currentSyncAnchor @2 () -> (supported :Bool, anchor :Data);
  invalidate @3 ();

  struct Page {
    union {
      none @0 :Void;          # no page given
      initialByName @1 :Void;
      initialByDate @2 :Void;
      token @3 :Data;         # at most 4 KiB; opaque to the host
    }
  }
  struct PageResult {
    union {
      page :group {
        items @0 :List(Common.Item);
        next @1 :Common.OptionalData;   # none: the listing is complete
      }
      error @2 :Common.Error;
    }
  }
  struct ChangesResult {
    union {
      changes :group {
        updated @0 :List(Common.Item);
        deleted @1 :List(Text);         # identifiers
        anchor @2 :Data;
        moreComing @3 :Bool;
      }
      error @4 :Common.Error;           # NSFileProviderErrorDomain -1002: list again
    }
  }
}

interface ExtensionHost {
  signalEnumerator @0 (container :Text) -> (result :Common.OptionalError);
  # The container has changes; the host asks for them in its own time. Answered at once.
}
