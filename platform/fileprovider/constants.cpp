#include "platform/fileprovider/constants.h"

namespace yomber {

const NSFileProviderPage NSFileProviderInitialPageSortedByDate =
    NSData::dataWithString("NSFileProviderInitialPageSortedByDate");
const NSFileProviderPage NSFileProviderInitialPageSortedByName =
    NSData::dataWithString("NSFileProviderInitialPageSortedByName");

}  // namespace yomber
