# Third-party libraries, each as an imported target whose headers count as system headers.

find_package(Threads REQUIRED)
find_package(PkgConfig REQUIRED)
find_package(CapnProto REQUIRED CONFIG)
find_package(GTest REQUIRED CONFIG)
find_package(fmt REQUIRED CONFIG)
find_package(spdlog REQUIRED CONFIG)
find_package(SQLiteCpp REQUIRED CONFIG)
find_package(SQLite3 REQUIRED)
find_package(OpenSSL REQUIRED COMPONENTS Crypto)
find_package(ICU REQUIRED COMPONENTS i18n uc)
find_package(benchmark CONFIG)

pkg_check_modules(uuid REQUIRED IMPORTED_TARGET uuid)
# Optional: only some rooms use these, and say so when they are missing.
pkg_check_modules(libsystemd IMPORTED_TARGET libsystemd)
pkg_check_modules(fuse3 IMPORTED_TARGET fuse3)
pkg_check_modules(vips IMPORTED_TARGET vips)

# Header-only packages without a CMake target of their own.
if(NOT TARGET CLI11::CLI11)
  add_library(CLI11::CLI11 INTERFACE IMPORTED)
endif()
if(NOT TARGET nlohmann_json::nlohmann_json)
  add_library(nlohmann_json::nlohmann_json INTERFACE IMPORTED)
endif()

if(CMAKE_CXX_COMPILER_ID STREQUAL "Clang")
  # See the header for why Cap'n Proto needs it.
  add_compile_options(
    "$<$<COMPILE_LANGUAGE:CXX>:SHELL:-include ${CMAKE_SOURCE_DIR}/cmake/clang_kj_comparison.h>")
endif()
