# Precompiled headers for what is slow to parse: Cap'n Proto and GoogleTest. A target opts in with
# PCH capnp, gtest or gtest_capnp in yomber_room. The lint build parses without them, so that a file
# that forgot an include is found there.

set(YOMBER_GTEST_HEADERS <gtest/gtest.h> <gmock/gmock.h> <functional> <map> <memory> <mutex>
  <optional> <string> <thread> <vector>)
set(YOMBER_CAPNP_HEADERS <capnp/capability.h> <capnp/message.h> <capnp/rpc-twoparty.h>
  <kj/async-io.h> <kj/async-unix.h> <functional> <map> <memory> <mutex> <optional> <string> <vector>)

function(_yomber_precompiled kind)
  set(source "${CMAKE_BINARY_DIR}/precompiled/${kind}.cpp")
  file(CONFIGURE OUTPUT "${source}" CONTENT "namespace yomber {}\n")
  add_library(yomber_pch_${kind} OBJECT EXCLUDE_FROM_ALL "${source}")
  target_precompile_headers(yomber_pch_${kind} PRIVATE ${ARGN})
  # The macros must be those of the targets that use it.
  set(libraries Threads::Threads CapnProto::capnp-rpc)
  if(kind MATCHES "gtest")
    list(APPEND libraries GTest::gmock)
  endif()
  target_link_libraries(yomber_pch_${kind} PRIVATE yomber_options ${libraries})
endfunction()

_yomber_precompiled(gtest ${YOMBER_GTEST_HEADERS})
_yomber_precompiled(capnp ${YOMBER_CAPNP_HEADERS})
_yomber_precompiled(gtest_capnp ${YOMBER_GTEST_HEADERS} ${YOMBER_CAPNP_HEADERS})

# yomber_use_precompiled(<target> <gtest|capnp|gtest_capnp>)
function(yomber_use_precompiled target kind)
  if(NOT CMAKE_DISABLE_PRECOMPILE_HEADERS)
    target_precompile_headers(${target} REUSE_FROM yomber_pch_${kind})
  endif()
endfunction()
