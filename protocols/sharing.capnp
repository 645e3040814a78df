@0xa9c3e15d7b4f8206;

# Sharing, as zarn serves it to the client library: shares of items, their links and tokens, and what
# an item's sharing allows. All calls are account-bound: while nobody is signed in they fail with
# QSOstrellErrorDomain 2.
#
# A share makes its item's records a zone of their own, in which its participants are members. Whoever
# accepts one has the item in his drive from then on.

using Cxx = import "/capnp/c++.capnp";
$Cxx.namespace("yomber::protocol");
using Common = import "common.capnp";

struct Share {
  # A share record. Participants are at most 1000.
  zoneName @0 :Text;
  zoneOwner @1 :Text;             # as the account that is told sees it
  rootRecord @2 :Text;            # the name of the shared item's record, in that zone
  changeTag @3 :Text;             # empty: not known to the store
  type @4 :Text;                  # "document" or "folder"
  title @5 :Text;
  ownerName @6 :Text;
  participants @7 :List(Participant);
  publicPermission @8 :Int64;     # RZShareParticipantPermission
  url @9 :Common.OptionalData;

  struct Participant {
    userName @0 :Text;
    role @1 :Int64;               # RZShareParticipantRole
    permission @2 :Int64;         # RZShareParticipantPermission
    acceptanceStatus @3 :Int64;   # RZShareParticipantAcceptanceStatus
  }
}

struct ShareResult {
  union {
    share @0 :Share;
    error @1 :Common.Error;
  }
}

interface Sharing {
  checkIfShareable @0 (rawID :UInt64) -> (shareable :Bool, failure :Common.OptionalError);
  # The folder with that id. Folders of the drive can be shared, and those that are shared with the
  # account count as shareable; the root, containers' folders, the trash and what is in it, folders
  # inside a shared folder and folders that have one inside cannot. When it cannot, the failure says why.

  copyShare @1 (path :Data) -> (result :ShareResult, rootPath :Common.OptionalData);
  # The share that the item at that location belongs to. `rootPath` is the location of the shared folder
  # when the item is not shared itself but lies in one. QSOstrellErrorDomain 20 when there is none.

  newShare @2 (path :Data) -> (result :ShareResult);
  # A share of the item for `saveShare`; the store knows nothing of it yet.

  saveShare @3 (share :Share) -> (result :ShareResult);
  # Answered when the store has it. RZErrorServerRecordChanged when somebody else saved it meanwhile,
  # RZErrorPermissionFailure for whoever is not its owner.

  destroyShare @4 (share :Share) -> (failure :Common.OptionalError);
  # The owner's: nobody else sees the item any more. A participant's: he leaves it, and the item leaves
  # his drive. Content that others have not got yet is kept aside there.

  copyShareURL @5 (path :Data, documentType :Text) -> (url :Common.OptionalData, failure :Common.OptionalError);
  # QSOstrellErrorDomain 20 when the item has no share.

  copyShareToken @6 (path :Data)
      -> (shareToken :Text, baseToken :Text, failure :Common.OptionalError);
  # The share token names the share, the base token the version of the document that the store has.

  refreshSharingState @7 (identifier :Text) -> (failure :Common.OptionalError);
  # Answered when what the store now has of the item's share, and of shares with this account, is known.

  shareOptions @8 (identifier :Text)
      -> (isShared :Bool, mayWrite :Bool, isSharedItself :Bool, folderName :Common.OptionalData,
          failure :Common.OptionalError);
  # Whether the item belongs to a share; whether this account may write to it; whether the share is the
  # document's own rather than a folder's; the shared folder's name where there is one.

  acceptShare @9 (url :Text) -> (identifier :Text, failure :Common.OptionalError);
  # Becomes a participant. Answered with the shared item's identifier when it is in the drive; accepting
  # once more answers the same. RZErrorUnknownItem when there is no such share (any more),
  # RZErrorPermissionFailure when it is not for this account.

  sharesWithMe @10 () -> (shares :List(Share), failure :Common.OptionalError);
}
