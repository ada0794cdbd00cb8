# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#
# clang, in the newest version that is known to work and installed. BRENVIK_CLANG_VERSION names another.
foreach(version $ENV{BRENVIK_CLANG_VERSION} 19 14)
  find_program(BRENVIK_CLANG_${version} clang++-${version})
  mark_as_advanced(BRENVIK_CLANG_${version})
  if(BRENVIK_CLANG_${version})
    set(CMAKE_C_COMPILER clang-${version})
    set(CMAKE_CXX_COMPILER clang++-${version})
    return()
  endif()
endforeach()
message(FATAL_ERROR "No clang was found: install clang-14 (Debian 12) or clang-19 (Debian 13); scripts/setup does")
