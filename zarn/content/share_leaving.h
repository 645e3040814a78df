#pragma once

#include <memory>

#include "platform/foundation/error.h"
#include "zarn/content/content_core.h"
#include "zarn/content/share_rows.h"

namespace yomber {

/// Whether the account's own share may still have what others have saved.
enum class LastSaves : bool { Gone, InZone };

/// What follows when an item is shared no longer. Of the account's own, whose zone nobody else can
/// write to any more, what the others have saved is taken over first; while some of that has to
/// wait, as for a document that somebody has open, the share stays and the answer is nil. Then it
/// is noted, and left.
[[nodiscard]] NSErrorRef endShare(ContentCore& core, const std::shared_ptr<ContentStore>& store,
                                  ShareRow share, LastSaves last);

/// Does what is left to be done for a share that is no longer one; harmless when done again.
/// Somebody else's: what was not saved is kept aside, and the item goes. The account's own: when
/// all records are back, the zone goes.
[[nodiscard]] NSErrorRef leaveShare(ContentCore& core, const std::shared_ptr<ContentStore>& store,
                                    const ShareRow& share);

}  // namespace yomber
