#include "platform/glimmet/thumbnail_store_retrieval_operation.h"

#include "platform/glimmet/installed_thumbnailers.h"

namespace yomber {

bool GMThumbnailStoreRetrievalOperation::canMostRecentClientsGenerateThumbnailsForUTI(
    std::string_view uti) {
  return InstalledThumbnailers::system().canDraw(uti);
}

}  // namespace yomber
