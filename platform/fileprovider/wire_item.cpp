#include "platform/fileprovider/wire_item.h"

#include <memory>

#include "platform/fileprovider/item_codec.h"
#include "platform/ipc/error_codec.h"

namespace yomber {

std::string WireItem::description() const {
  return "<WireItem " + fields_.identifier + " \"" + fields_.filename + "\">";
}

void registerItemsInErrors() {
  ipc::registerObjectCodec({
      .encode =
          [](const NSObjectRef& object, protocol::Item::Builder builder) {
            const auto* item = dynamic_cast<const NSFileProviderItem*>(object.get());
            if (item == nullptr) return false;
            encodeItem(item->fields(), builder);
            return true;
          },
      .decode = [](protocol::Item::Reader reader) -> NSObjectRef {
        return std::make_shared<WireItem>(decodeItem(reader));
      },
  });
}

}  // namespace yomber
