# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#
# Build options, and every named place of the system as a cache variable. The places are compiled in:
# the daemon reads no configuration and nothing of the environment but socket activation.

set(BRENVIK_SANITIZE "" CACHE STRING "Sanitizers, as -fsanitize= takes them: address,undefined or thread")
option(BRENVIK_FUZZ "Build the fuzz targets with libFuzzer (needs clang)" OFF)
option(BRENVIK_BENCHMARKS "Build the benchmarks" OFF)
option(BRENVIK_STATIC_RUNTIME "Link libstdc++ and libgcc statically into the daemon and bvhelperctl: 0.4 ms less at each start" OFF)
option(BRENVIK_COVERAGE "Instrument for line and branch coverage (gcov)" OFF)
option(BRENVIK_WERROR "Warnings are errors. On for us; a packager, whose compiler may be newer, switches it off" ON)
option(BRENVIK_CLIENT_ONLY "Build the client library alone: it needs a compiler and nothing else" OFF)
if(BRENVIK_CLIENT_ONLY)
  # The tests need the test framework, and more of the tree than is built.
  set(BUILD_TESTING OFF)
endif()

option(BRENVIK_BUILD_TOOLS_ONLY "Build the programs that a build runs, and nothing else; a cross build sets it for itself" OFF)
mark_as_advanced(BRENVIK_BUILD_TOOLS_ONLY)

# The messages are laid out in memory as they travel, and they travel in little-endian order.
if(CMAKE_CXX_BYTE_ORDER STREQUAL "BIG_ENDIAN")
  message(FATAL_ERROR "BrenvikMobileHelper runs on little-endian machines only; ${CMAKE_SYSTEM_PROCESSOR} is not one.")
endif()
# The programs that a cross build runs are for the machine that builds, whatever that is.
if(NOT BRENVIK_BUILD_TOOLS_ONLY)
  if(NOT CMAKE_SIZEOF_VOID_P EQUAL 8)
    message(FATAL_ERROR "BrenvikMobileHelper runs on 64-bit machines only; this build's pointers have ${CMAKE_SIZEOF_VOID_P} bytes.")
  endif()
  # The filters of system calls are written for these two: on another one every caller would be refused.
  string(TOLOWER "${CMAKE_SYSTEM_PROCESSOR}" processor)
  if(NOT BRENVIK_CLIENT_ONLY AND NOT processor MATCHES "^(x86_64|amd64|aarch64|arm64)$")
    message(FATAL_ERROR "BrenvikMobileHelper runs on x86-64 and aarch64 only; CMAKE_SYSTEM_PROCESSOR is \"${CMAKE_SYSTEM_PROCESSOR}\". "
      "The client library alone, -DBRENVIK_CLIENT_ONLY=ON, can be built for any 64-bit little-endian machine.")
  endif()
endif()

set(BRENVIK_BOOTSTRAP_DIRECTORY "/run/brenvik/bootstrap" CACHE STRING "Socket files of named services")
set(BRENVIK_SERVICE_GROUP "brenvik" CACHE STRING "Group that may connect to the service socket")
set(BRENVIK_ENTITLEMENT_DIRECTORIES "/etc/brenvik/entitlements.d;/usr/lib/brenvik/entitlements.d"
    CACHE STRING "Entitlement files, earlier directories first")
set(BRENVIK_LASD_HOST "lasd.norvale.example" CACHE STRING "Update server, HTTPS; host or host:port")
set(BRENVIK_GEOCODER_URL "" CACHE STRING "Nominatim-compatible server; empty: none")
set(BRENVIK_GEOCODER_PACE "1000" CACHE STRING "Least milliseconds between two requests to the geocoder")
if(NOT BRENVIK_GEOCODER_PACE MATCHES "^[0-9]+$" OR BRENVIK_GEOCODER_PACE GREATER 4000)
  message(FATAL_ERROR "BRENVIK_GEOCODER_PACE must be 0 to 4000 milliseconds, it is \"${BRENVIK_GEOCODER_PACE}\"")
