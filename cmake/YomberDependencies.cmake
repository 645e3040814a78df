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
find_package(CLI11 REQUIRED CONFIG)
find_package(nlohmann_json REQUIRED CONFIG)
find_package(benchmark REQUIRED CONFIG)

pkg_check_modules(uuid REQUIRED IMPORTED_TARGET uuid)
pkg_check_modules(libsystemd REQUIRED IMPORTED_TARGET libsystemd)
pkg_check_modules(fuse3 REQUIRED IMPORTED_TARGET fuse3)
pkg_check_modules(vips REQUIRED IMPORTED_TARGET vips-cpp)
pkg_check_modules(libseccomp REQUIRED IMPORTED_TARGET libseccomp)
# What thumbnails look like is read in tests only.
pkg_check_modules(libpng REQUIRED IMPORTED_TARGET libpng)

if(CMAKE_CXX_COMPILER_ID STREQUAL "Clang")
  # See the header for why Cap'n Proto needs it.
  add_compile_options(
    "$<$<COMPILE_LANGUAGE:CXX>:SHELL:-include ${CMAKE_SOURCE_DIR}/cmake/clang_kj_comparison.h>")
endif()
