# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#
# One folder, one static library. Each library shows its consumers a view of its own headers only (links in
# the build tree, under the path they have in the source tree), so an include of a folder that is not
# among a target's dependencies does not build. That is what keeps the arrows pointing one way.
#
# A folder's subfolder "internal" belongs to the same library: only the library's own sources see its headers.

find_package(Threads REQUIRED)
if(NOT BRENVIK_CLIENT_ONLY)
  find_package(PkgConfig REQUIRED)
  if(NOT BRENVIK_BUILD_TOOLS_ONLY)
    pkg_check_modules(systemd REQUIRED IMPORTED_TARGET libsystemd)
  endif()
endif()
if(BUILD_TESTING)
  find_package(GTest REQUIRED)
  # When it optimises the long functions of tests, g++ (12, 14) sees strings and vectors left, or read or written past their end,
  # that are not. In the sources it does not, so these keep the warnings.
  add_library(brenvik_test_flags INTERFACE)
  target_compile_options(brenvik_test_flags INTERFACE
    $<$<AND:$<CXX_COMPILER_ID:GNU>,$<NOT:$<CONFIG:Debug>>>:-Wno-array-bounds$<SEMICOLON>-Wno-stringop-overflow$<SEMICOLON>-Wno-stringop-overread>)
  # The test framework's headers are the larger part of what a test costs to compile, so they are compiled once.
  # Tests only: the sources themselves name what they include.
  # A program, as the tests are, for the flags must agree.
  file(CONFIGURE OUTPUT ${PROJECT_BINARY_DIR}/TestPrecompiled.cpp CONTENT "int main() {}\n")
  add_executable(brenvik_test_precompiled EXCLUDE_FROM_ALL ${PROJECT_BINARY_DIR}/TestPrecompiled.cpp)
  target_link_libraries(brenvik_test_precompiled PRIVATE brenvik_flags brenvik_test_flags GTest::gmock)
  target_precompile_headers(brenvik_test_precompiled PRIVATE <gmock/gmock.h> <gtest/gtest.h>
    <array> <chrono> <cstdint> <filesystem> <fstream> <functional> <memory> <optional> <span> <string> <string_view>
    <thread> <vector>)
endif()

