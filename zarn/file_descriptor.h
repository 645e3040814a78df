#pragma once

// The owner of descriptors is the foundation's; this name stays for the daemon's own sources.
#include "platform/foundation/file_descriptor.h"  // IWYU pragma: export
