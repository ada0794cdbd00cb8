# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#
# Programs that the build itself runs: command-pages makes completions and parts of manual pages. When the build is for
# another architecture they are built once more for this machine, in a build of their own below this one.

# What they need, and no more. Only for BRENVIK_BUILD_TOOLS_ONLY.
function(brenvik_add_build_tools)
  foreach(folder platform/base platform/datagram platform/log platform/worker platform/accounts platform/plist platform/runloop
                 platform/ipc platform/security client tools)
    add_subdirectory(${folder} EXCLUDE_FROM_ALL)
  endforeach()
endfunction()

# Makes the targets of those programs, as programs of this machine. CC_FOR_BUILD and CXX_FOR_BUILD name its compilers
# (default: cc and c++).
function(brenvik_build_tools_for_this_machine)
  include(ExternalProject)
  set(tools command-pages)
  set(folder ${PROJECT_BINARY_DIR}/build-tools)
  set(cc $ENV{CC_FOR_BUILD})
  set(cxx $ENV{CXX_FOR_BUILD})
  if(NOT cc)
    set(cc cc)
  endif()
  if(NOT cxx)
    set(cxx c++)
  endif()
  # The same places: help texts name them. In a file, since some of them are lists.
  set(settings "")
  get_cmake_property(variables CACHE_VARIABLES)
  foreach(variable IN LISTS variables)
    get_property(type CACHE ${variable} PROPERTY TYPE)
    if(variable MATCHES "^(BRENVIK_|CMAKE_INSTALL_)" AND NOT variable MATCHES "^BRENVIK_(HAS|TOOL)_" AND
       type MATCHES "^(BOOL|STRING|PATH|FILEPATH)$")
      string(APPEND settings "set(${variable} [==[${${variable}}]==] CACHE ${type} \"\")\n")
    endif()
  endforeach()
  foreach(off BRENVIK_SANITIZE BRENVIK_FUZZ BRENVIK_COVERAGE BRENVIK_BENCHMARKS BUILD_TESTING)
    string(APPEND settings "set(${off} \"\" CACHE STRING \"\" FORCE)\n")
  endforeach()
  file(CONFIGURE OUTPUT ${folder}/settings.cmake CONTENT "${settings}" @ONLY)
  # Flags in the environment are for the other architecture.
  set(clean ${CMAKE_COMMAND} -E env --unset=CFLAGS --unset=CXXFLAGS --unset=CPPFLAGS --unset=LDFLAGS
      --unset=PKG_CONFIG --unset=PKG_CONFIG_PATH --unset=PKG_CONFIG_LIBDIR --unset=PKG_CONFIG_SYSROOT_DIR)
  list(TRANSFORM tools PREPEND ${folder}/build/ OUTPUT_VARIABLE programs)
  ExternalProject_Add(build_tools
    PREFIX ${folder}
    SOURCE_DIR ${PROJECT_SOURCE_DIR}
    BINARY_DIR ${folder}/build
    CONFIGURE_COMMAND ${clean} ${CMAKE_COMMAND} -G ${CMAKE_GENERATOR} -S ${PROJECT_SOURCE_DIR} -B ${folder}/build
                      -C ${folder}/settings.cmake -DBRENVIK_BUILD_TOOLS_ONLY=ON -DCMAKE_BUILD_TYPE=
                      -DCMAKE_C_COMPILER=${cc} -DCMAKE_CXX_COMPILER=${cxx}
    BUILD_COMMAND ${clean} ${CMAKE_COMMAND} --build ${folder}/build --target ${tools}
    BUILD_BYPRODUCTS ${programs}
    BUILD_ALWAYS ON
    INSTALL_COMMAND "")
  foreach(tool IN LISTS tools)
    add_executable(${tool} IMPORTED GLOBAL)
    set_target_properties(${tool} PROPERTIES IMPORTED_LOCATION ${folder}/build/${tool})
    add_dependencies(${tool} build_tools)
  endforeach()
endfunction()
