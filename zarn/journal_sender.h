#pragma once

#include <memory>

#include "platform/ipc/remote.h"
#include "protocols/tree.capnp.h"
#include "zarn/tree_journal.h"

namespace yomber {

/// Hands over to an observer in another process. The first of some changes is told at once; those
/// that follow closely go together, so that a file that is being written costs few calls.
[[nodiscard]] std::shared_ptr<JournalReceiver> makeJournalSender(
    ipc::Remote<protocol::TreeObserver> observer);

}  // namespace yomber
