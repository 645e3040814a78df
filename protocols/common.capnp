@0xd1f5c0a7b3e94a01;

# Types that every protocol of the drive shares.
#
# Strings that name things on disk (paths, file names) are Data: file names are bytes and need not be
# UTF-8. Times are nanoseconds since 1970-01-01T00:00:00Z. "Nil" is said by a flag or a union, never
# by an empty value.
#
# Domain failures travel as an `Error` in the results; only transport failures are exceptions.

using Cxx = import "/capnp/c++.capnp";
$Cxx.namespace("yomber::protocol");

struct Error {
  domain @0 :Text;
  code @1 :Int64;
  userInfo @2 :List(Entry);

  struct Entry {
    key @0 :Text;
    value :union {
      text @1 :Data;
      integer @2 :Int64;
      real @3 :Float64;
      boolean @4 :Bool;
      error @5 :Error;      # nested at most 8 deep; deeper ones are cut
      path @6 :Data;        # a location
      item @7 :Item;        # the item in the way of a collision
      description @8 :Text; # an object with no wire form, as its description
    }
  }
}

struct OptionalError {
  # How a result says "success" (none) or what failed.
  union {
    none @0 :Void;
    error @1 :Error;
  }
}

enum SortOrder {
  name @0;
  date @1;
}

struct Item {
  # One item of the drive, as the daemon describes it and as the framework shows it. `identifier` is
  # the string form of a file object id, or the root's constant.
  identifier @0 :Text;
  parentIdentifier @1 :Text;
  filename @2 :Data;
  contentType @3 :Text;          # a MIME type; "inode/directory" for folders
  kind @4 :Kind;
  rawID @5 :UInt64;              # of the file object id; 0 for the root
  size @6 :UInt64;               # bytes; 0 for folders
  creationDate @7 :Int64;
  modificationDate @8 :Int64;
  lastUsedDate @9 :OptionalInt64;
  favoriteRank @10 :OptionalInt64;
  tags @11 :List(Text);          # in order
  capabilities @12 :UInt32;      # NSFileProviderItemCapabilities bits
  flags @13 :UInt32;             # ItemFlag bits
  rank @14 :UInt64;              # the daemon's rank of the item's last change
  version @15 :UInt64;           # changes whenever the content changes
  childCount @16 :UInt32;        # of folders; 0 when not known. zarn says 0: a number that is kept would
                                 # cost every change of a folder a write, one that is counted as much
                                 # as the folder is large
  containerID @17 :Text;         # set on a container's own folder only

  enum Kind {
    document @0;
    folder @1;
    alias @2;                    # points outside the drive's own zones
    bookmark @3;                 # a symbolic link that resolves inside the drive
    symlink @4;                  # any other symbolic link
  }
}

const itemFlagDead :UInt32 = 1;          # a deletion; only identifier, kind and rawID count
const itemFlagTrashed :UInt32 = 2;
const itemFlagDownloaded :UInt32 = 4;    # the content is here
const itemFlagUploaded :UInt32 = 8;
const itemFlagShared :UInt32 = 16;
const itemFlagHidden :UInt32 = 32;       # its name starts with a dot
const itemFlagExcluded :UInt32 = 64;     # never synced

struct OptionalInt64 {
  union {
    none @0 :Void;
    value @1 :Int64;
  }
}

struct OptionalData {
  union {
    none @0 :Void;
    value @1 :Data;
  }
}
