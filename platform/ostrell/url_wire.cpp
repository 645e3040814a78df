#include "platform/ostrell/url_wire.h"

#include "platform/fileprovider/item_codec.h"

namespace yomber {

void encodeURL(const NSURLRef& url, protocol::OptionalUrl::Builder builder) {
  if (url == nullptr) {
    builder.setNone();
  } else if (url->isFileURL()) {
    builder.setPath(wireData(url->path()));
  } else {
    builder.setText(wireText(url->absoluteString()));
  }
}

NSURLRef decodeURL(protocol::OptionalUrl::Reader reader) {
  switch (reader.which()) {
    case protocol::OptionalUrl::NONE:
      return nullptr;
    case protocol::OptionalUrl::PATH:
      return NSURL::fileURLWithPath(stringFromWire(reader.getPath()));
    case protocol::OptionalUrl::TEXT:
      return NSURL::URLWithString(stringFromWire(reader.getText()));
  }
  return nullptr;
}

}  // namespace yomber
