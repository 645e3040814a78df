@0x9be1f04d6c2a7358;

# Services of items, which a client and the extension speak between themselves, over a socket of their
# own.
#
# The host hands out endpoints (`Control.services`, `Extension.services`). An endpoint carries one end of
# a socket pair; whoever adopts it talks to the extension directly. On that connection each side's
# bootstrap capability answers two interfaces: `ServicePeer`, and that of the object that the side offers,
# if any.
#
# Methods with a `call` answer to `ServicePeer.cancel` by that number, which the caller chooses; the
# progress of their work is told to the caller's `ServicePeer.progressed`, before and after the reply.
# Methods that an object leaves out fail as unimplemented, and the connection stays.

using Cxx = import "/capnp/c++.capnp";
$Cxx.namespace("yomber::protocol");
using Common = import "common.capnp";
using Sharing = import "sharing.capnp";

interface ServiceEndpoint {}
# Carries a descriptor. It is good for one connection.

struct Service {
  name @0 :Text;
  endpoint @1 :ServiceEndpoint;
}

interface ServicePeer {
  goodbye @0 () -> ();
  # The last call: this connection ends on purpose.
  cancel @1 (call :UInt64) -> ();
  # The caller wants its work called off; the call is answered nevertheless.
  progressed @2 (call :UInt64, totalUnits :Int64, completedUnits :Int64) -> ();
}

struct OptionalItem {
  union {
    none @0 :Void;
    item @1 :Common.Item;
  }
}

interface SharingService {
  # "com.kelvo.Ostrell.SharingV1"

  fetchSharingInfo @0 ()
      -> (shared :Bool, item :OptionalItem, failure :Common.OptionalError);
  preflight @1 (call :UInt64)
      -> (shareable :Bool, item :OptionalItem, first :List(Common.Item), second :List(Common.Item),
          failure :Common.OptionalError);
  participants @2 (call :UInt64)
      -> (participants :List(Sharing.Share.Participant), publicPermission :Int64,
          failure :Common.OptionalError);
  startPreparing @3 (forcing :Bool) -> ();
  fetchShare @4 (call :UInt64) -> (share :OptionalShare, failure :Common.OptionalError);
  fetchShareUrl @5 (call :UInt64) -> (url :OptionalUrl, failure :Common.OptionalError);
  saveShare @6 (call :UInt64, share :OptionalShare)
      -> (share :OptionalShare, failure :Common.OptionalError);
  unshare @7 (call :UInt64) -> (failure :Common.OptionalError);

  struct OptionalShare {
    union {
      none @0 :Void;
      share @1 :Sharing.Share;
    }
  }
}

struct OptionalUrl {
  union {
    none @0 :Void;
    path @1 :Data;     # of a location on this machine
    text @2 :Text;     # any other URL
  }
}

interface CollaborationService {
  # "com.kelvo.PandrelCollaboration". All but the first may be left out.

  fetchVersionAndCapabilities @0 ()
      -> (version :UInt64, capabilities :UInt64, failure :Common.OptionalError);
  setEnvironmentType @1 (type :UInt64) -> ();
  fetchCollaborationToken @2 (call :UInt64)
      -> (providerIdentifier :Common.OptionalData, baseToken :Common.OptionalData,
          shareToken :Common.OptionalData, expirationDate :Common.OptionalInt64,
          failure :Common.OptionalError);
  fetchLatestRevision @3 (call :UInt64) -> (failure :Common.OptionalError);
  refreshSharingState @4 (call :UInt64) -> (failure :Common.OptionalError);
  fetchPrivacyState @5 (call :UInt64)
      -> (first :Bool, second :Bool, url :OptionalUrl, failure :Common.OptionalError);
  documentIsInUse @6 (timeout :Float64) -> ();
  fetchFileProviderIdentifier @7 ()
      -> (identifier :Common.OptionalData, failure :Common.OptionalError);
  fetchUrlForSharingFile @8 () -> (url :OptionalUrl, failure :Common.OptionalError);
  fetchFolderSharingState @9 (call :UInt64)
      -> (isInSharedFolder :Bool, failure :Common.OptionalError);
  fetchSharedFolderInfo @10 (call :UInt64)
      -> (isInSharedFolder :Bool, folderName :Common.OptionalData, failure :Common.OptionalError);
}