endif()
set(BRENVIK_STUN_SERVER "stun.norvale.example:3478" CACHE STRING "STUN server for the public address")
set(BRENVIK_GAZETTEER "/usr/share/brenvik/gazetteer.db" CACHE STRING "Offline place database")
set(BRENVIK_DISPUTED_AREAS "${PROJECT_SOURCE_DIR}/data/gazetteer/disputed.tsv"
    CACHE FILEPATH "Table of what country is answered on disputed land")
set(BRENVIK_COUNTRY_CONFIGURATION "/var/lib/brenvik/country.plist" CACHE STRING "Shared country configuration")
set(BRENVIK_REACHABILITY_ADDRESS "192.0.2.1" CACHE STRING "Heartbeat destination, IPv4")
set(BRENVIK_ANY_USER_PREFERENCES "/var/lib/brenvik/Library/Preferences"
    CACHE STRING "Preference domains of the any-user scope")
set(BRENVIK_VISUAL_VOICEMAIL_LIBRARY "libbrenvik-visualvoicemail.so.0" CACHE STRING "Subscription query: library")
set(BRENVIK_VISUAL_VOICEMAIL_SYMBOL "_VisualVoicemailIsSubscribed" CACHE STRING "Subscription query: symbol")
set(BRENVIK_BASEBAND_LIBRARY "libbrenvik-baseband-helper.so.0" CACHE STRING "Optional hosted baseband server")

# A target that is ours links brenvik_flags. What a compiler or linker does not know is left out.
include(CheckCXXCompilerFlag)
include(CheckCXXSourceCompiles)
include(CheckLinkerFlag)
function(brenvik_keep_known kept)
  foreach(flag IN LISTS ARGN)
    string(MAKE_C_IDENTIFIER "BRENVIK_HAS${flag}" known)
    if(flag MATCHES "^-Wl,")
      check_linker_flag(CXX ${flag} ${known})
    else()
      check_cxx_compiler_flag(${flag} ${known})
    endif()
    if(NOT ${known})
      list(REMOVE_ITEM ARGN ${flag})
    endif()
  endforeach()
  set(${kept} ${ARGN} PARENT_SCOPE)
endfunction()
add_library(brenvik_flags INTERFACE)
add_library(brenvik_c_flags INTERFACE)
target_compile_definitions(brenvik_flags INTERFACE _GNU_SOURCE)
brenvik_keep_known(flags -Wall -Wextra -Wpedantic -Wshadow -Wnon-virtual-dtor -Wold-style-cast -Wcast-align -Wunused
  -Woverloaded-virtual -Wconversion -Wsign-conversion -Wdouble-promotion -Wformat=2 -Wimplicit-fallthrough
  -fstack-protector-strong -fno-plt)
target_compile_options(brenvik_flags INTERFACE ${flags})
target_compile_options(brenvik_c_flags INTERFACE -Wall -Wextra -Wpedantic -Wshadow -Wconversion)
# g++ 12 sees overlaps in std::string concatenation that are not there (GCC bug 105651), when it optimises. The
# positive form is asked for, because g++ takes any -Wno- without a word.
check_cxx_compiler_flag(-Wrestrict BRENVIK_HAS_Wrestrict)
if(BRENVIK_HAS_Wrestrict)
  target_compile_options(brenvik_flags INTERFACE $<$<NOT:$<CONFIG:Debug>>:-Wno-restrict>)
endif()
if(BRENVIK_WERROR)
  target_compile_options(brenvik_flags INTERFACE -Werror)
  target_compile_options(brenvik_c_flags INTERFACE -Werror)
endif()

