@0xf3ea5c97d2b1804d;

# Pictures of items, on their way from the extension over the host to whoever shows them.

using Cxx = import "/capnp/c++.capnp";
$Cxx.namespace("yomber::protocol");
using Common = import "common.capnp";

struct Thumbnail {
  identifier @0 :Text;
  image :union {
    none @1 :Void;                  # the item has no picture
    place @2 :ImagePlace;           # in whatever format
  }
  contentType @3 :Text;             # of the image; empty: as its bytes say
  failure @4 :Common.OptionalError; # why there is no image, where something went wrong
}

struct ImagePlace {
  # Bytes of a call's image file.
  offset @0 :UInt64;
  length @1 :UInt64;
}

interface ImageFile {
  # Carries the descriptor of a file of memory: whoever passes it on copies no image.
}

interface ThumbnailReceiver {
  # Who asked for thumbnails. The extension has at most two calls of a request under way, and holds
  # back until one of them is answered.

  didFetch @0 (thumbnails :List(Thumbnail), images :ImageFile) -> ();
  # Without images there is no file. The answer says that they have been read: the sender puts others
  # into the file afterwards.
}
