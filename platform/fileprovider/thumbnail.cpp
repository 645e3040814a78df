#include "platform/fileprovider/thumbnail.h"

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/error_codec.h"

namespace yomber {

void encodeThumbnail(const ItemThumbnail& thumbnail, protocol::Thumbnail::Builder builder) {
  builder.setIdentifier(wireText(thumbnail.identifier));
  if (thumbnail.image != nullptr) builder.getImage().setValue(wireData(thumbnail.image->bytes()));
  if (thumbnail.contentType) builder.setContentType(wireText(*thumbnail.contentType));
  if (thumbnail.error != nullptr) ipc::encodeOptional(thumbnail.error, builder.initFailure());
}

ItemThumbnail decodeThumbnail(protocol::Thumbnail::Reader reader) {
  ItemThumbnail thumbnail;
  thumbnail.identifier = stringFromWire(reader.getIdentifier());
  const auto image = reader.getImage();
  if (image.isValue()) {
    const auto bytes = image.getValue();
    thumbnail.image = NSData::dataWithBytes(bytes.begin(), bytes.size());
  }
  if (reader.getContentType().size() > 0) {
    thumbnail.contentType = stringFromWire(reader.getContentType());
  }
  thumbnail.error = ipc::decodeOptional(reader.getFailure());
  return thumbnail;
}

}  // namespace yomber
