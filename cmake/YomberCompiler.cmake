# Language, warnings, sanitizers and the compiler cache, for every target of the repository.

set(CMAKE_CXX_STANDARD 23)
set(CMAKE_CXX_STANDARD_REQUIRED ON)
set(CMAKE_CXX_EXTENSIONS OFF)
set(CMAKE_POSITION_INDEPENDENT_CODE ON)
# Programs compile as libraries do, so that both can use the same precompiled headers.
set(CMAKE_CXX_COMPILE_OPTIONS_PIE "-fPIC")
set(CMAKE_RUNTIME_OUTPUT_DIRECTORY "${CMAKE_BINARY_DIR}/bin")

if(NOT CMAKE_BUILD_TYPE)
  set(CMAKE_BUILD_TYPE RelWithDebInfo CACHE STRING "Build type" FORCE)
endif()

# Assertions stay on in every build: they are cheap, and Debian's libkj is built with them too.
set(CMAKE_CXX_FLAGS_RELWITHDEBINFO "-O2 -g1")
set(CMAKE_C_FLAGS_RELWITHDEBINFO "-O2 -g1")
set(CMAKE_CXX_FLAGS_DEBUG "-O0 -g -D_GLIBCXX_ASSERTIONS")

set(YOMBER_SANITIZE "" CACHE STRING "Sanitizer: empty, address (with undefined) or thread")
set_property(CACHE YOMBER_SANITIZE PROPERTY STRINGS "" address thread)

find_program(YOMBER_CCACHE ccache)
if(YOMBER_CCACHE)
  # Precompiled headers are only cacheable with these two liberties.
  set(launcher "${CMAKE_COMMAND};-E;env;CCACHE_SLOPPINESS=pch_defines,time_macros;CCACHE_BASEDIR=/;CCACHE_NOHASHDIR=true;${YOMBER_CCACHE}")
  set(CMAKE_C_COMPILER_LAUNCHER "${launcher}")
  set(CMAKE_CXX_COMPILER_LAUNCHER "${launcher}")
  if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
    add_compile_options($<$<COMPILE_LANGUAGE:CXX>:-fpch-preprocess>)
  else()
    add_compile_options("$<$<COMPILE_LANGUAGE:CXX>:SHELL:-Xclang -fno-pch-timestamp>")
  endif()
endif()

# Not -Wnon-virtual-dtor: Cap'n Proto's servers have none by design (-Wall still refuses to delete
# through such a base).
set(YOMBER_WARNINGS
  -Wall -Wextra -Wpedantic -Werror
  -Wshadow -Wconversion -Wold-style-cast -Wcast-qual -Wcast-align
  -Woverloaded-virtual -Wextra-semi -Wundef -Wformat=2)
if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
  # -Wrestrict: gcc 12 reports std::string concatenation in its own headers. -Warray-bounds: it
  # reports how kj finds out where a lambda's code is, wherever a promise is inlined.
  # -Wmaybe-uninitialized: it does not see that a promise of an optional is set when it is read.
  # -Wstringop-overflow: it takes a long string literal in a list of strings for a short one.
  list(APPEND YOMBER_WARNINGS -Wduplicated-cond -Wlogical-op -Wno-restrict -Wno-array-bounds
    -Wno-maybe-uninitialized -Wno-stringop-overflow)
else()
  # Clang counts implicit sign changes as conversions where gcc does not, and reports what the
  # standard library itself uses of its own old parts; gcc reports our own uses.
  list(APPEND YOMBER_WARNINGS -Wno-sign-conversion -Wno-deprecated-declarations
    -Wno-implicit-int-float-conversion -Wno-format-nonliteral
    -Wno-gnu-zero-variadic-macro-arguments
    -Wthread-safety -Wzero-as-null-pointer-constant -Winconsistent-missing-override -Wunused-macros)
endif()

# What a test itself does takes no time worth optimising for, and most of a build is spent on it.
set(YOMBER_TEST_OPTIONS -O0)
# Nor does the command line under a sanitizer: its templates are the largest of all.
set(YOMBER_COMMAND_OPTIONS $<$<BOOL:${YOMBER_SANITIZE}>:-O0>)

if(YOMBER_SANITIZE)
  # gcc takes three times as long to instrument the same code, and has no fuzzer.
  if(NOT CMAKE_CXX_COMPILER_ID STREQUAL "Clang")
    message(FATAL_ERROR "The sanitizers need clang: use the preset \"asan\" or \"tsan\".")
  endif()
  if(YOMBER_SANITIZE STREQUAL "address")
    # fuzzer-no-link: counters that lead the fuzzers through the rooms, but not through tests.
    set(sanitizer -fsanitize=address,undefined,fuzzer-no-link -fno-sanitize-recover=all)
    list(APPEND YOMBER_TEST_OPTIONS -fno-sanitize=fuzzer-no-link)
  elseif(YOMBER_SANITIZE STREQUAL "thread")
    set(sanitizer -fsanitize=thread)
  else()
    message(FATAL_ERROR "YOMBER_SANITIZE is '${YOMBER_SANITIZE}': use address or thread")
  endif()
  # -O1 keeps the reports readable and the builds short.
  set(CMAKE_CXX_FLAGS_RELWITHDEBINFO "-O1 -g1 -fno-omit-frame-pointer")
  add_compile_options(${sanitizer})
  add_link_options(${sanitizer})
endif()

# Every first-party target links this; third-party and generated headers come in as SYSTEM.
add_library(yomber_options INTERFACE)
target_compile_options(yomber_options INTERFACE $<$<COMPILE_LANGUAGE:CXX>:${YOMBER_WARNINGS}>)
target_include_directories(yomber_options INTERFACE "${CMAKE_SOURCE_DIR}")
