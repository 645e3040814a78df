# What every room's CMakeLists.txt is written with.
include(GoogleTest)

# Seconds a single test may take; the thread sanitizer makes some of them ten times slower.
set(YOMBER_TEST_TIMEOUT 120)
if(YOMBER_SANITIZE)
  set(YOMBER_TEST_TIMEOUT 360)
endif()
define_property(GLOBAL PROPERTY YOMBER_BENCHES BRIEF_DOCS "Every benchmark program")

set(YOMBER_TEST_LAUNCHER "")
if(YOMBER_SANITIZE STREQUAL "thread")
  set(YOMBER_TEST_LAUNCHER "${CMAKE_SOURCE_DIR}/tests/sanitizers/fixed-addresses")
endif()

find_program(YOMBER_SYMBOLIZER NAMES llvm-symbolizer-19 llvm-symbolizer)

# What the sanitizers are told at run time, for ctest and for scripts.
set(YOMBER_TEST_ENVIRONMENT
  "ASAN_OPTIONS=external_symbolizer_path=${YOMBER_SYMBOLIZER}:strict_string_checks=1:detect_stack_use_after_return=1:check_initialization_order=1"
  "LSAN_OPTIONS=external_symbolizer_path=${YOMBER_SYMBOLIZER}:suppressions=${CMAKE_SOURCE_DIR}/tests/sanitizers/leak.supp:print_suppressions=0"
  "UBSAN_OPTIONS=external_symbolizer_path=${YOMBER_SYMBOLIZER}:print_stacktrace=1"
  "TSAN_OPTIONS=external_symbolizer_path=${YOMBER_SYMBOLIZER}:halt_on_error=1:second_deadlock_stack=1:atexit_sleep_ms=0:suppressions=${CMAKE_SOURCE_DIR}/tests/sanitizers/thread.supp:print_suppressions=0"
  "YOMBER_BUILD_DIR=${CMAKE_BINARY_DIR}"
  "YOMBER_SOURCE_DIR=${CMAKE_SOURCE_DIR}")

# yomber_test(<executable> SOURCES … [DEPENDS …] [PCH kind] [LABELS …] [TIMEOUT seconds] [SERIAL])
#
# A GoogleTest program; each of its tests is a ctest of its own. SERIAL: its tests never run beside
# others (they measure, or own something machine-wide).
function(yomber_test name)
  cmake_parse_arguments(PARSE_ARGV 1 arg "SERIAL" "PCH;TIMEOUT" "SOURCES;DEPENDS;LABELS")
  if(arg_UNPARSED_ARGUMENTS OR NOT arg_SOURCES)
    message(FATAL_ERROR "yomber_test(${name}): needs SOURCES; not understood: ${arg_UNPARSED_ARGUMENTS}")
  endif()
  add_executable(${name} ${arg_SOURCES})
  target_link_libraries(${name} PRIVATE
    yomber_options ${arg_DEPENDS} GTest::gmock GTest::gtest GTest::gtest_main Threads::Threads)
  target_compile_options(${name} PRIVATE ${YOMBER_TEST_OPTIONS})
  if(NOT arg_PCH)
    set(arg_PCH gtest)
  endif()
  if(NOT arg_PCH STREQUAL "none")
    yomber_use_precompiled(${name} ${arg_PCH})
  endif()
  if(NOT arg_TIMEOUT)
    set(arg_TIMEOUT ${YOMBER_TEST_TIMEOUT})
  endif()
  set_target_properties(${name} PROPERTIES CROSSCOMPILING_EMULATOR "${YOMBER_TEST_LAUNCHER}")
  yomber_discover_tests(${name} "" "" "" "${arg_LABELS}" "${arg_TIMEOUT}" "${arg_SERIAL}")
endfunction()

# yomber_test_again(<executable> <kind> <NAME=VALUE> [LABELS …] [TIMEOUT seconds] [FILTER filter])
#
# The same tests, or those that a filter of GoogleTest's leaves, once more with a variable that makes
# them different; <kind> is in their names.
function(yomber_test_again name kind variable)
  cmake_parse_arguments(PARSE_ARGV 3 arg "" "TIMEOUT;FILTER" "LABELS")
  yomber_discover_tests(${name} "${kind}" "${variable}" "${arg_FILTER}" "${arg_LABELS}" "${arg_TIMEOUT}" FALSE)
endfunction()

function(yomber_discover_tests name kind variable filter labels timeout serial)
  set(list ${name}_TESTS)
  set(prefix "${name}.")
  if(kind)
    set(list ${name}_${kind}_TESTS)
    set(prefix "${name}.${kind}.")
  endif()
  gtest_discover_tests(${name} DISCOVERY_MODE PRE_TEST DISCOVERY_TIMEOUT 60
    TEST_PREFIX "${prefix}" TEST_LIST ${list} TEST_FILTER "${filter}")
  # Properties that are lists do not survive gtest_discover_tests: they are set once ctest has its
  # list of the tests.
  set(environment "${YOMBER_TEST_ENVIRONMENT}" ${variable})
  set(properties "${CMAKE_CURRENT_BINARY_DIR}/${list}_properties.cmake")
  file(CONFIGURE OUTPUT "${properties}" @ONLY CONTENT [[
foreach(test IN LISTS @list@)
  set_tests_properties("${test}" PROPERTIES
    TIMEOUT @timeout@ RUN_SERIAL @serial@ LABELS "@labels@"
    ENVIRONMENT "@environment@")
endforeach()
]])
  set_property(DIRECTORY APPEND PROPERTY TEST_INCLUDE_FILES "${properties}")
