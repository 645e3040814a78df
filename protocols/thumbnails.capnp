@0xf3ea5c97d2b1804d;

# Pictures of items, on their way from the extension over the host to whoever shows them.

using Cxx = import "/capnp/c++.capnp";
$Cxx.namespace("yomber::protocol");
using Common = import "common.capnp";

struct Thumbnail {
  identifier @0 :Text;
  image @1 :Common.OptionalData;    # in whatever format; none: the item has no picture
  contentType @2 :Text;             # of the image; empty: as its bytes say
  failure @3 :Common.OptionalError; # why there is no image, where something went wrong
}

interface ThumbnailReceiver {
  # Who asked for thumbnails. A sender has at most two calls under way, and holds back until one of
  # them is answered.

  didFetch @0 (thumbnails :List(Thumbnail)) -> ();
}