if(BRENVIK_SANITIZE)
  add_compile_options(-fsanitize=${BRENVIK_SANITIZE} -fno-omit-frame-pointer -fno-sanitize-recover=all)
  add_link_options(-fsanitize=${BRENVIK_SANITIZE})
  if(BRENVIK_SANITIZE MATCHES undefined)
    # It looks at memory through a pipe, and calls any object bad when descriptors have run out: tests see to that.
    add_compile_options(-fno-sanitize=vptr)
  endif()
  if(CMAKE_CXX_COMPILER_ID MATCHES Clang)
    # clang does not name its sanitizers the way g++ does.
    if(BRENVIK_SANITIZE MATCHES address)
      add_compile_definitions(__SANITIZE_ADDRESS__=1)
    elseif(BRENVIK_SANITIZE MATCHES thread)
      add_compile_definitions(__SANITIZE_THREAD__=1)
    endif()
  endif()
endif()
# Programs and tests link this; it has something to say in a coverage build only.
add_library(brenvik_keep_counts INTERFACE)
if(BRENVIK_COVERAGE)
  add_compile_options(--coverage -fprofile-update=atomic)
  add_link_options(--coverage)
  add_library(brenvik_counts OBJECT ${PROJECT_SOURCE_DIR}/tests/KeepCounts.c)
  target_sources(brenvik_keep_counts INTERFACE $<TARGET_OBJECTS:brenvik_counts>)
  target_link_options(brenvik_keep_counts INTERFACE -Wl,--wrap=_exit)
endif()
if(BRENVIK_FUZZ)
  if(NOT CMAKE_CXX_COMPILER_ID MATCHES Clang)
    message(FATAL_ERROR "BRENVIK_FUZZ needs clang++: cmake --preset fuzz chooses it")
  endif()
  add_compile_options(-fsanitize=fuzzer-no-link)
endif()
if(NOT BRENVIK_SANITIZE AND NOT BRENVIK_FUZZ AND NOT CMAKE_BUILD_TYPE MATCHES "^(Debug)?$")
  # A packager's flags may ask for more than this, and "None", which some use, optimises only when they say so.
  check_cxx_source_compiles("
    #ifdef _FORTIFY_SOURCE
    #error named already
    #endif
    int main() {}" BRENVIK_MAY_FORTIFY)
  if(BRENVIK_MAY_FORTIFY AND CMAKE_BUILD_TYPE MATCHES "Rel")
    add_compile_definitions(_FORTIFY_SOURCE=2)
  endif()
  # Packed relocations: fewer pages to read at each start.
  brenvik_keep_known(flags -Wl,-z,relro -Wl,-z,now -Wl,--as-needed -Wl,--gc-sections -Wl,-z,pack-relative-relocs)
  add_link_options(${flags})
  # Nothing here asks an object for its type, and the answers would be two of the six pages that each start relocates.
  # The sanitizers need them, so not in the other builds.
  brenvik_keep_known(flags -fno-rtti)
  add_compile_options("$<$<COMPILE_LANGUAGE:CXX>:${flags}>")
  # Log entries name their source file. It is named from the root of the sources, wherever that is, and whether a
  # compiler cache has made the path relative to the build folder or not: what is installed is the same.
  file(RELATIVE_PATH to_sources ${PROJECT_BINARY_DIR} ${PROJECT_SOURCE_DIR})
  string(REGEX REPLACE "([^/])$" "\\1/" to_sources "${to_sources}")
  brenvik_keep_known(flags -ffunction-sections -fdata-sections -fmacro-prefix-map=${PROJECT_SOURCE_DIR}/=
                     -fmacro-prefix-map=${to_sources}=)
  add_compile_options(${flags})
endif()

# ccache, where there is one, makes the sanitizer builds of a second run cheap.
find_program(BRENVIK_CCACHE ccache)
if(BRENVIK_CCACHE AND NOT CMAKE_CXX_COMPILER_LAUNCHER)
  # Paths are taken relative to the tree, so that a fresh clone finds what another has built.
  set(launcher ${CMAKE_COMMAND} -E env CCACHE_BASEDIR=${PROJECT_SOURCE_DIR} CCACHE_NOHASHDIR=1
      CCACHE_SLOPPINESS=pch_defines,time_macros ${BRENVIK_CCACHE})
  set(CMAKE_C_COMPILER_LAUNCHER ${launcher})
  set(CMAKE_CXX_COMPILER_LAUNCHER ${launcher})
endif()
