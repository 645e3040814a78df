#pragma once

// The low-level interface of libfuse, in the version that this room is written for.
#define FUSE_USE_VERSION FUSE_MAKE_VERSION(3, 12)
#include <fuse3/fuse_lowlevel.h>
