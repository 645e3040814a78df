# Precompiled headers for what is slow to parse: Cap'n Proto, GoogleTest, and what the command line is
# written with. A target opts in with PCH capnp, gtest, gtest_capnp or command in yomber_room. The
# lint build parses everything but tests without them, so that a file that forgot an include is found
# there.

set(YOMBER_PRECOMPILE all CACHE STRING "Which targets use precompiled headers: all or tests")
set_property(CACHE YOMBER_PRECOMPILE PROPERTY STRINGS all tests)

set(YOMBER_GTEST_HEADERS <gtest/gtest.h> <gmock/gmock.h> <functional> <map> <memory> <mutex>
  <optional> <string> <thread> <vector>)
set(YOMBER_CAPNP_HEADERS <capnp/capability.h> <capnp/message.h> <capnp/rpc-twoparty.h>
  <kj/async-io.h> <kj/async-unix.h> <functional> <map> <memory> <mutex> <optional> <string> <vector>)
set(YOMBER_COMMAND_HEADERS <CLI/CLI.hpp> <nlohmann/json.hpp>)

function(_yomber_precompiled kind)
  set(source "${CMAKE_BINARY_DIR}/precompiled/${kind}.cpp")
  file(CONFIGURE OUTPUT "${source}" CONTENT "namespace yomber {}\n")
  add_library(yomber_pch_${kind} OBJECT EXCLUDE_FROM_ALL "${source}")
  target_precompile_headers(yomber_pch_${kind} PRIVATE ${ARGN})
  # The macros must be those of the targets that use it.
  set(libraries Threads::Threads CapnProto::capnp-rpc)
  if(kind MATCHES "gtest")
    list(APPEND libraries GTest::gmock)
    target_compile_options(yomber_pch_${kind} PRIVATE ${YOMBER_TEST_OPTIONS})
  elseif(kind STREQUAL "command")
    list(APPEND libraries CLI11::CLI11 nlohmann_json::nlohmann_json)
    target_compile_options(yomber_pch_${kind} PRIVATE ${YOMBER_COMMAND_OPTIONS})
  endif()
  target_link_libraries(yomber_pch_${kind} PRIVATE yomber_options ${libraries})
endfunction()

_yomber_precompiled(gtest ${YOMBER_GTEST_HEADERS})
_yomber_precompiled(capnp ${YOMBER_CAPNP_HEADERS})
_yomber_precompiled(gtest_capnp ${YOMBER_GTEST_HEADERS} ${YOMBER_CAPNP_HEADERS})
_yomber_precompiled(command ${YOMBER_COMMAND_HEADERS} ${YOMBER_CAPNP_HEADERS})

# yomber_use_precompiled(<target> <gtest|capnp|gtest_capnp|command>)
function(yomber_use_precompiled target kind)
  if(YOMBER_PRECOMPILE STREQUAL "all" OR kind MATCHES "gtest")
    target_precompile_headers(${target} REUSE_FROM yomber_pch_${kind})
  endif()
endfunction()
