@0x9d3b0e51c7a86f25;

# What can be done to the items of a drive, by item. The extension serves it to the host, and the host
# passes it on to its clients.
#
# Items that are answered are as they are after the change. What an item's capabilities do not allow
# (renaming a container's folder, deleting the root) is refused with NSCocoaErrorDomain 513. A name that
# is taken is NSFileProviderErrorDomain -1001 with the item in the way, or NSCocoaErrorDomain 516 with its
# location. A call that is dropped is carried out all the same.
#
# Names and locations are bytes. An empty text is no identifier.

using Cxx = import "/capnp/c++.capnp";
$Cxx.namespace("yomber::protocol");
using Common = import "common.capnp";

interface Changes {
  importDocument @0 (path :Data, parent :Text) -> Changed;
  # Copies a file, folder or link from anywhere on this machine into the drive, under its own name. May
  # answer no item: then it is there, and the daemon has yet to see it.
  createDirectory @1 (name :Data, parent :Text) -> Changed;
  # A folder of that name that exists already is answered.
  rename @2 (identifier :Text, name :Data) -> Changed;
  reparent @3 (identifier :Text, parent :Text, newName :Common.OptionalData) -> Changed;
  # Under its own name without a new one.

  trash @4 (identifier :Text) -> Changed;
  untrash @5 (identifier :Text, parent :Text) -> Changed;
  # Back to where it came from without a parent (an empty one); the name is made free by counting.
  delete @6 (identifier :Text) -> Changed;
  # For good. Answers no item.

  setLastUsedDate @7 (identifier :Text, date :Common.OptionalInt64) -> Changed;
  setTags @8 (identifier :Text, labels :List(Text)) -> Changed;
  # Replaces the tags. Labels are UTF-8, neither empty nor with a NUL in them.
  setFavoriteRank @9 (identifier :Text, rank :Common.OptionalInt64) -> Changed;

  defaultApplicationContainer @10 (bundleIdentifier :Text) -> Changed;
  # The folder of an application; without one (empty), that of the drive itself. Made where it is missing.
}

struct Changed {
  union {
    none @0 :Void;
    item @1 :Common.Item;
    error @2 :Common.Error;
  }
}