# brenvik_view(<view> <folder>)
# Makes the view anew: links to the headers of the folder, which is named from the root of the source tree.
function(brenvik_view view folder)
  file(GLOB headers CONFIGURE_DEPENDS ${PROJECT_SOURCE_DIR}/${folder}/*.h)
  file(REMOVE_RECURSE ${view})
  file(MAKE_DIRECTORY ${view}/${folder})
  foreach(header IN LISTS headers)
    get_filename_component(name ${header} NAME)
    file(CREATE_LINK ${header} ${view}/${folder}/${name} SYMBOLIC)
  endforeach()
endfunction()

# Ends the configuration when a library needs one of the project's own that is not part of it: CMake would take the name for one
# of the system's, and the first missing header would tell.
function(brenvik_expect_libraries target)
  foreach(library IN LISTS ARGN)
    if(library MATCHES "^(platform|helper|tools)_" AND NOT TARGET ${library})
      message(FATAL_ERROR "${target} needs ${library}, which this build does not have")
    endif()
  endforeach()
endfunction()

# brenvik_library(<target> [DEPENDS <what its headers use>...] [PRIVATE <what only its sources use>...])
# Takes every .cpp of the folder but *Test.cpp, *Fuzz.cpp and main.cpp; a folder of headers only becomes an
# INTERFACE library.
function(brenvik_library target)
  cmake_parse_arguments(ARG "" "" "DEPENDS;PRIVATE;SOURCES" ${ARGN})
  file(GLOB sources CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*.cpp ${CMAKE_CURRENT_SOURCE_DIR}/internal/*.cpp)
  list(FILTER sources EXCLUDE REGEX "/([A-Za-z0-9]*(Test|Fuzz)|main)\\.cpp$")
  list(APPEND sources ${ARG_SOURCES})
  file(RELATIVE_PATH folder ${PROJECT_SOURCE_DIR} ${CMAKE_CURRENT_SOURCE_DIR})
  set(view ${PROJECT_BINARY_DIR}/views/${target})
  set(internal_view "")
  brenvik_view(${view} ${folder})
  if(IS_DIRECTORY ${CMAKE_CURRENT_SOURCE_DIR}/internal)
    set(internal_view ${view}.internal)
    brenvik_view(${internal_view} ${folder}/internal)
  endif()
  if(sources)
    add_library(${target} STATIC ${sources})
    target_include_directories(${target} PUBLIC ${view} PRIVATE ${internal_view})
    target_link_libraries(${target} PUBLIC ${ARG_DEPENDS} PRIVATE brenvik_flags ${ARG_PRIVATE})
  else()
    add_library(${target} INTERFACE)
    target_include_directories(${target} INTERFACE ${view})
    target_link_libraries(${target} INTERFACE ${ARG_DEPENDS})
  endif()
  # When all folders have been read.
  cmake_language(EVAL CODE "cmake_language(DEFER DIRECTORY [[${PROJECT_SOURCE_DIR}]]
                            CALL brenvik_expect_libraries [[${target}]] ${ARG_DEPENDS} ${ARG_PRIVATE})")
endfunction()

# brenvik_static_runtime(<program>)
# Links the C++ library into a program whose start somebody waits for, where BRENVIK_STATIC_RUNTIME says so. To be called
# in the folder of the program.
macro(brenvik_static_runtime program)
  if(BRENVIK_STATIC_RUNTIME)
    # By hand instead of with -static-libstdc++, which puts -lm behind the C++ library: parts of that, which the linker
    # drops again, ask for it, and then every start loads it for nothing. Here it is for our own code. See
    # docs/decisions/16-start.md. A build that is not optimised drops no parts, so there it comes behind as well.
    set(behind)
    if(CMAKE_BUILD_TYPE MATCHES "^(Debug)?$")
      set(behind " -lm")
    endif()
    target_link_options(${program} PRIVATE -nodefaultlibs)
    # The only libraries that are sure to come last on the command line are those of the folder.
    set(CMAKE_CXX_STANDARD_LIBRARIES
        "-lm -Wl,-Bstatic -lstdc++ -Wl,-Bdynamic -Wl,--start-group -lgcc -lgcc_eh -lc -Wl,--end-group${behind}")
  endif()
endmacro()

# brenvik_tests(<target> [DEPENDS ...] [LABELS ...])
# Builds <target>_tests of the folder's *Test.cpp and registers it with CTest.
function(brenvik_tests target)
  if(NOT BUILD_TESTING)
    return()
  endif()
  cmake_parse_arguments(ARG "" "" "DEPENDS;LABELS" ${ARGN})
  file(GLOB sources CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*Test.cpp)
  add_executable(${target}_tests ${sources})
  set_target_properties(${target}_tests PROPERTIES RUNTIME_OUTPUT_DIRECTORY ${PROJECT_BINARY_DIR}/unit)
  target_link_libraries(${target}_tests PRIVATE brenvik_flags brenvik_test_flags brenvik_keep_counts ${target}
                                                  ${ARG_DEPENDS} GTest::gmock_main Threads::Threads)
  target_precompile_headers(${target}_tests REUSE_FROM brenvik_test_precompiled)
  add_test(NAME ${target} COMMAND ${target}_tests)
  # Ends one that hangs; a slow machine with a slow disk and a sanitizer may take minutes, an emulator twice as long.
  set(timeout 600)
  if(CMAKE_CROSSCOMPILING)
    set(timeout 1200)
  endif()
  set_tests_properties(${target} PROPERTIES LABELS "unit;${ARG_LABELS}" TIMEOUT ${timeout})
endfunction()

# brenvik_fuzz_target(<name> DEPENDS ...)
# <name>.cpp of the folder defines LLVMFuzzerTestOneInput. With BRENVIK_FUZZ it becomes a libFuzzer program.
# In every build it replays the kept corpus, tests/corpus/<name>/, as a test.
function(brenvik_fuzz_target name)
  if(NOT BUILD_TESTING)
    return()
  endif()
  cmake_parse_arguments(ARG "" "" "DEPENDS" ${ARGN})
  set(corpus ${PROJECT_SOURCE_DIR}/tests/corpus/${name})
  add_executable(${name} ${name}.cpp)
  set_target_properties(${name} PROPERTIES RUNTIME_OUTPUT_DIRECTORY ${PROJECT_BINARY_DIR}/fuzz)
  target_link_libraries(${name} PRIVATE brenvik_flags ${ARG_DEPENDS})
  if(NOT TARGET brenvik_fuzz_targets)
    add_custom_target(brenvik_fuzz_targets)
  endif()
  add_dependencies(brenvik_fuzz_targets ${name})
  if(BRENVIK_FUZZ)
    target_link_options(${name} PRIVATE -fsanitize=fuzzer)
    # With the entropic schedule, loading the inputs of a target that reaches much code takes five times as long.
    add_test(NAME ${name} COMMAND ${name} -runs=0 -entropic=0 ${corpus})
  else()
    target_sources(${name} PRIVATE ${PROJECT_SOURCE_DIR}/tests/ReplayCorpus.cpp)
    add_test(NAME ${name} COMMAND ${name} ${corpus})
  endif()
  set_tests_properties(${name} PROPERTIES LABELS "corpus" TIMEOUT 600)
endfunction()

# brenvik_e2e_test(<name> [FOLDER <folder>] [TIMEOUT <seconds>] [CLASSES <classes>...])
# tests/e2e/<name>.py, or that of another folder of tests/, in the sandbox, against the daemon of this build; with
# CLASSES one test for each class of it, so that they run beside each other. Needs root; skipped, and said so, without.
function(brenvik_e2e_test name)
  cmake_parse_arguments(ARG "" "FOLDER;TIMEOUT" "CLASSES" ${ARGN})
  if(NOT ARG_FOLDER)
    set(ARG_FOLDER e2e)
  endif()
  if(NOT ARG_TIMEOUT)
    set(ARG_TIMEOUT 300)
  endif()
  foreach(class IN LISTS ARG_CLASSES ITEMS "")
    if(class)
      set(test e2e_${name}_${class})
    elseif(ARG_CLASSES)
      break()
    else()
      set(test e2e_${name})
    endif()
    add_test(NAME ${test}
      COMMAND ${PROJECT_SOURCE_DIR}/tests/e2e/sandbox ${PROJECT_BINARY_DIR} /usr/bin/python3 -W error::ResourceWarning
        ${PROJECT_SOURCE_DIR}/tests/${ARG_FOLDER}/${name}.py ${class})
    set_tests_properties(${test} PROPERTIES LABELS "e2e" TIMEOUT ${ARG_TIMEOUT} SKIP_RETURN_CODE 77
                         COST ${ARG_TIMEOUT})  # the longest first: they mostly wait
  endforeach()
endfunction()