endfunction()

# yomber_room(<name> SOURCES … [TESTS …] [DEPENDS …] [TEST_SOURCES …] [TEST_DEPENDS …]
#             [PCH kind] [TEST_PCH kind] [TEST_LABELS …] [TEST_SERIAL])
#
# The static library yomber_<name> from SOURCES and its unit tests <name>_test from TESTS.
# DEPENDS are linked PUBLIC: a room's name ("foundation") or any other target. TEST_SOURCES are fakes
# and fixtures that hold no test. PCH: see YomberPrecompiled.cmake.
function(yomber_room name)
  cmake_parse_arguments(PARSE_ARGV 1 arg "TEST_SERIAL" "PCH;TEST_PCH"
    "SOURCES;TESTS;DEPENDS;TEST_SOURCES;TEST_DEPENDS;TEST_LABELS")
  if(arg_UNPARSED_ARGUMENTS)
    message(FATAL_ERROR "yomber_room(${name}): not understood: ${arg_UNPARSED_ARGUMENTS}")
  endif()
  _yomber_targets(depends ${arg_DEPENDS})
  _yomber_targets(test_depends ${arg_TEST_DEPENDS})

  if(arg_SOURCES)
    add_library(yomber_${name} STATIC ${arg_SOURCES})
    target_link_libraries(yomber_${name} PUBLIC Threads::Threads ${depends} PRIVATE yomber_options)
    target_include_directories(yomber_${name} PUBLIC "${CMAKE_SOURCE_DIR}")
    if(arg_PCH)
      yomber_use_precompiled(yomber_${name} ${arg_PCH})
    endif()
  else()
    add_library(yomber_${name} INTERFACE)
    target_link_libraries(yomber_${name} INTERFACE Threads::Threads ${depends})
    target_include_directories(yomber_${name} INTERFACE "${CMAKE_SOURCE_DIR}")
  endif()

  if(arg_TESTS)
    set(serial "")
    if(arg_TEST_SERIAL)
      set(serial SERIAL)
    endif()
    if(NOT arg_TEST_PCH)
      set(arg_TEST_PCH gtest)
    endif()
    yomber_test(${name}_test ${serial}
      SOURCES ${arg_TESTS} ${arg_TEST_SOURCES}
      DEPENDS yomber_${name} ${test_depends}
      PCH ${arg_TEST_PCH}
      LABELS unit ${arg_TEST_LABELS})
  endif()
endfunction()

# yomber_program(<name> SOURCES … [DEPENDS …] [PCH kind]): the executable <build>/bin/<name>.
function(yomber_program name)
  cmake_parse_arguments(PARSE_ARGV 1 arg "" "PCH" "SOURCES;DEPENDS")
  if(arg_UNPARSED_ARGUMENTS OR NOT arg_SOURCES)
    message(FATAL_ERROR
      "yomber_program(${name}): needs SOURCES; not understood: ${arg_UNPARSED_ARGUMENTS}")
  endif()
  _yomber_targets(depends ${arg_DEPENDS})
  # A program may be called like its room's directory, so the target has a name of its own.
  add_executable(${name}_program ${arg_SOURCES})
  set_target_properties(${name}_program PROPERTIES OUTPUT_NAME ${name})
  target_link_libraries(${name}_program PRIVATE yomber_options ${depends} Threads::Threads)
  if(arg_PCH)
    yomber_use_precompiled(${name}_program ${arg_PCH})
  endif()
endfunction()

# yomber_bench(<name> SOURCES … [DEPENDS …]): a Google Benchmark program, part of bench_all.
function(yomber_bench name)
  cmake_parse_arguments(PARSE_ARGV 1 arg "" "" "SOURCES;DEPENDS")
  if(arg_UNPARSED_ARGUMENTS OR NOT arg_SOURCES)
    message(FATAL_ERROR
      "yomber_bench(${name}): needs SOURCES; not understood: ${arg_UNPARSED_ARGUMENTS}")
  endif()
  _yomber_targets(depends ${arg_DEPENDS})
  add_executable(${name} EXCLUDE_FROM_ALL ${arg_SOURCES})
  target_link_libraries(${name} PRIVATE
    yomber_options ${depends} benchmark::benchmark Threads::Threads)
  set_property(GLOBAL APPEND PROPERTY YOMBER_BENCHES ${name})
endfunction()

# The target bench_all: every benchmark, and the programs that they start.
function(yomber_finish_bench_all)
  get_property(benches GLOBAL PROPERTY YOMBER_BENCHES)
  add_custom_target(bench_all)
  foreach(program IN ITEMS qs-fileprovider zarn fileproviderd yomber yomber-mount
      yomber-thumbnailer)
    if(TARGET ${program}_program)
      add_dependencies(bench_all ${program}_program)
    endif()
  endforeach()
  if(benches)
    add_dependencies(bench_all ${benches})
  endif()
endfunction()

# Turns rooms' names into targets; what has no target yomber_<name> now or later is passed through.
function(_yomber_targets out)
  set(result "")
  foreach(name IN LISTS ARGN)
    if(name MATCHES "^[a-z_]+$" AND NOT name MATCHES "^yomber_" AND NOT TARGET ${name})
      list(APPEND result yomber_${name})
    else()
      list(APPEND result ${name})
    endif()
  endforeach()
  set(${out} ${result} PARENT_SCOPE)
endfunction()
